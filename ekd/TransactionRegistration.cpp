// The registration requests: "add", "remove" and "bulk".

#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Handlers.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {
namespace {

// The file URL text of a path; the path itself when it cannot be written as one (the registry
// answers both).
std::string urlForPath(const std::string& path) {
  auto url = EkFileURL::fromPath(path);
  return url ? url->string() : path;
}

}  // namespace

namespace handlers {

void addPlugIns(const Request& request, EkDServer& daemon, Respond respond) {
  EkDatabase& database = daemon.database();
  auto step = [&database](const std::string& path, bool resolved) -> Step {
    if (!resolved) {
      return Reply::failure(protocol::kErrorBadPath, log::format("invalid plugin path: %@", path));
    }
    EK_PROBE1(plugin_add, path.c_str());
    if (database.addPlugIn(urlForPath(path))) {
      log::ops().defaultLevel("failed to register plug-in at %@", path);
      return Reply::failure(protocol::kErrorRegistry,
                            log::format("unable to register plug-in at %@", path));
    }
    return std::nullopt;
  };
  forEachPathInSlices(request, daemon, std::move(step), std::move(respond));
}

void removePlugIns(const Request& request, EkDServer& daemon, Respond respond) {
  EkDatabase& database = daemon.database();
  auto step = [&request, &database](const std::string& path, bool resolved) -> Step {
    EK_PROBE2(plugin_remove, path.c_str(), resolved);
    if (!request.sender->hasEntitlement(protocol::kEntitlementManager)) {
      log::process().defaultLevel(
          "refused request from pid=%d to remove plug-in at %@ - client lacks required "
          "entitlement",
          request.pid, path);
      return Reply::failure(protocol::kErrorNotPermitted,
                            "caller lacks entitlement for this operation");
    }
    if (database.removePlugIn(urlForPath(path))) {
      return Reply::failure(protocol::kErrorBadPath, log::format("no plugin at %@", path));
    }
    return std::nullopt;
  };
  forEachPathInSlices(request, daemon, std::move(step), std::move(respond));
}

Reply bulkPlugIns(const Request& request, EkDServer&) {
  const uint64_t* flags = request.body.getUnsigned(protocol::kFlags);
  uint64_t value = flags ? *flags : 0;
  log::ops().info("bulk options 0x%lx not supported", static_cast<uint32_t>(value));
  return Reply{};
}

}  // namespace handlers
}  // namespace ek
