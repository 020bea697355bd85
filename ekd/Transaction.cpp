#include "ekd/Transaction.h"

#include <cstdlib>
#include <unordered_map>
#include <unordered_set>
#include <utility>

#include "Ekora/EkFileURL.h"
#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {
namespace {

using Handler = void (Transaction::*)();

const std::unordered_map<std::string_view, Handler>& requestTable() {
  static const std::unordered_map<std::string_view, Handler> table{
      {protocol::kAdd, &Transaction::addPlugIns},
      {protocol::kRemove, &Transaction::removePlugIns},
      {protocol::kBulk, &Transaction::bulkPlugIns},
      {protocol::kMatch, &Transaction::matchPlugIns},
      {protocol::kReady, &Transaction::readyPlugIns},
      {protocol::kAccess, &Transaction::accessPlugIns},
      {protocol::kAnnotate, &Transaction::annotatePlugIns},
      {protocol::kBulkAnnotate, &Transaction::bulkAnnotatePlugIns},
      {protocol::kLock, &Transaction::lockDownPlugIns},
      {protocol::kFind, &Transaction::findPlugIn},
      {protocol::kStatus, &Transaction::reportStatus},
  };
  return table;
}

}  // namespace

std::shared_ptr<Transaction> Transaction::initWithRequest(
    wyre::Message request, std::shared_ptr<EkDWyreClient> client,
    std::shared_ptr<const EkDClientProcess> sender) {
  if (!sender) sender = client->process();
  return std::shared_ptr<Transaction>(
      new Transaction(std::move(request), std::move(client), std::move(sender)));
}

EkDServer& Transaction::server() const {
  return *client_->server();
}

std::shared_ptr<wyre::Connection> Transaction::connection() const {
  return client_->connection();
}

const Array* Transaction::arrayForKey(std::string_view key) const {
  return request_.body.getArray(key);
}

const Dictionary* Transaction::dictionaryForKey(std::string_view key) const {
  return request_.body.getDictionary(key);
}

void Transaction::dispatch() {
  const std::string* type = request_.body.getString(protocol::kRequest);
  const uint64_t* requested = request_.body.getUnsigned(protocol::kVersion);
  version_ = requested ? *requested : 0;

  if (version_ != protocol::kCurrentVersion && version_ != protocol::kOldestVersion) {
    // Shown as %d shows it: the low 32 bits, signed.
    int32_t shown = static_cast<int32_t>(static_cast<uint32_t>(version_.load()));
    fail(protocol::kErrorVersion,
         log::format(protocol::kMsgUnsupportedVersion, shown, protocol::kCurrentVersion));
    return;
  }
  if (!client_->acceptWork()) return;

  log::ops().debug("client %d requested %{public}s", client_->pid(),
                   type ? std::string_view(*type) : std::string_view("(null)"));
  EK_PROBE2(request, client_->pid(), type ? type->c_str() : "");

  if (!type) {
    fail(protocol::kErrorInvalidRequest, protocol::kMsgMissingType);
    return;
  }
  auto it = requestTable().find(*type);
  if (it == requestTable().end()) {
    fail(protocol::kErrorInvalidRequest, protocol::kMsgUnrecognized);
    return;
  }
  (this->*(it->second))();
}

void Transaction::prepareReply() {
  if (replied_) {
    log::ops().error("transaction for client %d replied twice", client_->pid());
    std::abort();
  }
  replied_ = true;
  if (beforeReply_) std::exchange(beforeReply_, nullptr)();
  // Diagnostic lines logged for a request are out before its reply, unless other requests
  // wait: then they go out together a moment later, rather than one write each. Default-level
  // lines always wait for the next batch (log::bufferLines).
  if (!server().mainQueue()->hasWaiting()) log::flushDiagnostics();
}

void Transaction::done() {
  prepareReply();
  Value reply(std::move(reply_));
  if (EK_PROBE_ENABLED(request_output)) {
    std::string text = reply.description();
    EK_PROBE2(request_output, client_->pid(), text.c_str());
  }
  if (!request_.wantsReply()) return;
  std::vector<uint8_t> frame(wyre::kHeaderSize);
  cbor::encode(reply, frame);
  sendFrame(std::move(frame));
}

void Transaction::sendFrame(std::vector<uint8_t> frame) {
  auto connection = client_->connection();
  if (!connection) return;
  const size_t body = frame.size() - wyre::kHeaderSize;
  if (body > wyre::kMaxBodySize) {
    // The client could not read it: it would take the frame for a broken stream.
    const std::string message = log::format(protocol::kMsgReplyTooLarge, body, wyre::kMaxBodySize);
    log::ops().error("refusing to send client %d a %{public}s", client_->pid(), message);
    const Value error(Dictionary{
        {std::string(protocol::kErrorCode),
         Value(static_cast<uint64_t>(static_cast<int64_t>(protocol::kErrorInvalidRequest)))},
        {std::string(protocol::kError), Value(message)}});
    frame.assign(wyre::kHeaderSize, 0);
    frame.shrink_to_fit();
    cbor::encode(error, frame);
  }
  connection->replyEncoded(request_, std::move(frame));
}

void Transaction::doneWithEncoded(
    std::string_view key, const std::function<void(std::vector<uint8_t>& out)>& writeValue) {
  prepareReply();
  if (auto it = reply_.find(key); it != reply_.end()) reply_.erase(it);
  std::vector<uint8_t> frame(wyre::kHeaderSize);
  cbor::encodeMapHead(reply_.size() + 1, frame);
  for (const auto& [name, value] : reply_) {
    cbor::encodeText(name, frame);
    cbor::encode(value, frame);
  }
  cbor::encodeText(key, frame);
  writeValue(frame);
  if (EK_PROBE_ENABLED(request_output)) {
    auto reply = cbor::decode(std::span(frame).subspan(wyre::kHeaderSize));
    std::string text = reply ? reply->description() : reply.error().message;
    EK_PROBE2(request_output, client_->pid(), text.c_str());
  }
  sendFrame(std::move(frame));
}

