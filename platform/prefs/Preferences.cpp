#include "platform/prefs/Preferences.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <unistd.h>

#include "platform/dmap/Dmap.h"
#include "platform/io/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::prefs {
namespace {

std::string directoryOf(const std::string& path) {
  return path.substr(0, path.rfind('/'));
}

// Reads a regular file of at most dmap::kMaxFileSize bytes from an open descriptor.
Result<std::string> readAll(int fd, const struct stat& status, const std::string& path) {
  if (!S_ISREG(status.st_mode)) return EkError::format(fmt::format("{}: not a regular file", path));
  if (static_cast<uint64_t>(status.st_size) > dmap::kMaxFileSize) {
    return EkError::posix(EFBIG, fmt::format("{}: larger than {} bytes", path, dmap::kMaxFileSize));
  }
  std::string bytes;
  bytes.reserve(static_cast<size_t>(status.st_size));
  char buffer[65536];
  while (true) {
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, fmt::format("read {}", path));
    }
    if (n == 0) break;
    // The file may have grown since fstat.
    if (bytes.size() + static_cast<size_t>(n) > dmap::kMaxFileSize) {
      return EkError::posix(EFBIG,
                            fmt::format("{}: larger than {} bytes", path, dmap::kMaxFileSize));
    }
    bytes.append(buffer, static_cast<size_t>(n));
  }
  return bytes;
}

}  // namespace

Result<void> checkDomainName(std::string_view domain) {
  const auto refuse = [](std::string_view why) {
    return EkError::posix(EINVAL, fmt::format("invalid preferences domain name: {}", why));
  };
  if (domain.empty()) return refuse("empty");
  if (domain == "." || domain == "..") return refuse(fmt::format("\"{}\"", domain));
  if (domain.find('/') != std::string_view::npos) return refuse("it contains '/'");
  if (domain.find('\0') != std::string_view::npos) return refuse("it contains a NUL byte");
  if (domain.size() > kMaxDomainNameLength) {
    return refuse(fmt::format("longer than {} bytes", kMaxDomainNameLength));
  }
  return {};
}

std::string domainPath(std::string_view domain, uid_t uid) {
  return paths::join(
      paths::join(paths::join(paths::stateDir(), "preferences"), std::to_string(uid)),
      fmt::format("{}.dmap", domain));
}

PreferencesDomain::PreferencesDomain(std::string domain, std::string path)
    : domain_(std::move(domain)), path_(std::move(path)) {}

Result<std::unique_ptr<PreferencesDomain>> PreferencesDomain::open(std::string_view domain,
                                                                   uid_t uid) {
  EK_TRY(checkDomainName(domain));
  std::unique_ptr<PreferencesDomain> result(
      new PreferencesDomain(std::string(domain), domainPath(domain, uid)));
  result->synchronize();
  return result;
}

Result<std::unique_ptr<PreferencesDomain>> PreferencesDomain::open(std::string_view domain) {
  return open(domain, ::geteuid());
}

void PreferencesDomain::synchronize() {
  std::lock_guard lock(mutex_);
  reload(false);
}

void PreferencesDomain::noteFailure(const EkError& error) {
  readError_ = error;
  contents_.clear();
  auto key = std::make_pair(stamp_, error.message);
  if (logged_ && logged_->first == key.first && logged_->second == key.second) return;
  logged_ = std::move(key);
  // Every message names the file.
  log::ops().error("unreadable preferences taken as empty: %{public}s", error.message);
}

void PreferencesDomain::reload(bool force) {
  struct stat status {};
  if (::stat(path_.c_str(), &status) != 0) {
    const int error = errno;
    if (error == ENOENT || error == ENOTDIR) {
      if (current_ && !stamp_ && !force) return;
      contents_.clear();
      stamp_.reset();
      readError_.reset();
      current_ = true;
      return;
    }
    stamp_.reset();
    current_ = false;
    noteFailure(EkError::fromErrno(error, fmt::format("stat {}", path_)));
    return;
  }
  if (!force && current_ && stamp_ && *stamp_ == FileStamp::of(status)) return;

  // Read through one descriptor so the stamp kept is that of the bytes parsed, even when the
  // file is replaced meanwhile. O_NONBLOCK keeps a FIFO put here from stalling the reader.
  UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (fd.get() < 0) {
    const int error = errno;
    if (error == ENOENT) {
      // Removed between stat and open: look again next time.
      contents_.clear();
      stamp_.reset();
      readError_.reset();
      current_ = false;
      return;
    }
    stamp_.reset();
    current_ = false;
    noteFailure(EkError::fromErrno(error, fmt::format("open {}", path_)));
    return;
  }
  if (::fstat(fd.get(), &status) != 0) {
    stamp_.reset();
    current_ = false;
    noteFailure(EkError::fromErrno(errno, fmt::format("fstat {}", path_)));
    return;
  }
  stamp_ = FileStamp::of(status);
  current_ = true;
  Result<std::string> bytes = readAll(fd.get(), status, path_);
  if (!bytes) {
    noteFailure(bytes.error());
    return;
  }
  Result<Value> parsed = dmap::parse(*bytes);
  if (!parsed) {
    noteFailure(EkError::format(fmt::format("{}: {}", path_, parsed.error().message)));
    return;
  }
  Dictionary* dictionary = parsed->dictionary();
  if (!dictionary) {
    noteFailure(EkError::format(
        fmt::format("{}: the root is {}, not a dictionary", path_, valueTypeName(parsed->type()))));
    return;
  }
  contents_ = std::move(*dictionary);
  readError_.reset();
}

