// The "lock" request: placing and releasing holds.

#include "Ekora/EkProtocol.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
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

void Transaction::lockDownPlugIns() {
  EkDServer& daemon = server();
  EkDatabase& database = daemon.database();
  if (const Array* tokens = arrayForKey(protocol::kUuids)) {
    for (const Value& token : *tokens) {
      // Elements that are not UUIDs name no hold.
      if (const Uuid* uuid = token.uuid()) daemon.unholdToken(*uuid);
    }
    done();
    return;
  }

  const uint64_t* flagsValue = request_.body.getUnsigned(protocol::kFlags);
  const uint64_t flags = flagsValue ? *flagsValue : 0;
  std::vector<std::shared_ptr<EkDPlugIn>> plugIns;
  bool collected = marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      fail(protocol::kErrorBadPath, log::format("invalid path: %@", path));
      return PathStep::Stop;
    }
    if (flags & kHoldPlugInPaths) {
      auto plugIn = database.findPlugInAtPath(path);
      if (!plugIn) {
        fail(protocol::kErrorBadPath, log::format("no plug-in at path:%@", path));
        return PathStep::Stop;
      }
      plugIns.push_back(std::move(plugIn));
    } else if (auto within = database.plugInsWithinApplication(path)) {
      for (auto& plugIn : *within) plugIns.push_back(std::move(plugIn));
    }
    return PathStep::Continue;
  });
  if (!collected) return;
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
      reply_.insert_or_assign(std::string(protocol::kConflicts), Value(std::move(conflicts)));
      fail(protocol::kErrorBusy, "plug-ins are busy");
      return;
    }
  }

  auto hold = EkDPlugInHold::initWithPlugIns(plugIns, client_, daemon.platform().serviceManager);
  Uuid token = hold->uuid();
  daemon.addHold(std::move(hold));
  reply_.insert_or_assign(std::string(protocol::kUuids), Value(token));

  if (flags & kHoldTerminate) {
    std::vector<vantor::PlugInProxyPtr> proxies;
    for (const auto& plugIn : plugIns) {
      // A plug-in the registry no longer knows has no instances to end.
      if (auto proxy = plugIn->getProxy()) proxies.push_back(std::move(proxy));
    }
    // The reply waits for every answer; the transaction lives until then.
    daemon.terminatePlugIns(proxies, [self = shared_from_this(), token] {
      log::ops().info("forced termination complete; hold request granted uuid:%{public}@", token);
      self->done();
    });
    return;
  }
  log::ops().info("hold request granted uuid:%{public}@", token);
  done();
}

}  // namespace ek
