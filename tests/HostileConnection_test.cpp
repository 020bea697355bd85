// A hostile local user against the connection layer, end to end: each finding replayed on a
// real daemon, which must keep judging requests by their writer and keep serving others.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr uint64_t kDiscoverAll = 0x200;
constexpr const char* kManager = "com.corvane.private.ekora.manager";

// ---- A helper role of this very binary -----------------------------------------------------
//
// A copy of this binary with an entitlements file is the entitled program of the tests below.
// Started with EK_HOSTILE_ROLE set, the binary plays that role and exits before any test runs.

int connectTo(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return -1;
  return fd;
}

// Asks for every plug-in (allowed to unsandboxed managers only) on fd; answers the reply's
// error code, or -1 when no reply came.
int64_t askForEverything(int fd) {
  std::vector<uint8_t> frame;
  wyre::appendFrame(frame, request("match", {{"flags", Value(kDiscoverAll)}}),
                    wyre::kFlagWantsReply, 7);
  if (::write(fd, frame.data(), frame.size()) != static_cast<ssize_t>(frame.size())) return -1;
  std::vector<uint8_t> bytes;
  uint8_t buffer[65536];
  while (true) {
    if (bytes.size() >= wyre::kHeaderSize) {
      auto header = wyre::decodeHeader(bytes.data());
      if (bytes.size() >= wyre::kHeaderSize + header.length) {
        auto body = cbor::decode(std::span(bytes).subspan(wyre::kHeaderSize, header.length));
        return body ? replyErrorCode(*body) : -1;
      }
    }
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 20000) <= 0) return -1;
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n <= 0) return -1;
    bytes.insert(bytes.end(), buffer, buffer + n);
  }
}

[[noreturn]] void playRole(std::string_view role) {
  const char* socket = std::getenv("EK_HOSTILE_SOCKET");
  if (role == "ask" && socket) {
    // The entitled program asks on its own connection.
    std::printf("reply-code %lld\n", static_cast<long long>(askForEverything(connectTo(socket))));
  } else if (role == "lend" && socket) {
    // The entitled program connects, and a child that keeps the socket runs another program.
    int fd = connectTo(socket);
    pid_t child = fork();
    if (child == 0) {
      std::string number = std::to_string(fd);
      setenv("EK_HOSTILE_ROLE", "write", 1);
      setenv("EK_HOSTILE_FD", number.c_str(), 1);
      const char* writer = std::getenv("EK_HOSTILE_WRITER");
      execl(writer, writer, static_cast<char*>(nullptr));
      _exit(127);
    }
    int status = 0;
    waitpid(child, &status, 0);
  } else if (role == "write") {
    std::printf("reply-code %lld\n",
                static_cast<long long>(askForEverything(std::atoi(std::getenv("EK_HOSTILE_FD")))));
  } else if (role == "idle") {
    pause();
  }
  std::fflush(stdout);
  _exit(0);
}

// Played once everything static is made, before the first test.
class Role : public ::testing::Environment {
 public:
  void SetUp() override {
    if (const char* role = std::getenv("EK_HOSTILE_ROLE")) playRole(role);
  }
};
[[maybe_unused]] ::testing::Environment* const kRole =
    ::testing::AddGlobalTestEnvironment(new Role);

// The error code a role printed, or "none".
std::string reported(const CommandResult& result) {
  size_t at = result.out.find("reply-code ");
  if (at == std::string::npos) return "none";
  return result.out.substr(at + 11, result.out.find('\n', at) - at - 11);
}

// A copy of this binary in dir, holding the manager entitlement.
std::string entitledCopy(const fs::path& dir) {
  fs::create_directories(dir);
  fs::path program = dir / "entitled";
  fs::copy_file(fs::read_symlink("/proc/self/exe"), program, fs::copy_options::overwrite_existing);
  std::ofstream(program.string() + ".entitlements")
      << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n<dict>\n\t<key>"
      << kManager << "</key>\n\t<true/>\n</dict>\n</dmap>\n";
  chmod((program.string() + ".entitlements").c_str(), 0644);
  return program.string();
}

