#include "bench/LoadGenerator.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <tuple>

#include "bench/EchoServer.h"
#include "bench/FrameIo.h"
#include "platform/cbor/Cbor.h"

namespace ek::bench {
namespace {

using Action = EchoServer::Action;

std::vector<uint8_t> requestBody() {
  return cbor::encode(Value(Dictionary{{"request", "find"}, {"version", 3}}));
}

std::unique_ptr<EchoServer> startServer(EchoServer::Responder responder = {}) {
  auto server = EchoServer::start(std::move(responder));
  EXPECT_TRUE(server.ok());
  return server.ok() ? std::move(server).value() : nullptr;
}

// Count-bounded, with a generous time bound that only a broken run would reach.
LoadOptions countedRun(const EchoServer& server, uint64_t count, unsigned connections = 1) {
  LoadOptions options;
  options.socketPath = server.socketPath();
  options.connections = connections;
  options.count = count;
  options.duration = Seconds(60);
  options.replyTimeout = std::chrono::milliseconds(2000);
  return options;
}

LoadResult runOk(const LoadOptions& options, const std::vector<uint8_t>& body = requestBody()) {
  Result<LoadResult> result = runLoad(options, body);
  EXPECT_TRUE(result.ok()) << (result.ok() ? "" : result.error().message);
  return result.ok() ? std::move(result).value() : LoadResult{};
}

TEST(PercentileTest, NearestRankOfSortedValues) {
  const std::vector<uint64_t> hundred = [] {
    std::vector<uint64_t> v;
    for (uint64_t i = 1; i <= 100; ++i) v.push_back(i);
    return v;
  }();
  const std::vector<std::tuple<std::vector<uint64_t>, double, uint64_t>> cases = {
      {{}, 0.5, 0},        {{7}, 0.0, 7},          {{7}, 0.99, 7},     {{1, 2}, 0.5, 1},
      {{1, 2}, 0.51, 2},   {{1, 2, 3, 4}, 0.9, 4}, {hundred, 0.5, 50}, {hundred, 0.9, 90},
      {hundred, 0.99, 99}, {hundred, 1.0, 100},    {hundred, 0.0, 1},  {hundred, 1.5, 100},
  };
  for (const auto& [values, fraction, expected] : cases) {
    EXPECT_EQ(percentile(values, fraction), expected)
        << "size " << values.size() << " fraction " << fraction;
  }
}

TEST(ProcessCpuTest, ReadsOwnTimeAndRefusesAMissingProcess) {
  volatile uint64_t spin = 0;
  for (uint64_t i = 0; i < 50'000'000; ++i) spin = spin + i;
  std::optional<double> own = processCpuSeconds(static_cast<int>(::getpid()));
  ASSERT_TRUE(own.has_value());
  EXPECT_GT(*own, 0.0);
  EXPECT_FALSE(processCpuSeconds(1 << 30).has_value());
}

TEST(LoadResultTest, LatencySummaryIsInMicroseconds) {
  LoadResult result;
  for (uint64_t i = 1; i <= 100; ++i) result.latenciesNs.push_back(i * 1000);
  LatencySummary summary = result.latency();
  EXPECT_DOUBLE_EQ(summary.p50, 50);
  EXPECT_DOUBLE_EQ(summary.p90, 90);
  EXPECT_DOUBLE_EQ(summary.p99, 99);
  EXPECT_DOUBLE_EQ(summary.max, 100);
  EXPECT_DOUBLE_EQ(summary.mean, 50.5);
}

TEST(LoadResultTest, CombineAddsCountsTimesAndLatencies) {
  LoadResult a{.requests = 10,
               .errorReplies = 1,
               .failures = 2,
               .seconds = 1.5,
               .firstFailure = "no reply in time",
               .latenciesNs = {1, 2, 3}};
  LoadResult b{.requests = 20,
               .failures = 1,
               .seconds = 2.5,
               .firstError = "error 4: bad",
               .firstFailure = "send failed",
               .latenciesNs = {4}};
  LoadResult sum = combine({a, b});
  EXPECT_EQ(sum.requests, 30u);
  EXPECT_EQ(sum.errorReplies, 1u);
  EXPECT_EQ(sum.failures, 3u);
  EXPECT_DOUBLE_EQ(sum.seconds, 4.0);
  EXPECT_EQ(sum.latenciesNs.size(), 4u);
  EXPECT_DOUBLE_EQ(sum.requestsPerSecond(), 7.5);
  EXPECT_EQ(sum.firstError, "error 4: bad");
  EXPECT_EQ(sum.firstFailure, "no reply in time");
}

TEST(LoadGeneratorTest, CountedRunCompletesExactlyThatManyRoundTrips) {
  // Waiting for readiness or asleep in recv.
  for (bool waitInRecv : {false, true}) {
    auto server = startServer();
    ASSERT_TRUE(server);
    LoadOptions options = countedRun(*server, 300, 3);
    options.waitInRecv = waitInRecv;
    LoadResult result = runOk(options);
    EXPECT_EQ(result.requests, 300u);
    EXPECT_EQ(result.latenciesNs.size(), 300u);
    EXPECT_EQ(result.failures, 0u);
    EXPECT_EQ(result.errorReplies, 0u);
    EXPECT_GT(result.seconds, 0);
    EXPECT_EQ(server->accepted(), 3u);
  }
}

TEST(LoadGeneratorTest, TimedRunStopsByItselfWithRequests) {
  auto server = startServer();
  ASSERT_TRUE(server);
  LoadOptions options;
  options.socketPath = server->socketPath();
  options.connections = 2;
  options.duration = Seconds(0.2);
  LoadResult result = runOk(options);
  EXPECT_GT(result.requests, 0u);
  EXPECT_EQ(result.failures, 0u);
  EXPECT_EQ(result.latenciesNs.size(), result.requests);
}

TEST(LoadGeneratorTest, RequestsWantRepliesCarryTheBodyAndIncreasingIds) {
  std::mutex mutex;
  std::vector<uint64_t> ids;
  std::vector<uint32_t> flags;
  std::vector<std::vector<uint8_t>> bodies;
  auto server = startServer([&](wyre::FrameHeader& header, std::vector<uint8_t>& body) {
    std::lock_guard lock(mutex);
    ids.push_back(header.id);
    bodies.push_back(body);
    return Action::Reply;
  });
  ASSERT_TRUE(server);
  std::vector<uint8_t> body = requestBody();
  LoadResult result = runOk(countedRun(*server, 20), body);
  EXPECT_EQ(result.requests, 20u);
  std::lock_guard lock(mutex);
  ASSERT_EQ(ids.size(), 20u);
  for (size_t i = 1; i < ids.size(); ++i) EXPECT_GT(ids[i], ids[i - 1]);
  for (const auto& received : bodies) EXPECT_EQ(received, body);
}

std::vector<std::vector<uint8_t>> numberedBodies(int count) {
  std::vector<std::vector<uint8_t>> bodies;
  for (int i = 0; i < count; ++i) {
    bodies.push_back(cbor::encode(Value(Dictionary{{"request", "find"}, {"n", i}})));
  }
  return bodies;
}

TEST(LoadGeneratorTest, OneConnectionSendsSeveralRequestsInTurn) {
  std::mutex mutex;
  std::vector<std::vector<uint8_t>> received;
  auto server = startServer([&](wyre::FrameHeader&, std::vector<uint8_t>& body) {
    std::lock_guard lock(mutex);
    received.push_back(body);
    return Action::Reply;
  });
  ASSERT_TRUE(server);
  std::vector<std::vector<uint8_t>> bodies = numberedBodies(3);
  Result<LoadResult> result = runLoad(countedRun(*server, 7), bodies);
  ASSERT_TRUE(result.ok()) << result.error().message;
  EXPECT_EQ(result->requests, 7u);
  EXPECT_EQ(result->failures, 0u);
  std::lock_guard lock(mutex);
  ASSERT_EQ(received.size(), 7u);
  for (size_t i = 0; i < received.size(); ++i) EXPECT_EQ(received[i], bodies[i % 3]) << i;
}

TEST(LoadGeneratorTest, EachConnectionStartsAtItsOwnRequestAndWrapsAround) {
  // The echo server serves each connection on its own thread.
  std::mutex mutex;
  std::map<std::thread::id, std::vector<std::vector<uint8_t>>> byConnection;
  auto server = startServer([&](wyre::FrameHeader&, std::vector<uint8_t>& body) {
    std::lock_guard lock(mutex);
    byConnection[std::this_thread::get_id()].push_back(body);
    return Action::Reply;
  });
  ASSERT_TRUE(server);
  std::vector<std::vector<uint8_t>> bodies = numberedBodies(4);
  Result<LoadResult> result = runLoad(countedRun(*server, 200, 2), bodies);
  ASSERT_TRUE(result.ok()) << result.error().message;
  EXPECT_EQ(result->failures, 0u);
  std::lock_guard lock(mutex);
  std::set<size_t> firsts;
  for (const auto& [thread, sent] : byConnection) {
    auto first = std::find(bodies.begin(), bodies.end(), sent.front());
    ASSERT_NE(first, bodies.end());
    size_t start = static_cast<size_t>(first - bodies.begin());
    firsts.insert(start);
    for (size_t i = 0; i < sent.size(); ++i) EXPECT_EQ(sent[i], bodies[(start + i) % 4]) << i;
  }
  EXPECT_EQ(byConnection.size(), firsts.size()) << "two connections began with the same request";
  for (size_t start : firsts) EXPECT_TRUE(start == 0 || start == 2) << start;
}

TEST(LoadGeneratorTest, FirstRequestsSpreadOverTheList) {
  const std::vector<std::tuple<unsigned, unsigned, size_t, size_t>> cases = {
      {0, 1, 10, 0}, {0, 16, 10000, 0}, {1, 16, 10000, 625}, {15, 16, 10000, 9375}, {3, 4, 2, 1},
      {1, 4, 2, 0},  {2, 3, 1, 0},      {0, 0, 5, 0},        {5, 4, 8, 2},          {7, 8, 0, 0},
  };
  for (const auto& [connection, connections, requests, expected] : cases) {
    EXPECT_EQ(firstRequestOf(connection, connections, requests), expected)
        << connection << " of " << connections << ", " << requests << " requests";
  }
}

TEST(LoadGeneratorTest, NoRequestsIsAnError) {
  auto server = startServer();
  ASSERT_TRUE(server);
  std::vector<std::vector<uint8_t>> none;
  EXPECT_FALSE(runLoad(countedRun(*server, 1), none).ok());
}

TEST(LoadGeneratorTest, AnOversizedRequestAmongSeveralIsRefusedBeforeConnecting) {
  auto server = startServer();
  ASSERT_TRUE(server);
  std::vector<std::vector<uint8_t>> bodies = numberedBodies(2);
  bodies.emplace_back(wyre::kMaxBodySize + 1, 0);
  EXPECT_FALSE(runLoad(countedRun(*server, 1), bodies).ok());
  EXPECT_EQ(server->accepted(), 0u);
}

TEST(LoadGeneratorTest, EchoServerAnswersOnlyRequestsThatWantAReply) {
  // The echo server skips frames without the wants-reply flag: the generator never sends
  // them, so a reply to the first request proves the flag was set.
  auto server = startServer();
  ASSERT_TRUE(server);
  LoadResult result = runOk(countedRun(*server, 1));
  EXPECT_EQ(result.requests, 1u);
  EXPECT_EQ(result.failures, 0u);
}

TEST(LoadGeneratorTest, NonZeroErrorCodesAreErrorRepliesAndZeroIsNot) {
  const std::vector<std::pair<Value, bool>> cases = {
      {Value(Dictionary{{"errorcode", 4}, {"error", "invalid request format"}}), true},
      {Value(Dictionary{{"errorcode", 11}}), true},
      {Value(Dictionary{{"errorcode", -1}}), true},
      {Value(Dictionary{{"errorcode", uint64_t{0xFFFFFFFFFFFFFFF2ull}}}), true},
      {Value(Dictionary{{"errorcode", uint64_t{1} << 32}}), false},
      {Value(Dictionary{{"errorcode", 0}}), false},
      {Value(Dictionary{{"matches", Array{}}}), false},
      {Value(Array{}), false},
  };
  // Read from the error members alone, or from the whole reply built: the same verdicts.
  for (bool decodeReplies : {false, true}) {
    for (const auto& [reply, isError] : cases) {
      std::vector<uint8_t> encoded = cbor::encode(reply);
      auto server = startServer([&](wyre::FrameHeader&, std::vector<uint8_t>& body) {
        body = encoded;
        return Action::Reply;
      });
      ASSERT_TRUE(server);
      LoadOptions options = countedRun(*server, 5);
      options.decodeReplies = decodeReplies;
      LoadResult result = runOk(options);
      EXPECT_EQ(result.requests, 5u) << reply.description();
      EXPECT_EQ(result.failures, 0u) << reply.description();
      EXPECT_EQ(result.errorReplies, isError ? 5u : 0u) << reply.description();
      EXPECT_EQ(result.firstError.empty(), !isError) << reply.description();
    }
  }
}

TEST(LoadGeneratorTest, BadRepliesAreFailuresNotRequests) {
  using Mutation = std::function<void(wyre::FrameHeader&, std::vector<uint8_t>&)>;
  const std::vector<std::tuple<std::string, Mutation, std::string>> cases = {
      {"wrong id", [](wyre::FrameHeader& h, std::vector<uint8_t>&) { h.id += 1; },
       "reply carries id"},
      {"no reply flag", [](wyre::FrameHeader& h, std::vector<uint8_t>&) { h.flags = 0; },
       "answer without the reply flag"},
      {"undecodable CBOR", [](wyre::FrameHeader&, std::vector<uint8_t>& b) { b = {0xff}; },
       "undecodable reply"},
      {"trailing bytes", [](wyre::FrameHeader&, std::vector<uint8_t>& b) { b.push_back(0); },
       "undecodable reply"},
      {"empty body", [](wyre::FrameHeader&, std::vector<uint8_t>& b) { b.clear(); },
       "undecodable reply"},
      // {"matches": ["\xff"]}: bad deep inside a member that only the whole decode builds.
      {"text that is not UTF-8 in a large member",
       [](wyre::FrameHeader&, std::vector<uint8_t>& b) {
         b = {0xa1, 0x67, 'm', 'a', 't', 'c', 'h', 'e', 's', 0x81, 0x61, 0xff};
       },
       "undecodable reply"},
  };
  for (bool decodeReplies : {false, true}) {
    for (const auto& [name, mutate, reason] : cases) {
      auto server = startServer([&](wyre::FrameHeader& header, std::vector<uint8_t>& body) {
        mutate(header, body);
        return Action::Reply;
      });
      ASSERT_TRUE(server);
      LoadOptions options = countedRun(*server, 4);
      options.decodeReplies = decodeReplies;
      LoadResult result = runOk(options);
      EXPECT_EQ(result.requests, 0u) << name;
      EXPECT_EQ(result.failures, 4u) << name;
      EXPECT_TRUE(result.latenciesNs.empty()) << name;
      EXPECT_EQ(result.firstFailure.rfind(reason, 0), 0u) << name << ": " << result.firstFailure;
      // Every failure drops the connection, which may be out of step, and opens a new one.
      EXPECT_EQ(server->accepted(), 4u) << name;
    }
  }
}

TEST(LoadGeneratorTest, ServerClosingTheConnectionIsAFailure) {
  auto server =
      startServer([](wyre::FrameHeader&, std::vector<uint8_t>&) { return Action::Close; });
  ASSERT_TRUE(server);
  LoadResult result = runOk(countedRun(*server, 3));
  EXPECT_EQ(result.requests, 0u);
  EXPECT_EQ(result.failures, 3u);
  EXPECT_EQ(result.firstFailure, "connection closed by the peer");
}

TEST(LoadGeneratorTest, SilentServerTimesOutAsAFailure) {
  auto server =
      startServer([](wyre::FrameHeader&, std::vector<uint8_t>&) { return Action::Silent; });
  ASSERT_TRUE(server);
  LoadOptions options = countedRun(*server, 2);
  options.replyTimeout = std::chrono::milliseconds(50);
  LoadResult result = runOk(options);
  EXPECT_EQ(result.requests, 0u);
  EXPECT_EQ(result.failures, 2u);
  EXPECT_EQ(result.firstFailure, "no reply in time");
}

class FrameReaderTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, fds_), 0); }
  void TearDown() override {
    for (int fd : fds_) ::close(fd);
  }
  void send(const std::vector<uint8_t>& bytes) {
    ASSERT_TRUE(writeAll(fds_[1], bytes.data(), bytes.size()));
  }
  static std::vector<uint8_t> frame(uint64_t id, std::vector<uint8_t> body) {
    std::vector<uint8_t> out(wyre::kHeaderSize);
    wyre::encodeHeader({static_cast<uint32_t>(body.size()), wyre::kFlagReply, id}, out.data());
    out.insert(out.end(), body.begin(), body.end());
    return out;
  }
  int reading() const { return fds_[0]; }
  int fds_[2] = {-1, -1};
};

