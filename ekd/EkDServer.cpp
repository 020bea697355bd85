#include "ekd/EkDServer.h"

#include <fcntl.h>
#include <malloc.h>

#include <chrono>
#include <future>
#include <mutex>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDAnnotationStore.h"
#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDSystemVolumeWatch.h"
#include "ekd/EkDUserPrefs.h"
#include "ekd/EkDWyreClient.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"
#include "platform/vantor/SqliteRegistry.h"

namespace ek {
namespace {

constexpr size_t kMaxHostWatches = 256;
// Long enough that a host's burst of requests is over, short enough that the footprint is
// back before anyone looks.
constexpr auto kHeapTrimQuiet = std::chrono::milliseconds(500);
constexpr auto kSystemVolumeSettle = std::chrono::milliseconds(500);

std::shared_ptr<EkDServer> gServer;
std::mutex gServerMutex;

}  // namespace

EkDPlatform EkDPlatform::system() {
  EkDPlatform platform;
  platform.codeSigning = CodeSigning::system();
  platform.sandbox = SandboxCheck::system();
  auto serviceManager = std::make_shared<stard::FileServiceManager>();
  // Declarations of hosts that exited while the daemon was not running.
  serviceManager->pruneDeclarations();
  platform.serviceManager = std::move(serviceManager);
  platform.notifier = std::make_shared<notify::FileNotifier>();
  return platform;
}

std::shared_ptr<EkDServer> EkDServer::initForService(const std::string& serviceName,
                                                     std::optional<std::string> database,
                                                     EkDPlatform platform) {
  auto server = std::shared_ptr<EkDServer>(new EkDServer());
  server->databasePath_ = std::move(database);
  server->platform_ = std::move(platform);
  // The annotation file and the registry know nothing of each other: the one is read while
  // the other opens (or, with no thread to be had, when the store is asked for).
  std::future<std::unique_ptr<EkDAnnotationStore>> store = std::async(
      std::launch::async | std::launch::deferred,
      [path = server->databasePath_] { return EkDAnnotationStore::initWithDatabase(path); });
  if (!server->platform_.registry) {
    vantor::SqliteRegistry::Options options;
    options.codeSigning = server->platform_.codeSigning;
    // Reading a large system volume takes seconds: it is done once the server serves.
    options.scanOnOpen = false;
    auto registry = vantor::SqliteRegistry::open(std::move(options));
    if (!registry) {
      log::vr().error("unable to open the registry: %{public}@", registry.error());
      return nullptr;
    }
    server->platform_.registry = std::move(registry).value();
    server->scanAtStart_ = true;
  }
  if (!server->platform_.serviceManager) {
    server->platform_.serviceManager = std::make_shared<stard::FileServiceManager>();
  }
  if (!server->platform_.notifier) {
    server->platform_.notifier = std::make_shared<notify::FileNotifier>();
  }
  if (!server->platform_.consent) {
    server->platform_.consent = std::make_shared<privo::FileConsent>();
  }
  EkDatabasePlatform databasePlatform{
      server->platform_.registry, server->platform_.extensions, {},
      server->platform_.notifier, server->platform_.types,      server->platform_.serviceManager,
      server->platform_.consent};
  // Requests run on the thread that reads the sockets: a request then reaches its handler
  // without waking another thread, and handlers run one at a time all the same. The database
  // is theirs: its cache and annotations are touched on this queue only.
  server->mainQueue_ = SerialQueue::make("service", wyre::ioContext());
  server->database_ = std::make_shared<EkDatabase>();
  if (!server->database_->initWithStore(store.get(), std::move(databasePlatform),
                                        server->mainQueue_)) {
    return nullptr;
  }
  server->userPrefs_ = EkDUserPrefs::init(server->platform_.preferences);
  server->wyreQueue_ = SerialQueue::make("wyre");
  server->heapTrim_ = EkDHeapTrim::make(wyre::ioContext(), kHeapTrimQuiet);

  auto listener = wyre::Listener::create(serviceName, server->wyreQueue_);
  if (!listener) {
    log::ops().error("unable to listen on service %s: %{public}@", serviceName, listener.error());
    return nullptr;
  }
  server->service_ = std::move(listener).value();
  {
    std::lock_guard lock(gServerMutex);
    gServer = server;
  }
  server->database_->setDelegate([weak = std::weak_ptr<EkDServer>(server)](const auto& plugIns) {
    if (auto self = weak.lock()) self->removedPlugIns(plugIns);
  });
  server->registry()->addObserver(server->database_);
  // The listener holds the server weakly: the process-wide reference keeps it alive.
  std::weak_ptr<EkDServer> weak = server;
  server->service_->setEventHandler([weak](const wyre::ListenerEvent& event) {
    if (auto self = weak.lock()) self->handleListenerEvent(event);
  });
  return server;
}

std::shared_ptr<EkDServer> EkDServer::server() {
  std::lock_guard lock(gServerMutex);
  return gServer;
}

void EkDServer::handleListenerEvent(const wyre::ListenerEvent& event) {
  if (event.connection) {
    EkDWyreClient::initWithConnection(event.connection, shared_from_this());
    return;
  }
  if (event.error && event.error->domain == wyre::kErrorDomain &&
      event.error->code == wyre::kConnectionInvalid) {
    log::ops().defaultLevel("potentially unexpected error from wyre: %{public}@", *event.error);
  } else if (event.error) {
    // Accept failures repeat while they last (out of descriptors): one line a second.
    static log::Throttle throttle;
    log::ops().throttled(throttle, log::Level::Error, "unexpected error from wyre: %{public}@",
                         *event.error);
  } else {
    log::ops().error("unexpected message: %{public}@", "(empty listener event)");
  }
}

void EkDServer::run() {
  // Bundles added to or removed from the system volume while the daemon runs are registered
  // or unregistered without a restart. The settle time lets a package manager finish first.
  const std::string plugIns = paths::join(paths::systemRoot(), "Library/PlugIns");
  auto scan = [weak = weak_from_this()] {
    if (auto self = weak.lock()) self->scanSystemVolume();
  };
  auto watch = EkDSystemVolumeWatch::make(wyre::ioContext(), plugIns, kSystemVolumeSettle, scan);
  if (watch) {
    systemVolumeWatch_ = std::move(watch).value();
  } else {
    log::vr().error("cannot watch %s: %{public}@; system plug-ins are read at start only", plugIns,
                    watch.error());
  }
  // Set before the first request can ask: the scan is due from the moment the server serves.
  if (scanAtStart_) scanning_ = true;
  service_->resume();
  if (!scanAtStart_) return;
  // On the queue of the watch's rescans, so that a change seen meanwhile is read after it.
  if (systemVolumeWatch_) {
    systemVolumeWatch_->rescanNow();
  } else {
    scanQueue_ = SerialQueue::make("system-volume");
    scanQueue_->async(std::move(scan));
  }
}

void EkDServer::scanSystemVolume() {
  const bool startUp = scanAtStart_ && !scannedOnce_.load();
  if (!startUp) log::vr().info("rescanning the system volume");
  scanning_ = true;
  const auto began = std::chrono::steady_clock::now();
  const vantor::Registry::SystemVolumeScan scan = registry()->rescanSystemVolume();
  const auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::steady_clock::now() - began);
  const size_t registered = registry()->plugInCount();
  scannedOnce_ = true;
  scanning_ = false;
  log::ops().log(startUp ? log::Level::Default : log::Level::Info,
                 "system volume read in %llu ms: %zu bundles, %zu read, %zu unchanged; %zu "
                 "plug-ins registered",
                 static_cast<unsigned long long>(elapsed.count()), scan.bundles, scan.read,
                 scan.unchanged, registered);
  // A scan reads every bundle it registers: give that heap back once the daemon is quiet.
  heapTrim_->activity();
}

