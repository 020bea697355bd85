#include "platform/wyre/Wyre.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <future>

#include "platform/cbor/Cbor.h"

namespace ek::wyre {
namespace {

TEST(WyreFrame, HeaderIsBigEndian) {
  uint8_t bytes[kHeaderSize];
  encodeHeader({0x01020304, 0x3, 0x0A0B0C0D0E0F1011ULL}, bytes);
  const uint8_t expected[kHeaderSize] = {1,    2,    3,    4,    0,    0,    0,    3,
                                         0x0A, 0x0B, 0x0C, 0x0D, 0x0E, 0x0F, 0x10, 0x11};
  EXPECT_EQ(0, std::memcmp(bytes, expected, kHeaderSize));
  FrameHeader back = decodeHeader(bytes);
  EXPECT_EQ(back.length, 0x01020304u);
  EXPECT_EQ(back.flags, 3u);
  EXPECT_EQ(back.id, 0x0A0B0C0D0E0F1011ULL);
}

TEST(WyreFrame, AppendFrameCountsTheBody) {
  std::vector<uint8_t> out{0xEE};
  appendFrame(out, Value(Dictionary{{"a", 1}}), kFlagWantsReply, 9);
  FrameHeader header = decodeHeader(out.data() + 1);
  EXPECT_EQ(header.length, out.size() - 1 - kHeaderSize);
  EXPECT_EQ(header.flags, kFlagWantsReply);
  EXPECT_EQ(header.id, 9u);
}

TEST(WyreServiceName, OnlyPlainFileNamesAreServiceNames) {
  EXPECT_TRUE(isValidServiceName("com.corvane.ekora.ekd"));
  EXPECT_TRUE(isValidServiceName("a-b_c.1"));
  for (const char* bad : {"", ".", "..", "../x", "a/b", ".hidden", "a b", "a\nb"}) {
    EXPECT_FALSE(isValidServiceName(bad)) << bad;
  }
  EXPECT_FALSE(isValidServiceName(std::string(200, 'a')));
}

class WyreLoopback : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/wyre-test-XXXXXX";
    ASSERT_TRUE(mkdtemp(pattern));
    dir_ = pattern;
    setenv("EKORA_RUNTIME_DIR", dir_.c_str(), 1);
    queue_ = SerialQueue::make("wyre-test");
    auto listener = Listener::create("echo", queue_);
    ASSERT_TRUE(listener.ok()) << listener.error().message;
    listener_ = listener.value();
    // Echoes every request's body back as its reply.
    listener_->setEventHandler([invalidated_ = invalidated_](const ListenerEvent& event) {
      if (!event.connection) return;
      auto connection = event.connection;
      std::weak_ptr<Connection> weak = connection;
      // Server-side connections may outlive the fixture: capture nothing of it.
      connection->setEventHandler([invalidated = invalidated_, weak](const Event& e) {
        auto self = weak.lock();
        if (e.isConnectionInvalid()) {
          ++*invalidated;
          return;
        }
        if (!self || e.type != EventType::Message) return;
        if (e.message.body.get("encoded")) {
          std::vector<uint8_t> frame(kHeaderSize);
          cbor::encode(e.message.body, frame);
          self->replyEncoded(e.message, std::move(frame));
        } else {
          self->reply(e.message, e.message.body);
        }
      });
      connection->resume();
    });
    listener_->resume();
  }
  void TearDown() override {
    listener_->cancel();
    std::filesystem::remove_all(dir_);
  }

  std::string dir_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Listener> listener_;
  std::shared_ptr<std::atomic<int>> invalidated_ = std::make_shared<std::atomic<int>>(0);
};

TEST_F(WyreLoopback, RepliesReachTheirHandlersInOrder) {
  auto connection = Connection::connect("echo");
  ASSERT_TRUE(connection.ok()) << connection.error().message;
  auto c = connection.value();
  c->resume();
  std::vector<std::promise<Value>> replies(50);
  for (int i = 0; i < 50; ++i) {
    c->sendWithReply(Value(Dictionary{{"n", i}}), [&replies, i](Result<Value> reply) {
      replies[i].set_value(reply.ok() ? reply.value() : Value("error"));
    });
  }
  for (int i = 0; i < 50; ++i) {
    EXPECT_EQ(replies[i].get_future().get(), Value(Dictionary{{"n", i}}));
  }
  EXPECT_EQ(c->auditToken().pid, getpid());
}

TEST_F(WyreLoopback, RepliesEncodedByTheirSenderArriveAsOthersDo) {
  auto connection = Connection::connect("echo");
  ASSERT_TRUE(connection.ok()) << connection.error().message;
  auto c = connection.value();
  c->resume();
  std::vector<std::promise<Value>> replies(20);
  for (int i = 0; i < 20; ++i) {
    Dictionary body{{"n", i}};
    if (i % 2 == 0) body["encoded"] = Value(std::string(i * 1000, 'e'));
    c->sendWithReply(Value(std::move(body)), [&replies, i](Result<Value> reply) {
      replies[i].set_value(reply.ok() ? reply.value() : Value("error"));
    });
  }
  for (int i = 0; i < 20; ++i) {
    Value reply = replies[i].get_future().get();
    EXPECT_EQ(reply.getUnsigned("n") ? *reply.getUnsigned("n") : 99u, static_cast<uint64_t>(i));
    EXPECT_EQ(reply.get("encoded") != nullptr, i % 2 == 0);
  }
}

TEST_F(WyreLoopback, PendingRepliesReceiveConnectionInvalidWhenTheConnectionEnds) {
  auto connection = Connection::connect("echo");
  ASSERT_TRUE(connection.ok());
  auto c = connection.value();
  c->cancel();
  std::promise<EkError> failed;
  c->sendWithReply(Value(Dictionary{}), [&](Result<Value> reply) {
    failed.set_value(reply.ok() ? EkError{} : reply.error());
  });
  EkError error = failed.get_future().get();
  EXPECT_EQ(error.domain, kErrorDomain);
  EXPECT_EQ(error.code, kConnectionInvalid);
}

TEST_F(WyreLoopback, SecondListenerOnALiveServiceIsRefused) {
  auto second = Listener::create("echo", queue_);
  ASSERT_FALSE(second.ok());
  EXPECT_EQ(second.error().code, EADDRINUSE);
}

TEST_F(WyreLoopback, ConnectingToAnAbsentServiceFails) {
  auto connection = Connection::connect("nobody-listens");
  ASSERT_FALSE(connection.ok());
  EXPECT_EQ(connection.error().code, ENOENT);
}

}  // namespace
}  // namespace ek::wyre
