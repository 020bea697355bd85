#include "platform/codesign/CodeSigning.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <mutex>
#include <set>
#include <vector>

#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"

namespace ek {
namespace {

// Entitlements are a handful of keys; anything near this size is not an entitlements file,
// and every client connection reads one.
constexpr size_t kMaxEntitlementsSize = 1024 * 1024;
// Distinct refused executables remembered for logging once; past this the memory is
// started afresh, so a flood of refusals costs repeated log lines, not unbounded memory.
constexpr size_t kMaxRememberedRefusals = 4096;

class ListedTask : public CodeSigningTask {
 public:
  explicit ListedTask(Dictionary entitlements) : entitlements_(std::move(entitlements)) {}
  Result<std::optional<Value>> entitlementValue(std::string_view key) const override {
    auto it = entitlements_.find(key);
    if (it == entitlements_.end()) return std::optional<Value>();
    return std::optional<Value>(it->second);
  }

 private:
  Dictionary entitlements_;
};

class FailedTask : public CodeSigningTask {
 public:
  explicit FailedTask(EkError error) : error_(std::move(error)) {}
  Result<std::optional<Value>> entitlementValue(std::string_view) const override { return error_; }

 private:
  EkError error_;
};

}  // namespace

std::string untrustedReason(const struct stat& st, std::string_view what, uid_t self) {
  if (!S_ISREG(st.st_mode)) return fmt::format("the {} is not a regular file", what);
  if (st.st_uid != 0 && st.st_uid != self) {
    return fmt::format("the {} is owned by uid {}", what, st.st_uid);
  }
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    return fmt::format("the {} is writable by group or others", what);
  }
  return {};
}

namespace {

// What reading an entitlements file came to: the entitlements, or why there are none.
// A refusal with an empty reason is a missing file, which is not worth a log line.
struct Outcome {
  Dictionary entitlements;
  std::optional<std::string> refusal;
};

Outcome refused(std::string reason) {
  return {{}, std::move(reason)};
}

Result<std::string> readBounded(int fd, size_t limit) {
  std::string bytes;
  char buffer[16384];
  while (true) {
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, "reading");
    }
    if (n == 0) return bytes;
    if (bytes.size() + size_t(n) > limit) {
      return EkError::posix(EFBIG, fmt::format("larger than {} bytes", limit));
    }
    bytes.append(buffer, size_t(n));
  }
}

Outcome readEntitlements(const std::string& executable, const struct stat& executableStat) {
  if (std::string reason = untrustedReason(executableStat, "executable", geteuid());
      !reason.empty()) {
    return refused(reason);
  }
  std::string path = executable + ".entitlements";
  // O_NOFOLLOW: a link could point anywhere, including at a file its maker could not have
  // written. O_NONBLOCK: a FIFO in its place must not stall us before fstat can refuse it.
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NOFOLLOW | O_NONBLOCK));
  if (!fd.valid()) {
    int error = errno;
    if (error == ENOENT) return {};
    if (error == ELOOP) return refused("the entitlements file is a symbolic link");
    return refused(fmt::format("opening {}: {}", path, std::strerror(error)));
  }
  // The checks apply to the file we opened, not to whatever the path names a moment later.
  struct stat st {};
  if (fstat(fd.get(), &st) != 0) {
    return refused(fmt::format("reading {}: {}", path, std::strerror(errno)));
  }
  if (std::string reason = untrustedReason(st, "entitlements file", geteuid()); !reason.empty()) {
    return refused(reason);
  }
  if (static_cast<uint64_t>(st.st_size) > kMaxEntitlementsSize) {
    return refused(
        fmt::format("the entitlements file is larger than {} bytes", kMaxEntitlementsSize));
  }
  auto bytes = readBounded(fd.get(), kMaxEntitlementsSize);
  if (!bytes) return refused(fmt::format("{}: {}", path, bytes.error().message));
  auto value = dmap::parse(*bytes);
  if (!value) return refused(fmt::format("{}: {}", path, value.error().message));
  Dictionary* dictionary = value->dictionary();
  if (dictionary == nullptr) return refused("the entitlements file does not hold a dictionary");
  return {std::move(*dictionary), std::nullopt};
}

