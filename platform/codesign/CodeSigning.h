#pragma once

#include <sys/stat.h>

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/process/Process.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek {

// Whether an entitlement with this value is held: it is present and not boolean false. Any
// other value holds it, a number 0 or an empty string included. The one rule for hosts and
// plug-ins alike.
inline bool entitlementHeld(const Value* value) {
  if (value == nullptr) return false;
  const bool* flag = value->boolean();
  return flag == nullptr || *flag;
}

// The code-signing record of one process: its entitlements, read when the record is made.
class CodeSigningTask {
 public:
  virtual ~CodeSigningTask() = default;
  // The value of an entitlement, absent when the program does not have it. An error means
  // the entitlements could not be determined.
  virtual Result<std::optional<Value>> entitlementValue(std::string_view key) const = 0;
};

// Entitlements are the dmap dictionary in "<executable>.entitlements", honoured only when that
// file and the executable are regular files owned by root or by this process's user and
// writable by nobody else. A refused file is logged once per executable.
class CodeSigning {
 public:
  virtual ~CodeSigning() = default;
  virtual std::shared_ptr<CodeSigningTask> taskForAuditToken(const AuditToken& token) = 0;
  // The entitlements of a program file (empty when it has none or they are refused).
  virtual Dictionary entitlementsForExecutable(const std::string& path) = 0;
  // The files whose state alone decides entitlementsForExecutable(path), so that a caller may
  // keep its answer while none of them changes; absent when the answer does not come from
  // files alone.
  virtual std::optional<std::vector<std::string>> entitlementSources(const std::string& path) {
    (void)path;
    return std::nullopt;
  }

  // The real implementation over the file system.
  static std::shared_ptr<CodeSigning> system();
};

// Why a file with this status may not vouch for a program to a process running as user self
// (the rule above); empty when it may.
std::string untrustedReason(const struct stat& st, std::string_view what, uid_t self);

// The SHA-256 of an executable file, in lower-case hex; absent when it cannot be read.
std::optional<std::string> codeDirectoryHash(const std::string& executablePath);

// A double for tests: entitlements set per pid and per executable path. Thread-safe.
class FakeCodeSigning : public CodeSigning {
 public:
  void setEntitlements(pid_t pid, Dictionary entitlements);
  void setExecutableEntitlements(const std::string& path, Dictionary entitlements);
  void failFor(pid_t pid);  // entitlementValue answers an error for this pid

  std::shared_ptr<CodeSigningTask> taskForAuditToken(const AuditToken& token) override;
  Dictionary entitlementsForExecutable(const std::string& path) override;

 private:
  std::mutex mutex_;
  std::map<pid_t, Dictionary> byPid_;
  std::map<std::string, Dictionary> byPath_;
  std::map<pid_t, bool> failing_;
};

}  // namespace ek
