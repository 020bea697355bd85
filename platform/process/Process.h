#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

namespace ek {

// An owned file descriptor, closed on destruction.
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept;
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd();

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int release();
  void reset(int fd = -1);

 private:
  int fd_ = -1;
};

// A peer's identity, read once when its connection is accepted. The pidfd refers to that one
// process: after reading anything about the pid from /proc, confirm with alive() that the
// process it describes is still the peer.
struct AuditToken {
  pid_t pid = 0;
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
  std::shared_ptr<UniqueFd> pidfd;  // may be null when the kernel has no pidfd_open

  // The token of a connected Unix socket's peer (SO_PEERCRED and a pidfd); absent on failure.
  static std::optional<AuditToken> forSocket(int fd);
  // The token of the calling process.
  static AuditToken self();

  // Whether the process is still running (by pidfd when there is one).
  bool alive() const;
};

// The executable path of a process, from /proc/<pid>/exe; absent when it cannot be read.
// Paths longer than 2048 bytes are not answered.
std::optional<std::string> executablePathForPid(pid_t pid);

}  // namespace ek
