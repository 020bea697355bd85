#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace ek::test {

// A client that speaks the frame by hand, so tests can send what no library would.
class RawClient {
 public:
  explicit RawClient(const std::string& socketPath);
  // Takes over a connected socket.
  explicit RawClient(int fd) : fd_(fd) {}
  ~RawClient();
  bool connected() const { return fd_ >= 0; }
  int fd() const { return fd_; }

  bool sendBytes(const std::vector<uint8_t>& bytes);
  bool sendMessage(const Value& body, uint64_t id, bool wantsReply = true);

  struct Frame {
    uint32_t flags = 0;
    uint64_t id = 0;
    Value body;
  };
  // The next frame, or nothing when none arrives in time or the connection closed.
  std::optional<Frame> readFrame(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // True when the daemon closes the connection within the timeout.
  bool closedByPeer(std::chrono::milliseconds timeout = std::chrono::seconds(10));

 private:
  bool readExactly(uint8_t* out, size_t n, std::chrono::steady_clock::time_point deadline);
  int fd_ = -1;
};

// A request dictionary of the current protocol version.
Value request(std::string_view type, Dictionary extra = {});

}  // namespace ek::test