size_t occurrences(const std::string& text, std::string_view what) {
  size_t count = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++count;
  return count;
}

std::vector<uint8_t> header(uint32_t length, uint32_t flags, uint64_t id) {
  std::vector<uint8_t> bytes(wyre::kHeaderSize);
  wyre::encodeHeader({length, flags, id}, bytes.data());
  return bytes;
}

// ---- One daemon for the findings that leave it running as it was ---------------------------

class HostileConnection : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    setenv("EKORA_LOG", "default", 1);
    daemon_ = new EkdProcess();
    ASSERT_TRUE(daemon_->start()) << daemon_->log();
    unsetenv("EKORA_LOG");
  }
  static void TearDownTestSuite() {
    EXPECT_EQ(daemon_->terminate(), 0) << daemon_->log();
    delete daemon_;
    daemon_ = nullptr;
  }

  // Another client's request, answered within the time given.
  static bool servedWithin(std::chrono::milliseconds limit) {
    RawClient client(daemon_->socketPath());
    if (!client.sendMessage(request("Nope"), 9)) return false;
    auto frame = client.readFrame(limit);
    return frame && frame->body.getString("error") &&
           *frame->body.getString("error") == "unrecognized request";
  }

  CommandResult run(const std::string& program, std::map<std::string, std::string> env) {
    env["EK_HOSTILE_SOCKET"] = daemon_->socketPath();
    for (const auto& [key, value] : daemon_->environment()) env[key] = value;
    return runCommand({program}, env);
  }

  static EkdProcess* daemon_;
};

EkdProcess* HostileConnection::daemon_ = nullptr;

