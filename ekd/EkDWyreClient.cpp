#include "ekd/EkDWyreClient.h"

#include <fmt/format.h>

#include <algorithm>

#include "Ekora/EkBundle.h"
#include "Ekora/EkFileURL.h"
#include "ekd/EkDServer.h"
#include "ekd/Transaction.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {
namespace {

// Writers remembered per connection, the connecting process among them. Each other writer's
// record pins its process with a pidfd, so a connection that forks writer after writer must not
// make the daemon keep a descriptor for each: past this the oldest is read again if it writes.
constexpr size_t kMaxWritersPerConnection = 8;

}  // namespace

// ---- EkDClientProcess ------------------------------------------------------------------------

std::shared_ptr<const EkDClientProcess> EkDClientProcess::read(
    AuditToken token, std::optional<FileId> executable, CodeSigning& codeSigning,
    std::shared_ptr<SandboxCheck> sandbox) {
  auto record = std::shared_ptr<EkDClientProcess>(new EkDClientProcess());
  record->sandbox_ = std::move(sandbox);
  record->token_ = std::move(token);
  const pid_t pid = record->token_.pid;
  auto path = executable ? executablePathForPid(pid) : std::nullopt;
  auto task = path ? codeSigning.taskForAuditToken(record->token_) : nullptr;
  // What was read describes the process only if it still runs the same program now: it may
  // have executed another, or exited and left its pid to another process, meanwhile.
  if (!path || !record->token_.alive() || executableIdForPid(pid) != executable) {
    record->unknown_ = true;
    return record;
  }
  record->executable_ = executable;
  if (auto url = EkFileURL::fromPath(*path)) {
    record->bundle_ = EkBundle::initWithExecutableURL(url.value());
  }
  record->path_ = std::move(*path);
  record->task_ = std::move(task);
  return record;
}

std::optional<Value> EkDClientProcess::entitlementValueForKey(std::string_view key) const {
  if (!task_) return std::nullopt;
  auto value = task_->entitlementValue(key);
  if (!value) {
    log::ops().error("error retrieving entitlements for client %d", pid());
    return std::nullopt;
  }
  return std::move(value).value();
}

bool EkDClientProcess::hasEntitlement(std::string_view key) const {
  auto value = entitlementValueForKey(key);
  return entitlementHeld(value ? &*value : nullptr);
}

bool EkDClientProcess::isSandboxed() const {
  // Asked anew each time of the pinned process (rarely: only privileged requests ask), since a
  // process may confine itself after it first wrote; an unknown process always is.
  return unknown_ || !sandbox_ || sandbox_->isSandboxed(token_);
}

// ---- EkDWyreClient ---------------------------------------------------------------------------

std::shared_ptr<EkDWyreClient> EkDWyreClient::initWithConnection(
    const std::shared_ptr<wyre::Connection>& connection, std::shared_ptr<EkDServer> server) {
  auto client = std::shared_ptr<EkDWyreClient>(new EkDWyreClient());
  client->connection_ = connection;
  client->server_ = std::move(server);
  client->pid_ = connection->pid();
  const EkDPlatform& platform = client->server_->platform();
  client->process_ =
      EkDClientProcess::read(connection->auditToken(), executableIdForPid(client->pid_),
                             *platform.codeSigning, platform.sandbox);
  client->writers_.push_back(client->process_);

  log::ops().debug("new client %d %s", client->pid_, client->process_->path());
  EK_PROBE1(client_new, client->pid_);

  connection->setContext(client);
  std::weak_ptr<EkDWyreClient> weak = client;
  connection->setEventHandler([weak](const wyre::Event& event) {
    if (auto self = weak.lock()) self->handleEvent(event);
  });
  connection->resume();
  return client;
}

