#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "ekd/Handlers.h"
#include "platform/value/Value.h"
#include "platform/wyre/Wyre.h"

namespace ek {

class EkDServer;
class EkDClientProcess;
class EkDWyreClient;

// One request from arrival to reply: the transport around a handler (Handlers.h). Made on the
// connection's queue, then used only on the work queue (or, for a hold with forced
// termination, on its termination waiter).
class Transaction : public std::enable_shared_from_this<Transaction> {
 public:
  // The writer's record is looked up (EkDWyreClient::writerOf) only when the request first
  // asks about its sender.
  static std::shared_ptr<Transaction> initWithRequest(wyre::Message request,
                                                      std::shared_ptr<EkDWyreClient> client);

  // Checks version and type and runs the request's handler; its reply is sent exactly once.
  void dispatch();

  const std::shared_ptr<EkDWyreClient>& client() const { return client_; }
  // The process that wrote this request: every question about the caller's program,
  // entitlements or sandbox is asked of it, never of the connection.
  const EkDClientProcess& sender() const;
  const Value& request() const { return request_.body; }
  uint64_t version() const { return version_.load(); }
  EkDServer& server() const;
  std::shared_ptr<wyre::Connection> connection() const;

 private:
  Transaction(wyre::Message request, std::shared_ptr<EkDWyreClient> client);

  // Sends reply on the client's connection (a no-op when it has gone).
  void send(Reply reply);
  // Sends frame (kHeaderSize bytes of room, then the reply), or an error in its place when
  // it is larger than a frame may be.
  void sendFrame(std::vector<uint8_t> frame);

  std::shared_ptr<EkDWyreClient> client_;
  // Null until a handler first asks for the writer; then set on the work queue.
  mutable std::shared_ptr<const EkDClientProcess> sender_;
  wyre::Message request_;
  std::atomic<uint64_t> version_{0};
  // What the handler sees; made by dispatch.
  std::optional<Request> decoded_;
  bool replied_ = false;
};

}  // namespace ek
