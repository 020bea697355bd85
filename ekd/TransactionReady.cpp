// The "ready" and "access" requests.

#include <unordered_set>

#include "Ekora/EkProtocol.h"
#include "Ekora/EkSandboxExtension.h"
#include "ekd/EkDPlugIn.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "ekd/Handlers.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek::handlers {

Reply readyPlugIns(const Request& request, EkDServer& daemon) {
  const EkDClientProcess& sender = request.sender;
  std::optional<Dictionary> environment;
  if (const Dictionary* given = request.body.getDictionary(protocol::kEnvironment)) {
    environment = *given;
  }
  if (environment) {
    if (!sender.hasEntitlement(protocol::kEntitlementProvideEnvironment)) {
      return Reply::failure(
          protocol::kErrorNotPermitted,
          log::format("Transmission of environment variables requires the %@ host entitlement",
                      protocol::kEntitlementProvideEnvironment));
    }
    log::ops().debug("pid %d provided %d environment entries", request.pid, environment->size());
  }

  std::vector<std::shared_ptr<EkDPlugIn>> accepted;
  std::unordered_set<Uuid> seen;
  const std::shared_ptr<const EkDPlugInHolds> holds = daemon.holds();
  Step failure =
      forEachListedPlugIn(request, daemon, [&](const std::shared_ptr<EkDPlugIn>& plugIn) -> Step {
        std::string uuid = plugIn->uuid().string();
        std::string identifier = plugIn->identifier().value_or("(null)");
        EK_PROBE1(plugin_ready, uuid.c_str());
        if (holds->blocks(*plugIn)) {
          log::ops().defaultLevel(
              "denied access to %d for plugin %{public}@(%{public}@): the plug-in is on hold",
              request.pid, identifier, uuid);
          return Reply::failure(
              protocol::kErrorNotPermitted,
              log::format("access to plugin %@ denied: the plug-in is on hold", identifier));
        }
        if (plugIn->isData()) return std::nullopt;
        if (auto reason = plugIn->allowForClient(sender)) {
          log::ops().defaultLevel("denied access to %d for plugin %@(%{public}@): %{public}@",
                                  request.pid, identifier, uuid, *reason);
          return Reply::failure(protocol::kErrorNotPermitted,
                                log::format("access to plugin %@ denied: %@", identifier, *reason));
        }
        if (seen.insert(plugIn->uuid()).second) accepted.push_back(plugIn);
        return std::nullopt;
      });
  if (failure) return std::move(*failure);

  std::optional<EkError> firstError;
  for (const auto& plugIn : accepted) {
    auto error = plugIn->enableForClient(sender, environment ? &*environment : nullptr);
    if (error && !firstError) firstError = std::move(error);
  }
  if (!accepted.empty()) {
    daemon.watchHostExit(sender.token());
  }
  if (firstError) {
    // An Ekora error keeps its own code.
    return Reply::failure(firstError->isEkora() ? firstError->code : protocol::kErrorInvalidRequest,
                          firstError->description());
  }
  return Reply{};
}

Reply accessPlugIns(const Request& request, EkDServer& daemon) {
  Array tokens;
  Step failure =
      forEachListedPlugIn(request, daemon, [&](const std::shared_ptr<EkDPlugIn>& plugIn) -> Step {
        // Only for the bundle directory that was registered: one swapped for a link since gets
        // nothing.
        Result<std::string> token = plugIn->issueBundleExtension();
        if (token) {
          tokens.emplace_back(std::move(token).value());
          return std::nullopt;
        }
        int error = token.error().domain == kPosixErrorDomain ? token.error().code : EINVAL;
        return Reply::failure(protocol::kErrorInvalidRequest,
                              log::format("cannot create file extension to %@: %d",
                                          plugIn->path().value_or("(null)"), error));
      });
  if (failure) return std::move(*failure);
  Reply reply;
  reply.members.insert_or_assign(std::string(protocol::kExtensions), Value(std::move(tokens)));
  return reply;
}

}  // namespace ek::handlers
