#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "Ekora/EkSandboxKey.h"
#include "platform/value/Result.h"

namespace ek {

namespace sandbox {
// Read access to a file tree.
inline constexpr std::string_view kReadOnlyFileClass = "com.corvane.sandbox.read-only";
// The right to look up a plug-in's service.
inline constexpr std::string_view kPlugInServiceClass = "com.corvane.ekora.plugin-service";

// Resolve links so the token names the real location.
inline constexpr uint32_t kCanonicalizeFlag = 1;

inline constexpr size_t kMaxClassLength = 255;
// A canonical path is shorter than PATH_MAX; service names are held to the same bound.
inline constexpr size_t kMaxSubjectLength = 4096;
inline constexpr size_t kNonceSize = 16;
inline constexpr size_t kTagSize = 32;
// No token is parsed beyond this length: class, flags, hex subject, nonce, tag, separators.
inline constexpr size_t kMaxTokenLength = 10 * 1024;
static_assert(kMaxClassLength + 10 + 2 * (kMaxSubjectLength + kNonceSize + kTagSize) + 4 <=
              kMaxTokenLength);
}  // namespace sandbox

// What consuming a token granted.
struct EkSandboxGrant {
  std::string extensionClass;
  uint32_t flags = 0;
  std::string subject;  // the canonical path or the service name
};

// The platform sandbox's extension machinery. A token is the text
//   <class>;<flags>;<hex of the path or service name>;<nonce>;<tag>
// with flags in decimal, lower-case hex, a random 16-byte nonce and the tag the HMAC-SHA256 of
// everything before its separator under the key of the key source. Only the holder of the key
// can make a token that consumes. Thread-safe.
class EkSandbox {
 public:
  explicit EkSandbox(std::shared_ptr<EkSandboxKeySource> keys);

  // The process's sandbox, keyed by $EKORA_STATE_DIR/sandbox.key (read on first use).
  static std::shared_ptr<EkSandbox> system();

  // A read-only file extension for an existing absolute path. With kCanonicalizeFlag the path
  // is resolved with realpath first. Errors carry the POSIX domain and errno (ENOENT for a
  // path that does not exist), or the key source's error.
  Result<std::string> issueFileExtension(std::string_view path, uint32_t flags);
  // A read-only file extension (with kCanonicalizeFlag) for a path the caller already holds
  // in canonical form, kept from an earlier resolution: nothing is walked again. EINVAL for a
  // path that is not absolute.
  Result<std::string> issueCanonicalFileExtension(std::string_view canonicalPath);
  // A service-lookup extension of extensionClass for serviceName. EINVAL for a class or name
  // that is empty, too long, or holds a NUL or ";" (the class) byte.
  Result<std::string> issueServiceExtension(std::string_view extensionClass,
                                            std::string_view serviceName, uint32_t flags);

  // A handle (positive, never reused in the process) for a well-formed token whose tag
  // verifies; -1 with errno EINVAL otherwise, including when the key cannot be had.
  int64_t consume(std::string_view token);
  // 0, or -1 with errno EBADF for a handle this sandbox did not give or already released.
  int release(int64_t handle);

  // What a handle grants; absent for handles that are not held.
  std::optional<EkSandboxGrant> grant(int64_t handle) const;
  size_t heldCount() const;

 private:
  Result<std::string> issue(std::string_view extensionClass, uint32_t flags,
                            std::string_view subject);

  const std::shared_ptr<EkSandboxKeySource> keys_;
  mutable std::mutex mutex_;
  std::map<int64_t, EkSandboxGrant> grants_;  // guarded by mutex_
};

}  // namespace ek
