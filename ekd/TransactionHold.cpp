// The "lock" request: placing and releasing holds.

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Handlers.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

constexpr uint64_t kHoldPlugInPaths = 0x1;
constexpr uint64_t kHoldRefuseBusy = 0x2;
constexpr uint64_t kHoldTerminate = 0x4;

// The plug-ins of a hold as "%@" shows a list of records.
struct PlugInList {
  const std::vector<std::shared_ptr<EkDPlugIn>>& plugIns;
  std::string description() const {
    Array lines;
    for (const auto& plugIn : plugIns) lines.emplace_back(plugIn->description());
    return Value(std::move(lines)).description();
  }
};

}  // namespace

namespace handlers {

void lockDownPlugIns(const Request& request, EkDServer& daemon, Respond respond) {
  EkDatabase& database = daemon.database();
  if (const Array* tokens = request.body.getArray(protocol::kUuids)) {
    for (const Value& token : *tokens) {
      // Elements that are not UUIDs name no hold.
      if (const Uuid* uuid = token.uuid()) daemon.unholdToken(*uuid);
    }
    respond(Reply{});
    return;
  }

  const uint64_t* flagsValue = request.body.getUnsigned(protocol::kFlags);
  const uint64_t flags = flagsValue ? *flagsValue : 0;
  std::vector<std::shared_ptr<EkDPlugIn>> plugIns;
  Step failure = forEachPath(request, [&](const std::string& path, bool resolved) -> Step {
    if (!resolved)
      return Reply::failure(protocol::kErrorBadPath, log::format("invalid path: %@", path));
    if (flags & kHoldPlugInPaths) {
      auto plugIn = database.findPlugInAtPath(path);
      if (!plugIn) {
        return Reply::failure(protocol::kErrorBadPath, log::format("no plug-in at path:%@", path));
      }
      plugIns.push_back(std::move(plugIn));
    } else if (auto within = database.plugInsWithinApplication(path)) {
      for (auto& plugIn : *within) plugIns.push_back(std::move(plugIn));
    }
    return std::nullopt;
  });
  if (failure) {
    respond(std::move(*failure));
    return;
  }
  log::ops().info("processing hold request for plug-ins:%@", PlugInList{plugIns});

  if (flags & kHoldRefuseBusy) {
    Array conflicts;
    std::vector<std::shared_ptr<EkDPlugIn>> busy;
    for (const auto& plugIn : plugIns) {
      if (auto descriptor = plugIn->checkBusy()) {
        busy.push_back(plugIn);
        conflicts.emplace_back(std::move(*descriptor));
      }
    }
    if (!busy.empty()) {
      log::ops().debug("hold refused. Busy plug-ins:%@", PlugInList{busy});
      Reply refused = Reply::failure(protocol::kErrorBusy, "plug-ins are busy");
      refused.members.insert_or_assign(std::string(protocol::kConflicts),
                                       Value(std::move(conflicts)));
      respond(std::move(refused));
      return;
    }
  }

  auto hold =
      EkDPlugInHold::initWithPlugIns(plugIns, request.client, daemon.platform().serviceManager);
  Uuid token = hold->uuid();
  daemon.addHold(std::move(hold));
  Reply granted;
  granted.members.insert_or_assign(std::string(protocol::kUuids), Value(token));

  if (flags & kHoldTerminate) {
    std::vector<vantor::PlugInProxyPtr> proxies;
    for (const auto& plugIn : plugIns) {
      // A plug-in the registry no longer knows has no instances to end.
      if (auto proxy = plugIn->getProxy()) proxies.push_back(std::move(proxy));
    }
    // The reply waits for every answer; the transaction lives until then.
    daemon.terminatePlugIns(proxies, [respond = std::move(respond), granted, token] {
      log::ops().info("forced termination complete; hold request granted uuid:%{public}@", token);
      respond(granted);
    });
    return;
  }
  log::ops().info("hold request granted uuid:%{public}@", token);
  respond(std::move(granted));
}

}  // namespace handlers
}  // namespace ek