void EkDServer::rescanSystemVolume() {
  if (systemVolumeWatch_) systemVolumeWatch_->requestRescan();
}

void EkDServer::submitWork(std::function<void()> work) {
  // Called as a connection's read handler hands over a request: the thread that read it runs
  // it next, instead of waking the other I/O thread for it.
  mainQueue_->asyncContinuation(std::move(work));
  heapTrim_->activity();
}

void EkDServer::memoryChurned() {
  heapTrim_->activity();
}

void EkDServer::stop() {
  service_->cancel();
  if (systemVolumeWatch_) systemVolumeWatch_->cancel();
  changeHolds([](std::vector<std::shared_ptr<EkDPlugInHold>>& holds) {
    for (const auto& hold : holds) {
      log::ops().debug("releasing plug-in hold %{public}@ because server is stopping",
                       hold->uuid());
    }
    holds.clear();
  });
  platform_.notifier->post(protocol::kAnnotationChangeNotification);
  registry()->checkpoint();
}

std::shared_ptr<const EkDPlugInHolds> EkDServer::holds() const {
  std::lock_guard lock(holdsPointer_);
  return holds_;
}

void EkDServer::changeHolds(
    const std::function<void(std::vector<std::shared_ptr<EkDPlugInHold>>&)>& change) {
  std::shared_ptr<const EkDPlugInHolds> previous;
  std::lock_guard lock(holdsWriter_);
  previous = holds();
  auto next = std::make_shared<EkDPlugInHolds>();
  next->holds = previous->holds;
  change(next->holds);
  for (const auto& hold : next->holds) {
    for (const auto& plugIn : hold->blocked()) next->blocked.insert(plugIn->uuid());
  }
  std::lock_guard pointer(holdsPointer_);
  holds_ = std::move(next);
}