class SystemCodeSigning : public CodeSigning {
 public:
  std::shared_ptr<CodeSigningTask> taskForAuditToken(const AuditToken& token) override {
    errno = 0;
    auto path = executablePathForPid(token.pid);
    if (!path) {
      return std::make_shared<FailedTask>(EkError::fromErrno(
          errno ? errno : ESRCH, fmt::format("resolving the executable of pid {}", token.pid)));
    }
    // The file now at the path must be the one the process runs: a program replaced or
    // removed since it started is not vouched for by what now lies there.
    struct stat running {};
    struct stat named {};
    std::string link = fmt::format("/proc/{}/exe", token.pid);
    if (::stat(link.c_str(), &running) != 0) {
      return std::make_shared<FailedTask>(
          EkError::fromErrno(errno, fmt::format("reading the executable of pid {}", token.pid)));
    }
    // Only now do we know the answers describe the process of the token and not a later
    // process that was given the same pid.
    if (!token.alive()) {
      return std::make_shared<FailedTask>(
          EkError::posix(ESRCH, fmt::format("pid {} has exited", token.pid)));
    }
    if (::stat(path->c_str(), &named) != 0 || named.st_dev != running.st_dev ||
        named.st_ino != running.st_ino) {
      noteRefusal(*path, "the program was replaced or removed since it started");
      return std::make_shared<ListedTask>(Dictionary{});
    }
    return std::make_shared<ListedTask>(load(*path, named));
  }

  std::optional<std::vector<std::string>> entitlementSources(const std::string& path) override {
    return std::vector<std::string>{path, path + ".entitlements"};
  }

  Dictionary entitlementsForExecutable(const std::string& path) override {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return {};
    return load(path, st);
  }

 private:
  Dictionary load(const std::string& path, const struct stat& st) {
    Outcome outcome = readEntitlements(path, st);
    if (outcome.refusal) noteRefusal(path, *outcome.refusal);
    return std::move(outcome.entitlements);
  }

  void noteRefusal(const std::string& path, const std::string& reason) {
    {
      std::lock_guard lock(mutex_);
      if (refused_.size() >= kMaxRememberedRefusals) refused_.clear();
      if (!refused_.insert(path).second) return;
    }
    log::ops().error("ignoring entitlements of %s: %s", path, reason);
  }

  std::mutex mutex_;
  std::set<std::string, std::less<>> refused_;
};

}  // namespace

std::shared_ptr<CodeSigning> CodeSigning::system() {
  static const std::shared_ptr<CodeSigning> shared = std::make_shared<SystemCodeSigning>();
  return shared;
}

std::optional<std::string> codeDirectoryHash(const std::string& executablePath) {
  UniqueFd fd(::open(executablePath.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!fd.valid()) return std::nullopt;
  struct stat st {};
  if (fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;

  std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> context(EVP_MD_CTX_new(),
                                                                  EVP_MD_CTX_free);
  if (!context || EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) != 1) {
    return std::nullopt;
  }
  std::vector<unsigned char> buffer(64 * 1024);
  while (true) {
    ssize_t n = ::read(fd.get(), buffer.data(), buffer.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) break;
    if (EVP_DigestUpdate(context.get(), buffer.data(), size_t(n)) != 1) return std::nullopt;
  }
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  if (EVP_DigestFinal_ex(context.get(), digest, &length) != 1) return std::nullopt;
  std::string hex;
  hex.reserve(length * 2);
  for (unsigned int i = 0; i < length; ++i) hex += fmt::format("{:02x}", digest[i]);
  return hex;
}

// --- FakeCodeSigning ---------------------------------------------------------------------------

void FakeCodeSigning::setEntitlements(pid_t pid, Dictionary entitlements) {
  std::lock_guard lock(mutex_);
  byPid_[pid] = std::move(entitlements);
}

void FakeCodeSigning::setExecutableEntitlements(const std::string& path, Dictionary entitlements) {
  std::lock_guard lock(mutex_);
  byPath_[path] = std::move(entitlements);
}

void FakeCodeSigning::failFor(pid_t pid) {
  std::lock_guard lock(mutex_);
  failing_[pid] = true;
}

std::shared_ptr<CodeSigningTask> FakeCodeSigning::taskForAuditToken(const AuditToken& token) {
  std::lock_guard lock(mutex_);
  if (auto it = failing_.find(token.pid); it != failing_.end() && it->second) {
    return std::make_shared<FailedTask>(
        EkError::posix(ESRCH, fmt::format("no code signing information for pid {}", token.pid)));
  }
  auto it = byPid_.find(token.pid);
  return std::make_shared<ListedTask>(it == byPid_.end() ? Dictionary{} : it->second);
}

Dictionary FakeCodeSigning::entitlementsForExecutable(const std::string& path) {
  std::lock_guard lock(mutex_);
  auto it = byPath_.find(path);
  return it == byPath_.end() ? Dictionary{} : it->second;
}

}  // namespace ek
