#include "Ekora/EkDaemonClient.h"

#include "Ekora/EkProtocol.h"
#include "platform/log/Log.h"

namespace ek {

std::shared_ptr<EkDaemonClient> EkDaemonClient::initWithServiceName(
    std::optional<std::string> serviceName) {
  auto client = std::shared_ptr<EkDaemonClient>(new EkDaemonClient());
  client->replyQueue_ = SerialQueue::make("ekd_client");
  std::string name = serviceName.value_or(std::string(protocol::kServiceName));
  auto connection = wyre::Connection::connect(name, client->replyQueue_);
  if (!connection) {
    client->connectError_ = connection.error();
    log::ops().error("Communications error: %{public}@", connection.error());
    return client;
  }
  client->ekd_ = std::move(connection).value();
  client->ekd_->setEventHandler([](const wyre::Event& event) {
    if (event.type == wyre::EventType::Error) {
      log::ops().error("Communications error: %{public}@", event.error);
    } else {
      log::ops().error("Communications error: %{public}@", event.message.body);
    }
  });
  client->ekd_->resume();
  return client;
}

Dictionary EkDaemonClient::request(std::string_view type) const {
  Dictionary message;
  message.emplace(protocol::kRequest, Value(type));
  message.emplace(protocol::kVersion, Value(protocolVersion_.load()));
  return message;
}

Dictionary EkDaemonClient::request(std::string_view type,
                                   const std::vector<std::string>& paths) const {
  Dictionary message = request(type);
  Array array(paths.begin(), paths.end());
  message.emplace(protocol::kPaths, Value(std::move(array)));
  return message;
}

void EkDaemonClient::set(Dictionary& message, const std::vector<PlugInRef>& plugIns) {
  Array uuids, paths;
  uuids.reserve(plugIns.size());
  paths.reserve(plugIns.size());
  for (const PlugInRef& ref : plugIns) {
    uuids.emplace_back(ref.uuid);
    // An element that is not a string gives no path to fall back on.
    paths.emplace_back(ref.path ? Value(*ref.path) : Value(false));
  }
  message[std::string(protocol::kUuids)] = Value(std::move(uuids));
  message[std::string(protocol::kPaths)] = Value(std::move(paths));
}

void EkDaemonClient::set(Dictionary& message, const std::vector<Uuid>& uuids) {
  Array array(uuids.begin(), uuids.end());
  message[std::string(protocol::kUuids)] = Value(std::move(array));
}

void EkDaemonClient::send(Dictionary message, Reply reply) {
  Value body(std::move(message));
  log::traffic().debug("request: %@", body);
  if (!ekd_) {
    replyQueue_->async([reply = std::move(reply), error = *connectError_] { reply(error); });
    return;
  }
  ekd_->sendWithReply(body, [reply = std::move(reply)](Result<Value> result) {
    if (result) {
      log::traffic().debug("reply: %@", result.value());
    } else {
      log::traffic().debug("reply: %@", result.error());
    }
    reply(std::move(result));
  });
}

void EkDaemonClient::addPlugIns(const std::vector<std::string>& paths, Reply reply) {
  send(request(protocol::kAdd, paths), std::move(reply));
}

void EkDaemonClient::removePlugIns(const std::vector<std::string>& paths, Reply reply) {
  send(request(protocol::kRemove, paths), std::move(reply));
}

void EkDaemonClient::bulkPlugins(uint64_t flags, Reply reply) {
  Dictionary message = request(protocol::kBulk);
  message.emplace(protocol::kFlags, Value(flags));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::readyPlugIns(const std::vector<PlugInRef>& plugIns, uint64_t flags,
                                  const std::optional<Dictionary>& environment, Reply reply) {
  Dictionary message = request(protocol::kReady);
  message.emplace(protocol::kFlags, Value(flags));
  if (environment) message.emplace(protocol::kEnvironment, Value(*environment));
  set(message, plugIns);
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::accessPlugIns(const std::vector<PlugInRef>& plugIns, uint64_t flags,
                                   Reply reply) {
  Dictionary message = request(protocol::kAccess);
  message.emplace(protocol::kFlags, Value(flags));
  set(message, plugIns);
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::findPlugInByUUID(const Uuid& uuid, Reply reply) {
  log::ops().defaultLevel("findPlugInByUUID %{public}@", uuid);
  Dictionary message = request(protocol::kFind);
  message.emplace(protocol::kUuids, Value(uuid));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::findPlugInByPathURL(const std::string& url, Reply reply) {
  log::ops().defaultLevel("findPlugInByPathURL %{public}@", url);
  Dictionary message = request(protocol::kFind);
  message.emplace(protocol::kPaths, Value(url));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::matchPlugIns(const Dictionary& rules, uint64_t flags, Reply reply) {
  Dictionary message = request(protocol::kMatch);
  message.emplace(protocol::kRules, Value(rules));
  message.emplace(protocol::kFlags, Value(flags));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::setPluginAnnotations(const std::vector<Uuid>& uuids,
                                          const Dictionary& annotations, Reply reply) {
  Dictionary message = request(protocol::kAnnotate);
  set(message, uuids);
  message.emplace(protocol::kAnnotations, Value(annotations));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::bulkSetPluginAnnotations(const Dictionary& annotations, Reply reply) {
  Dictionary message = request(protocol::kBulkAnnotate);
  message.emplace(protocol::kAnnotations, Value(annotations));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::holdPlugins(const std::vector<std::string>& paths, uint64_t flags,
                                 Reply reply) {
  Dictionary message = request(protocol::kLock, paths);
  message.emplace(protocol::kFlags, Value(flags));
  send(std::move(message), std::move(reply));
}

void EkDaemonClient::releaseHold(const Uuid& hold, Reply reply) {
  Dictionary message = request(protocol::kLock);
  message.emplace(protocol::kUuids, Value(Array{Value(hold)}));
  send(std::move(message), std::move(reply));
}

std::optional<EkError> EkDaemonClient::errorInReply(const Result<Value>& reply) {
  if (!reply) {
    return EkError::ekora(protocol::kErrorInvalidRequest, reply.error().description());
  }
  const Value& body = reply.value();
  int32_t code = 0;
  if (const uint64_t* raw = body.getUnsigned(protocol::kErrorCode)) {
    code = static_cast<int32_t>(static_cast<uint32_t>(*raw));
  } else if (const int64_t* negative = body.get(protocol::kErrorCode)
                                           ? body.get(protocol::kErrorCode)->negativeNumber()
                                           : nullptr) {
    code = static_cast<int32_t>(*negative);
  }
  const std::string* text = body.getString(protocol::kError);
  if (code == 0) {
    if (text) {
      // The daemon broke the protocol; report it and treat the reply as a success.
      log::ops().error(protocol::kMsgErrorWithoutCode, *text);
    }
    return std::nullopt;
  }
  return EkError::ekora(code, text ? *text : std::string(protocol::kMsgUnknownError));
}

std::optional<Value> EkDaemonClient::convertToWyre(Value object, uint64_t version) {
  if (!convertsToWyre(version)) return std::nullopt;
  return std::optional<Value>(std::move(object));
}

std::optional<Value> EkDaemonClient::convertFromWyre(const Value& value) const {
  if (protocolVersion_.load() != static_cast<int64_t>(protocol::kCurrentVersion)) {
    return std::nullopt;
  }
  return value;
}

}  // namespace ek
