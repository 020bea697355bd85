#include "platform/paths/Directories.h"

#include <errno.h>
#include <fmt/format.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <vector>

namespace ek::paths {
namespace {

// Our own variables are taken as given when set and not empty.
std::optional<std::string> fromEnvironment(const char* name) {
  const char* value = std::getenv(name);
  if (value == nullptr || value[0] == '\0') return std::nullopt;
  return std::string(value);
}

// The XDG base directory rules: a relative value is invalid and ignored.
std::optional<std::string> absoluteFromEnvironment(const char* name) {
  const char* value = std::getenv(name);
  if (value == nullptr || value[0] != '/') return std::nullopt;
  return std::string(value);
}

std::string homeDirectory(uid_t uid) {
  if (auto home = absoluteFromEnvironment("HOME")) return *home;
  std::vector<char> buffer(16384);
  struct passwd entry {};
  struct passwd* found = nullptr;
  if (getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &found) == 0 && found &&
      found->pw_dir && found->pw_dir[0] == '/') {
    return found->pw_dir;
  }
  return fmt::format("/tmp/ekora-{}", uid);
}

}  // namespace

std::string runtimeDir(uid_t uid) {
  if (auto dir = fromEnvironment("EKORA_RUNTIME_DIR")) return *dir;
  if (uid == 0) return "/run/ekora";
  if (auto dir = absoluteFromEnvironment("XDG_RUNTIME_DIR")) return join(*dir, "ekora");
  return fmt::format("/tmp/ekora-{}", uid);
}

std::string stateDir(uid_t uid) {
  if (auto dir = fromEnvironment("EKORA_STATE_DIR")) return *dir;
  if (uid == 0) return "/var/lib/ekora";
  if (auto dir = absoluteFromEnvironment("XDG_STATE_HOME")) return join(*dir, "ekora");
  return join(homeDirectory(uid), ".local/state/ekora");
}

std::string runtimeDir() {
  return runtimeDir(geteuid());
}

std::string stateDir() {
  return stateDir(geteuid());
}

std::string systemRoot() {
  if (auto dir = fromEnvironment("EKORA_SYSTEM_ROOT")) return *dir;
  return "/usr/lib/ekora";
}

std::string servicePath(std::string_view name) {
  return join(runtimeDir(), name);
}

std::string notificationsDir() {
  return join(runtimeDir(), "notifications");
}

std::string join(std::string_view a, std::string_view b) {
  while (a.size() > 1 && a.back() == '/') a.remove_suffix(1);
  while (!b.empty() && b.front() == '/') b.remove_prefix(1);
  if (a.empty()) return std::string(b);
  if (b.empty()) return std::string(a);
  if (a == "/") return fmt::format("/{}", b);
  return fmt::format("{}/{}", a, b);
}

Result<void> ensureDirectory(const std::string& path, mode_t mode) {
  if (path.empty()) return EkError::posix(ENOENT, "creating a directory: empty path");
  // Mostly the parent exists: one call then, rather than one per component (a registration
  // makes two directories per plug-in, a first start hundreds of thousands).
  if (mkdir(path.c_str(), mode) == 0) return {};
  if (errno == EEXIST) {
    struct stat st {};
    if (stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return {};
  }
  // Walk down from the root so that every missing parent is made in order; an existing
  // directory (ours or made concurrently by someone else) is fine at every step.
  size_t position = 0;
  while (true) {
    size_t slash = path.find('/', position);
    std::string prefix = path.substr(0, slash);
    position = slash == std::string::npos ? path.size() : slash + 1;
    if (!prefix.empty() && prefix != "." && prefix != "..") {
      if (mkdir(prefix.c_str(), mode) != 0) {
        int error = errno;
        struct stat st {};
        if (error != EEXIST) {
          // A parent we may not create (EACCES on "/home", EROFS) may still exist.
          if (stat(prefix.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
            return EkError::fromErrno(error, fmt::format("creating directory {}", prefix));
          }
        } else if (stat(prefix.c_str(), &st) != 0) {
          return EkError::fromErrno(errno, fmt::format("creating directory {}", prefix));
        } else if (!S_ISDIR(st.st_mode)) {
          return EkError::fromErrno(ENOTDIR, fmt::format("creating directory {}", prefix));
        }
      }
    }
    if (slash == std::string::npos || position >= path.size()) break;
  }
  return {};
}

}  // namespace ek::paths
