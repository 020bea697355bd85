#include "platform/sandbox/SandboxCheck.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

namespace ek {
namespace {

const char* const kSandboxExec = EK_SANDBOX_EXEC_PATH;

struct ToolRun {
  int status = -1;
  std::string output;  // standard output and standard error together
};

// Runs the tool to completion and collects what it printed.
ToolRun runTool(std::vector<std::string> args) {
  int fds[2];
  if (pipe(fds) != 0) return {};
  pid_t child = fork();
  if (child == 0) {
    dup2(fds[1], STDOUT_FILENO);
    dup2(fds[1], STDERR_FILENO);
    close(fds[0]);
    close(fds[1]);
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(kSandboxExec));
    for (auto& arg : args) argv.push_back(arg.data());
    argv.push_back(nullptr);
    execv(kSandboxExec, argv.data());
    _exit(99);
  }
  close(fds[1]);
  ToolRun run;
  char buffer[512];
  ssize_t n;
  while ((n = read(fds[0], buffer, sizeof buffer)) > 0) run.output.append(buffer, size_t(n));
  close(fds[0]);
  int status = 0;
  waitpid(child, &status, 0);
  run.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return run;
}

// Starts a long-running program, under the tool or directly, and waits until it runs.
pid_t startSleep(bool sandboxed) {
  std::string sleep = std::filesystem::canonical("/bin/sleep").string();
  pid_t child = fork();
  if (child == 0) {
    if (sandboxed) {
      execl(kSandboxExec, kSandboxExec, sleep.c_str(), "30", static_cast<char*>(nullptr));
    } else {
      execl(sleep.c_str(), sleep.c_str(), "30", static_cast<char*>(nullptr));
    }
    _exit(127);
  }
  // Once sleep runs, the tool has installed its filter: it only execs afterwards.
  for (int i = 0; i < 5000; ++i) {
    if (executablePathForPid(child) == sleep) return child;
    usleep(1000);
  }
  return -1;
}

void stop(pid_t pid) {
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
}

AuditToken tokenFor(pid_t pid) {
  AuditToken token;
  token.pid = pid;
  return token;
}

TEST(SandboxCheck, ProgramUnderTheToolIsSandboxed) {
  pid_t child = startSleep(true);
  ASSERT_GT(child, 0);
  bool sandboxed = SandboxCheck::system()->isSandboxed(tokenFor(child));
  stop(child);
  EXPECT_TRUE(sandboxed);
}

TEST(SandboxCheck, PlainProgramIsNot) {
  pid_t child = startSleep(false);
  ASSERT_GT(child, 0);
  bool sandboxed = SandboxCheck::system()->isSandboxed(tokenFor(child));
  stop(child);
  EXPECT_FALSE(sandboxed);
}

TEST(SandboxCheck, OurOwnProcessIsNot) {
  EXPECT_FALSE(SandboxCheck::system()->isSandboxed(AuditToken::self()));
}

// Fails closed: what cannot be read about a process, or a process that is gone, is sandboxed.
TEST(SandboxCheck, ExitedOrUnknownProcessIs) {
  pid_t child = startSleep(false);
  ASSERT_GT(child, 0);
  stop(child);
  EXPECT_TRUE(SandboxCheck::system()->isSandboxed(tokenFor(child)));
  EXPECT_TRUE(SandboxCheck::system()->isSandboxed(tokenFor(0)));
  EXPECT_TRUE(SandboxCheck::system()->isSandboxed(tokenFor(-5)));
}

TEST(SandboxExec, FilterIsInheritedByWhatTheProgramRuns) {
  ToolRun run = runTool({"/bin/sh", "-c", "grep Seccomp_filters /proc/self/status"});
  EXPECT_EQ(run.status, 0);
  ToolRun outside = runTool({"/bin/sh", "-c", "grep Seccomp_filters /proc/1/status"});
  ASSERT_EQ(outside.status, 0);
  // One filter more than process 1.
  auto count = [](const std::string& line) { return std::stoul(line.substr(line.find(':') + 1)); };
  EXPECT_EQ(count(run.output), count(outside.output) + 1) << run.output;
}

TEST(SandboxExec, PassesArgumentsAndExitStatusThrough) {
  ToolRun run = runTool({"sh", "-c", "echo \"$0 $1\"; exit 7", "first", "second"});
  EXPECT_EQ(run.status, 7);
  EXPECT_EQ(run.output, "first second\n");
}

TEST(SandboxExec, NoProgramIsAUsageError) {
  ToolRun run = runTool({});
  EXPECT_EQ(run.status, 2);
  EXPECT_EQ(run.output.rfind("usage: ek-sandbox-exec PROGRAM", 0), 0u) << run.output;
}

TEST(SandboxExec, ProgramThatCannotRunExits127) {
  ToolRun run = runTool({"/nonexistent/program"});
  EXPECT_EQ(run.status, 127);
  EXPECT_EQ(run.output, "ek-sandbox-exec: /nonexistent/program: No such file or directory\n");
}

TEST(FakeSandboxCheck, AnswersWhatWasSet) {
  FakeSandboxCheck fake;
  EXPECT_FALSE(fake.isSandboxed(tokenFor(10)));
  fake.setSandboxed(10, true);
  EXPECT_TRUE(fake.isSandboxed(tokenFor(10)));
  EXPECT_FALSE(fake.isSandboxed(tokenFor(11)));
  fake.setSandboxed(10, false);
  EXPECT_FALSE(fake.isSandboxed(tokenFor(10)));
}

}  // namespace
}  // namespace ek
