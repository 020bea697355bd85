#include "platform/privo/Consent.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

#include "platform/dmap/Dmap.h"
#include "platform/io/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/paths/Directories.h"

namespace ek::privo {

namespace {

constexpr std::string_view kLogUnusableFile = "ignoring unusable consent file %@: %{public}@";

std::string errnoText(int code) {
  return std::generic_category().message(code);
}

// At most limit + 1 bytes, so an oversized file is noticed even if it grew after fstat.
std::optional<std::string> readBounded(int fd, size_t limit, int& failure) {
  std::string bytes;
  char buffer[16384];
  while (bytes.size() <= limit) {
    const size_t want = std::min(sizeof buffer, limit + 1 - bytes.size());
    const ssize_t got = ::read(fd, buffer, want);
    if (got < 0) {
      if (errno == EINTR) continue;
      failure = errno;
      return std::nullopt;
    }
    if (got == 0) break;
    bytes.append(buffer, static_cast<size_t>(got));
  }
  return bytes;
}

void insertSorted(std::vector<std::string>& services, std::string service) {
  auto at = std::lower_bound(services.begin(), services.end(), service);
  if (at == services.end() || *at != service) services.insert(at, std::move(service));
}

}  // namespace

FileConsent::FileConsent(std::string stateDirectory) : stateDirectory_(std::move(stateDirectory)) {}

std::string FileConsent::path() const {
  return paths::join(stateDirectory_.empty() ? paths::stateDir() : stateDirectory_,
                     kConsentFileName);
}

std::vector<std::string> FileConsent::grantedServices(
    std::string_view applicationBundleIdentifier) {
  std::lock_guard lock(mutex_);
  synchronize();
  auto it = granted_.find(applicationBundleIdentifier);
  if (it == granted_.end()) return {};
  return it->second;
}

std::optional<std::vector<std::string>> FileConsent::informationForApplication(
    std::string_view applicationBundleIdentifier) {
  std::lock_guard lock(mutex_);
  synchronize();
  if (unusable_) return std::nullopt;
  auto it = granted_.find(applicationBundleIdentifier);
  if (it == granted_.end()) return std::vector<std::string>{};
  return it->second;
}

void FileConsent::synchronize() {
  const std::string file = path();
  auto fail = [&](std::optional<FileStamp> stamp, std::string reason) {
    granted_.clear();
    unusable_ = true;
    stamp_ = stamp;
    read_ = stamp.has_value();
    std::pair<std::optional<FileStamp>, std::string> failure{stamp, reason};
    if (logged_ == failure) return;
    logged_ = std::move(failure);
    log::ops().error(kLogUnusableFile, file, reason);
  };

  // Non-blocking, so a FIFO planted in place of the file cannot stall the caller.
  UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (fd.get() < 0) {
    const int code = errno;
    if (code == ENOENT || code == ENOTDIR) {
      granted_.clear();
      unusable_ = false;
      stamp_.reset();
      read_ = true;
      logged_.reset();
      return;
    }
    fail(std::nullopt, errnoText(code));
    return;
  }
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) {
    fail(std::nullopt, errnoText(errno));
    return;
  }
  const FileStamp stamp = FileStamp::of(status);
  if (read_ && stamp_ == stamp) return;

  if (!S_ISREG(status.st_mode)) {
    fail(stamp, "not a regular file");
    return;
  }
  if (status.st_size < 0 || static_cast<uint64_t>(status.st_size) > kMaxConsentFileSize) {
    fail(stamp, errnoText(EFBIG));
    return;
  }
  int readFailure = 0;
  std::optional<std::string> bytes = readBounded(fd.get(), kMaxConsentFileSize, readFailure);
  if (!bytes) {
    fail(stamp, errnoText(readFailure));
    return;
  }
  if (bytes->size() > kMaxConsentFileSize) {
    fail(stamp, errnoText(EFBIG));
    return;
  }
  Result<Value> parsed = dmap::parse(*bytes);
  if (!parsed.ok()) {
    fail(stamp, parsed.error().message);
    return;
  }
  const Dictionary* applications = parsed->dictionary();
  if (applications == nullptr) {
    fail(stamp, "the root is not a dictionary");
    return;
  }

  std::map<std::string, std::vector<std::string>, std::less<>> granted;
  for (const auto& [application, services] : *applications) {
    const Dictionary* decisions = services.dictionary();
    if (decisions == nullptr) continue;
    std::vector<std::string> names;
    for (const auto& [service, decision] : *decisions) {
      const bool* flag = decision.boolean();
      if (flag != nullptr && *flag) names.push_back(service);  // keys arrive sorted
    }
    if (!names.empty()) granted.emplace(application, std::move(names));
  }
  granted_ = std::move(granted);
  unusable_ = false;
  stamp_ = stamp;
  read_ = true;
  logged_.reset();
}

std::vector<std::string> FakeConsent::grantedServices(
    std::string_view applicationBundleIdentifier) {
  std::lock_guard lock(mutex_);
  queries_.emplace_back(applicationBundleIdentifier);
  auto it = granted_.find(applicationBundleIdentifier);
  if (it == granted_.end()) return {};
  return it->second;
}

std::optional<std::vector<std::string>> FakeConsent::informationForApplication(
    std::string_view applicationBundleIdentifier) {
  std::vector<std::string> granted = grantedServices(applicationBundleIdentifier);
  std::lock_guard lock(mutex_);
  if (unavailable_) return std::nullopt;
  return granted;
}

void FakeConsent::setUnavailable(bool unavailable) {
  std::lock_guard lock(mutex_);
  unavailable_ = unavailable;
}

void FakeConsent::grant(std::string applicationBundleIdentifier, std::string service) {
  std::lock_guard lock(mutex_);
  insertSorted(granted_[std::move(applicationBundleIdentifier)], std::move(service));
}

void FakeConsent::revokeAll(std::string_view applicationBundleIdentifier) {
  std::lock_guard lock(mutex_);
  auto it = granted_.find(applicationBundleIdentifier);
  if (it != granted_.end()) granted_.erase(it);
}

std::vector<std::string> FakeConsent::queries() const {
  std::lock_guard lock(mutex_);
  return queries_;
}

}  // namespace ek::privo
