#pragma once

#include <memory>
#include <mutex>
#include <set>

#include "platform/process/Process.h"

namespace ek {

// Whether a process runs in a sandbox: its Seccomp_filters count in /proc/<pid>/status
// exceeds that of process 1, so it has confined itself beyond what the system imposes. A
// process whose status cannot be read, or that has exited, counts as sandboxed.
class SandboxCheck {
 public:
  virtual ~SandboxCheck() = default;
  virtual bool isSandboxed(const AuditToken& token) = 0;

  static std::shared_ptr<SandboxCheck> system();
};

// A double for tests. Thread-safe.
class FakeSandboxCheck : public SandboxCheck {
 public:
  void setSandboxed(pid_t pid, bool sandboxed);
  bool isSandboxed(const AuditToken& token) override;

 private:
  std::mutex mutex_;
  std::set<pid_t> sandboxed_;
};

}  // namespace ek