std::optional<Value> PreferencesDomain::value(std::string_view key) const {
  std::lock_guard lock(mutex_);
  auto found = contents_.find(key);
  if (found == contents_.end()) return std::nullopt;
  return found->second;
}

Dictionary PreferencesDomain::dictionary() const {
  std::lock_guard lock(mutex_);
  return contents_;
}

bool PreferencesDomain::exists() const {
  std::lock_guard lock(mutex_);
  return stamp_.has_value();
}

std::optional<EkError> PreferencesDomain::readError() const {
  std::lock_guard lock(mutex_);
  return readError_;
}

Result<void> PreferencesDomain::modify(const std::function<bool(Dictionary&)>& change) {
  const std::string directory = directoryOf(path_);
  EK_TRY(paths::ensureDirectory(directory, 0755));
  // Writers of other processes hold the same lock while they read and replace a file, so
  // neither loses the keys the other set. The lock goes with the descriptor.
  UniqueFd lockFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (lockFd.get() < 0) return EkError::fromErrno(errno, fmt::format("open {}", directory));
  while (::flock(lockFd.get(), LOCK_EX) != 0) {
    if (errno != EINTR) return EkError::fromErrno(errno, fmt::format("lock {}", directory));
  }

  reload(true);
  if (!current_ && readError_) {
    // The file is there but could not be looked at (permissions, say): replacing it blindly
    // could lose keys.
    return *readError_;
  }
  Dictionary next = contents_;
  if (!change(next)) return {};
  EK_TRY(dmap::writeFileAtomically(path_, Value(next), 0644));
  contents_ = std::move(next);
  readError_.reset();
  struct stat status {};
  if (::stat(path_.c_str(), &status) == 0) {
    stamp_ = FileStamp::of(status);
    current_ = true;
  } else {
    current_ = false;
  }
  return {};
}

Result<void> PreferencesDomain::set(std::string_view key, Value value) {
  std::lock_guard lock(mutex_);
  return modify([&](Dictionary& dictionary) {
    dictionary.insert_or_assign(std::string(key), std::move(value));
    return true;
  });
}

Result<void> PreferencesDomain::remove(std::string_view key) {
  std::lock_guard lock(mutex_);
  return modify([&](Dictionary& dictionary) {
    auto found = dictionary.find(key);
    if (found == dictionary.end()) return false;
    dictionary.erase(found);
    return true;
  });
}

Result<void> PreferencesDomain::removeAll() {
  std::lock_guard lock(mutex_);
  return modify([&](Dictionary& dictionary) {
    // A missing domain stays missing.
    if (!stamp_) return false;
    dictionary.clear();
    return true;
  });
}

FilePreferences::FilePreferences(uid_t uid) : uid_(uid) {}

FilePreferences::FilePreferences() : FilePreferences(::geteuid()) {}

std::optional<Value> FilePreferences::value(std::string_view domain, std::string_view key) {
  PreferencesDomain* found = nullptr;
  {
    std::lock_guard lock(mutex_);
    auto entry = domains_.find(domain);
    if (entry == domains_.end()) {
      auto opened = PreferencesDomain::open(domain, uid_);
      if (!opened) {
        log::ops().error("preferences: %{public}s", opened.error().message);
        return std::nullopt;
      }
      entry = domains_.emplace(std::string(domain), std::move(opened).value()).first;
    }
    found = entry->second.get();
  }
  // Domains are never dropped, and each guards itself.
  found->synchronize();
  return found->value(key);
}

std::optional<Value> FakePreferences::value(std::string_view domain, std::string_view key) {
  std::lock_guard lock(mutex_);
  auto entry = domains_.find(domain);
  if (entry == domains_.end()) return std::nullopt;
  auto found = entry->second.find(key);
  if (found == entry->second.end()) return std::nullopt;
  return found->second;
}

void FakePreferences::set(std::string_view domain, std::string_view key, Value value) {
  std::lock_guard lock(mutex_);
  domains_[std::string(domain)].insert_or_assign(std::string(key), std::move(value));
}

void FakePreferences::remove(std::string_view domain, std::string_view key) {
  std::lock_guard lock(mutex_);
  auto entry = domains_.find(domain);
  if (entry == domains_.end()) return;
  if (auto found = entry->second.find(key); found != entry->second.end()) {
    entry->second.erase(found);
  }
}

}  // namespace ek::prefs