std::shared_ptr<const EkDClientProcess> EkDWyreClient::writerOf(const wyre::Message& message) {
  const Credentials& writer = message.sender;
  // Messages of one read were written by one process before the read: a stat after the read
  // already answers for all of them.
  if (lastWriter_ && message.read != 0 && message.read == lastRead_ &&
      lastWriter_->pid() == writer.pid) {
    return lastWriter_;
  }
  lastWriter_ = resolveWriter(writer);
  lastRead_ = message.read;
  return lastWriter_;
}

std::shared_ptr<const EkDClientProcess> EkDWyreClient::resolveWriter(const Credentials& writer) {
  if (writer.pid <= 0) {
    // The kernel could not name the writer: judged as nobody in particular.
    return EkDClientProcess::read(AuditToken::forWriter(writer), std::nullopt,
                                  *server_->platform().codeSigning, server_->platform().sandbox);
  }
  // The one stat on the way of every request: it tells whether the writer still runs the
  // program its record describes. Exec keeps the pid, so nothing cheaper notices it.
  std::optional<FileId> executable = executableIdForPid(writer.pid);
  auto known = std::find_if(writers_.begin(), writers_.end(),
                            [&](const auto& record) { return record->pid() == writer.pid; });
  if (known != writers_.end() && (*known)->executable() && (*known)->executable() == executable) {
    return *known;
  }
  // A writer not seen yet, or one that has executed another program since: read it. The
  // connecting process keeps the pidfd taken at accept.
  AuditToken token = writer.pid == pid_ ? process_->token() : AuditToken::forWriter(writer);
  if (known != writers_.end() && (*known)->token().pidfd && (*known)->token().alive()) {
    token = (*known)->token();
  }
  const EkDPlatform& platform = server_->platform();
  auto record =
      EkDClientProcess::read(std::move(token), executable, *platform.codeSigning, platform.sandbox);
  if (known != writers_.end()) {
    *known = record;
  } else {
    if (writers_.size() >= kMaxWritersPerConnection) writers_.erase(writers_.begin() + 1);
    writers_.push_back(record);
  }
  if (writer.pid != pid_ || known != writers_.end()) {
    log::ops().debug("client %d: requests written by %d %s", pid_, writer.pid, record->path());
  }
  return record;
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
    log::ops().error("unexpected message: %{public}@ from: %d", message.body, message.sender.pid);
    if (auto connection = connection_.lock()) connection->dropRequest(message);
    return;
  }
  if (EK_PROBE_ENABLED(request_input)) {
    std::string text = message.body.description();
    EK_PROBE2(request_input, pid_, text.c_str());
  }
  submit(Transaction::initWithRequest(message, shared_from_this()));
}

void EkDWyreClient::submit(std::shared_ptr<Transaction> transaction) {
  {
    std::lock_guard lock(queueMutex_);
    queued_.push_back(std::move(transaction));
    if (scheduled_) return;
    scheduled_ = true;
  }
  server_->submitWork([self = shared_from_this()] { self->runNext(); });
}

void EkDWyreClient::runNext() {
  std::shared_ptr<Transaction> transaction;
  {
    std::lock_guard lock(queueMutex_);
    transaction = std::move(queued_.front());
    queued_.pop_front();
  }
  uint32_t count = countRequest();
  if (count % 1000 == 0) {
    log::ops().debug("client %d used %u requests so far", pid_, count);
  }
  transaction->dispatch();
  transaction.reset();
  {
    std::lock_guard lock(queueMutex_);
    if (queued_.empty()) {
      scheduled_ = false;
      return;
    }
  }
  // Behind every other client's turn.
  server_->submitWork([self = shared_from_this()] { self->runNext(); });
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

std::string EkDWyreClient::description() const {
  auto connection = connection_.lock();
  if (!connection) {
    return fmt::format("<EkDWyreClient {} NO CONNECTION>", static_cast<const void*>(this));
  }
  return fmt::format("<EkDWyreClient {} con={} pid={} path={}>", static_cast<const void*>(this),
                     connection->description(), pid_, process_->path());
}

}  // namespace ek
