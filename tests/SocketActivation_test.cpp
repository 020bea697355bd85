// ekd adopts a socket passed by the service manager instead of making its own.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

int listeningSocket(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return -1;
  if (listen(fd, 16) != 0) return -1;
  return fd;
}

TEST(SocketActivation, DaemonServesThePassedSocketAndLeavesItInPlace) {
  TempDir dir;
  std::string runtime = (dir.path() / "run").string();
  std::filesystem::create_directories(runtime);
  // The socket lives where the manager put it, not where ekd would make its own.
  std::string socketPath = (dir.path() / "activated.sock").string();
  int fd = listeningSocket(socketPath);
  ASSERT_GE(fd, 0);

  pid_t pid = fork();
  if (pid == 0) {
    dup2(fd, 3);
    int devnull = open("/dev/null", O_WRONLY);
    dup2(devnull, 2);
    setenv("LISTEN_FDS", "1", 1);
    setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    setenv("EKORA_RUNTIME_DIR", runtime.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir.path().c_str(), 1);
    execl(ekdPath().c_str(), ekdPath().c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  close(fd);

  RawClient client(socketPath);
  ASSERT_TRUE(client.connected());
  ASSERT_TRUE(client.sendMessage(request("Nope"), 42));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame) << "the daemon did not answer on the activated socket";
  EXPECT_EQ(frame->id, 42u);
  EXPECT_FALSE(std::filesystem::exists(runtime + "/com.corvane.ekora.ekd"))
      << "the daemon made its own socket despite activation";

  kill(pid, SIGTERM);
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_TRUE(std::filesystem::exists(socketPath)) << "an activated socket belongs to the manager";
}

}  // namespace
}  // namespace ek::test
