#include "platform/wyre/Wyre.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "platform/cbor/Cbor.h"
#include "platform/testing/Files.h"

namespace ek::wyre {
namespace {

// The pid the service saw as the writer of the reply's request; absent when the connection
// closed instead, -1 when neither came in time.
std::optional<pid_t> replyPid(int fd) {
  const timeval timeout{10, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  std::vector<uint8_t> bytes(kHeaderSize);
  const ssize_t n = ::recv(fd, bytes.data(), kHeaderSize, MSG_WAITALL);
  if (n < 0 && errno == EAGAIN) return -1;
  if (n != ssize_t(kHeaderSize)) return std::nullopt;
  bytes.resize(kHeaderSize + decodeHeader(bytes.data()).length);
  ::recv(fd, bytes.data() + kHeaderSize, bytes.size() - kHeaderSize, MSG_WAITALL);
  const Value reply = cbor::decode(std::span(bytes).subspan(kHeaderSize)).value();
  const uint64_t* pid = reply.getUnsigned("pid");
  return pid ? std::optional(pid_t(*pid)) : std::nullopt;
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

// Frames written by hand to a service that answers each request with the pid that wrote it:
// a message carries its writer; a frame two processes wrote, or one over the limit, closes the
// connection.
TEST(WyreFrame, FramesAreTakenWholeFromTheProcessThatWroteThem) {
  ek::testing::TempDir dir;
  setenv("EKORA_RUNTIME_DIR", dir.path().c_str(), 1);
  auto listener = Listener::create("echo", SerialQueue::make("wyre-test")).value();
  listener->setEventHandler([](const ListenerEvent& event) {
    if (!event.connection) return;
    event.connection->setEventHandler([weak = std::weak_ptr(event.connection)](const Event& e) {
      auto self = weak.lock();
      if (self && e.type == EventType::Message) {
        self->reply(e.message, Value(Dictionary{{"pid", uint64_t(e.message.sender.pid)}}));
      }
    });
    event.connection->resume();
  });
  listener->resume();
  std::vector<uint8_t> frame;  // its header big-endian: length, flags, id
  appendFrame(frame, Value(Dictionary{}), kFlagWantsReply, 0x0A0B0C0D0E0F1011);
  EXPECT_EQ(std::vector(frame.begin(), frame.begin() + kHeaderSize),
            (std::vector<uint8_t>{0, 0, 0, 1, 0, 0, 0, 1, 10, 11, 12, 13, 14, 15, 16, 17}));
  EXPECT_EQ(decodeHeader(frame.data()).id, 0x0A0B0C0D0E0F1011u);
  const auto half = std::span(frame).first(frame.size() / 2);
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
         writeFromChild([&] { writeAll(fd, std::span(frame).subspan(half.size())); });
         return 0;
       }},
      {"longer than the body limit",
       [&](int fd) {
         uint8_t header[kHeaderSize];
         encodeHeader({kMaxBodySize + 1, kFlagWantsReply, 2}, header);
         writeAll(fd, header);
         return 0;
       }},
  };
  EXPECT_EQ(std::filesystem::status(listener->path()).permissions(),  // for its owner only
            std::filesystem::perms(0600));
  for (const auto& row : rows) {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{.sun_family = AF_UNIX};
    listener->path().copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    const pid_t expected = row.write(fd);
    EXPECT_EQ(replyPid(fd), expected ? std::optional(expected) : std::nullopt) << row.name;
    ::close(fd);
  }
  listener->cancel();
}

}  // namespace
}  // namespace ek::wyre
