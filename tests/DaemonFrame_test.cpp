// The request frame, end to end through a real ekd.
#include <gtest/gtest.h>

#include <future>

#include "Ekora/EkDaemonClient.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

class DaemonFrame : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    daemon_ = new EkdProcess();
    ASSERT_TRUE(daemon_->start()) << daemon_->log();
  }
  static void TearDownTestSuite() {
    EXPECT_EQ(daemon_->terminate(), 0) << daemon_->log();
    delete daemon_;
  }

  // Sends one request and answers the reply dictionary.
  static Value ask(const Value& body) {
    RawClient client(daemon_->socketPath());
    EXPECT_TRUE(client.connected());
    EXPECT_TRUE(client.sendMessage(body, 77));
    auto frame = client.readFrame();
    if (!frame) {
      ADD_FAILURE() << "no reply to " << body.description();
      return Value();
    }
    EXPECT_EQ(frame->id, 77u);
    EXPECT_TRUE(frame->flags & 2u);
    return frame->body;
  }

  static void expectError(const Value& reply, uint64_t code, const std::string& message) {
    ASSERT_NE(reply.getUnsigned("errorcode"), nullptr) << reply.description();
    EXPECT_EQ(*reply.getUnsigned("errorcode"), code);
    ASSERT_NE(reply.getString("error"), nullptr);
    EXPECT_EQ(*reply.getString("error"), message);
  }

  static EkdProcess* daemon_;
};

EkdProcess* DaemonFrame::daemon_ = nullptr;

TEST_F(DaemonFrame, MissingVersionIsAVersionMismatch) {
  expectError(ask(Value(Dictionary{{"request", "find"}})), 7,
              "unsupported protocol version 0 (current 3)");
}

TEST_F(DaemonFrame, UnsupportedVersionsAreRefusedBeforeAnythingElse) {
  expectError(ask(Value(Dictionary{{"request", "nonsense"}, {"version", 4}})), 7,
              "unsupported protocol version 4 (current 3)");
  expectError(ask(Value(Dictionary{{"version", 1}})), 7,
              "unsupported protocol version 1 (current 3)");
  // A version of the wrong type reads as missing.
  expectError(ask(Value(Dictionary{{"request", "find"}, {"version", "3"}})), 7,
              "unsupported protocol version 0 (current 3)");
}

TEST_F(DaemonFrame, MissingTypeIsReported) {
  expectError(ask(Value(Dictionary{{"version", 3}})), 4, "invalid request format (missing type)");
  expectError(ask(Value(Dictionary{{"version", 2}, {"request", 5}})), 4,
              "invalid request format (missing type)");
}

TEST_F(DaemonFrame, RequestTypesAreCaseSensitive) {
  expectError(ask(request("Add")), 4, "unrecognized request");
  expectError(ask(request("")), 4, "unrecognized request");
}

TEST_F(DaemonFrame, VersionTwoIsServedLikeThree) {
  Value v2(Dictionary{{"request", "Nope"}, {"version", 2}});
  expectError(ask(v2), 4, "unrecognized request");
}

TEST_F(DaemonFrame, EveryKnownRequestTypeGetsExactlyOneReply) {
  RawClient client(daemon_->socketPath());
  const char* types[] = {"add",    "remove",   "bulk", "match", "ready",
                         "access", "annotate", "find", "lock",  "bulk-annotate"};
  uint64_t id = 1;
  for (const char* type : types) ASSERT_TRUE(client.sendMessage(request(type), id++));
  for (uint64_t expected = 1; expected < id; ++expected) {
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << "missing reply " << expected;
    EXPECT_EQ(frame->id, expected);
    EXPECT_TRUE(frame->body.dictionary());
  }
  EXPECT_FALSE(client.readFrame(std::chrono::milliseconds(200)));
}

TEST_F(DaemonFrame, RepliesKeepTheOrderOfRequestsFromManyClients) {
  constexpr int kClients = 8, kRequests = 200;
  std::vector<std::future<int>> results;
  for (int c = 0; c < kClients; ++c) {
    results.push_back(std::async(std::launch::async, [] {
      RawClient client(daemon_->socketPath());
      for (int i = 1; i <= kRequests; ++i) {
        if (!client.sendMessage(request("Nope"), static_cast<uint64_t>(i))) return -1;
      }
      for (int i = 1; i <= kRequests; ++i) {
        auto frame = client.readFrame();
        if (!frame || frame->id != static_cast<uint64_t>(i)) return i;
      }
      return 0;
    }));
  }
  for (auto& r : results) EXPECT_EQ(r.get(), 0);
}

TEST_F(DaemonFrame, MessageThatWantsNoReplyGetsNone) {
  RawClient client(daemon_->socketPath());
  ASSERT_TRUE(client.sendMessage(request("find"), 5, /*wantsReply=*/false));
  ASSERT_TRUE(client.sendMessage(request("Nope"), 6));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame);
  EXPECT_EQ(frame->id, 6u);
}

TEST_F(DaemonFrame, ClientLibraryDecodesErrorReplies) {
  daemon_->exportEnvironment();
  auto client = EkDaemonClient::initWithServiceName(daemon_->service());
  std::promise<Result<Value>> replied;
  Dictionary message = client->request("Nope");
  client->send(message, [&](Result<Value> reply) { replied.set_value(std::move(reply)); });
  auto reply = replied.get_future().get();
  ASSERT_TRUE(reply.ok());
  auto error = EkDaemonClient::errorInReply(reply);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "Ekora");
  EXPECT_EQ(error->code, 4);
  EXPECT_EQ(error->message, "unrecognized request");
}

TEST_F(DaemonFrame, ClientLibraryReportsAMissingDaemonAsTransportError) {
  daemon_->exportEnvironment();
  auto client = EkDaemonClient::initWithServiceName("com.corvane.ekora.nobody");
  std::promise<Result<Value>> replied;
  client->bulkPlugins(0, [&](Result<Value> reply) { replied.set_value(std::move(reply)); });
  auto reply = replied.get_future().get();
  ASSERT_FALSE(reply.ok());
  auto error = EkDaemonClient::errorInReply(reply);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, 4);
  EXPECT_FALSE(error->message.empty());
}

}  // namespace
}  // namespace ek::test