TEST_F(FrameReaderTest, ReadsTwoFramesArrivingInOneWrite) {
  std::vector<uint8_t> bytes = frame(1, {0x01, 0x02});
  std::vector<uint8_t> second = frame(2, {0x03});
  bytes.insert(bytes.end(), second.begin(), second.end());
  send(bytes);
  FrameReader reader;
  wyre::FrameHeader header;
  std::span<const uint8_t> body;
  ASSERT_EQ(reader.next(reading(), header, body), FrameReader::Status::Frame);
  EXPECT_EQ(header.id, 1u);
  EXPECT_EQ(header.flags, wyre::kFlagReply);
  EXPECT_EQ(std::vector<uint8_t>(body.begin(), body.end()), (std::vector<uint8_t>{1, 2}));
  ASSERT_EQ(reader.next(reading(), header, body), FrameReader::Status::Frame);
  EXPECT_EQ(header.id, 2u);
  EXPECT_EQ(std::vector<uint8_t>(body.begin(), body.end()), (std::vector<uint8_t>{3}));
}

TEST_F(FrameReaderTest, ReassemblesAFrameSplitAcrossWrites) {
  for (FrameReader::Wait wait : {FrameReader::Wait::InRecv, FrameReader::Wait::ForReadiness}) {
    std::vector<uint8_t> body(200000, 0x5a);
    std::vector<uint8_t> bytes = frame(7, body);
    std::thread writer([&] {
      for (size_t at = 0; at < bytes.size(); at += 1000) {
        size_t n = std::min<size_t>(1000, bytes.size() - at);
        ASSERT_TRUE(writeAll(fds_[1], bytes.data() + at, n));
      }
    });
    FrameReader reader(wait);
    wyre::FrameHeader header;
    std::span<const uint8_t> received;
    ASSERT_EQ(reader.next(reading(), header, received), FrameReader::Status::Frame);
    writer.join();
    EXPECT_EQ(header.id, 7u);
    EXPECT_EQ(std::vector<uint8_t>(received.begin(), received.end()), body);
    EXPECT_EQ(reader.buffered(), 0u);
  }
}

