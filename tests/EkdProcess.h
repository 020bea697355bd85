#pragma once

#include <sys/types.h>

#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace ek::test {

// A temporary directory removed with its contents on destruction.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
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

  // Starts ekd and waits until its socket answers; false (with the log) when it did not.
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
  // The environment every client of this daemon needs (EKORA_RUNTIME_DIR and friends).
  std::map<std::string, std::string> environment() const;
  // Points this process's own EKORA_* variables at the daemon, for in-process clients.
  void exportEnvironment() const;

  // Runs ekctl against this daemon.
  CommandResult ekctl(std::vector<std::string> args, const std::string& input = "") const;

  const TempDir& root() const { return root_; }

 private:
  TempDir root_;
  std::vector<std::string> extraArgs_;
  std::string service_;
  pid_t pid_ = -1;
  int exitStatus_ = -1;
};

// The paths of the built programs.
std::string ekdPath();
std::string ekctlPath();
std::string sandboxExecPath();

}  // namespace ek::test
