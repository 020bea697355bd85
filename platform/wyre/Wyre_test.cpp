#include "platform/wyre/Wyre.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/cbor/Cbor.h"
#include "platform/testing/Files.h"

namespace ek::wyre {
namespace {

TEST(WyreFrame, HeaderIsBigEndianAndCountsTheBody) {
  std::vector<uint8_t> out{0xEE};
  appendFrame(out, Value(Dictionary{{"a", 1}}), kFlagWantsReply, 0x0A0B0C0D0E0F1011ULL);
  const std::vector<uint8_t> header(out.begin() + 1, out.begin() + 1 + kHeaderSize);
  EXPECT_EQ(header, (std::vector<uint8_t>{0, 0, 0, 4, 0, 0, 0, 1, 10, 11, 12, 13, 14, 15, 16, 17}));
  FrameHeader back = decodeHeader(header.data());
  EXPECT_EQ(back.length, out.size() - 1 - kHeaderSize);
  EXPECT_EQ(back.flags, kFlagWantsReply);
  EXPECT_EQ(back.id, 0x0A0B0C0D0E0F1011ULL);
}

TEST(WyreServiceName, OnlyPlainFileNamesAreServiceNames) {
  EXPECT_TRUE(isValidServiceName("com.corvane.ekora.ekd"));
  for (std::string bad : std::vector<std::string>{"", ".", "..", "a/b", ".hidden", "a b", "a\nb",
                                                  std::string(200, 'a')}) {
    EXPECT_FALSE(isValidServiceName(bad)) << bad;
  }
}

// A service "echo" that answers each request with the pid that wrote it.
class WyreLoopback : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("EKORA_RUNTIME_DIR", dir_.path().c_str(), 1);
    auto listener = Listener::create("echo", queue_);
    ASSERT_TRUE(listener.ok()) << listener.error().message;
    listener_ = listener.value();
    listener_->setEventHandler([](const ListenerEvent& event) {
      if (!event.connection) return;
      std::weak_ptr<Connection> weak = event.connection;
      event.connection->setEventHandler([weak](const Event& e) {
        auto self = weak.lock();
        if (self && e.type == EventType::Message) {
          self->reply(e.message, Value(Dictionary{{"pid", uint64_t(e.message.sender.pid)}}));
        }
      });
      event.connection->resume();
    });
    listener_->resume();
  }
  void TearDown() override { listener_->cancel(); }

  ek::testing::TempDir dir_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::make("wyre-test");
  std::shared_ptr<Listener> listener_;
};

TEST_F(WyreLoopback, ServiceHasOneListenerAndOnlyItsOwnerMayConnect) {
  EXPECT_EQ(Listener::create("echo", queue_).error().code, EADDRINUSE);
  EXPECT_EQ(Connection::connect("nobody-listens").error().code, ENOENT);
  struct stat st {};
  ASSERT_EQ(::stat(listener_->path().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

// The pid the service saw as the writer of the reply's request; absent when the connection
// closed instead.
std::optional<pid_t> replyPid(int fd) {
  const timeval timeout{10, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  std::vector<uint8_t> bytes;
  uint8_t buffer[4096];
  for (ssize_t n; (n = ::read(fd, buffer, sizeof buffer)) > 0;) {
    bytes.insert(bytes.end(), buffer, buffer + n);
    if (bytes.size() < kHeaderSize) continue;
    FrameHeader header = decodeHeader(bytes.data());
    if (bytes.size() < kHeaderSize + header.length) continue;
    auto body = cbor::decode(std::span(bytes).subspan(kHeaderSize, header.length));
    if (!body.ok() || !body->getUnsigned("pid")) return std::nullopt;
    return static_cast<pid_t>(*body->getUnsigned("pid"));
  }
  return std::nullopt;
}

void writeAll(int fd, std::span<const uint8_t> bytes) {
  for (ssize_t n = 0; !bytes.empty(); bytes = bytes.subspan(n)) {
    if ((n = ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL)) <= 0) return;
  }
}

// Runs write in a child process and answers its pid.
pid_t writeFromChild(const std::function<void()>& write) {
  pid_t child = fork();
  if (child == 0) {
    write();
    _exit(0);
  }
  waitpid(child, nullptr, 0);
  return child;
}

// Frames written on a socket by hand: each message carries the process that wrote it; a frame
// two processes wrote, or one longer than the limit, closes the connection.
TEST_F(WyreLoopback, FramesAreTakenFromTheProcessThatWroteThemWhole) {
  std::vector<uint8_t> frame;
  appendFrame(frame, Value(Dictionary{}), kFlagWantsReply, 1);
  const auto half = std::span(frame).first(frame.size() / 2);
  const auto rest = std::span(frame).subspan(half.size());
  const struct {
    const char* name;
    std::function<pid_t(int fd)> write;  // answers the writer expected, 0 for a closed connection
  } rows[] = {
      {"by the connecting process", [&](int fd) { return writeAll(fd, frame), getpid(); }},
      {"by a child that kept the socket",
       [&](int fd) { return writeFromChild([&] { writeAll(fd, frame); }); }},
      {"begun by one process and ended by another",
       [&](int fd) {
         writeAll(fd, half);
         writeFromChild([&] { writeAll(fd, rest); });
         return 0;
       }},
      {"longer than the body limit",
       [&](int fd) {
         std::vector<uint8_t> big;
         appendFrame(big, Value(Dictionary{{"pad", Data(kMaxBodySize)}}), kFlagWantsReply, 2);
         writeAll(fd, big);
         return 0;
       }},
  };
  for (const auto& row : rows) {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{.sun_family = AF_UNIX};
    listener_->path().copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    const pid_t expected = row.write(fd);
    EXPECT_EQ(replyPid(fd), expected ? std::optional(expected) : std::nullopt) << row.name;
    ::close(fd);
  }
}

}  // namespace
}  // namespace ek::wyre