TEST_F(FrameReaderTest, RefusesAHeaderAnnouncingMoreThanAFrameMayCarry) {
  std::vector<uint8_t> header(wyre::kHeaderSize);
  wyre::encodeHeader({wyre::kMaxBodySize + 1, wyre::kFlagReply, 1}, header.data());
  send(header);
  FrameReader reader;
  wyre::FrameHeader decoded;
  std::span<const uint8_t> body;
  EXPECT_EQ(reader.next(reading(), decoded, body), FrameReader::Status::TooLarge);
}

TEST_F(FrameReaderTest, PeerClosingMidFrameIsClosed) {
  std::vector<uint8_t> bytes = frame(1, {1, 2, 3, 4});
  bytes.erase(bytes.end() - 2, bytes.end());  // the body stops short
  send(bytes);
  ::shutdown(fds_[1], SHUT_WR);
  FrameReader reader;
  wyre::FrameHeader header;
  std::span<const uint8_t> body;
  EXPECT_EQ(reader.next(reading(), header, body), FrameReader::Status::Closed);
}

TEST_F(FrameReaderTest, SilentPeerTimesOut) {
  ASSERT_TRUE(setIoTimeout(reading(), std::chrono::milliseconds(20)));
  FrameReader reader;
  wyre::FrameHeader header;
  std::span<const uint8_t> body;
  EXPECT_EQ(reader.next(reading(), header, body), FrameReader::Status::TimedOut);
  // Waiting for readiness, the deadline bounds the wait by itself.
  FrameReader waiting(FrameReader::Wait::ForReadiness);
  ASSERT_TRUE(setIoTimeout(reading(), std::chrono::hours(1)));
  EXPECT_EQ(waiting.next(reading(), header, body,
                         std::chrono::steady_clock::now() + std::chrono::milliseconds(20)),
            FrameReader::Status::TimedOut);
}

