#include "Ekora/EkDaemonClient.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <future>

namespace ek {
namespace {

TEST(EkDaemonClient, ErrorInReplyFollowsTheProtocol) {
  const std::pair<Dictionary, std::optional<EkError>> rows[] = {
      {{}, std::nullopt},
      {{{"errorcode", 0}}, std::nullopt},
      {{{"error", "stray"}}, std::nullopt},
      {{{"errorcode", 15}, {"error", "Cannot locate PlugIn"}},
       EkError::ekora(15, "Cannot locate PlugIn")},
      {{{"errorcode", 11}}, EkError::ekora(11, "unknown error returned by Ekora subsystem")},
      {{{"errorcode", uint64_t{0xFFFFFFFFFFFFFFFFULL}}, {"error", "x"}}, EkError::ekora(-1, "x")},
  };
  for (const auto& [reply, expected] : rows) {
    EXPECT_EQ(EkDaemonClient::errorInReply(Value(reply)), expected) << Value(reply).description();
  }
  EXPECT_EQ(EkDaemonClient::errorInReply(EkError{"Wyre", 1, "Connection invalid"}),
            EkError::ekora(4, "Connection invalid"));
}

TEST(EkDaemonClient, RequestsWithoutADaemonFailOnTheReplyQueue) {
  setenv("EKORA_RUNTIME_DIR", "/nonexistent/ekora-client-test", 1);
  auto client = EkDaemonClient::initWithServiceName("com.corvane.ekora.unit");
  EXPECT_EQ(Value(client->request("find")), Value(Dictionary{{"request", "find"}, {"version", 3}}));
  std::promise<std::pair<bool, bool>> result;
  client->releaseHold(Uuid::random(), [&](Result<Value> reply) {
    result.set_value({reply.ok(), client->replyQueue()->isCurrent()});
  });
  EXPECT_EQ(result.get_future().get(), std::pair(false, true));
}

}  // namespace
}  // namespace ek
