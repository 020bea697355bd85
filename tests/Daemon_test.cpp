// The frame and the connection through a real ekd: what it refuses, and bad input and
// misbehaving clients that only the offending connection may suffer from.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

#include "platform/cbor/Cbor.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

std::vector<uint8_t> frameWithBody(std::vector<uint8_t> body) {
  std::vector<uint8_t> bytes(wyre::kHeaderSize);
  wyre::encodeHeader({static_cast<uint32_t>(body.size()), wyre::kFlagWantsReply, 1}, bytes.data());
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

// A batch of requests for no known type, each answered with a short error.
std::vector<uint8_t> batchOfUnknown(int count) {
  std::vector<uint8_t> batch;
  for (int i = 0; i < count; ++i) {
    wyre::appendFrame(batch, request("Nope"), wyre::kFlagWantsReply, static_cast<uint64_t>(i));
  }
  return batch;
}

// One daemon per test (ctest runs each alone); these serve floods of requests, which a debug
// line each would only slow down.
class DaemonFrame : public ::testing::Test {
 protected:
  void SetUp() override {
    daemon_.setEnvironment("EKORA_LOG", "default");
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
  }
  void TearDown() override { EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log(); }

  // A well-behaved client is still answered.
  void expectServed() {
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendMessage(request("Nope"), 9));
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << "daemon stopped answering";
    EXPECT_EQ(replyError(frame->body), "unrecognized request");
  }

  EkdProcess daemon_;
};
using DaemonFaults = DaemonFrame;

TEST_F(DaemonFrame, RefusalsOfVersionAndType) {
  const struct {
    Dictionary body;
    uint64_t code;
    std::string error;
  } cases[] = {
      {{{"request", "find"}}, 7, "unsupported protocol version 0 (current 3)"},
      {{{"request", "nonsense"}, {"version", 4}}, 7, "unsupported protocol version 4 (current 3)"},
      {{{"version", 1}}, 7, "unsupported protocol version 1 (current 3)"},
      {{{"request", "find"}, {"version", "3"}}, 7, "unsupported protocol version 0 (current 3)"},
      {{{"version", 3}}, 4, "invalid request format (missing type)"},
      {{{"version", 2}, {"request", 5}}, 4, "invalid request format (missing type)"},
      {{{"version", 3}, {"request", "Add"}}, 4, "unrecognized request"},
      {{{"version", 2}, {"request", ""}}, 4, "unrecognized request"},
  };
  RawClient client(daemon_.socketPath());
  for (const auto& c : cases) {
    const Value body(c.body);
    ASSERT_TRUE(client.sendMessage(body, 77));
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << body.description();
    EXPECT_EQ(frame->id, 77u);
    EXPECT_EQ(replyErrorCode(frame->body), static_cast<int64_t>(c.code)) << body.description();
    EXPECT_EQ(replyError(frame->body), c.error) << body.description();
  }
}

TEST_F(DaemonFrame, EachRequestWantingAReplyGetsOneInOrder) {
  RawClient client(daemon_.socketPath());
  const char* types[] = {"add",      "remove", "bulk", "match",         "ready", "access",
                         "annotate", "find",   "lock", "bulk-annotate", "status"};
  uint64_t id = 1;
  ASSERT_TRUE(client.sendMessage(request("find"), 100, /*wantsReply=*/false));
  for (const char* type : types) ASSERT_TRUE(client.sendMessage(request(type), id++));
  for (uint64_t expected = 1; expected < id; ++expected) {
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << "missing reply " << expected;
    EXPECT_EQ(frame->id, expected);
    EXPECT_TRUE(frame->body.dictionary());
  }
}