void EkDServer::watchHostExit(const AuditToken& host) {
  if (!host.pidfd || !host.pidfd->valid()) return;
  if (hostWatches_.contains(host.pid)) return;
  // Each watch keeps a descriptor open for as long as its host lives: bounded, so that hosts
  // cannot run the daemon out of descriptors. Past the bound, declarations go at the next
  // declaration instead.
  if (hostWatches_.size() >= kMaxHostWatches) {
    log::ops().info("not watching host %d for its exit: %zu hosts watched already", host.pid,
                    hostWatches_.size());
    return;
  }
  // A copy of the descriptor: the watch outlives the connection that brought the pidfd.
  int fd = ::fcntl(host.pidfd->get(), F_DUPFD_CLOEXEC, 0);
  if (fd < 0) {
    log::ops().error("cannot watch host %d for its exit: %{errno}d", host.pid, errno);
    return;
  }
  auto watch = std::make_shared<asio::posix::stream_descriptor>(wyre::ioContext(), fd);
  hostWatches_.emplace(host.pid, watch);
  // A pidfd becomes readable when its process has exited.
  watch->async_wait(asio::posix::stream_descriptor::wait_read,
                    [weak = weak_from_this(), pid = host.pid](const asio::error_code& error) {
                      auto server = weak.lock();
                      if (!server || error == asio::error::operation_aborted) return;
                      server->mainQueue_->async([server, pid] {
                        server->hostWatches_.erase(pid);
                        log::ops().debug("host %d exited: pruning its service declarations", pid);
                        server->platform_.serviceManager->pruneDeclarations();
                      });
                    });
}

void EkDServer::addHold(std::shared_ptr<EkDPlugInHold> hold) {
  // A hold request may pass its client's check just before the client dies and arrive here
  // after the client's holds were released: nobody would ever release it then. The client
  // stops accepting work before it releases its holds, and both changes of the list are
  // ordered by holdsWriter_.
  bool added = false;
  changeHolds([&](std::vector<std::shared_ptr<EkDPlugInHold>>& holds) {
    auto client = hold->client();
    if (client && !client->acceptWork()) {
      log::ops().debug("dropping plug-in hold %{public}@ of dead client pid %d", hold->uuid(),
                       client->pid());
      return;
    }
    holds.push_back(hold);
    added = true;
  });
  if (added) platform_.notifier->post(protocol::kAnnotationChangeNotification);
}

void EkDServer::unholdToken(const Uuid& token) {
  if (!holds()->holds.empty()) {
    bool released = false;
    changeHolds([&](std::vector<std::shared_ptr<EkDPlugInHold>>& holds) {
      for (auto it = holds.begin(); it != holds.end(); ++it) {
        if ((*it)->uuid() == token) {
          log::ops().debug("releasing plug-in hold %{public}@ at client's request", token);
          holds.erase(it);
          released = true;
          return;
        }
      }
    });
    if (released) platform_.notifier->post(protocol::kAnnotationChangeNotification);
  }
}

