#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/testing/Files.h"
#include "platform/value/Value.h"

namespace ek::test {

// A temporary directory removed with its contents on destruction.
class TempDir : public ek::testing::TempDir {
 public:
  std::filesystem::path path() const { return ek::testing::TempDir::path(); }
};

struct CommandResult {
  int status = -1;  // exit status, or 128 + signal
  std::string out;
  std::string err;
};

// Runs a program to completion with extra environment variables, capturing its output.
CommandResult runCommand(const std::vector<std::string>& argv,
                         const std::map<std::string, std::string>& env = {},
                         const std::string& input = "");

// A real ekd started on private runtime, state and system directories.
class EkdProcess {
 public:
  explicit EkdProcess(std::vector<std::string> extraArgs = {});
  ~EkdProcess();

  // Starts ekd and waits until it answers and has registered the system volume; false (with
  // the log) when it did not.
  bool start();
  // Sends SIGTERM and answers the exit status (128 + signal when killed by one).
  int terminate();
  void kill9();
  bool running() const;

  pid_t pid() const { return pid_; }
  const std::string& service() const { return service_; }
  std::string socketPath() const;
  // What ekd wrote to standard error so far.
  std::string log() const;
  // Whether text shows in the log within five seconds. A reply follows the lines logged for
  // its request, but lines logged elsewhere may wait a moment before ekd writes them.
  bool logShows(std::string_view text) const;
  // The environment every client of this daemon needs (EKORA_RUNTIME_DIR and friends).
  std::map<std::string, std::string> environment() const;

  // Runs ekctl against this daemon.
  CommandResult ekctl(std::vector<std::string> args, const std::string& input = "") const;
  // Runs another ekctl binary (a copy with its own entitlements) against this daemon.
  CommandResult ekctlAs(const std::string& program, std::vector<std::string> args) const;

  // An environment variable for the daemon, set after the defaults (EKORA_LOG among them) at
  // every later start.
  void setEnvironment(const std::string& name, const std::string& value);
  // Sends one request on a fresh connection and answers the reply's body; nothing when no
  // reply came within the timeout.
  std::optional<Value> ask(const Value& request,
                           std::chrono::milliseconds timeout = std::chrono::seconds(30)) const;
  // The last generation posted for a notification in this daemon's runtime directory (0 when
  // never posted).
  uint64_t notificationGeneration(std::string_view name) const;

  const TempDir& root() const { return root_; }

 private:
  TempDir root_;
  std::vector<std::string> extraArgs_;
  std::map<std::string, std::string> extraEnvironment_;
  std::string service_;
  pid_t pid_ = -1;
  int exitStatus_ = -1;
};

// The paths of the built programs.
std::string ekdPath();
std::string ekctlPath();

// A copy of ekctl (or of program) in dir with an entitlements file beside it granting each name
// (owned by this user, mode 0644, so the daemon honours it); answers the copy's path.
std::string ekctlWithEntitlements(const std::filesystem::path& dir,
                                  const std::vector<std::string>& entitlements,
                                  const std::filesystem::path& program = ekctlPath());

// The "errorcode" of a reply as the signed 32-bit code it carries (0 when absent), and its
// "error" text (empty when absent).
int64_t replyErrorCode(const Value& reply);
std::string replyError(const Value& reply);

}  // namespace ek::test
