#include "platform/notify/Notifications.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cstring>
#include <limits>

#include "platform/io/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::notify {
namespace {

constexpr size_t kMaxNameLength = 255;
// A generation is at most 20 digits; anything longer than this is not ours.
constexpr size_t kMaxFileSize = 32;
constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;
// Every post writes its new contents here first and renames it over the notification file.
// Posts are serialised by the directory lock, so one fixed name suffices and a poster that
// died half-way leaves at most this one file behind.
constexpr const char* kPostingName = ".posting";

// Closes a descriptor on every path out of a function.
std::string resolve(const std::string& directory) {
  return directory.empty() ? paths::notificationsDir() : directory;
}

// Makes the notification directory (and its parents) when missing; the directory itself gets
// exactly kDirectoryMode whatever the umask.
Result<void> ensureNotificationsDirectory(const std::string& directory) {
  if (mkdir(directory.c_str(), kDirectoryMode) == 0) {
    chmod(directory.c_str(), kDirectoryMode);
    return {};
  }
  if (errno == EEXIST) return {};
  if (errno != ENOENT) {
    return EkError::fromErrno(errno, fmt::format("creating directory {}", directory));
  }
  size_t slash = directory.find_last_not_of('/');
  slash = slash == std::string::npos ? std::string::npos : directory.rfind('/', slash);
  if (slash != std::string::npos && slash > 0) {
    EK_TRY(paths::ensureDirectory(directory.substr(0, slash), kDirectoryMode));
  }
  if (mkdir(directory.c_str(), kDirectoryMode) == 0) {
    chmod(directory.c_str(), kDirectoryMode);
  } else if (errno != EEXIST) {
    return EkError::fromErrno(errno, fmt::format("creating directory {}", directory));
  }
  return {};
}

Result<UniqueFd> openDirectory(const std::string& directory) {
  UniqueFd fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return EkError::fromErrno(errno, fmt::format("opening {}", directory));
  return fd;
}

// Parses the decimal text of a notification file; nullopt for anything else.
std::optional<uint64_t> parseGeneration(std::string_view text) {
  if (text.empty()) return std::nullopt;
  uint64_t value = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

// The generation stored in name under dirFd, 0 when missing, unreadable, larger than
// kMaxFileSize or not a decimal number.
uint64_t readGeneration(int dirFd, const std::string& name) {
  // O_NONBLOCK: a FIFO planted under the name must not hang the reader.
  UniqueFd fd(openat(dirFd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd.valid()) return 0;
  struct stat st {};
  if (fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return 0;
  char buffer[kMaxFileSize + 1];
  size_t total = 0;
  while (total < sizeof buffer) {
    ssize_t n = read(fd.get(), buffer + total, sizeof buffer - total);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return 0;
    if (n == 0) break;
    total += static_cast<size_t>(n);
  }
  if (total > kMaxFileSize) return 0;
  return parseGeneration(std::string_view(buffer, total)).value_or(0);
}

Result<void> writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    ssize_t n = write(fd, text.data(), text.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return EkError::fromErrno(errno, "writing a notification");
    text.remove_prefix(static_cast<size_t>(n));
  }
  return {};
}

}  // namespace

Result<void> checkName(std::string_view name) {
  if (name.empty()) return EkError::posix(EINVAL, "a notification name must not be empty");
  if (name.size() > kMaxNameLength) {
    return EkError::posix(EINVAL, fmt::format("notification name longer than {} bytes: {}",
                                              kMaxNameLength, name.substr(0, 32)));
  }
  if (name == "." || name == "..") {
    return EkError::posix(EINVAL, fmt::format("not a notification name: {}", name));
  }
  if (name.find('/') != std::string_view::npos) {
    return EkError::posix(EINVAL, fmt::format("notification name contains '/': {}", name));
  }
  if (name.find('\0') != std::string_view::npos) {
    return EkError::posix(EINVAL, "notification name contains a NUL byte");
  }
  return {};
}

Result<uint64_t> post(std::string_view name, const std::string& directory) {
  EK_TRY(checkName(name));
  const std::string dir = resolve(directory);
  const std::string file(name);
  EK_TRY(ensureNotificationsDirectory(dir));
  UniqueFd dirFd = EK_TRY(openDirectory(dir));

  // The directory itself is the lock: it cannot collide with a notification name, and every
  // poster of every process holds it around read-increment-write, so generations only grow.
  while (flock(dirFd.get(), LOCK_EX) != 0) {
    if (errno != EINTR) return EkError::fromErrno(errno, fmt::format("locking {}", dir));
  }

  uint64_t current = readGeneration(dirFd.get(), file);
  if (current == std::numeric_limits<uint64_t>::max()) {
    return EkError::posix(EOVERFLOW, fmt::format("notification {} cannot grow further", name));
  }
  uint64_t next = current + 1;

  // A fresh inode each time: whatever a crashed poster left under the temporary name (or
  // planted there) is not reused.
  if (unlinkat(dirFd.get(), kPostingName, 0) != 0 && errno != ENOENT) {
    return EkError::fromErrno(errno, fmt::format("removing {}/{}", dir, kPostingName));
  }
  UniqueFd tmp(openat(dirFd.get(), kPostingName,
                      O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kFileMode));
  if (!tmp.valid())
    return EkError::fromErrno(errno, fmt::format("creating {}/{}", dir, kPostingName));
  if (fchmod(tmp.get(), kFileMode) != 0) {
    return EkError::fromErrno(errno, fmt::format("setting the mode of {}/{}", dir, kPostingName));
  }
  auto written = writeAll(tmp.get(), fmt::format("{}", next));
  // No fsync: notifications are not durable state. After a crash the runtime directory is
  // gone or stale anyway, and a lost generation only means watchers miss a wake-up.
  if (close(tmp.release()) != 0 && written.ok()) {
    written = EkError::fromErrno(errno, "writing a notification");
  }
  if (!written.ok()) {
    unlinkat(dirFd.get(), kPostingName, 0);
    return written.error();
  }
  if (renameat(dirFd.get(), kPostingName, dirFd.get(), file.c_str()) != 0) {
    int error = errno;
    unlinkat(dirFd.get(), kPostingName, 0);
    return EkError::fromErrno(error, fmt::format("replacing {}/{}", dir, name));
  }
  return next;  // closing dirFd releases the lock
}

uint64_t generation(std::string_view name, const std::string& directory) {
  if (!checkName(name).ok()) return 0;
  UniqueFd dirFd(open(resolve(directory).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dirFd.valid()) return 0;
  return readGeneration(dirFd.get(), std::string(name));
}

FileNotifier::FileNotifier(std::string directory) : directory_(resolve(directory)) {}

void FileNotifier::post(std::string_view name) {
  auto result = notify::post(name, directory_);
  if (!result.ok()) {
    log::ops().error("cannot post notification %{public}s: %{public}s", name,
                     result.error().message);
  }
}

void FakeNotifier::post(std::string_view name) {
  std::lock_guard lock(mutex_);
  posts_.emplace_back(name);
}

std::vector<std::string> FakeNotifier::posts() const {
  std::lock_guard lock(mutex_);
  return posts_;
}

size_t FakeNotifier::count(std::string_view name) const {
  std::lock_guard lock(mutex_);
  return static_cast<size_t>(std::count(posts_.begin(), posts_.end(), name));
}

Result<std::unique_ptr<Watcher>> Watcher::create(std::vector<std::string> names,
                                                 const std::string& directory) {
  if (names.empty()) return EkError::posix(EINVAL, "no notification names to watch");
  for (const auto& name : names) EK_TRY(checkName(name));
  std::sort(names.begin(), names.end());
  names.erase(std::unique(names.begin(), names.end()), names.end());

  std::unique_ptr<Watcher> watcher(new Watcher());
  watcher->directory_ = resolve(directory);
  EK_TRY(ensureNotificationsDirectory(watcher->directory_));
  watcher->fd_ = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (watcher->fd_ < 0) return EkError::fromErrno(errno, "creating an inotify instance");
  // A post is a rename onto the name (IN_MOVED_TO); IN_CLOSE_WRITE catches a file written in
  // place by hand. The temporary file's own IN_CLOSE_WRITE carries another name.
  if (inotify_add_watch(watcher->fd_, watcher->directory_.c_str(),
                        IN_MOVED_TO | IN_CLOSE_WRITE | IN_ONLYDIR) < 0) {
    return EkError::fromErrno(errno, fmt::format("watching {}", watcher->directory_));
  }
  // Generations as they stand once the watch exists: an overflow reports what grew past them.
  for (const auto& name : names) {
    watcher->seen_.push_back(generation(name, watcher->directory_));
  }
  watcher->names_ = std::move(names);
  return watcher;
}

Watcher::~Watcher() {
  if (fd_ >= 0) close(fd_);
}

Result<std::vector<std::pair<std::string, uint64_t>>> Watcher::next(
    std::optional<std::chrono::milliseconds> timeout) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = timeout ? Clock::now() + *timeout : Clock::time_point::max();
  std::vector<std::pair<std::string, uint64_t>> entries;
  alignas(struct inotify_event) char buffer[16384];

  while (true) {
    ssize_t n = read(fd_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno != EAGAIN) {
      return EkError::fromErrno(errno, fmt::format("reading events of {}", directory_));
    }
    if (n > 0) {
      bool overflow = false;
      size_t offset = 0;
      const size_t size = static_cast<size_t>(n);
      while (offset + sizeof(struct inotify_event) <= size) {
        struct inotify_event event;
        std::memcpy(&event, buffer + offset, sizeof event);
        const size_t nameOffset = offset + sizeof event;
        if (event.len > size - nameOffset) break;
        offset = nameOffset + event.len;
        if (event.mask & IN_Q_OVERFLOW) {
          overflow = true;
          continue;
        }
        if (event.mask & IN_IGNORED) {
          return EkError::posix(ENOENT, fmt::format("{} is no longer watched: it was removed "
                                                    "or unmounted",
                                                    directory_));
        }
        if (event.len == 0) continue;
        std::string_view name(buffer + nameOffset, strnlen(buffer + nameOffset, event.len));
        auto found = std::lower_bound(names_.begin(), names_.end(), name);
        if (found == names_.end() || *found != name) continue;
        size_t index = static_cast<size_t>(found - names_.begin());
        uint64_t current = generation(name, directory_);
        if (event.mask & IN_MOVED_TO) {
          // Posts are serialised and each adds one and renames once, so this event stands for
          // the generation after the last one reported, even when later posts have already
          // moved the file on. An event for a post counted when the watch began is skipped.
          if (seen_[index] >= current) continue;
          current = ++seen_[index];
        } else {
          // Written in place by hand: whatever it says now.
          if (current == seen_[index]) continue;
          seen_[index] = current;
        }
        entries.emplace_back(*found, current);
      }
      if (overflow) {
        // The lost events cannot be recovered; report every name that was posted since we
        // last looked, once.
        for (size_t i = 0; i < names_.size(); ++i) {
          uint64_t current = generation(names_[i], directory_);
          bool reported = std::any_of(entries.begin(), entries.end(),
                                      [&](const auto& e) { return e.first == names_[i]; });
          if (current != seen_[i] && !reported) entries.emplace_back(names_[i], current);
          seen_[i] = current;
        }
      }
      if (!entries.empty()) return entries;
      continue;  // only other names: drain what is queued before waiting again
    }

    int waitMs = -1;
    if (timeout) {
      auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
      if (left.count() <= 0) return entries;
      waitMs = static_cast<int>(std::min<int64_t>(left.count(), std::numeric_limits<int>::max()));
    }
    struct pollfd pfd {
      fd_, POLLIN, 0
    };
    int ready = poll(&pfd, 1, waitMs);
    if (ready < 0 && errno != EINTR) {
      return EkError::fromErrno(errno, fmt::format("waiting for events of {}", directory_));
    }
    // Readable, interrupted or timed out: the read above and the deadline check decide.
  }
}

}  // namespace ek::notify
