// ekctl watch against posts from another process: no daemon needed, only the runtime directory.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "platform/notify/Notifications.h"
#include "tests/EkdProcess.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

// ekctl watch running in the background with its standard output on a pipe.
class WatchProcess {
 public:
  WatchProcess(const std::vector<std::string>& names, const std::string& runtimeDir) {
    int out[2];
    if (pipe2(out, O_CLOEXEC) != 0) std::abort();
    std::vector<std::string> argv = {ekctlPath(), "watch"};
    argv.insert(argv.end(), names.begin(), names.end());
    pid_ = fork();
    if (pid_ == 0) {
      dup2(out[1], 1);
      setenv("EKORA_RUNTIME_DIR", runtimeDir.c_str(), 1);
      std::vector<char*> args;
      for (auto& a : argv) args.push_back(a.data());
      args.push_back(nullptr);
      execv(args[0], args.data());
      _exit(127);
    }
    close(out[1]);
    out_ = out[0];
  }
  ~WatchProcess() {
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    close(out_);
  }

  // True once ekctl holds an inotify watch, so that no post can slip in before it.
  bool waitUntilWatching(std::chrono::milliseconds limit) const {
    auto deadline = std::chrono::steady_clock::now() + limit;
    fs::path fdinfo = fs::path("/proc") / std::to_string(pid_) / "fdinfo";
    while (std::chrono::steady_clock::now() < deadline) {
      std::error_code error;
      for (const auto& entry : fs::directory_iterator(fdinfo, error)) {
        std::ifstream in(entry.path());
        std::string line;
        while (std::getline(in, line)) {
          if (line.rfind("inotify wd:", 0) == 0) return true;
        }
      }
      std::this_thread::sleep_for(5ms);
    }
    return false;
  }

  // The next line ekctl printed, without its newline; empty when none came in time.
  std::string readLine(std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (true) {
      auto newline = buffered_.find('\n');
      if (newline != std::string::npos) {
        std::string line = buffered_.substr(0, newline);
        buffered_.erase(0, newline + 1);
        return line;
      }
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) return {};
      struct pollfd pfd {
        out_, POLLIN, 0
      };
      if (poll(&pfd, 1, static_cast<int>(left.count())) <= 0) continue;
      char chunk[256];
      ssize_t n = read(out_, chunk, sizeof chunk);
      if (n <= 0) return {};
      buffered_.append(chunk, static_cast<size_t>(n));
    }
  }

  // Posts name until ekctl reports it and answers the generation reported: a post that lands
  // while ekctl reads the generations it starts from counts as made before the watch began.
  uint64_t firstReport(const std::string& name, const std::string& notifications) {
    for (int attempt = 0; attempt < 5; ++attempt) {
      if (!notify::post(name, notifications).ok()) return 0;
      std::string line = readLine(2s);
      if (line.empty()) continue;
      if (line.rfind(name + " ", 0) != 0) return 0;
      return std::stoull(line.substr(name.size() + 1));
    }
    return 0;
  }

  // Sends signal and answers the exit status (128 + signal when it killed the process).
  int stop(int signal) {
    kill(pid_, signal);
    int status = 0;
    waitpid(pid_, &status, 0);
    pid_ = -1;
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : -1;
  }

 private:
  pid_t pid_ = -1;
  int out_ = -1;
  std::string buffered_;
};

TEST(WatchTest, PrintsOneLinePerPostAndEndsCleanlyOnSigterm) {
  TempDir runtime;
  std::string notifications = (runtime.path() / "notifications").string();
  WatchProcess watch({"foo"}, runtime.path().string());
  ASSERT_TRUE(watch.waitUntilWatching(10s));
  ASSERT_TRUE(notify::post("other", notifications).ok());
  uint64_t first = watch.firstReport("foo", notifications);
  ASSERT_GE(first, 1u);
  ASSERT_TRUE(notify::post("foo", notifications).ok());
  EXPECT_EQ(watch.readLine(10s), "foo " + std::to_string(first + 1));
  EXPECT_EQ(watch.stop(SIGTERM), 0);
}

TEST(WatchTest, EndsCleanlyOnSigint) {
  TempDir runtime;
  WatchProcess watch({"foo", "bar"}, runtime.path().string());
  ASSERT_TRUE(watch.waitUntilWatching(10s));
  EXPECT_GE(watch.firstReport("bar", (runtime.path() / "notifications").string()), 1u);
  EXPECT_EQ(watch.stop(SIGINT), 0);
}

TEST(WatchTest, InvalidNameIsAUsageError) {
  TempDir runtime;
  for (std::string name : {"a/b", "..", ""}) {
    auto result = runCommand({ekctlPath(), "watch", "ok", name},
                             {{"EKORA_RUNTIME_DIR", runtime.path().string()}});
    EXPECT_EQ(result.status, 2) << name;
    EXPECT_NE(result.err.find("invalid notification name"), std::string::npos) << result.err;
  }
}

TEST(WatchTest, MissingNameIsAUsageError) {
  auto result = runCommand({ekctlPath(), "watch"});
  EXPECT_EQ(result.status, 2);
}

}  // namespace
}  // namespace ek::test
