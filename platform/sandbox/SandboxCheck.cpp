#include "platform/sandbox/SandboxCheck.h"

#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <charconv>
#include <optional>
#include <string>
#include <string_view>

namespace ek {
namespace {

// /proc/<pid>/status is a few kilobytes; Seccomp_filters sits well inside this.
constexpr size_t kMaxStatusSize = 16 * 1024;

std::optional<std::string> readStatus(pid_t pid) {
  std::string path = "/proc/" + std::to_string(pid) + "/status";
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;
  std::string text(kMaxStatusSize, '\0');
  size_t filled = 0;
  while (filled < text.size()) {
    ssize_t n = ::read(fd.get(), text.data() + filled, text.size() - filled);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) break;
    filled += size_t(n);
  }
  text.resize(filled);
  return text;
}

// The number of seccomp filters of a process; absent when its status cannot be read (it has
// exited, or /proc hides it). A status without the field is a kernel without seccomp: none.
std::optional<unsigned long> seccompFilters(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  auto status = readStatus(pid);
  if (!status) return std::nullopt;
  constexpr std::string_view kField = "\nSeccomp_filters:";
  size_t at = status->find(kField);
  if (at == std::string::npos) return 0;
  std::string_view rest = std::string_view(*status).substr(at + kField.size());
  while (!rest.empty() && (rest.front() == ' ' || rest.front() == '\t')) rest.remove_prefix(1);
  unsigned long count = 0;
  auto [end, error] = std::from_chars(rest.data(), rest.data() + rest.size(), count);
  if (error != std::errc() || end == rest.data()) return std::nullopt;
  return count;
}

class SystemSandboxCheck : public SandboxCheck {
 public:
  // What the whole system imposes: process 1's filters, read once. Unreadable (another pid
  // namespace without a visible init, a hardened /proc) counts as none.
  SystemSandboxCheck() : baseline_(seccompFilters(1).value_or(0)) {}

  // Fails closed: a process we cannot read, or that is gone (its pid may name another process
  // by now), counts as sandboxed, so it never gets what only unsandboxed clients get.
  bool isSandboxed(const AuditToken& token) override {
    auto filters = seccompFilters(token.pid);
    if (!filters || !token.alive()) return true;
    return *filters > baseline_;
  }

 private:
  unsigned long baseline_;
};

}  // namespace

std::shared_ptr<SandboxCheck> SandboxCheck::system() {
  static const std::shared_ptr<SandboxCheck> shared = std::make_shared<SystemSandboxCheck>();
  return shared;
}

void FakeSandboxCheck::setSandboxed(pid_t pid, bool sandboxed) {
  std::lock_guard lock(mutex_);
  if (sandboxed) {
    sandboxed_.insert(pid);
  } else {
    sandboxed_.erase(pid);
  }
}

bool FakeSandboxCheck::isSandboxed(const AuditToken& token) {
  std::lock_guard lock(mutex_);
  return sandboxed_.contains(token.pid);
}

}  // namespace ek
