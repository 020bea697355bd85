#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/io/UniqueFd.h"

namespace ek {

// Who wrote bytes on a socket, as the kernel stamps them (SCM_CREDENTIALS). pid 0 means the
// kernel could not say (a writer outside this pid namespace).
struct Credentials {
  pid_t pid = 0;
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
  bool operator==(const Credentials&) const = default;
};

// One file, whatever its name: what tells a program apart from the one a process ran before
// it executed another.
struct FileId {
  dev_t device = 0;
  ino_t inode = 0;
  bool operator==(const FileId&) const = default;
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
  // The token of the process that wrote with these credentials, pinned by a pidfd opened now:
  // confirm with alive() after reading about it, as for a peer.
  static AuditToken forWriter(const Credentials& writer);

  // Whether the process is still running (by pidfd when there is one).
  bool alive() const;
};

// The executable path of a process, from /proc/<pid>/exe; absent when it cannot be read.
// Paths longer than 2048 bytes are not answered.
std::optional<std::string> executablePathForPid(pid_t pid);
// The file a process runs (one stat of /proc/<pid>/exe); absent when it cannot be read. Cheap
// enough to ask per request, to notice that a process has executed another program.
std::optional<FileId> executableIdForPid(pid_t pid);

}  // namespace ek
