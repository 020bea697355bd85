#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/value/Result.h"
#include "platform/wyre/Wyre.h"

namespace ek::bench {

// The baseline every daemon figure is compared with: a Unix-socket server in a private
// temporary directory that answers each frame with the same body, the reply flag and the same
// id, without decoding the body. One blocking thread per connection, which is the cheapest
// server the kernel allows, so the ratio to it is what the daemon itself adds.
class EchoServer {
 public:
  enum class Action { Reply, Silent, Close };
  // Test hook, called on the connection's thread before answering: may change the reply
  // header (its length is set from the body afterwards) and body, stay silent or close.
  using Responder = std::function<Action(wyre::FrameHeader& header, std::vector<uint8_t>& body)>;

  static Result<std::unique_ptr<EchoServer>> start(Responder responder = {});
  // Stops accepting, closes every connection, joins every thread and removes the directory.
  ~EchoServer();

  EchoServer(const EchoServer&) = delete;
  EchoServer& operator=(const EchoServer&) = delete;

  const std::string& socketPath() const { return socketPath_; }
  // Connections accepted so far.
  uint64_t accepted() const { return accepted_.load(); }

 private:
  struct Client {
    int fd = -1;
    std::thread thread;
    std::atomic<bool> done{false};
  };

  EchoServer() = default;
  void acceptLoop();
  void serve(Client& client);
  // Joins and closes the connections whose threads have ended. REQUIRES: clientsMutex_ held.
  void reapFinished();

  Responder responder_;
  std::string directory_;
  std::string socketPath_;
  int listenFd_ = -1;
  int wakeRead_ = -1;
  int wakeWrite_ = -1;
  std::thread acceptThread_;
  std::atomic<uint64_t> accepted_{0};
  std::mutex clientsMutex_;
  std::list<Client> clients_;  // guarded by clientsMutex_
};

}  // namespace ek::bench
