// Bad input and misbehaving clients, end to end: only the offending connection suffers.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

std::vector<uint8_t> header(uint32_t length, uint32_t flags, uint64_t id) {
  std::vector<uint8_t> bytes(wyre::kHeaderSize);
  wyre::encodeHeader({length, flags, id}, bytes.data());
  return bytes;
}

std::vector<uint8_t> frameWithBody(std::vector<uint8_t> body) {
  auto bytes = header(static_cast<uint32_t>(body.size()), wyre::kFlagWantsReply, 1);
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

class DaemonFaults : public ::testing::Test {
 protected:
  // These daemons serve floods of requests: a debug line for each would only slow them down.
  void SetUp() override {
    setenv("EKORA_LOG", "default", 1);
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
  }
  void TearDown() override {
    unsetenv("EKORA_LOG");
    EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
  }

  // A well-behaved client is still answered.
  void expectServed() {
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendMessage(request("Nope"), 9));
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << "daemon stopped answering";
    EXPECT_EQ(*frame->body.getString("error"), "unrecognized request");
  }

  EkdProcess daemon_;
};

TEST_F(DaemonFaults, MalformedFramesCloseOnlyTheirConnection) {
  struct Case {
    const char* name;
    std::vector<uint8_t> bytes;
  };
  std::vector<Case> cases{
      {"length over 64 MiB", header((64u << 20) + 1, 1, 1)},
      {"undecodable CBOR", frameWithBody({0xff, 0xff, 0xff})},
      {"map with a non-text key", frameWithBody({0xa1, 0x01, 0x02})},
      {"trailing bytes after the item", frameWithBody({0xa0, 0x00})},
      {"map declaring billions of entries", frameWithBody({0xbb, 0, 0, 0, 0, 0xb2, 0xd0, 0x5e, 0})},
      {"garbage text",
       [] {
         std::string junk = "GET / HTTP/1.1\r\nHost: x\r\n\r\n";
         return std::vector<uint8_t>(junk.begin(), junk.end());
       }()},
  };
  // Nesting deeper than the codec's limit.
  std::vector<uint8_t> deep(600, 0x81);
  deep.push_back(0x00);
  cases.push_back({"nesting deeper than 512", frameWithBody(deep)});

  RawClient bystander(daemon_.socketPath());
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendBytes(c.bytes));
    EXPECT_TRUE(client.closedByPeer());
    ASSERT_TRUE(bystander.sendMessage(request("Nope"), 1));
    EXPECT_TRUE(bystander.readFrame()) << "the bystander's connection suffered";
  }
  expectServed();
}

TEST_F(DaemonFaults, TruncatedFrameThenHangUpIsHarmless) {
  {
    RawClient client(daemon_.socketPath());
    auto frame = frameWithBody(cbor::encode(request("find")));
    frame.resize(frame.size() - 3);
    ASSERT_TRUE(client.sendBytes(frame));
  }
  {
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendBytes({0x00, 0x00, 0x01}));
  }
  expectServed();
}

TEST_F(DaemonFaults, NonDictionaryMessageGetsNoReplyAndIsLogged) {
  RawClient client(daemon_.socketPath());
  ASSERT_TRUE(client.sendMessage(Value(Array{1, 2, 3}), 1));
  ASSERT_TRUE(client.sendMessage(Value("a string"), 2));
  ASSERT_TRUE(client.sendMessage(request("Nope"), 3));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame);
  EXPECT_EQ(frame->id, 3u) << "a non-dictionary message was answered";
  std::string log = daemon_.log();
  EXPECT_NE(log.find("unexpected message: [1, 2, 3] from: " + std::to_string(getpid())),
            std::string::npos)
      << log;
}

TEST_F(DaemonFaults, ClientThatNeverReadsIsCutOffWithoutStallingOthers) {
  RawClient greedy(daemon_.socketPath());
  // Each request is answered with an error reply of ~60 bytes: enough requests to exceed
  // the daemon's bound on unsent replies many times over what the socket buffers hold.
  std::vector<uint8_t> batch;
  for (int i = 0; i < 4096; ++i) {
    wyre::appendFrame(batch, request("Nope"), wyre::kFlagWantsReply, static_cast<uint64_t>(i));
  }
  // Bounded by rounds and time: a slow (sanitized) daemon takes longer to fill its bound.
  bool cutOff = false;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(90);
  for (int round = 0; round < 2000 && !cutOff && std::chrono::steady_clock::now() < deadline;
       ++round) {
    if (!greedy.sendBytes(batch)) cutOff = true;
    if (round % 50 == 0) expectServed();
  }
  EXPECT_TRUE(cutOff || greedy.closedByPeer(std::chrono::seconds(30)))
      << "the daemon kept a connection that never reads";
  expectServed();
  EXPECT_NE(daemon_.log().find("does not read its replies"), std::string::npos) << daemon_.log();
}

