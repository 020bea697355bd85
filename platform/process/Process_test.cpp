#include "platform/process/Process.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstddef>
#include <cstring>
#include <filesystem>
#include <string>

extern char** environ;

namespace ek {
namespace {

bool isOpen(int fd) {
  return fcntl(fd, F_GETFD) != -1;
}

TEST(UniqueFd, ClosesOnDestruction) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  close(fds[1]);
  { UniqueFd owned(fds[0]); }
  EXPECT_FALSE(isOpen(fds[0]));
}

TEST(UniqueFd, ReleaseGivesUpOwnership) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  close(fds[1]);
  int released;
  {
    UniqueFd owned(fds[0]);
    released = owned.release();
    EXPECT_FALSE(owned.valid());
  }
  EXPECT_TRUE(isOpen(released));
  close(released);
}

TEST(UniqueFd, MoveAndResetCloseTheOldDescriptor) {
  int a[2], b[2];
  ASSERT_EQ(pipe(a), 0);
  ASSERT_EQ(pipe(b), 0);
  UniqueFd first(a[0]);
  UniqueFd second(b[0]);
  second = std::move(first);
  EXPECT_FALSE(isOpen(b[0]));
  EXPECT_EQ(second.get(), a[0]);
  EXPECT_FALSE(first.valid());
  second.reset(a[1]);
  EXPECT_FALSE(isOpen(a[0]));
  UniqueFd third(std::move(second));
  EXPECT_EQ(third.get(), a[1]);
  close(b[1]);
}

TEST(AuditToken, ForSocketReadsThePeer) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  auto token = AuditToken::forSocket(fds[0]);
  close(fds[0]);
  close(fds[1]);
  ASSERT_TRUE(token);
  EXPECT_EQ(token->pid, getpid());
  EXPECT_EQ(token->uid, geteuid());
  EXPECT_EQ(token->gid, getegid());
  ASSERT_TRUE(token->pidfd);
  EXPECT_TRUE(token->pidfd->valid());
  EXPECT_TRUE(token->alive());
}

TEST(AuditToken, ForSocketFailsOnSomethingElse) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  EXPECT_FALSE(AuditToken::forSocket(fds[0]));
  close(fds[0]);
  close(fds[1]);
  EXPECT_FALSE(AuditToken::forSocket(-1));
}

TEST(AuditToken, SelfIsAlive) {
  AuditToken token = AuditToken::self();
  EXPECT_EQ(token.pid, getpid());
  EXPECT_EQ(token.uid, geteuid());
  EXPECT_TRUE(token.alive());
}

// A child that stays until the parent closes its end of the socket.
struct Child {
  pid_t pid = -1;
  int socket = -1;
};

// The peer credentials of a socket pair are those of its creator, so the child connects to
// a listening socket of ours instead.
Child startChild() {
  int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (listener < 0) return {};
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::string name = "ek_process_test." + std::to_string(getpid());
  memcpy(address.sun_path + 1, name.data(), name.size());  // abstract namespace
  socklen_t length = socklen_t(offsetof(sockaddr_un, sun_path) + 1 + name.size());
  if (bind(listener, reinterpret_cast<sockaddr*>(&address), length) != 0 ||
      listen(listener, 1) != 0) {
    close(listener);
    return {};
  }
  pid_t pid = fork();
  if (pid == 0) {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), length) != 0) _exit(1);
    char c;
    while (read(fd, &c, 1) > 0) {
    }
    _exit(0);
  }
  int connection = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  close(listener);
  return {pid, connection};
}

TEST(AuditToken, NotAliveOnceThePeerExited) {
  Child child = startChild();
  ASSERT_GT(child.pid, 0);
  auto token = AuditToken::forSocket(child.socket);
  ASSERT_TRUE(token);
  EXPECT_EQ(token->pid, child.pid);
  EXPECT_TRUE(token->alive());
  close(child.socket);
  int status;
  ASSERT_EQ(waitpid(child.pid, &status, 0), child.pid);
  EXPECT_FALSE(token->alive());
}

TEST(AuditToken, ZombieCountsAsExited) {
  Child child = startChild();
  ASSERT_GT(child.pid, 0);
  auto token = AuditToken::forSocket(child.socket);
  ASSERT_TRUE(token && token->pidfd);
  close(child.socket);
  // Wait for the exit without reaping, so that the pid still exists as a zombie.
  siginfo_t info{};
  ASSERT_EQ(waitid(P_PID, id_t(child.pid), &info, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(token->alive());
  waitpid(child.pid, nullptr, 0);
}

TEST(AuditToken, WithoutPidfdFallsBackToTheProcessTable) {
  Child child = startChild();
  ASSERT_GT(child.pid, 0);
  AuditToken token;
  token.pid = child.pid;
  EXPECT_TRUE(token.alive());
  close(child.socket);
  waitpid(child.pid, nullptr, 0);
  EXPECT_FALSE(token.alive());
  AuditToken empty;
  EXPECT_FALSE(empty.alive());
}

pid_t spawn(const std::string& program) {
  pid_t pid = -1;
  char* argv[] = {const_cast<char*>(program.c_str()), const_cast<char*>("30"), nullptr};
  if (posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv, environ) != 0) return -1;
  return pid;
}

// Waits until the child runs the new program rather than the forked copy of us.
bool waitForExec(pid_t pid, const std::string& program) {
  for (int i = 0; i < 5000; ++i) {
    auto path = executablePathForPid(pid);
    if (path && *path == program) return true;
    usleep(1000);
  }
  return false;
}

void stop(pid_t pid) {
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
}

TEST(ExecutablePath, IsTheProgramOfTheProcess) {
  std::string sleep = std::filesystem::canonical("/bin/sleep").string();
  pid_t pid = spawn(sleep);
  ASSERT_GT(pid, 0);
  EXPECT_TRUE(waitForExec(pid, sleep));
  EXPECT_EQ(executablePathForPid(pid), sleep);
  stop(pid);
}

TEST(ExecutablePath, OurOwnMatchesProcSelf) {
  auto path = executablePathForPid(getpid());
  ASSERT_TRUE(path);
  EXPECT_EQ(std::filesystem::path(*path).filename(), "ek_process_test");
  EXPECT_TRUE(std::filesystem::is_regular_file(*path));
}

TEST(ExecutablePath, DeletedSuffixIsStripped) {
  std::string directory = (std::filesystem::current_path() / "ekproc.XXXXXX").string();
  ASSERT_NE(mkdtemp(directory.data()), nullptr);
  std::string copy = directory + "/sleeper";
  std::filesystem::copy_file("/bin/sleep", copy);
  std::filesystem::permissions(copy, std::filesystem::perms(0755));
  pid_t pid = spawn(copy);
  ASSERT_GT(pid, 0);
  ASSERT_TRUE(waitForExec(pid, copy));
  std::filesystem::remove(copy);
  EXPECT_EQ(executablePathForPid(pid), copy);
  stop(pid);
  std::filesystem::remove_all(directory);
}

TEST(ExecutablePath, AbsentForNoProcess) {
  EXPECT_FALSE(executablePathForPid(0));
  EXPECT_FALSE(executablePathForPid(-1));
  Child child = startChild();
  ASSERT_GT(child.pid, 0);
  close(child.socket);
  waitpid(child.pid, nullptr, 0);
  EXPECT_FALSE(executablePathForPid(child.pid));
}

}  // namespace
}  // namespace ek
