#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "Ekora/EkFileURL.h"
#include "Ekora/EkSandbox.h"
#include "platform/value/Result.h"

namespace ek {

// Issuing. Failures carry the system error (POSIX domain, errno) for the caller to report;
// nothing is logged on failure. Without a sandbox argument the process's sandbox is used.

// A read-only extension to the file tree at url, naming its canonical location. ENOENT when
// the path does not exist.
Result<std::string> issueFileExtension(const EkFileURL& url);
Result<std::string> issueFileExtension(const EkFileURL& url, EkSandbox& sandbox);
// The directory a registered bundle was read from: its device, inode and canonical path.
struct EkBundleIdentity {
  uint64_t device = 0;
  uint64_t inode = 0;
  std::string canonicalPath;
};
// Success while the directory at bundlePath is the one registered: a directory, not a link,
// with the recorded device and inode, both as named and at the recorded canonical path (one
// lstat when the two are the same path). ESTALE otherwise, and when nothing was recorded.
Result<void> checkRegisteredBundle(std::string_view bundlePath,
                                   const std::optional<EkBundleIdentity>& identity);
// A read-only extension for the registered bundle at bundlePath (relative empty or ".") or
// for relative inside it. Issued only while the directory at bundlePath is the one registered
// (ESTALE otherwise, and when nothing was recorded), and only for a target whose canonical
// location lies inside the bundle (EPERM otherwise: through "..", an absolute path or a link).
// The bundle's own token names the recorded canonical path, which is not resolved again.
Result<std::string> issueBundleExtension(std::string_view bundlePath,
                                         const std::optional<EkBundleIdentity>& identity,
                                         std::string_view relative, EkSandbox& sandbox);
// An extension of class "com.corvane.ekora.plugin-service" to look up serviceName.
Result<std::string> issueServiceExtension(std::string_view serviceName);
Result<std::string> issueServiceExtension(std::string_view serviceName, EkSandbox& sandbox);

// A token received from the daemon and the right gained by consuming it. One record is meant
// to be used from one thread at a time; token and handle may be read from any thread.
// Destroying the record gives the right back.
class EkSandboxExtension {
 public:
  static constexpr int64_t kNotConsumed = -1;

  // sandbox null means the process's sandbox.
  explicit EkSandboxExtension(std::string token, std::shared_ptr<EkSandbox> sandbox = nullptr);
  static std::shared_ptr<EkSandboxExtension> initWithExtension(
      std::string token, std::shared_ptr<EkSandbox> sandbox = nullptr);
  ~EkSandboxExtension();

  EkSandboxExtension(const EkSandboxExtension&) = delete;
  EkSandboxExtension& operator=(const EkSandboxExtension&) = delete;

  const std::string& token() const { return token_; }
  // kNotConsumed while the token is not consumed.
  int64_t handle() const { return handle_.load(); }

  // Consumes the token unless it already is; a failure is logged and may be retried.
  void consume();
  // Gives the right back when the token is consumed; the record is then not consumed.
  void expel();

  // Equal tokens make equal records, whatever their handles.
  bool isEqual(const EkSandboxExtension& other) const { return token_ == other.token_; }
  bool operator==(const EkSandboxExtension& other) const { return isEqual(other); }

 private:
  const std::string token_;
  const std::shared_ptr<EkSandbox> sandbox_;
  std::atomic<int64_t> handle_{kNotConsumed};
};

}  // namespace ek