// (a) Entitlements go with the program that writes a request, not with the connection.
TEST_F(HostileConnection, EntitlementsAreNotLentWithTheSocket) {
  std::string entitled = entitledCopy(daemon_->root().path() / "lender");
  std::string plain = fs::read_symlink("/proc/self/exe").string();

  // The entitled program on its own connection: allowed.
  CommandResult own = run(entitled, {{"EK_HOSTILE_ROLE", "ask"}});
  EXPECT_EQ(reported(own), "0") << own.out << own.err << daemon_->log();

  // It connects, and its child runs a plain program on that socket: refused.
  CommandResult lent = run(entitled, {{"EK_HOSTILE_ROLE", "lend"}, {"EK_HOSTILE_WRITER", plain}});
  EXPECT_EQ(reported(lent), "11") << lent.out << lent.err << daemon_->log();

  // A plain process connects, then executes the entitled program; this process kept the
  // socket (a child would do the same): refused.
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  pid_t connecting = fork();
  if (connecting == 0) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, daemon_->socketPath().c_str(), sizeof address.sun_path - 1);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) _exit(1);
    setenv("EK_HOSTILE_ROLE", "idle", 1);
    execl(entitled.c_str(), entitled.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  std::string exe = "/proc/" + std::to_string(connecting) + "/exe";
  for (int i = 0; i < 500; ++i) {
    std::error_code ignored;
    if (fs::read_symlink(exe, ignored) == entitled) break;
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(askForEverything(fd), 11) << daemon_->log();
  ::kill(connecting, SIGKILL);
  waitpid(connecting, nullptr, 0);
  ::close(fd);
}

// (g) Only the instance's own user and root are served.
TEST_F(HostileConnection, OtherUsersAreRefused) {
  struct stat st {};
  ASSERT_EQ(::stat(daemon_->socketPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  if (geteuid() != 0) GTEST_SKIP() << "needs root to connect as another user";

  // Opened up as a careless administrator might: the uid check at accept still holds.
  // Only the daemon's own directories: what lies above them is the system's.
  const fs::path root = daemon_->root().path();
  for (fs::path p = daemon_->socketPath(); p.has_relative_path() && p != root.parent_path();
       p = p.parent_path()) {
    chmod(p.c_str(), p == daemon_->socketPath() ? 0666 : 0755);
  }
  for (int attempt = 0; attempt < 2; ++attempt) {
    pid_t child = fork();
    if (child == 0) {
      if (setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0) _exit(2);
      RawClient client(daemon_->socketPath());
      if (!client.connected()) _exit(3);
      client.sendMessage(request("Nope"), 1);
      _exit(client.readFrame(10s) ? 4 : client.closedByPeer(10s) ? 0 : 5);
    }
    int status = 0;
    waitpid(child, &status, 0);
    EXPECT_EQ(WEXITSTATUS(status), 0) << "attempt " << attempt;
  }
  chmod(daemon_->socketPath().c_str(), 0600);
  EXPECT_TRUE(daemon_->logShows("uid 65534 is not served")) << daemon_->log();
  EXPECT_EQ(occurrences(daemon_->log(), "uid 65534 is not served"), 1u) << daemon_->log();
  EXPECT_TRUE(servedWithin(5s));
}

// (c) Messages that want no reply count among the 256 that may wait: a flood of them neither
// grows the daemon nor keeps another client waiting.
TEST_F(HostileConnection, FloodOfMessagesWantingNoReplyIsBounded) {
  RawClient flooder(daemon_->socketPath());
  // Cheap to read, dear to serve: every path is resolved and looked up in the registry.
  std::vector<uint8_t> frame;
  wyre::appendFrame(frame, request("lock", {{"paths", Value(Array(1000, Value("/")))}}), 0, 1);
  std::atomic<int> sent{0};
  long baseline = residentKiB(daemon_->pid());
  long peak = baseline;
  std::thread flood([&] {
    for (int i = 0; i < 3000 && flooder.sendBytes(frame); ++i) ++sent;
  });
  // The other client asks only once more is waiting than may be: on a busy machine the flood
  // could otherwise still be starting when the last answer comes.
  for (auto until = std::chrono::steady_clock::now() + 10s;
       sent.load() <= static_cast<int>(wyre::kMaxWaitingMessages) &&
       std::chrono::steady_clock::now() < until;) {
    std::this_thread::sleep_for(1ms);
  }
  for (int i = 0; i < 20; ++i) {
    EXPECT_TRUE(servedWithin(2s)) << "request " << i << " waited behind the flood";
    peak = std::max(peak, residentKiB(daemon_->pid()));
  }
  ::shutdown(flooder.fd(), SHUT_RDWR);
  flood.join();
  EXPECT_GT(sent.load(), static_cast<int>(wyre::kMaxWaitingMessages));
  if (!kSanitized) {
    EXPECT_LT(peak - baseline, 64 * 1024) << "KiB grown while flooded";
  }
}

// (e) A frame left half-sent is closed after 10 s, and holds nothing after.
TEST_F(HostileConnection, HalfSentFrameIsClosedAfterTenSeconds) {
  std::vector<std::unique_ptr<RawClient>> holders;
  auto begun = std::chrono::steady_clock::now();
  for (int i = 0; i < 4; ++i) {
    holders.push_back(std::make_unique<RawClient>(daemon_->socketPath()));
    auto bytes = header(63u << 20, wyre::kFlagWantsReply, 1);
    bytes.resize(bytes.size() + (8u << 20), 'x');
    ASSERT_TRUE(holders.back()->sendBytes(bytes));
  }
  EXPECT_TRUE(servedWithin(2s));
  for (auto& holder : holders) EXPECT_TRUE(holder->closedByPeer(20s));
  EXPECT_GE(std::chrono::steady_clock::now() - begun, 9s);
  EXPECT_TRUE(daemon_->logShows("frame incomplete 10 s after it began")) << daemon_->log();
}

// (f) Malformed frames close their connections without flooding the log.
TEST_F(HostileConnection, MalformedFramesAreLoggedAtMostOnceASecond) {
  // Out of the second in which an earlier test may have had its line.
  std::this_thread::sleep_for(1100ms);
  const std::string before = daemon_->log();
  auto begun = std::chrono::steady_clock::now();
  std::vector<uint8_t> garbage(64, 0xff);
  wyre::encodeHeader({48, wyre::kFlagWantsReply, 1}, garbage.data());
  for (int i = 0; i < 2000; ++i) {
    RawClient client(daemon_->socketPath());
    client.sendBytes(garbage);
  }
  EXPECT_TRUE(servedWithin(5s));
  auto seconds =
      std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - begun)
          .count();
  std::string added = daemon_->log().substr(before.size());
  EXPECT_GE(occurrences(added, "closing connection from pid="), 1u);
  EXPECT_LE(occurrences(added, "closing connection from pid="), static_cast<size_t>(seconds + 2))
      << added;
}

// ---- (b) Descriptor pressure, on a daemon with a low descriptor limit ----------------------

TEST(HostileDescriptors, ConnectionsAreBoundedAndTheDaemonRecoversFromRunningOut) {
  setenv("EKORA_LOG", "default", 1);
  EkdProcess daemon;
  bool started = daemon.start();
  unsetenv("EKORA_LOG");
  ASSERT_TRUE(started) << daemon.log();
  // A descriptor limit of 256 leaves room for (256 - 64) / 3 = 64 connections.
  struct rlimit low {
    256, 256
  };
  ASSERT_EQ(prlimit(daemon.pid(), RLIMIT_NOFILE, &low, nullptr), 0);

  // The connection with which start() saw the daemon up is gone by now.
  std::this_thread::sleep_for(500ms);

  std::vector<std::unique_ptr<RawClient>> flood, extra;
  for (int i = 0; i < 64; ++i) flood.push_back(std::make_unique<RawClient>(daemon.socketPath()));
  for (int i = 0; i < 16; ++i) extra.push_back(std::make_unique<RawClient>(daemon.socketPath()));
  std::this_thread::sleep_for(1s);
  size_t refused = 0, extraRefused = 0;
  for (auto& client : flood) refused += client->closedByPeer(5ms);
  for (auto& client : extra) extraRefused += client->closedByPeer(5ms);
  EXPECT_EQ(refused, 0u) << daemon.log();
  EXPECT_EQ(extraRefused, 16u) << daemon.log();
  EXPECT_TRUE(daemon.logShows("connections already")) << daemon.log();
  extra.clear();

  // Now out of descriptors altogether: a descriptor takes the lowest free number, and no
  // number from there on may be used. A sanitizer's runtime needs descriptors for its own
  // checks and reports false errors without them.
  if (kSanitized) {
    flood.clear();
    EXPECT_EQ(daemon.terminate(), 0) << daemon.log();
    return;
  }
  std::set<int> open;
  for (const auto& entry :
       fs::directory_iterator("/proc/" + std::to_string(daemon.pid()) + "/fd")) {
    open.insert(std::stoi(entry.path().filename().string()));
  }
  rlim_t lowestFree = 0;
  while (open.contains(static_cast<int>(lowestFree))) ++lowestFree;
  struct rlimit starved {
    lowestFree, lowestFree
  };
  ASSERT_EQ(prlimit(daemon.pid(), RLIMIT_NOFILE, &starved, nullptr), 0);
  std::vector<std::unique_ptr<RawClient>> late;
  for (int i = 0; i < 3; ++i) late.push_back(std::make_unique<RawClient>(daemon.socketPath()));
  std::this_thread::sleep_for(3s);
  size_t lines = occurrences(daemon.log(), "Too many open files");
  EXPECT_GE(lines, 1u) << daemon.log();
  EXPECT_LE(lines, 5u) << daemon.log();
  flood.clear();
  late.clear();
  // Served again once the flood is gone (those that waited may come too early for that).
  bool served = false;
  for (int i = 0; i < 50 && !served; ++i) {
    RawClient client(daemon.socketPath());
    served = client.sendMessage(request("Nope"), 1) && client.readFrame(200ms);
  }
  EXPECT_TRUE(served) << daemon.log();
  EXPECT_EQ(daemon.terminate(), 0) << daemon.log();
}

}  // namespace
}  // namespace ek::test
