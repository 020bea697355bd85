#include "bench/FrameIo.h"

#include <poll.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace ek::bench {

namespace {
constexpr size_t kReadChunk = 64 * 1024;

// poll for POLLIN until the deadline, or without end.
int pollReadable(int fd, const std::optional<std::chrono::steady_clock::time_point>& deadline) {
  int waitMs = -1;
  if (deadline) {
    auto left =
        std::chrono::ceil<std::chrono::milliseconds>(*deadline - std::chrono::steady_clock::now());
    waitMs = static_cast<int>(std::clamp<int64_t>(left.count(), 0, 1 << 30));
  }
  pollfd readable{fd, POLLIN, 0};
  return ::poll(&readable, 1, waitMs);
}
}  // namespace

FrameReader::Status FrameReader::fill(
    int fd, size_t needed, const std::optional<std::chrono::steady_clock::time_point>& deadline) {
  while (end_ - start_ < needed) {
    if (start_ > 0) {
      std::memmove(buffer_.data(), buffer_.data() + start_, end_ - start_);
      end_ -= start_;
      start_ = 0;
    }
    size_t want = std::max(needed, end_ + kReadChunk);
    if (buffer_.size() < want) buffer_.resize(want);
    if (wait_ == Wait::ForReadiness) {
      int ready = pollReadable(fd, deadline);
      if (ready == 0) return Status::TimedOut;
      if (ready < 0) {
        if (errno == EINTR) continue;
        return Status::Failed;
      }
    }
    ssize_t got = ::recv(fd, buffer_.data() + end_, buffer_.size() - end_, 0);
    if (got > 0) {
      end_ += static_cast<size_t>(got);
    } else if (got == 0) {
      return Status::Closed;
    } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
      return Status::TimedOut;
    } else if (errno != EINTR) {
      return Status::Failed;
    }
    if (deadline && end_ - start_ < needed && std::chrono::steady_clock::now() > *deadline) {
      return Status::TimedOut;
    }
  }
  return Status::Frame;
}

FrameReader::Status FrameReader::next(
    int fd, wyre::FrameHeader& header, std::span<const uint8_t>& body,
    std::optional<std::chrono::steady_clock::time_point> deadline) {
  start_ += consumed_;
  consumed_ = 0;
  if (start_ == end_) start_ = end_ = 0;

  if (Status status = fill(fd, wyre::kHeaderSize, deadline); status != Status::Frame) {
    return status;
  }
  header = wyre::decodeHeader(buffer_.data() + start_);
  if (header.length > wyre::kMaxBodySize) return Status::TooLarge;
  size_t frameSize = wyre::kHeaderSize + header.length;
  if (Status status = fill(fd, frameSize, deadline); status != Status::Frame) return status;
  body = std::span<const uint8_t>(buffer_.data() + start_ + wyre::kHeaderSize, header.length);
  consumed_ = frameSize;
  return Status::Frame;
}

bool writeAll(int fd, const uint8_t* bytes, size_t size) {
  while (size > 0) {
    ssize_t sent = ::send(fd, bytes, size, MSG_NOSIGNAL);
    if (sent < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    bytes += sent;
    size -= static_cast<size_t>(sent);
  }
  return true;
}

int connectUnix(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) {
    errno = ENAMETOOLONG;
    return -1;
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
    int saved = errno;
    ::close(fd);
    errno = saved;
    return -1;
  }
  return fd;
}

bool setIoTimeout(int fd, std::chrono::milliseconds timeout) {
  timeval tv{};
  tv.tv_sec = static_cast<time_t>(timeout.count() / 1000);
  tv.tv_usec = static_cast<suseconds_t>((timeout.count() % 1000) * 1000);
  if (tv.tv_sec == 0 && tv.tv_usec == 0) tv.tv_usec = 1000;  // zero would mean "forever"
  return ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) == 0 &&
         ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) == 0;
}

}  // namespace ek::bench