void EkDServer::unholdClient(const std::shared_ptr<EkDWyreClient>& client) {
  size_t released = 0;
  changeHolds([&](std::vector<std::shared_ptr<EkDPlugInHold>>& holds) {
    std::erase_if(holds, [&](const std::shared_ptr<EkDPlugInHold>& hold) {
      if (!hold->placedBy(client)) return false;
      log::ops().debug("releasing plug-in hold %{public}@ for dead client pid %d", hold->uuid(),
                       client->pid());
      ++released;
      return true;
    });
  });
  for (size_t i = 0; i < released; ++i)
    platform_.notifier->post(protocol::kAnnotationChangeNotification);
}

size_t EkDServer::holdCount() {
  return holds()->holds.size();
}

namespace {

// Counts the service manager's answers for one termination request and runs the waiter's
// steps as they arrive, so no thread blocks while the answers are outstanding.
struct TerminationWaiter {
  std::shared_ptr<SerialQueue> waiterQueue;
  std::function<void()> reply;
  int32_t expected = 0;
  int32_t received = 0;  // on waiterQueue
  int32_t awaiting = 0;  // on waiterQueue: the index of the answer the waiter waits for
  bool started = false;  // on waiterQueue: the waiter has begun

  // On waiterQueue: logs and passes every answer already in, then either waits for the next
  // one or sends the reply.
  void advance() {
    if (!started) return;
    while (awaiting < expected && received > awaiting) {
      ++awaiting;
      if (awaiting < expected) log::ops().debug("awaiting termination reply #%d", awaiting);
    }
    if (awaiting >= expected) {
      log::ops().debug("sending termination reply");
      if (reply) std::exchange(reply, nullptr)();
    }
  }
};

}  // namespace

void EkDServer::terminatePlugIns(const std::vector<vantor::PlugInProxyPtr>& plugIns,
                                 std::function<void()> reply) {
  auto killer = SerialQueue::make("killer");
  auto waiter = std::make_shared<TerminationWaiter>();
  waiter->waiterQueue = SerialQueue::make("killer-waiter");
  waiter->reply = std::move(reply);
  waiter->expected = static_cast<int32_t>(plugIns.size());

  for (const auto& proxy : plugIns) {
    const std::string* infoVersion = nullptr;
    auto it = proxy->info.find(vantor::kBundleVersionKey);
    if (it != proxy->info.end()) infoVersion = it->second.string();
    std::string version = infoVersion ? *infoVersion : "1";
    std::string uuid = proxy->uuid.string();
    log::ops().debug("requesting termination for %@(%@) stard:%@ %@", proxy->identifier,
                     proxy->bundleVersion.value_or("(null)"), version, uuid);
    platform_.serviceManager->removeExternalService(
        proxy->identifier, version, killer, [waiter, uuid](int error) {
          if (error == stard::kNoSuchProcess) {
            log::ops().debug("stard reported no plug-ins on record for uuid=%@", uuid);
          } else if (error != 0) {
            log::ops().error("stard error attempting to terminate plug-ins: error=%d for uuid=%@",
                             error, uuid);
          } else {
            log::ops().info("one or more plug-ins have been terminated for uuid=%@", uuid);
          }
          waiter->waiterQueue->async([waiter] {
            ++waiter->received;
            waiter->advance();
          });
        });
  }
  waiter->waiterQueue->async([waiter] {
    waiter->started = true;
    log::ops().debug("waiting for %d termination replies", waiter->expected);
    if (waiter->expected > 0) log::ops().debug("awaiting termination reply #%d", 0);
    waiter->advance();
  });
}

void EkDServer::removedPlugIns(const std::vector<vantor::PlugInProxyPtr>& plugIns) {
  auto described = std::make_shared<std::string>();
  if (log::ops().enabled(log::Level::Debug)) {
    for (const auto& proxy : plugIns) *described += proxy->description() + " ";
  }
  terminatePlugIns(plugIns,
                   [described] { log::ops().debug("removal complete for %@", *described); });
}

}  // namespace ek
