#include "Ekora/EkDaemonClient.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <future>

#include "Ekora/EkProtocol.h"

namespace ek {
namespace {

class EkDaemonClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("EKORA_RUNTIME_DIR", "/nonexistent/ekora-client-test", 1);
    client_ = EkDaemonClient::initWithServiceName("com.corvane.ekora.unit");
  }
  std::shared_ptr<EkDaemonClient> client_;
};

const Uuid kA = *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
const Uuid kB = *Uuid::parse("0A4B5C6D-0000-4000-8000-000000000001");

TEST_F(EkDaemonClientTest, RequestsCarryTypeAndVersion) {
  Dictionary message = client_->request("find");
  EXPECT_EQ(Value(message), Value(Dictionary{{"request", "find"}, {"version", 3}}));
  client_->setProtocolVersion(2);
  EXPECT_EQ(*Value(client_->request("add", {"/a", "/b"})).getUnsigned("version"), 2u);
  EXPECT_EQ(*Value(client_->request("add", {"/a", "/b"})).getArray("paths"), (Array{"/a", "/b"}));
}

TEST_F(EkDaemonClientTest, PlugInListsBuildParallelArrays) {
  Dictionary message;
  EkDaemonClient::set(message, {{kA, "/Apps/A.app/PlugIns/A.appex"}, {kB, std::nullopt}});
  Value v(message);
  EXPECT_EQ(*v.getArray("uuids"), (Array{kA, kB}));
  // An entry without a path carries a non-string, which gives it no fallback.
  EXPECT_EQ(*v.getArray("paths"), (Array{"/Apps/A.app/PlugIns/A.appex", false}));

  Dictionary empty;
  EkDaemonClient::set(empty, std::vector<EkDaemonClient::PlugInRef>{});
  EXPECT_EQ(Value(empty), Value(Dictionary{{"paths", Array{}}, {"uuids", Array{}}}));
}

TEST_F(EkDaemonClientTest, ErrorInReplyFollowsTheProtocol) {
  struct Case {
    const char* name;
    Dictionary reply;
    std::optional<EkError> expected;
  };
  const Case cases[] = {
      {"success", {}, std::nullopt},
      {"explicit zero", {{"errorcode", 0}}, std::nullopt},
      {"code and text",
       {{"errorcode", 15}, {"error", "Cannot locate PlugIn"}},
       EkError::ekora(15, "Cannot locate PlugIn")},
      {"code without text",
       {{"errorcode", 11}},
       EkError::ekora(11, "unknown error returned by Ekora subsystem")},
      {"negative code widened",
       {{"errorcode", uint64_t{0xFFFFFFFFFFFFFFFFULL}}, {"error", "x"}},
       EkError::ekora(-1, "x")},
      {"text without code", {{"error", "stray"}}, std::nullopt},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(EkDaemonClient::errorInReply(Value(c.reply)), c.expected);
  }
  auto transport = EkDaemonClient::errorInReply(EkError{"Wyre", 1, "Connection invalid"});
  ASSERT_TRUE(transport);
  EXPECT_EQ(*transport, EkError::ekora(4, "Connection invalid"));
}

TEST_F(EkDaemonClientTest, ConversionIsDefinedForVersionThreeOnly) {
  Value forms(Array{Value(Dictionary{{"identifier", "com.example.a"}})});
  EXPECT_EQ(EkDaemonClient::convertToWyre(forms, 3), forms);
  EXPECT_FALSE(EkDaemonClient::convertToWyre(forms, 2));
  EXPECT_EQ(client_->convertFromWyre(forms), forms);
  client_->setProtocolVersion(2);
  EXPECT_FALSE(client_->convertFromWyre(forms));
}

TEST_F(EkDaemonClientTest, RequestsWithoutADaemonFailOnTheReplyQueue) {
  std::promise<std::pair<bool, bool>> result;
  client_->releaseHold(kA, [&](Result<Value> reply) {
    result.set_value({reply.ok(), client_->replyQueue()->isCurrent()});
  });
  auto [ok, onReplyQueue] = result.get_future().get();
  EXPECT_FALSE(ok);
  EXPECT_TRUE(onReplyQueue);
  EXPECT_EQ(client_->replyQueue()->label(), "ekd_client");
}

}  // namespace
}  // namespace ek
