#include "ekd/EkDServer.h"

#include "ekd/EkDWyreClient.h"
#include "platform/log/Log.h"
#include "platform/vantor/SqliteRegistry.h"

namespace ek {
namespace {

std::shared_ptr<EkDServer> gServer;
std::mutex gServerMutex;

}  // namespace

EkDPlatform EkDPlatform::system() {
  return {CodeSigning::system(), SandboxCheck::system()};
}

std::shared_ptr<EkDServer> EkDServer::initForService(const std::string& serviceName,
                                                     std::optional<std::string> database,
                                                     EkDPlatform platform) {
  auto server = std::shared_ptr<EkDServer>(new EkDServer());
  server->databasePath_ = std::move(database);
  server->platform_ = std::move(platform);
  if (!server->platform_.registry) {
    vantor::SqliteRegistry::Options options;
    options.codeSigning = server->platform_.codeSigning;
    auto registry = vantor::SqliteRegistry::open(std::move(options));
    if (!registry) {
      log::vr().error("unable to open the registry: %{public}@", registry.error());
      return nullptr;
    }
    server->platform_.registry = std::move(registry).value();
  }
  server->wyreQueue_ = SerialQueue::make("wyre");
  // Requests run on the thread that reads the sockets: a request then reaches its handler
  // without waking another thread, and handlers run one at a time all the same.
  server->mainQueue_ = SerialQueue::make("service", wyre::ioContext());
  server->syncQueue_ = SerialQueue::make("serverSync");

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
    log::ops().error("unexpected error from wyre: %{public}@", *event.error);
  } else {
    log::ops().error("unexpected message: %{public}@", "(empty listener event)");
  }
}

void EkDServer::run() {
  service_->resume();
}

void EkDServer::submitWork(std::function<void()> work) {
  mainQueue_->async(std::move(work));
}

void EkDServer::stop() {
  service_->cancel();
}

}  // namespace ek
