// The registration requests: "add", "remove" and "bulk".

#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
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

void Transaction::addPlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    if (!resolved) {
      fail(protocol::kErrorBadPath, log::format("invalid plugin path: %@", path));
      return PathStep::Stop;
    }
    EK_PROBE1(plugin_add, path.c_str());
    if (server().database().addPlugIn(urlForPath(path))) {
      log::ops().defaultLevel("failed to register plug-in at %@", path);
      fail(protocol::kErrorRegistry, log::format("unable to register plug-in at %@", path));
      return PathStep::Stop;
    }
    return PathStep::Continue;
  });
}

void Transaction::removePlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    EK_PROBE2(plugin_remove, path.c_str(), resolved);
    if (!sender().hasEntitlement(protocol::kEntitlementManager)) {
      log::process().defaultLevel(
          "refused request from pid=%d to remove plug-in at %@ - client lacks required "
          "entitlement",
          client_->pid(), path);
      fail(protocol::kErrorNotPermitted, "caller lacks entitlement for this operation");
      return PathStep::Stop;
    }
    if (server().database().removePlugIn(urlForPath(path))) {
      fail(protocol::kErrorBadPath, log::format("no plugin at %@", path));
      return PathStep::Stop;
    }
    return PathStep::Continue;
  });
}

void Transaction::bulkPlugIns() {
  const uint64_t* flags = request_.body.getUnsigned(protocol::kFlags);
  uint64_t value = flags ? *flags : 0;
  log::ops().info("bulk options 0x%lx not supported", static_cast<uint32_t>(value));
  done();
}

}  // namespace ek