void Transaction::fail(int32_t code, std::string_view message) {
  // The code travels as a signed 32-bit value widened to 64 bits.
  reply_[std::string(protocol::kErrorCode)] =
      Value(static_cast<uint64_t>(static_cast<int64_t>(code)));
  reply_[std::string(protocol::kError)] = Value(message);
  done();
}

void Transaction::fail(int32_t code, const EkError& error) {
  fail(error.isEkora() ? error.code : code, error.description());
}

struct Transaction::PathWalk {
  const Array* paths = nullptr;
  size_t next = 0;
  // The texts already passed on, as sent and as resolved: a path sent many times costs one
  // resolution and one step.
  std::unordered_set<std::string> seen;
  PathCallback callback;
};

const Array* Transaction::pathList() {
  const Array* paths = arrayForKey(protocol::kPaths);
  if (!paths) {
    fail(protocol::kErrorInvalidRequest, protocol::kMsgInvalidFormat);
    return nullptr;
  }
  if (paths->size() > protocol::kMaxListEntries) {
    fail(protocol::kErrorInvalidRequest, log::format(protocol::kMsgTooManyEntries, protocol::kPaths,
                                                     paths->size(), protocol::kMaxListEntries));
    return nullptr;
  }
  return paths;
}

Transaction::PathStep Transaction::walkPath(PathWalk& walk, const Value& element) {
  const std::string* path = element.string();
  if (!path) {
    fail(protocol::kErrorInvalidRequest, protocol::kMsgInvalidFormat);
    return PathStep::Stop;
  }
  if (path->empty() || (*path)[0] != '/') {
    fail(protocol::kErrorBadPath, log::format(protocol::kMsgAbsolutePathRequired, *path));
    return PathStep::Stop;
  }
  if (!walk.seen.insert(*path).second) return PathStep::Continue;
  if (path->find('\0') == std::string::npos) {
    char* resolved = ::realpath(path->c_str(), nullptr);
    if (resolved) {
      std::string canonical(resolved);
      std::free(resolved);
      if (canonical != *path && !walk.seen.insert(canonical).second) return PathStep::Continue;
      return walk.callback(canonical, true);
    }
  }
  return walk.callback(*path, false);
}

bool Transaction::marshalPaths(const PathCallback& callback) {
  PathWalk walk;
  walk.paths = pathList();
  if (!walk.paths) return false;
  walk.callback = callback;
  for (const Value& element : *walk.paths) {
    if (walkPath(walk, element) == PathStep::Stop) return false;
  }
  return true;
}

void Transaction::processPaths(PathCallback callback) {
  auto walk = std::make_shared<PathWalk>();
  walk->paths = pathList();
  if (!walk->paths) return;
  walk->callback = std::move(callback);
  continuePaths(std::move(walk));
}

void Transaction::continuePaths(std::shared_ptr<PathWalk> walk) {
  if (!client_->acceptWork()) return;
  const auto deadline = std::chrono::steady_clock::now() + kPathSliceBudget;
  const Array& paths = *walk->paths;
  while (walk->next < paths.size()) {
    if (walkPath(*walk, paths[walk->next++]) == PathStep::Stop) return;
    if (walk->next < paths.size() && std::chrono::steady_clock::now() >= deadline) {
      server().mainQueue()->async(
          [self = shared_from_this(), walk] { self->continuePaths(std::move(walk)); });
      return;
    }
  }
  done();
}

bool Transaction::processUuidList(const PlugInStep& step) {
  const Array* uuids = arrayForKey(protocol::kUuids);
  if (!uuids) {
    fail(protocol::kErrorInvalidRequest, "invalid request format (uuid)");
    return false;
  }
  if (uuids->size() > protocol::kMaxListEntries) {
    fail(protocol::kErrorInvalidRequest, log::format(protocol::kMsgTooManyEntries, protocol::kUuids,
                                                     uuids->size(), protocol::kMaxListEntries));
    return false;
  }
  const Array* paths = nullptr;
  if (const Value* value = request_.body.get(protocol::kPaths)) {
    if (!value->array()) {
      log::traffic().defaultLevel("Paths present but not an array (ignoring values)");
    } else if (value->array()->size() != uuids->size()) {
      log::traffic().defaultLevel("Paths present but has different count than UUIDs (ignoring)");
    } else {
      paths = value->array();
    }
  }
  EkDServer& database = server();
  for (size_t i = 0; i < uuids->size(); ++i) {
    const Uuid* uuid = (*uuids)[i].uuid();
    if (!uuid) {
      fail(protocol::kErrorInvalidRequest, "invalid request (bad uuid array)");
      return false;
    }
    auto plugIn = database.findPlugIn(*uuid);
    if (!plugIn && paths) {
      log::traffic().info("Failed to find plugin by %{uuid_t}.16P", *uuid);
      if (const std::string* path = (*paths)[i].string()) {
        log::traffic().info("Looking for plugin %{uuid_t}.16P by path %s", *uuid, *path);
        if (auto url = EkFileURL::fromPath(*path))
          plugIn = database.findPlugInAtPath(url->string());
      }
    }
    if (!plugIn) {
      fail(protocol::kErrorInvalidRequest, "no such plugin (uuid not found)");
      return false;
    }
    if (!step(plugIn)) return false;
  }
  return true;
}

}  // namespace ek
