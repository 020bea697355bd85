#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/codesign/CodeSigning.h"
#include "platform/queue/SerialQueue.h"
#include "platform/sandbox/SandboxCheck.h"
#include "platform/vantor/Registry.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkDWyreClient;

// The platform services the daemon reaches, replaceable by doubles in tests.
struct EkDPlatform {
  std::shared_ptr<CodeSigning> codeSigning;
  std::shared_ptr<SandboxCheck> sandbox;
  // The application registry; when none is given the server opens the one in the state
  // directory, which also registers the system plug-ins.
  std::shared_ptr<vantor::Registry> registry;

  static EkDPlatform system();
};

// The daemon's one server: owns the listener, the work queue on which every request runs,
// and the queue that guards the hold list.
class EkDServer : public std::enable_shared_from_this<EkDServer> {
 public:
  // Answers nullptr when the server cannot be built (for instance, the service cannot be
  // listened on); the reason is logged.
  static std::shared_ptr<EkDServer> initForService(const std::string& serviceName,
                                                   std::optional<std::string> database,
                                                   EkDPlatform platform = EkDPlatform::system());

  // The process-wide server.
  static std::shared_ptr<EkDServer> server();

  // Starts accepting connections. The caller then runs the main run loop.
  void run();
  // Enqueues work on the work queue "service"; the only way request work reaches it.
  void submitWork(std::function<void()> work);
  // Cancels the listener and releases every hold. Called just before the process exits.
  void stop();

  uint32_t verbose() const { return verbose_; }
  void setVerbose(uint32_t verbose) { verbose_ = verbose; }
  int32_t cacheLimit() const { return cacheLimit_; }
  void setCacheLimit(int32_t limit) { cacheLimit_ = limit; }
  const std::optional<std::string>& databasePath() const { return databasePath_; }

  const EkDPlatform& platform() const { return platform_; }
  const std::shared_ptr<vantor::Registry>& registry() const { return platform_.registry; }
  const std::shared_ptr<SerialQueue>& mainQueue() const { return mainQueue_; }
  const std::shared_ptr<SerialQueue>& syncQueue() const { return syncQueue_; }
  const std::shared_ptr<wyre::Listener>& service() const { return service_; }

 private:
  EkDServer() = default;
  void handleListenerEvent(const wyre::ListenerEvent& event);

  std::atomic<uint32_t> verbose_{0};
  std::atomic<int32_t> cacheLimit_{1000000};
  std::optional<std::string> databasePath_;
  EkDPlatform platform_;
  std::shared_ptr<SerialQueue> wyreQueue_;
  std::shared_ptr<SerialQueue> mainQueue_;  // "service": every request runs here
  std::shared_ptr<SerialQueue> syncQueue_;  // "serverSync": guards the hold list
  std::shared_ptr<wyre::Listener> service_;
};

}  // namespace ek
