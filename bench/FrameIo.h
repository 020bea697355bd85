#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/wyre/Wyre.h"

// Blocking frame I/O shared by the load generator and its echo server. Both sides use the same
// code so that the echo baseline costs exactly what the framing costs, and nothing more.
namespace ek::bench {

// Reads whole frames from a blocking stream socket through one buffer, so that a frame that
// arrives in one segment costs one recv. Not thread-safe: one reader per socket.
class FrameReader {
 public:
  enum class Status { Frame, Closed, Failed, TooLarge, TimedOut };
  // How a read waits for bytes. A thread asleep in recv is woken by every wake-up of the
  // socket, also the write-space ones that the peer's own reads cause; a client on an event
  // loop, as the client library is, waits for readiness and sleeps through those. The load
  // generator waits as such a client does, so that the server is not charged for wake-ups a
  // real client never has; the echo server keeps the plain recv, the cheapest answer.
  enum class Wait { InRecv, ForReadiness };

  explicit FrameReader(Wait wait = Wait::InRecv) : wait_(wait) {}

  // Forgets what was received, for a new connection; the way of waiting stays.
  void reset() { *this = FrameReader(wait_); }

  // Reads the next frame. On Frame, header and body describe it; body stays valid until the
  // next call. With a deadline, gives up (TimedOut) once a recv returns after it; the socket's
  // SO_RCVTIMEO bounds how long one recv blocks. A header announcing more than
  // wyre::kMaxBodySize is refused before anything is allocated for it.
  Status next(int fd, wyre::FrameHeader& header, std::span<const uint8_t>& body,
              std::optional<std::chrono::steady_clock::time_point> deadline = std::nullopt);

  // Bytes received but not yet handed out as a frame.
  size_t buffered() const { return end_ - start_ - consumed_; }

 private:
  Status fill(int fd, size_t needed,
              const std::optional<std::chrono::steady_clock::time_point>& deadline);

  Wait wait_;
  std::vector<uint8_t> buffer_;
  size_t start_ = 0;     // first byte of the frame handed out last
  size_t consumed_ = 0;  // size of that frame, dropped at the next call
  size_t end_ = 0;       // end of the received bytes
};

// Writes all of bytes (MSG_NOSIGNAL); false when the peer is gone or a send timed out.
bool writeAll(int fd, const uint8_t* bytes, size_t size);

// Connects a blocking stream socket to the Unix socket at path; -1 with errno on failure.
int connectUnix(const std::string& path);

// Bounds every recv and send on fd (SO_RCVTIMEO / SO_SNDTIMEO).
bool setIoTimeout(int fd, std::chrono::milliseconds timeout);

}  // namespace ek::bench
