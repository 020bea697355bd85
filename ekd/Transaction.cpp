#include "ekd/Transaction.h"

#include <cstdlib>
#include <utility>

#include "Ekora/EkProtocol.h"
#include "ekd/EkDServer.h"
#include "ekd/EkDWyreClient.h"
#include "platform/cbor/Cbor.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace ek {

std::shared_ptr<Transaction> Transaction::initWithRequest(wyre::Message request,
                                                          std::shared_ptr<EkDWyreClient> client) {
  return std::shared_ptr<Transaction>(new Transaction(std::move(request), std::move(client)));
}

Transaction::Transaction(wyre::Message request, std::shared_ptr<EkDWyreClient> client)
    : client_(std::move(client)), request_(std::move(request)) {}

const EkDClientProcess& Transaction::sender() const {
  if (!sender_) sender_ = client_->writerOf(request_);
  return *sender_;
}

EkDServer& Transaction::server() const {
  return *client_->server();
}

std::shared_ptr<wyre::Connection> Transaction::connection() const {
  return client_->connection();
}

void Transaction::dispatch() {
  const std::string* type = request_.body.getString(protocol::kRequest);
  const uint64_t* requested = request_.body.getUnsigned(protocol::kVersion);
  version_ = requested ? *requested : 0;

  if (version_ != protocol::kCurrentVersion && version_ != protocol::kOldestVersion) {
    // Shown as %d shows it: the low 32 bits, signed.
    int32_t shown = static_cast<int32_t>(static_cast<uint32_t>(version_.load()));
    send(Reply::failure(protocol::kErrorVersion, log::format(protocol::kMsgUnsupportedVersion,
                                                             shown, protocol::kCurrentVersion)));
    return;
  }
  if (!client_->acceptWork()) return;

  log::ops().debug("client %d requested %{public}s", client_->pid(),
                   type ? std::string_view(*type) : std::string_view("(null)"));
  EK_PROBE2(request, client_->pid(), type ? type->c_str() : "");

  if (!type) {
    send(Reply::failure(protocol::kErrorInvalidRequest, protocol::kMsgMissingType));
    return;
  }
  const RequestHandler* handler = handlerFor(*type);
  if (!handler) {
    send(Reply::failure(protocol::kErrorInvalidRequest, protocol::kMsgUnrecognized));
    return;
  }
  const RequestSender sender(
      [](const void* self) -> const EkDClientProcess& {
        return static_cast<const Transaction*>(self)->sender();
      },
      this);
  decoded_.emplace(Request{request_.body, version_.load(), sender, client_->pid(), client_});
  if (handler->answer) {
    send(handler->answer(*decoded_, server()));
    return;
  }
  // The reply keeps the transaction, and with it the request, until it is sent.
  handler->start(*decoded_, server(),
                 [self = shared_from_this()](Reply reply) { self->send(std::move(reply)); });
}

void Transaction::send(Reply reply) {
  if (replied_) {
    log::ops().error("transaction for client %d replied twice", client_->pid());
    std::abort();
  }
  replied_ = true;
  // Diagnostic lines logged for a request are out before its reply, unless other requests
  // wait: then they go out together a moment later, rather than one write each. Default-level
  // lines always wait for the next batch (log::bufferLines).
  if (!server().mainQueue()->hasWaiting()) log::flushDiagnostics();
  Dictionary& members = reply.members;
  if (reply.error) {
    // The code travels as a signed 32-bit value widened to 64 bits.
    members[std::string(protocol::kErrorCode)] =
        Value(static_cast<uint64_t>(static_cast<int64_t>(reply.error->code)));
    members[std::string(protocol::kError)] = Value(std::move(reply.error->message));
  }
  if (!reply.writeEncoded) {
    Value value(std::move(members));
    if (EK_PROBE_ENABLED(request_output)) {
      std::string text = value.description();
      EK_PROBE2(request_output, client_->pid(), text.c_str());
    }
    if (!request_.wantsReply()) return;
    std::vector<uint8_t> frame(wyre::kHeaderSize);
    cbor::encode(value, frame);
    sendFrame(std::move(frame));
    return;
  }
  // One member goes straight into the frame, as its writer encodes it.
  if (auto it = members.find(reply.encodedKey); it != members.end()) members.erase(it);
  std::vector<uint8_t> frame(wyre::kHeaderSize);
  cbor::encodeMapHead(members.size() + 1, frame);
  for (const auto& [name, value] : members) {
    cbor::encodeText(name, frame);
    cbor::encode(value, frame);
  }
  cbor::encodeText(reply.encodedKey, frame);
  reply.writeEncoded(frame);
  if (EK_PROBE_ENABLED(request_output)) {
    auto decoded = cbor::decode(std::span(frame).subspan(wyre::kHeaderSize));
    std::string text = decoded ? decoded->description() : decoded.error().message;
    EK_PROBE2(request_output, client_->pid(), text.c_str());
  }
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

}  // namespace ek
