#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include <asio/posix/stream_descriptor.hpp>

#include "ekd/EkDHeapTrim.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDatabase.h"
#include "platform/codesign/CodeSigning.h"
#include "platform/notify/Notifications.h"
#include "platform/prefs/Preferences.h"
#include "platform/privo/Consent.h"
#include "platform/queue/SerialQueue.h"
#include "platform/sandbox/SandboxCheck.h"
#include "platform/stard/ServiceManager.h"
#include "platform/vantor/Registry.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkDSystemVolumeWatch;
class EkDUserPrefs;
class EkDWyreClient;

// The platform services the daemon reaches, replaceable by doubles in tests.
struct EkDPlatform {
  std::shared_ptr<CodeSigning> codeSigning;
  std::shared_ptr<SandboxCheck> sandbox;
  // The application registry; when none is given the server opens the one in the state
  // directory and registers the system plug-ins once it serves (see run).
  std::shared_ptr<vantor::Registry> registry;
  std::shared_ptr<stard::ServiceManager> serviceManager;
  std::shared_ptr<notify::Notifier> notifier;
  // The tokens added to forms; null means the process's sandbox.
  std::shared_ptr<EkSandbox> extensions;
  // The daemon user's preferences domains; null means the files of the state directory.
  std::shared_ptr<prefs::Preferences> preferences;
  // Null means the system's type hierarchy.
  std::shared_ptr<types::TypeSystem> types;
  // Null means the consent file of the state directory.
  std::shared_ptr<privo::Consent> consent;

  static EkDPlatform system();
};

// The daemon's one server: owns the listener, the work queue on which every request runs, the
// plug-in database that belongs to that queue, and the list of holds.
class EkDServer : public std::enable_shared_from_this<EkDServer> {
 public:
  // Answers nullptr when the server cannot be built (for instance, the service cannot be
  // listened on); the reason is logged.
  static std::shared_ptr<EkDServer> initForService(const std::string& serviceName,
                                                   std::optional<std::string> database,
                                                   EkDPlatform platform = EkDPlatform::system());

  // The process-wide server.
  static std::shared_ptr<EkDServer> server();

  // Starts accepting connections, then registers the system volume in the background when the
  // server opened the registry: requests are answered meanwhile and see the plug-ins
  // registered so far. The caller then runs the main run loop.
  void run();
  // Whether the system volume is being read (the start-up scan until it completes, or a
  // rescan).
  bool scanning() const { return scanning_.load(); }
  // Registers and unregisters system plug-ins as the system volume now holds them (SIGHUP),
  // a moment later and off the request threads. Any thread.
  void rescanSystemVolume();
  // Enqueues work on the work queue "service"; the only way request work reaches it. From a
  // connection's handler, the work runs on that thread once the handler returns, which must
  // not wait for it (SerialQueue::asyncContinuation).
  void submitWork(std::function<void()> work);
  // Something used or freed memory (a request, a client gone): the heap is trimmed once the
  // daemon has been quiet for a while. Requests through submitWork count already.
  void memoryChurned();
  // Cancels the listener and releases every hold. Called just before the process exits.
  void stop();

  // Holds. Readers take the list in force (holds()) and keep it for the whole request;
  // changes replace the list whole. Any thread.
  std::shared_ptr<const EkDPlugInHolds> holds() const;
  bool holdOnPlugIn(const EkDPlugIn& plugIn) const { return holds()->blocks(plugIn); }
  void addHold(std::shared_ptr<EkDPlugInHold> hold);
  void unholdToken(const Uuid& token);
  void unholdClient(const std::shared_ptr<EkDWyreClient>& client);
  size_t holdCount();
  // Asks the service manager to end every running instance of each plug-in; reply runs once
  // every answer is in, on a queue of its own. Returns at once.
  void terminatePlugIns(const std::vector<vantor::PlugInProxyPtr>& plugIns,
                        std::function<void()> reply);
  // The database's delegate: installed plug-ins are going away.
  void removedPlugIns(const std::vector<vantor::PlugInProxyPtr>& plugIns);
  // Prunes the service declarations once this host has exited: one watch per host, on its
  // pidfd. Without a pidfd they go at the next declaration or daemon start instead. Runs on
  // the work queue.
  void watchHostExit(const AuditToken& host);

  // When the server was built: the daemon's start, for its uptime.
  std::chrono::steady_clock::time_point startTime() const { return startTime_; }
  uint32_t verbose() const { return verbose_; }
  void setVerbose(uint32_t verbose) { verbose_ = verbose; }
  const std::optional<std::string>& databasePath() const { return databasePath_; }

  // The plug-in database; used on mainQueue() only.
  EkDatabase& database() const { return *database_; }
  const EkDPlatform& platform() const { return platform_; }
  const std::shared_ptr<vantor::Registry>& registry() const { return platform_.registry; }
  const std::shared_ptr<EkDUserPrefs>& userPrefs() const { return userPrefs_; }
  const std::shared_ptr<SerialQueue>& mainQueue() const { return mainQueue_; }
  const std::shared_ptr<wyre::Listener>& service() const { return service_; }

 private:
  EkDServer() = default;
  void handleListenerEvent(const wyre::ListenerEvent& event);
  // Replaces the holds in force with what change makes of a copy of them. The released holds
  // end after the lock is left: a hold's last reference may be the old list's.
  void changeHolds(const std::function<void(std::vector<std::shared_ptr<EkDPlugInHold>>&)>& change);
  // Runs on the system volume's queue, one scan at a time.
  void scanSystemVolume();

  const std::chrono::steady_clock::time_point startTime_ = std::chrono::steady_clock::now();
  std::atomic<uint32_t> verbose_{0};
  std::optional<std::string> databasePath_;
  EkDPlatform platform_;
  std::shared_ptr<EkDatabase> database_;
  std::shared_ptr<SerialQueue> wyreQueue_;
  std::shared_ptr<SerialQueue> mainQueue_;  // "service": every request runs here
  std::shared_ptr<wyre::Listener> service_;
  // Held only to copy or replace the pointer. libstdc++'s atomic shared_ptr would do without,
  // but the thread sanitizer cannot see its lock bit and reports every reader.
  mutable std::mutex holdsPointer_;
  std::shared_ptr<const EkDPlugInHolds> holds_ = std::make_shared<const EkDPlugInHolds>();
  // Serialises the changes of holds_: each reads the list in force and replaces it.
  std::mutex holdsWriter_;
  std::unordered_map<pid_t, std::shared_ptr<asio::posix::stream_descriptor>>
      hostWatches_;  // on mainQueue_
  std::shared_ptr<EkDUserPrefs> userPrefs_;
  std::shared_ptr<EkDHeapTrim> heapTrim_;
  std::shared_ptr<EkDSystemVolumeWatch> systemVolumeWatch_;
  // Where the start-up scan runs when the system volume cannot be watched.
  std::shared_ptr<SerialQueue> scanQueue_;
  bool scanAtStart_ = false;  // the server opened the registry, without its scan
  std::atomic<bool> scanning_{false};
  std::atomic<bool> scannedOnce_{false};
};

}  // namespace ek
