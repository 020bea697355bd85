// The "ready" and "access" requests.

#include <unordered_set>

#include "Ekora/EkProtocol.h"
#include "Ekora/EkSandboxExtension.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {

void Transaction::readyPlugIns() {
  std::optional<Dictionary> environment;
  if (const Dictionary* given = dictionaryForKey(protocol::kEnvironment)) environment = *given;
  if (environment) {
    if (!sender().hasEntitlement(protocol::kEntitlementProvideEnvironment)) {
      fail(protocol::kErrorNotPermitted,
           log::format("Transmission of environment variables requires the %@ host entitlement",
                       protocol::kEntitlementProvideEnvironment));
      return;
    }
    log::ops().debug("pid %d provided %d environment entries", client_->pid(), environment->size());
  }

  std::vector<std::shared_ptr<EkDPlugIn>> accepted;
  std::unordered_set<Uuid> seen;
  const std::shared_ptr<const EkDPlugInHolds> holds = server().holds();
  bool walked = processUuidList([&](const std::shared_ptr<EkDPlugIn>& plugIn) {
    std::string uuid = plugIn->uuid().string();
    std::string identifier = plugIn->identifier().value_or("(null)");
    EK_PROBE1(plugin_ready, uuid.c_str());
    if (holds->blocks(*plugIn)) {
      log::ops().defaultLevel(
          "denied access to %d for plugin %{public}@(%{public}@): the plug-in is on hold",
          client_->pid(), identifier, uuid);
      fail(protocol::kErrorNotPermitted,
           log::format("access to plugin %@ denied: the plug-in is on hold", identifier));
      return false;
    }
    if (plugIn->isData()) return true;
    if (auto reason = plugIn->allowForClient(sender())) {
      log::ops().defaultLevel("denied access to %d for plugin %@(%{public}@): %{public}@",
                              client_->pid(), identifier, uuid, *reason);
      fail(protocol::kErrorNotPermitted,
           log::format("access to plugin %@ denied: %@", identifier, *reason));
      return false;
    }
    if (seen.insert(plugIn->uuid()).second) accepted.push_back(plugIn);
    return true;
  });
  if (!walked) return;

  std::optional<EkError> firstError;
  for (const auto& plugIn : accepted) {
    auto error = plugIn->enableForClient(sender(), environment ? &*environment : nullptr);
    if (error && !firstError) firstError = std::move(error);
  }
  if (!accepted.empty()) {
    server().watchHostExit(sender().token());
  }
  if (firstError) {
    fail(protocol::kErrorInvalidRequest, *firstError);
    return;
  }
  done();
}

void Transaction::accessPlugIns() {
  Array tokens;
  bool walked = processUuidList([&](const std::shared_ptr<EkDPlugIn>& plugIn) {
    // Only for the bundle directory that was registered: one swapped for a link since gets
    // nothing.
    Result<std::string> token = plugIn->issueBundleExtension();
    if (token) {
      tokens.emplace_back(std::move(token).value());
      return true;
    }
    int error = token.error().domain == kPosixErrorDomain ? token.error().code : EINVAL;
    fail(protocol::kErrorInvalidRequest, log::format("cannot create file extension to %@: %d",
                                                     plugIn->path().value_or("(null)"), error));
    return false;
  });
  if (!walked) return;
  reply_.insert_or_assign(std::string(protocol::kExtensions), Value(std::move(tokens)));
  done();
}

}  // namespace ek