TEST(LoadGeneratorTest, WarmupRequestsAreNotCounted) {
  std::atomic<uint64_t> seen{0};
  auto server = startServer([&](wyre::FrameHeader&, std::vector<uint8_t>&) {
    seen.fetch_add(1);
    return Action::Reply;
  });
  ASSERT_TRUE(server);
  LoadOptions options = countedRun(*server, 10);
  options.warmup = Seconds(0.05);
  LoadResult result = runOk(options);
  EXPECT_EQ(result.requests, 10u);
  EXPECT_GT(seen.load(), 10u);
}

TEST(LoadGeneratorTest, MissingSocketIsAnError) {
  LoadOptions options;
  options.socketPath = "/nonexistent/ekbench-test.sock";
  options.duration = Seconds(0.1);
  Result<LoadResult> result = runLoad(options, requestBody());
  ASSERT_FALSE(result.ok());
  EXPECT_TRUE(result.error().isPosix(ENOENT)) << result.error().message;
}

TEST(LoadGeneratorTest, ZeroConnectionsIsAnError) {
  auto server = startServer();
  ASSERT_TRUE(server);
  LoadOptions options = countedRun(*server, 1, 0);
  EXPECT_FALSE(runLoad(options, requestBody()).ok());
}

}  // namespace
}  // namespace ek::bench
