#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/queue/SerialQueue.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

// stard, the service manager: external-service declarations of plug-ins for host processes,
// the plug-in instances launched for them, and the daemon's keep-alive transactions.
//
// Layout under the runtime directory (paths::runtimeDir() unless given):
//   services/<host pid>/<bundle identifier>.dmap    a declaration:
//       {"host-pid": pid, "host-path": executable of the host,
//        "program": the plug-in's executable, "overlay": the overlay dictionary}
//   instances/<bundle identifier>/<pid>.dmap        a running instance:
//       {"pid", "start-time" (from /proc/<pid>/stat, so a recycled pid is never taken for
//        the instance), "host-pid", "program"}
// Declarations of hosts that have exited are pruned whenever a declaration is written and when
// the daemon starts; instance entries whose process is gone are pruned whenever the table is
// read.
namespace ek::stard {

// Answers of the service manager's operations.
inline constexpr int kSuccess = 0;
inline constexpr int kNoSuchProcess = 3;  // nothing was running

struct Instance {
  pid_t pid = 0;
  std::string bundleIdentifier;
  pid_t hostPid = 0;
  std::string program;
};

class ServiceManager {
 public:
  virtual ~ServiceManager() = default;

  // Declares the plug-in program as an external service of the host; 0 or an errno value.
  virtual int addExternalService(pid_t hostPid, std::string_view hostPath,
                                 std::string_view bundleIdentifier, std::string_view program,
                                 const Dictionary& overlay) = 0;
  // Removes the plug-in's declarations and ends each of its running instances with SIGTERM,
  // whatever version it runs (a replaced bundle's old instances must end too). answer runs
  // once on queue, never on the caller's stack, with kSuccess, kNoSuchProcess when none was
  // running, or an errno value (a signal that could not be sent wins over kSuccess).
  virtual void removeExternalService(std::string_view bundleIdentifier, std::string_view version,
                                     std::shared_ptr<SerialQueue> queue,
                                     std::function<void(int)> answer) = 0;
  // Starts an instance of the plug-in declared for the host: a child process of the caller
  // running the declaration's program with the overlay's environment
  // (WyreService.EnvironmentVariables), recorded in the instance table. The caller reaps it.
  // No declaration is the POSIX error ENOENT.
  virtual Result<pid_t> launch(pid_t hostPid, std::string_view bundleIdentifier,
                               const std::vector<std::string>& arguments = {}) = 0;
  // The running instances of these bundle identifiers (grantd reports them as busy).
  virtual std::vector<Instance> instances(const std::vector<std::string>& bundleIdentifiers) = 0;
  // Removes the declarations of hosts that have exited.
  virtual void pruneDeclarations() = 0;

  // Keep-alive transactions: while the count is above 0 the daemon must not exit for idleness.
  void beginTransaction() { transactions_.fetch_add(1); }
  void endTransaction() { transactions_.fetch_sub(1); }
  int64_t transactionCount() const { return transactions_.load(); }

 private:
  std::atomic<int64_t> transactions_{0};
};

// The files above, in runtimeDirectory (empty: paths::runtimeDir()). Bundle identifiers are
// single path components of at most 242 bytes (NAME_MAX less ".dmap" and the atomic writer's
// temporary-name decoration); others, and host pids below 1, are EINVAL. Every operation may
// be called from any thread.
class FileServiceManager final : public ServiceManager {
 public:
  explicit FileServiceManager(std::string runtimeDirectory = {});
  int addExternalService(pid_t hostPid, std::string_view hostPath,
                         std::string_view bundleIdentifier, std::string_view program,
                         const Dictionary& overlay) override;
  void removeExternalService(std::string_view bundleIdentifier, std::string_view version,
                             std::shared_ptr<SerialQueue> queue,
                             std::function<void(int)> answer) override;
  Result<pid_t> launch(pid_t hostPid, std::string_view bundleIdentifier,
                       const std::vector<std::string>& arguments = {}) override;
  std::vector<Instance> instances(const std::vector<std::string>& bundleIdentifiers) override;
  void pruneDeclarations() override;
  // The declaration of a plug-in for a host, or absent.
  std::optional<Dictionary> declaration(pid_t hostPid, std::string_view bundleIdentifier) const;

  const std::string& runtimeDirectory() const { return runtimeDirectory_; }

 private:
  std::string runtimeDirectory_;
  // Serialises this object's changes to the two tables.
  mutable std::mutex mutex_;
};

// In memory: records declarations and removals, answers what the test sets.
class FakeServiceManager final : public ServiceManager {
 public:
  struct Removal {
    std::string bundleIdentifier;
    std::string version;
  };
  struct Declaration {
    pid_t hostPid = 0;
    std::string hostPath;
    std::string bundleIdentifier;
    std::string program;
    Dictionary overlay;
  };
  int addExternalService(pid_t hostPid, std::string_view hostPath,
                         std::string_view bundleIdentifier, std::string_view program,
                         const Dictionary& overlay) override;
  void removeExternalService(std::string_view bundleIdentifier, std::string_view version,
                             std::shared_ptr<SerialQueue> queue,
                             std::function<void(int)> answer) override;
  Result<pid_t> launch(pid_t hostPid, std::string_view bundleIdentifier,
                       const std::vector<std::string>& arguments = {}) override;
  std::vector<Instance> instances(const std::vector<std::string>& bundleIdentifiers) override;
  // Drops the declarations of hosts that are no longer running.
  void pruneDeclarations() override;

  // launch answers the POSIX error ENOTSUP: tests fill the table with addInstance.
  // The answer removeExternalService gives for a bundle identifier (default kNoSuchProcess);
  // a bundle identifier set to "hold" gets no answer until releaseHeldAnswers(), which posts
  // every held answer and ends all holds.
  void setRemovalAnswer(std::string bundleIdentifier, int answer);
  void holdAnswers(std::string bundleIdentifier);
  void releaseHeldAnswers();
  void addInstance(Instance instance);
  std::vector<Removal> removals() const;
  // Every addExternalService call, in order, whatever it answered.
  std::vector<Declaration> declarations() const;
  // What addExternalService answers; set before the calls start.
  int addResult = 0;

 private:
  mutable std::mutex mutex_;
  std::map<std::string, int, std::less<>> answers_;
  std::vector<std::string> held_;
  std::vector<std::function<void()>> heldAnswers_;
  std::vector<Removal> removals_;
  std::vector<Declaration> declarations_;
  std::vector<Instance> instances_;
};

}  // namespace ek::stard
