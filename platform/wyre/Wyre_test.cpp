#include "platform/wyre/Wyre.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <functional>
#include <future>
#include <optional>

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
        if (e.message.body.get("who")) {
          self->reply(e.message,
                      Value(Dictionary{{"pid", static_cast<uint64_t>(e.message.sender.pid)}}));
        } else if (e.message.body.get("encoded")) {
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

// A socket connected to the listener by hand, so that other processes can write on it.
int rawConnect(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Runs write in a child process and waits for it.
void writeFromChild(const std::function<void()>& write) {
  pid_t child = fork();
  if (child == 0) {
    write();
    _exit(0);
  }
  waitpid(child, nullptr, 0);
}

// The pid the listener saw as the writer of the reply's request; absent when the connection
// closed instead.
std::optional<pid_t> replyPid(int fd) {
  timeval timeout{10, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  std::vector<uint8_t> bytes;
  uint8_t buffer[4096];
  while (true) {
    if (bytes.size() >= kHeaderSize) {
      FrameHeader header = decodeHeader(bytes.data());
      if (bytes.size() >= kHeaderSize + header.length) {
        auto body = cbor::decode(std::span(bytes).subspan(kHeaderSize, header.length));
        if (!body || !body->getUnsigned("pid")) return std::nullopt;
        return static_cast<pid_t>(*body->getUnsigned("pid"));
      }
    }
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n <= 0) return std::nullopt;
    bytes.insert(bytes.end(), buffer, buffer + n);
  }
}

// Every message carries the process that wrote it, whichever process connected; a frame two
// processes wrote closes the connection.
TEST_F(WyreLoopback, MessagesCarryTheProcessThatWroteThem) {
  std::vector<uint8_t> frame;
  appendFrame(frame, Value(Dictionary{{"who", true}}), kFlagWantsReply, 1);
  const size_t half = frame.size() / 2;
  struct Case {
    const char* name;
    std::function<pid_t(int fd)> write;  // answers the writer expected, 0 for a closed connection
  };
  std::vector<Case> cases{
      {"the connecting process",
       [&](int fd) {
         EXPECT_EQ(::write(fd, frame.data(), frame.size()), ssize_t(frame.size()));
         return getpid();
       }},
      {"a child that kept the socket",
       [&](int fd) {
         pid_t writer = 0;
         int pipeFds[2];
         EXPECT_EQ(pipe(pipeFds), 0);
         writeFromChild([&] {
           pid_t self = getpid();
           (void)!::write(pipeFds[1], &self, sizeof self);
           (void)!::write(fd, frame.data(), frame.size());
         });
         EXPECT_EQ(::read(pipeFds[0], &writer, sizeof writer), ssize_t(sizeof writer));
         ::close(pipeFds[0]);
         ::close(pipeFds[1]);
         return writer;
       }},
      {"a frame begun by one process and ended by another",
       [&](int fd) {
         EXPECT_EQ(::write(fd, frame.data(), half), ssize_t(half));
         writeFromChild([&] { (void)!::write(fd, frame.data() + half, frame.size() - half); });
         return pid_t{0};
       }},
  };
  for (const Case& c : cases) {
    int fd = rawConnect(listener_->path());
    ASSERT_GE(fd, 0) << c.name;
    pid_t expected = c.write(fd);
    std::optional<pid_t> seen = replyPid(fd);
    if (expected == 0) {
      EXPECT_FALSE(seen) << c.name;
    } else {
      EXPECT_EQ(seen, expected) << c.name;
    }
    ::close(fd);
  }
}

TEST_F(WyreLoopback, SocketIsForItsOwnerOnly) {
  struct stat st {};
  ASSERT_EQ(::stat(listener_->path().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

}  // namespace
}  // namespace ek::wyre
