#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace ek::soak {

// A program run beside the soak test: started with posix_spawn (safe in a process with
// threads), its standard output collected by a thread of its own, every wait bounded. The
// destructor kills and reaps a child still running, so none outlives the test.
class Child {
 public:
  // Starts argv[0] with the current environment plus env; nullptr when it could not start.
  static std::unique_ptr<Child> spawn(const std::vector<std::string>& argv,
                                      const std::map<std::string, std::string>& env,
                                      const std::string& stderrPath = "/dev/null");
  ~Child();
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  pid_t pid() const { return pid_; }
  // The first complete output line starting with prefix, waiting at most timeout for it;
  // nothing when the child closed its output or the time ran out.
  std::optional<std::string> waitForLine(const std::string& prefix,
                                         std::chrono::milliseconds timeout);
  // Everything written to standard output so far.
  std::string output();
  // Sends SIGKILL (once running) and reaps; answers the wait status decoded as in the e2e
  // helpers (128 + signal).
  int kill9();
  // Waits for the child to end by itself; nothing when it is still running after timeout.
  std::optional<int> wait(std::chrono::milliseconds timeout);
  bool reaped() const { return reaped_; }

 private:
  Child() = default;
  void readLoop(int fd);

  pid_t pid_ = -1;
  bool reaped_ = false;
  int status_ = -1;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::string out_;
  bool closed_ = false;
  std::thread reader_;
};

// The wait status as the e2e helpers report it: the exit code, or 128 + the signal.
int decodeStatus(int status);

}  // namespace ek::soak
