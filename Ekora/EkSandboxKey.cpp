#include "Ekora/EkSandboxKey.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <openssl/crypto.h>
#include <openssl/rand.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>

#include "platform/io/UniqueFd.h"
#include "platform/paths/Directories.h"

namespace ek {

namespace {

constexpr std::string_view kKeyFileName = "sandbox.key";

std::string directoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

Result<void> readExactly(int fd, uint8_t* buffer, size_t size, const std::string& path) {
  size_t filled = 0;
  while (filled < size) {
    const ssize_t got = ::read(fd, buffer + filled, size - filled);
    if (got < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, path);
    }
    if (got == 0) return EkError::posix(EINVAL, fmt::format("{}: key file is short", path));
    filled += static_cast<size_t>(got);
  }
  return {};
}

Result<void> writeAll(int fd, const uint8_t* bytes, size_t size, const std::string& path) {
  size_t written = 0;
  while (written < size) {
    const ssize_t put = ::write(fd, bytes + written, size - written);
    if (put < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, path);
    }
    written += static_cast<size_t>(put);
  }
  return {};
}

}  // namespace

EkSandboxFileKeySource::EkSandboxFileKeySource(std::string path) : path_(std::move(path)) {}

std::string EkSandboxFileKeySource::defaultPath() {
  return paths::join(paths::stateDir(), kKeyFileName);
}

Result<EkSandboxKey> EkSandboxFileKeySource::key() {
  std::lock_guard lock(mutex_);
  if (key_) return *key_;
  Result<EkSandboxKey> loaded = load();
  if (loaded.ok() && !key_) key_ = *loaded;
  return loaded;
}

Result<EkSandboxKey> EkSandboxFileKeySource::load() {
  // A second round covers losing the creation race to another process.
  for (int attempt = 0; attempt < 2; ++attempt) {
    UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (fd.get() < 0) {
      if (errno != ENOENT) return EkError::fromErrno(errno, path_);
      Result<EkSandboxKey> created = create();
      if (created.ok() || !created.error().isPosix(EEXIST)) return created;
      continue;
    }
    struct stat status;
    if (::fstat(fd.get(), &status) != 0) return EkError::fromErrno(errno, path_);
    if (!S_ISREG(status.st_mode)) {
      return EkError::posix(EINVAL, fmt::format("{}: key is not a regular file", path_));
    }
    if (status.st_uid != ::geteuid()) {
      return EkError::posix(EPERM, fmt::format("{}: key file belongs to uid {}, not {}", path_,
                                               status.st_uid, ::geteuid()));
    }
    if ((status.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
      return EkError::posix(EPERM, fmt::format("{}: key file mode {:o} is open to others", path_,
                                               status.st_mode & 07777));
    }
    if (status.st_size != static_cast<off_t>(kSandboxKeySize)) {
      return EkError::posix(EINVAL, fmt::format("{}: key file holds {} bytes, not {}", path_,
                                                status.st_size, kSandboxKeySize));
    }
    EkSandboxKey key;
    Result<void> read = readExactly(fd.get(), key.data(), key.size(), path_);
    if (!read) return std::move(read).error();
    return key;
  }
  return EkError::posix(EAGAIN, fmt::format("{}: key file keeps changing", path_));
}

Result<EkSandboxKey> EkSandboxFileKeySource::create() {
  const std::string directory = directoryOf(path_);
  Result<void> made = paths::ensureDirectory(directory);
  if (!made) return std::move(made).error();

  EkSandboxKey key;
  if (RAND_bytes(key.data(), static_cast<int>(key.size())) != 1) {
    return EkError::posix(EIO, "no random bytes for a sandbox key");
  }
  // mkostemp opens with O_EXCL and mode 0600.
  std::string temporary = path_ + ".XXXXXX";
  UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
  if (fd.get() < 0) return EkError::fromErrno(errno, temporary);
  auto fail = [&](EkError error) -> Result<EkSandboxKey> {
    ::unlink(temporary.c_str());
    OPENSSL_cleanse(key.data(), key.size());
    return error;
  };
  if (::fchmod(fd.get(), 0600) != 0) return fail(EkError::fromErrno(errno, temporary));
  if (Result<void> written = writeAll(fd.get(), key.data(), key.size(), temporary); !written) {
    return fail(std::move(written).error());
  }
  if (::fsync(fd.get()) != 0) return fail(EkError::fromErrno(errno, temporary));
  // link() refuses to replace an existing file: whoever links first owns the key.
  if (::link(temporary.c_str(), path_.c_str()) != 0) {
    return fail(EkError::fromErrno(errno, path_));
  }
  ::unlink(temporary.c_str());
  UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directoryFd.get() >= 0) ::fsync(directoryFd.get());
  return key;
}

std::shared_ptr<EkSandboxMemoryKeySource> EkSandboxMemoryKeySource::random() {
  EkSandboxKey key;
  if (RAND_bytes(key.data(), static_cast<int>(key.size())) != 1) {
    throw std::runtime_error("the random number generator failed");
  }
  return std::make_shared<EkSandboxMemoryKeySource>(key);
}

}  // namespace ek
