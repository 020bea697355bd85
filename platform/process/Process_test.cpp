#include "platform/process/Process.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/testing/Files.h"

namespace ek {
namespace {

TEST(UniqueFd, ClosesWhatItOwnsUnlessReleased) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  auto open = [](int fd) { return fcntl(fd, F_GETFD) != -1; };
  UniqueFd first(fds[0]);
  {
    UniqueFd second(fds[1]);
    second = std::move(first);  // closes fds[1]
    EXPECT_FALSE(open(fds[1]));
    EXPECT_EQ(UniqueFd(second.release()).get(), fds[0]);
  }
  EXPECT_FALSE(open(fds[0]));
}

TEST(AuditToken, NamesThePeerUntilItExits) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  auto peer = AuditToken::forSocket(fds[0]);
  ASSERT_TRUE(peer && peer->pidfd);
  EXPECT_EQ(peer->pid, getpid());
  EXPECT_EQ(peer->uid, geteuid());
  EXPECT_TRUE(peer->alive());
  close(fds[0]);
  close(fds[1]);
  for (int fd : {fds[0], -1}) EXPECT_FALSE(AuditToken::forSocket(fd));

  pid_t child = fork();
  if (child == 0) {
    pause();
    _exit(0);
  }
  AuditToken pinned = AuditToken::forWriter({child, getuid(), getgid()});
  AuditToken plain;
  plain.pid = child;
  EXPECT_TRUE(pinned.alive() && plain.alive());
  kill(child, SIGKILL);
  siginfo_t info{};
  waitid(P_PID, id_t(child), &info, WEXITED | WNOWAIT);
  EXPECT_FALSE(pinned.alive());  // a zombie has exited
  waitpid(child, nullptr, 0);
  EXPECT_FALSE(plain.alive());
  EXPECT_FALSE(AuditToken().alive());
}

TEST(ExecutablePath, IsTheProgramTheProcessRunsEvenOnceRemoved) {
  testing::TempDir dir;
  const std::string program = dir.file("sleeper");
  std::filesystem::copy_file("/bin/sleep", program);
  pid_t child = fork();
  if (child == 0) {
    execl(program.c_str(), program.c_str(), "30", nullptr);
    _exit(127);
  }
  for (int i = 0; i < 5000 && executablePathForPid(child) != program; ++i) usleep(1000);
  std::filesystem::remove(program);
  EXPECT_EQ(executablePathForPid(child), program);  // without " (deleted)"
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  for (pid_t pid : {child, 0, -1}) EXPECT_FALSE(executablePathForPid(pid)) << pid;
}

}  // namespace
}  // namespace ek