TEST_F(DaemonFaults, AnswerLargerThanTheBoundOnUnsentRepliesIsStillSent) {
  // Ten forms of 900 KiB each: one reply above the 8 MiB bound, from a client that reads it.
  // Only what piles up behind an unread reply is bounded.
  namespace fs = std::filesystem;
  fs::path app = daemon_.root().path() / "Notes.app";
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications" / "Notes.app", app, fs::copy_options::recursive);
  constexpr int kPlugIns = 10;
  const std::string padding(900u << 10, 'x');
  for (int i = 0; i < kPlugIns; ++i) {
    fs::path plugIn = app / "PlugIns" / ("Big" + std::to_string(i) + ".appex");
    fs::copy(app / "PlugIns/Share.appex", plugIn, fs::copy_options::recursive);
    Result<Value> info = dmap::readFile((plugIn / "Info.dmap").string());
    ASSERT_TRUE(info.ok());
    Dictionary& dictionary = *info->dictionary();
    dictionary["QvBundleIdentifier"] = Value("com.corvane.example.notes.big" + std::to_string(i));
    Dictionary& extension = *dictionary["ZuExtension"].dictionary();
    (*extension["ZuExtensionAttributes"].dictionary())["Padding"] = Value(padding);
    ASSERT_TRUE(dmap::writeFileAtomically((plugIn / "Info.dmap").string(), *info).ok());
  }
  auto added = daemon_.ask(request("add", {{"paths", Value(Array{Value(app.string())})}}));
  ASSERT_TRUE(added && replyErrorCode(*added) == 0) << daemon_.log();

  auto big =
      daemon_.ask(request("match", {{"rules", Value(Dictionary{{"ZuExtensionPointIdentifier",
                                                                Value("com.corvane.share")}})}}),
                  std::chrono::seconds(120));
  ASSERT_TRUE(big.has_value()) << daemon_.log();
  const Array* matches = big->getArray("matches");
  ASSERT_TRUE(matches) << big->description().substr(0, 300);
  size_t padded = 0;
  for (const Value& form : *matches) {
    padded += form.description().find(padding) != std::string::npos ? 1 : 0;
  }
  EXPECT_EQ(padded, static_cast<size_t>(kPlugIns));
  expectServed();
}

TEST_F(DaemonFaults, ClientDyingWithQueuedRequestsDoesNotDisturbTheDaemon) {
  for (int round = 0; round < 20; ++round) {
    RawClient doomed(daemon_.socketPath());
    std::vector<uint8_t> batch;
    for (int i = 0; i < 500; ++i) {
      wyre::appendFrame(batch, request("Nope"), wyre::kFlagWantsReply, static_cast<uint64_t>(i));
    }
    ASSERT_TRUE(doomed.sendBytes(batch));
    // Destruction closes the socket with requests still queued in the daemon.
  }
  expectServed();
}

TEST_F(DaemonFaults, MemoryReturnsAfterManyConnections) {
  if (kSanitized) GTEST_SKIP() << "sanitizers hold freed memory on purpose";
  expectServed();
  long before = residentKiB(daemon_.pid());
  for (int i = 0; i < 1000; ++i) {
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendMessage(request("Nope"), 1));
    ASSERT_TRUE(client.readFrame());
  }
  expectServed();
  long after = residentKiB(daemon_.pid());
  ASSERT_GT(before, 0);
  // Leaked client records or connections would grow the daemon by megabytes here.
  EXPECT_LT(after - before, 4096) << "RSS " << before << " KiB -> " << after << " KiB";
}

TEST(DaemonStartup, SecondDaemonOnTheSameServiceFailsAndFirstKeepsServing) {
  EkdProcess first;
  ASSERT_TRUE(first.start());
  auto result = runCommand({ekdPath(), "-S", first.service()}, first.environment());
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("unable to construct server"), std::string::npos) << result.err;
  RawClient client(first.socketPath());
  ASSERT_TRUE(client.sendMessage(request("Nope"), 1));
  EXPECT_TRUE(client.readFrame());
  EXPECT_EQ(first.terminate(), 0);
}

TEST(DaemonStartup, StaleSocketFromADeadDaemonIsReplaced) {
  EkdProcess daemon;
  ASSERT_TRUE(daemon.start());
  daemon.kill9();
  ASSERT_TRUE(std::filesystem::exists(daemon.socketPath()));
  ASSERT_TRUE(daemon.start()) << daemon.log();
  RawClient client(daemon.socketPath());
  ASSERT_TRUE(client.sendMessage(request("Nope"), 1));
  EXPECT_TRUE(client.readFrame());
  EXPECT_EQ(daemon.terminate(), 0);
  EXPECT_FALSE(std::filesystem::exists(daemon.socketPath())) << "socket left behind at stop";
}

}  // namespace
}  // namespace ek::test
