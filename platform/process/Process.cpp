#include "platform/process/Process.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <string_view>

namespace ek {

namespace {

std::shared_ptr<UniqueFd> openPidfd(pid_t pid) {
#ifdef SYS_pidfd_open
  int fd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (fd >= 0) {
    // pidfd_open sets close-on-exec itself; the pidfd must never leak into a child.
    return std::make_shared<UniqueFd>(fd);
  }
#else
  (void)pid;
#endif
  return nullptr;
}

}  // namespace

std::optional<AuditToken> AuditToken::forSocket(int fd) {
  struct ucred credentials {};
  socklen_t length = sizeof credentials;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) return std::nullopt;
  if (length != sizeof credentials || credentials.pid <= 0) {
    errno = EINVAL;
    return std::nullopt;
  }
  AuditToken token;
  token.pid = credentials.pid;
  token.uid = credentials.uid;
  token.gid = credentials.gid;
  // A peer that exited before we asked has no pidfd (ESRCH); its token still says who it was,
  // and alive() answers false through kill().
  token.pidfd = openPidfd(credentials.pid);
  return token;
}

AuditToken AuditToken::self() {
  AuditToken token;
  token.pid = getpid();
  token.uid = geteuid();
  token.gid = getegid();
  token.pidfd = openPidfd(token.pid);
  return token;
}

AuditToken AuditToken::forWriter(const Credentials& writer) {
  AuditToken token;
  token.pid = writer.pid;
  token.uid = writer.uid;
  token.gid = writer.gid;
  if (writer.pid > 0) token.pidfd = openPidfd(writer.pid);
  return token;
}

bool AuditToken::alive() const {
  if (pidfd && pidfd->valid()) {
    struct pollfd p {
      pidfd->get(), POLLIN, 0
    };
    int r;
    do {
      r = poll(&p, 1, 0);
    } while (r < 0 && errno == EINTR);
    if (r >= 0) return r == 0;  // readable means the process has exited
  }
  if (pid <= 0) return false;
  // Without a pidfd the pid may have been reused; this is the best the kernel offers then.
  return kill(pid, 0) == 0 || errno == EPERM;
}

std::optional<std::string> executablePathForPid(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  constexpr size_t kMaxPath = 2048;
  char buffer[kMaxPath];
  std::string link = "/proc/" + std::to_string(pid) + "/exe";
  ssize_t n = readlink(link.c_str(), buffer, sizeof buffer);
  // A result that fills the buffer may have been cut short: no answer rather than a wrong one.
  if (n <= 0 || static_cast<size_t>(n) >= sizeof buffer) return std::nullopt;
  std::string path(buffer, static_cast<size_t>(n));
  // The kernel marks a replaced or removed executable with this suffix. The name is still the
  // one the program was started from, which is what callers match against; whether the file
  // at that path is the same program is for them to judge (code signing reads the file anew).
  constexpr std::string_view kDeleted = " (deleted)";
  if (path.size() > kDeleted.size() && path.ends_with(kDeleted)) {
    path.resize(path.size() - kDeleted.size());
  }
  return path;
}

std::optional<FileId> executableIdForPid(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  char link[32];
  std::snprintf(link, sizeof link, "/proc/%d/exe", static_cast<int>(pid));
  struct stat st {};
  if (::stat(link, &st) != 0) return std::nullopt;
  return FileId{st.st_dev, st.st_ino};
}

}  // namespace ek