TEST_F(DaemonFaults, MalformedFramesCloseOnlyTheirConnection) {
  std::vector<uint8_t> oversized(wyre::kHeaderSize);
  wyre::encodeHeader({(64u << 20) + 1, 1, 1}, oversized.data());
  std::vector<uint8_t> deep(600, 0x81);
  deep.push_back(0x00);
  const std::string junk = "GET / HTTP/1.1\r\nHost: x\r\n\r\n";
  const struct {
    const char* name;
    std::vector<uint8_t> bytes;
  } cases[] = {
      {"length over 64 MiB", oversized},
      {"undecodable CBOR", frameWithBody({0xff, 0xff, 0xff})},
      {"map with a non-text key", frameWithBody({0xa1, 0x01, 0x02})},
      {"trailing bytes after the item", frameWithBody({0xa0, 0x00})},
      {"map declaring billions of entries", frameWithBody({0xbb, 0, 0, 0, 0, 0xb2, 0xd0, 0x5e, 0})},
      {"nesting deeper than 512", frameWithBody(deep)},
      {"garbage text", std::vector<uint8_t>(junk.begin(), junk.end())},
  };
  RawClient bystander(daemon_.socketPath());
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendBytes(c.bytes));
    EXPECT_TRUE(client.closedByPeer());
    ASSERT_TRUE(bystander.sendMessage(request("Nope"), 1));
    EXPECT_TRUE(bystander.readFrame()) << "the bystander's connection suffered";
  }
  // Frames cut short by a hang-up, and messages that are no dictionary, harm nobody either.
  {
    RawClient client(daemon_.socketPath());
    auto frame = frameWithBody(cbor::encode(request("find")));
    frame.resize(frame.size() - 3);
    ASSERT_TRUE(client.sendBytes(frame));
  }
  RawClient client(daemon_.socketPath());
  ASSERT_TRUE(client.sendMessage(Value(Array{1, 2, 3}), 1));
  ASSERT_TRUE(client.sendMessage(request("Nope"), 2));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame);
  EXPECT_EQ(frame->id, 2u) << "a message that is no dictionary was answered";
  EXPECT_TRUE(daemon_.logShows("unexpected message: [1, 2, 3] from: " + std::to_string(getpid())));
  expectServed();
}

TEST_F(DaemonFaults, ClientThatNeverReadsIsCutOffWithoutStallingOthers) {
  RawClient greedy(daemon_.socketPath());
  // Many times over what the socket buffers and the bound on unsent replies hold.
  const std::vector<uint8_t> batch = batchOfUnknown(4096);
  bool cutOff = false;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(90);
  for (int round = 0; round < 2000 && !cutOff && std::chrono::steady_clock::now() < deadline;
       ++round) {
    if (!greedy.sendBytes(batch)) cutOff = true;
    if (round % 50 == 0) expectServed();
  }
  EXPECT_TRUE(cutOff || greedy.closedByPeer(std::chrono::seconds(30)))
      << "the daemon kept a connection that never reads";
  EXPECT_TRUE(daemon_.logShows("does not read its replies"));
  // Clients gone with requests still queued disturb nobody.
  for (int round = 0; round < 20; ++round) {
    RawClient doomed(daemon_.socketPath());
    ASSERT_TRUE(doomed.sendBytes(batchOfUnknown(500)));
  }
  expectServed();
}

TEST(DaemonStartup, SecondDaemonFailsAndAStaleSocketIsReplaced) {
  EkdProcess daemon;
  ASSERT_TRUE(daemon.start());
  auto second = runCommand({ekdPath(), "-S", daemon.service()}, daemon.environment());
  EXPECT_EQ(second.status, 1);
  EXPECT_NE(second.err.find("unable to construct server"), std::string::npos) << second.err;
  daemon.kill9();
  ASSERT_TRUE(std::filesystem::exists(daemon.socketPath()));
  ASSERT_TRUE(daemon.start()) << daemon.log();
  EXPECT_TRUE(daemon.ask(request("status")));
  EXPECT_EQ(daemon.terminate(), 0);
  EXPECT_FALSE(std::filesystem::exists(daemon.socketPath())) << "socket left behind at stop";
}

TEST(SocketActivation, DaemonServesThePassedSocketAndLeavesItInPlace) {
  TempDir dir;
  const std::string runtime = (dir.path() / "run").string();
  std::filesystem::create_directories(runtime);
  // The socket lives where the manager put it, not where ekd would make its own.
  const std::string socketPath = (dir.path() / "activated.sock").string();
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(fd, 16), 0);

  pid_t pid = fork();
  if (pid == 0) {
    dup2(fd, 3);
    dup2(open("/dev/null", O_WRONLY), 2);
    setenv("LISTEN_FDS", "1", 1);
    setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    setenv("EKORA_RUNTIME_DIR", runtime.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir.path().c_str(), 1);
    execl(ekdPath().c_str(), ekdPath().c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  close(fd);
  RawClient client(socketPath);
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
