#include "platform/sandbox/SandboxCheck.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

namespace ek {
namespace {

// Starts sleep, under ek-sandbox-exec or directly, and waits until it runs: the tool has
// installed its filter by then, since it only executes the program afterwards.
AuditToken startSleep(bool sandboxed) {
  const std::string tool = EK_SANDBOX_EXEC_PATH, sleep = std::filesystem::canonical("/bin/sleep");
  const pid_t pid = fork();
  if (pid == 0) {
    if (sandboxed) execl(tool.c_str(), tool.c_str(), sleep.c_str(), "30", nullptr);
    execl(sleep.c_str(), sleep.c_str(), "30", nullptr);
    _exit(127);
  }
  for (int i = 0; i < 5000 && executablePathForPid(pid) != sleep; ++i) usleep(1000);
  return AuditToken::forWriter({pid, getuid(), getgid()});  // pinned by a pidfd
}

unsigned long seccompFilters(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("Seccomp_filters:")) return std::stoul(line.substr(16));
  }
  return 0;
}

TEST(SandboxCheck, OneFilterBeyondTheSystemsSandboxesAndAGoneProcessCountsAsSandboxed) {
  auto check = SandboxCheck::system();
  AuditToken sandboxed = startSleep(true);
  AuditToken plain = startSleep(false);
  // The tool adds exactly one filter to what the system imposes on every process.
  EXPECT_EQ(seccompFilters(sandboxed.pid), seccompFilters(1) + 1);
  EXPECT_TRUE(check->isSandboxed(sandboxed));
  EXPECT_FALSE(check->isSandboxed(plain));
  for (pid_t pid : {sandboxed.pid, plain.pid}) kill(pid, SIGKILL);
  // Fails closed: a process that has exited, reaped or not, or none at all, is sandboxed.
  siginfo_t info{};
  waitid(P_PID, id_t(plain.pid), &info, WEXITED | WNOWAIT);
  EXPECT_TRUE(check->isSandboxed(plain));
  for (pid_t pid : {sandboxed.pid, plain.pid}) waitpid(pid, nullptr, 0);
  AuditToken unpinned;
  for (pid_t pid : {plain.pid, 0, -5}) {
    unpinned.pid = pid;
    EXPECT_TRUE(check->isSandboxed(unpinned)) << pid;
  }
}

}  // namespace
}  // namespace ek
