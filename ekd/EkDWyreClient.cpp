#include "ekd/EkDWyreClient.h"

#include <fmt/format.h>

#include "Ekora/EkBundle.h"
#include "Ekora/EkFileURL.h"
#include "ekd/EkDServer.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {

std::shared_ptr<EkDWyreClient> EkDWyreClient::initWithConnection(
    const std::shared_ptr<wyre::Connection>& connection, std::shared_ptr<EkDServer> server) {
  auto client = std::shared_ptr<EkDWyreClient>(new EkDWyreClient());
  client->connection_ = connection;
  client->server_ = std::move(server);
  client->token_ = connection->auditToken();
  client->pid_ = connection->pid();
  if (auto path = executablePathForPid(client->pid_)) {
    if (auto url = EkFileURL::fromPath(*path)) {
      client->bundle_ = EkBundle::initWithExecutableURL(url.value());
    }
    client->path_ = std::move(*path);
  }

  log::ops().debug("new client %d %s", client->pid_, client->path_);
  EK_PROBE1(client_new, client->pid_);

  client->task_ = client->server_->platform().codeSigning->taskForAuditToken(client->token_);
  connection->setContext(client);
  std::weak_ptr<EkDWyreClient> weak = client;
  connection->setEventHandler([weak](const wyre::Event& event) {
    if (auto self = weak.lock()) self->handleEvent(event);
  });
  connection->resume();
  return client;
}

void EkDWyreClient::handleEvent(const wyre::Event& event) {
  if (event.type == wyre::EventType::Error) {
    if (event.error.domain == wyre::kErrorDomain &&
        event.error.code == wyre::kTerminationImminent) {
      dying();
    } else if (event.isConnectionInvalid()) {
      dead();
    } else {
      log::ops().error("unexpected error type from wyre: %{public}@", event.error);
    }
    return;
  }
  const wyre::Message& message = event.message;
  if (!message.body.dictionary()) {
    log::ops().error("unexpected message: %{public}@ from: %d", message.body, pid_);
    if (auto connection = connection_.lock()) connection->dropRequest(message);
    return;
  }
  if (EK_PROBE_ENABLED(request_input)) {
    std::string text = message.body.description();
    EK_PROBE2(request_input, pid_, text.c_str());
  }
  auto transaction = Transaction::initWithRequest(message, shared_from_this());
  server_->submitWork([transaction] {
    auto& client = transaction->client();
    uint32_t count = client->countRequest();
    if (count % 1000 == 0) {
      log::ops().debug("client %d used %u requests so far", client->pid(), count);
    }
    transaction->dispatch();
  });
}

void EkDWyreClient::dying() {
  log::ops().debug("client %d termination imminent", pid_);
}

void EkDWyreClient::dead() {
  // First: a hold placed from now on is dropped rather than outliving its client.
  acceptWork_ = false;
  server_->unholdClient(shared_from_this());
  // Its connection's buffers go with it.
  server_->memoryChurned();
  log::ops().debug("client %d is dead", pid_);
  EK_PROBE1(client_done, pid_);
}

std::optional<Value> EkDWyreClient::entitlementValueForKey(std::string_view key) const {
  if (!task_) return std::nullopt;
  auto value = task_->entitlementValue(key);
  if (!value) {
    log::ops().error("error retrieving entitlements for client %d", pid_);
    return std::nullopt;
  }
  return std::move(value).value();
}

bool EkDWyreClient::hasEntitlement(std::string_view key) const {
  auto value = entitlementValueForKey(key);
  if (!value) return false;
  if (const bool* flag = value->boolean()) return *flag;
  if (auto number = value->numericValue()) return *number != 0;
  return true;
}

bool EkDWyreClient::isSandboxed() const {
  return server_->platform().sandbox->isSandboxed(token_);
}

std::string EkDWyreClient::description() const {
  auto connection = connection_.lock();
  if (!connection) {
    return fmt::format("<EkDWyreClient {} NO CONNECTION>", static_cast<const void*>(this));
  }
  return fmt::format("<EkDWyreClient {} con={} pid={} path={}>", static_cast<const void*>(this),
                     connection->description(), pid_, path_);
}

}  // namespace ek
