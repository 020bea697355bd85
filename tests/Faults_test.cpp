// Faults and hostile clients against a real ekd: the frame's refusals, bad input and clients that
// misbehave, lend their socket, flood the connection layer, put hostile bundles on disk or send
// annotations the file cannot hold; kills at any moment. The daemon must judge each request by its
// writer, keep serving everyone else and lose nothing it acknowledged.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <fstream>
#include <iostream>
#include <limits>
#include <random>
#include <thread>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"
#include "platform/value/Uuid.h"
#include "platform/wyre/Wyre.h"
#include "tests/EkdProcess.h"
#include "tests/RawClient.h"

namespace ek::test {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr uint64_t kDiscoverAll = 0x200;
constexpr const char* kManager = "com.corvane.private.ekora.manager";

std::vector<uint8_t> frameWithBody(std::vector<uint8_t> body) {
  std::vector<uint8_t> bytes(wyre::kHeaderSize);
  wyre::encodeHeader({static_cast<uint32_t>(body.size()), wyre::kFlagWantsReply, 1}, bytes.data());
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

// A batch of requests for no known type, each answered with a short error.
std::vector<uint8_t> batchOfUnknown(int count) {
  std::vector<uint8_t> batch;
  for (int i = 0; i < count; ++i) {
    wyre::appendFrame(batch, request("Nope"), wyre::kFlagWantsReply, static_cast<uint64_t>(i));
  }
  return batch;
}

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return address;
}

size_t occurrences(const std::string& text, std::string_view what) {
  size_t count = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++count;
  return count;
}

void writeInfo(const fs::path& bundle, const Dictionary& info) {
  ASSERT_TRUE(
      testing::writeFile((bundle / "Info.dmap").string(), dmap::write(Value(info)).value()));
}

Dictionary plugInInfo(const std::string& identifier,
                      const std::string& point = "com.example.hostile", std::string padding = {}) {
  Dictionary extension{{"ZuExtensionPointIdentifier", Value(point)},
                       {"ZuExtensionAttributes", Value(Dictionary{})}};
  if (!padding.empty()) extension.emplace("Padding", Value(std::move(padding)));
  return {{"QvBundleIdentifier", Value(identifier)}, {"ZuExtension", Value(std::move(extension))}};
}

// One daemon per test (ctest runs each alone), with Host.app, which holds hostile plug-ins, and the
// example Viewer.app. Some serve floods of requests, which a debug line each would only slow.
class Faults : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = fs::canonical(daemon_.root().path());
    writeInfo(host(), {{"QvBundleIdentifier", Value("com.example.host")}});
    fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", root_ / "Viewer.app",
             fs::copy_options::recursive);
    daemon_.setEnvironment("EKORA_LOG", "default");
    ASSERT_TRUE(daemon_.start()) << daemon_.log();
  }
  void TearDown() override {
    if (daemon_.running()) {
      EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
    }
  }
  fs::path host() const { return root_ / "Apps" / "Host.app"; }
  fs::path plugIn(const std::string& name) const { return host() / "PlugIns" / (name + ".appex"); }
  fs::path makePlugIn(const std::string& name) const {
    writeInfo(plugIn(name), plugInInfo("com.example." + name));
    return plugIn(name);
  }
  Value ask(const Value& message) {
    auto reply = daemon_.ask(message);
    EXPECT_TRUE(reply) << message.description().substr(0, 200) << "\n" << daemon_.log();
    return reply ? *reply : Value(Dictionary{{"errorcode", Value(uint64_t{999})}});
  }
  Value add(Array paths) { return ask(request("add", {{"paths", Value(std::move(paths))}})); }
  // The form of a bundle, or the error "find" answers.
  Value find(const fs::path& bundle) {
    Value reply = ask(request("find", {{"paths", Value("file://" + bundle.string())}}));
    return reply.get("matches") ? *reply.get("matches") : reply;
  }
  Uuid uuidOf(const fs::path& bundle) {
    const Value form = find(bundle);
    const std::string* uuid = form.getString("uuid");
    return uuid ? *Uuid::parse(*uuid) : Uuid();
  }
  // Another client's request, answered within the time given.
  bool servedWithin(std::chrono::milliseconds limit) {
    RawClient client(daemon_.socketPath());
    if (!client.sendMessage(request("Nope"), 9)) return false;
    auto frame = client.readFrame(limit);
    return frame && replyError(frame->body) == "unrecognized request";
  }

  EkdProcess daemon_;
  fs::path root_;
};
using DaemonFrame = Faults;
using DaemonFaults = Faults;
using HostileConnection = Faults;
using HostileBundle = Faults;
using HostileAnnotation = Faults;

TEST_F(DaemonFrame, RefusalsOfVersionAndType) {
  const struct {
    Dictionary body;
    uint64_t code;
    std::string error;
  } cases[] = {
      {{{"request", "find"}}, 7, "unsupported protocol version 0 (current 3)"},
      {{{"request", "nonsense"}, {"version", 4}}, 7, "unsupported protocol version 4 (current 3)"},
      {{{"version", 1}}, 7, "unsupported protocol version 1 (current 3)"},
      {{{"request", "find"}, {"version", "3"}}, 7, "unsupported protocol version 0 (current 3)"},
      {{{"version", 3}}, 4, "invalid request format (missing type)"},
      {{{"version", 2}, {"request", 5}}, 4, "invalid request format (missing type)"},
      {{{"version", 3}, {"request", "Add"}}, 4, "unrecognized request"},
      {{{"version", 2}, {"request", ""}}, 4, "unrecognized request"},
  };
  RawClient client(daemon_.socketPath());
  for (const auto& c : cases) {
    const Value body(c.body);
    ASSERT_TRUE(client.sendMessage(body, 77));
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << body.description();
    EXPECT_EQ(frame->id, 77u);
    EXPECT_EQ(replyErrorCode(frame->body), static_cast<int64_t>(c.code)) << body.description();
    EXPECT_EQ(replyError(frame->body), c.error) << body.description();
  }
}

TEST_F(DaemonFrame, EachRequestWantingAReplyGetsOneInOrder) {
  RawClient client(daemon_.socketPath());
  const char* types[] = {"add",      "remove", "bulk", "match",         "ready", "access",
                         "annotate", "find",   "lock", "bulk-annotate", "status"};
  uint64_t id = 1;
  ASSERT_TRUE(client.sendMessage(request("find"), 100, /*wantsReply=*/false));
  for (const char* type : types) ASSERT_TRUE(client.sendMessage(request(type), id++));
  for (uint64_t expected = 1; expected < id; ++expected) {
    auto frame = client.readFrame();
    ASSERT_TRUE(frame) << "missing reply " << expected;
    EXPECT_EQ(frame->id, expected);
    EXPECT_TRUE(frame->body.dictionary());
  }
}

TEST_F(DaemonFaults, MalformedFramesCloseOnlyTheirConnection) {
  std::vector<uint8_t> oversized(wyre::kHeaderSize);
  wyre::encodeHeader({(64u << 20) + 1, 1, 1}, oversized.data());
  std::vector<uint8_t> deep(600, 0x81);
  deep.push_back(0x00);
  const std::string junk = "GET / HTTP/1.1\r\nHost: x\r\n\r\n";
  const struct {
    const char* name;
    std::vector<uint8_t> bytes;
  } cases[] = {
      {"length over 64 MiB", oversized},
      {"undecodable CBOR", frameWithBody({0xff, 0xff, 0xff})},
      {"map with a non-text key", frameWithBody({0xa1, 0x01, 0x02})},
      {"trailing bytes after the item", frameWithBody({0xa0, 0x00})},
      {"map declaring billions of entries", frameWithBody({0xbb, 0, 0, 0, 0, 0xb2, 0xd0, 0x5e, 0})},
      {"nesting deeper than 512", frameWithBody(deep)},
      {"garbage text", std::vector<uint8_t>(junk.begin(), junk.end())},
  };
  RawClient bystander(daemon_.socketPath());
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    RawClient client(daemon_.socketPath());
    ASSERT_TRUE(client.sendBytes(c.bytes));
    EXPECT_TRUE(client.closedByPeer());
    ASSERT_TRUE(bystander.sendMessage(request("Nope"), 1));
    EXPECT_TRUE(bystander.readFrame()) << "the bystander's connection suffered";
  }
  // Frames cut short by a hang-up, and messages that are no dictionary, harm nobody either.
  {
    RawClient client(daemon_.socketPath());
    auto frame = frameWithBody(cbor::encode(request("find")));
    frame.resize(frame.size() - 3);
    ASSERT_TRUE(client.sendBytes(frame));
  }
  RawClient client(daemon_.socketPath());
  ASSERT_TRUE(client.sendMessage(Value(Array{1, 2, 3}), 1));
  ASSERT_TRUE(client.sendMessage(request("Nope"), 2));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame);
  EXPECT_EQ(frame->id, 2u) << "a message that is no dictionary was answered";
  EXPECT_TRUE(daemon_.logShows("unexpected message: [1, 2, 3] from: " + std::to_string(getpid())));
  EXPECT_TRUE(servedWithin(10s));
}

TEST_F(DaemonFaults, ClientThatNeverReadsIsCutOffWithoutStallingOthers) {
  RawClient greedy(daemon_.socketPath());
  // Many times over what the socket buffers and the bound on unsent replies hold.
  const std::vector<uint8_t> batch = batchOfUnknown(4096);
  bool cutOff = false;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(90);
  for (int round = 0; round < 2000 && !cutOff && std::chrono::steady_clock::now() < deadline;
       ++round) {
    if (!greedy.sendBytes(batch)) cutOff = true;
    if (round % 50 == 0) {
      EXPECT_TRUE(servedWithin(10s));
    }
  }
  EXPECT_TRUE(cutOff || greedy.closedByPeer(std::chrono::seconds(30)))
      << "the daemon kept a connection that never reads";
  EXPECT_TRUE(daemon_.logShows("does not read its replies"));
  // Clients gone with requests still queued disturb nobody.
  for (int round = 0; round < 20; ++round) {
    RawClient doomed(daemon_.socketPath());
    ASSERT_TRUE(doomed.sendBytes(batchOfUnknown(500)));
  }
  EXPECT_TRUE(servedWithin(10s));
}

TEST(SocketActivation, DaemonServesThePassedSocketAndLeavesItInPlace) {
  TempDir dir;
  const std::string runtime = (dir.path() / "run").string();
  std::filesystem::create_directories(runtime);
  // The socket lives where the manager put it, not where ekd would make its own.
  const std::string socketPath = (dir.path() / "activated.sock").string();
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  const sockaddr_un address = addressOf(socketPath);
  ASSERT_EQ(bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(fd, 16), 0);

  pid_t pid = fork();
  if (pid == 0) {
    dup2(fd, 3);
    dup2(open("/dev/null", O_WRONLY), 2);
    setenv("LISTEN_FDS", "1", 1);
    setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    setenv("EKORA_RUNTIME_DIR", runtime.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir.path().c_str(), 1);
    execl(ekdPath().c_str(), ekdPath().c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  close(fd);
  RawClient client(socketPath);
  ASSERT_TRUE(client.sendMessage(request("Nope"), 42));
  auto frame = client.readFrame();
  ASSERT_TRUE(frame) << "the daemon did not answer on the activated socket";
  EXPECT_EQ(frame->id, 42u);
  EXPECT_FALSE(std::filesystem::exists(runtime + "/com.corvane.ekora.ekd"))
      << "the daemon made its own socket despite activation";
  kill(pid, SIGTERM);
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_TRUE(std::filesystem::exists(socketPath)) << "an activated socket belongs to the manager";
}

// Entitlements go with the program that writes a request, not with the connection.
TEST_F(HostileConnection, EntitlementsAreNotLentWithTheSocket) {
  struct stat st {};
  ASSERT_EQ(::stat(daemon_.socketPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u) << "other users may connect";
  const std::string entitled = ekctlWithEntitlements(root_ / "entitled", {kManager});
  EXPECT_EQ(daemon_.ekctlAs(entitled, {"match", "--flags", "512"}).status, 0) << daemon_.log();

  // A child connects, then executes the entitled program and idles; this process, which kept the
  // socket, writes on it.
  RawClient lent(::socket(AF_UNIX, SOCK_STREAM, 0));
  pid_t child = fork();
  if (child == 0) {
    const sockaddr_un address = addressOf(daemon_.socketPath());
    if (::connect(lent.fd(), reinterpret_cast<const sockaddr*>(&address), sizeof address)) _exit(1);
    for (const auto& [key, value] : daemon_.environment()) setenv(key.c_str(), value.c_str(), 1);
    execl(entitled.c_str(), entitled.c_str(), "watch", "com.example.idle", nullptr);
    _exit(127);
  }
  const fs::path exe = "/proc/" + std::to_string(child) + "/exe";
  for (int i = 0; i < 500; ++i) {
    std::error_code ignored;
    if (fs::read_symlink(exe, ignored) == entitled) break;
    std::this_thread::sleep_for(10ms);
  }
  ASSERT_TRUE(lent.sendMessage(request("match", {{"flags", Value(kDiscoverAll)}}), 1));
  auto reply = lent.readFrame();
  ::kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  ASSERT_TRUE(reply) << daemon_.log();
  EXPECT_EQ(replyErrorCode(reply->body), 11) << reply->body.description().substr(0, 200);
}

// A writer that executes another program is judged as the program it runs now, not by the record
// kept for its pid.
TEST_F(HostileConnection, WriterThatExecutesAnotherProgramIsJudgedAnew) {
  const std::string cat = ekctlWithEntitlements(root_ / "entitled", {kManager}, "/bin/cat");
  const Value all = request("match", {{"flags", Value(kDiscoverAll)}});
  RawClient client(daemon_.socketPath());
  int input[2];
  ASSERT_EQ(::pipe(input), 0);
  pid_t child = fork();
  if (child == 0) {
    // First as this unentitled program, refused; then cat, entitled, copies the next request in.
    RawClient own(::dup(client.fd()));
    if (!own.sendMessage(all, 1)) _exit(1);
    auto refused = own.readFrame();
    if (!refused || replyErrorCode(refused->body) != 11) _exit(2);
    ::dup2(input[0], 0);
    ::dup2(client.fd(), 1);
    ::close(input[1]);  // cat ends at the end of its input
    execl(cat.c_str(), cat.c_str(), nullptr);
    _exit(127);
  }
  ::close(input[0]);
  const fs::path exe = "/proc/" + std::to_string(child) + "/exe";
  for (int i = 0; i < 500; ++i) {
    std::error_code ignored;
    if (fs::read_symlink(exe, ignored) == cat) break;
    std::this_thread::sleep_for(10ms);
  }
  std::vector<uint8_t> frame;
  wyre::appendFrame(frame, all, wyre::kFlagWantsReply, 2);
  ASSERT_EQ(::write(input[1], frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
  auto reply = client.readFrame();
  ::close(input[1]);
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
  ASSERT_TRUE(reply) << daemon_.log();
  EXPECT_EQ(replyErrorCode(reply->body), 0) << reply->body.description().substr(0, 200);
}

// An instance serves its own user and root only: a writer of another uid is cut off, whoever
// connected. Writing as another user needs root.
TEST_F(HostileConnection, WriterOfAnotherUserIsCutOff) {
  if (geteuid() != 0) GTEST_SKIP() << "only root can write as another user";
  RawClient client(daemon_.socketPath());
  pid_t child = fork();
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) _exit(1);
    _exit(client.sendMessage(request("status"), 1) ? 0 : 2);
  }
  int status = 0;
  waitpid(child, &status, 0);
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
  EXPECT_TRUE(client.closedByPeer()) << daemon_.log();
  EXPECT_TRUE(servedWithin(2s)) << daemon_.log();
}

// Messages that want no reply count among those that may wait: a flood of them keeps no other
// client waiting.
TEST_F(HostileConnection, FloodOfMessagesWantingNoReplyIsBounded) {
  RawClient flooder(daemon_.socketPath());
  // Cheap to read, dear to serve: every path is resolved and looked up in the registry.
  std::vector<uint8_t> frame;
  wyre::appendFrame(frame, request("lock", {{"paths", Value(Array(1000, Value("/")))}}), 0, 1);
  std::atomic<int> sent{0};
  std::thread flood([&] {
    for (int i = 0; i < 3000 && flooder.sendBytes(frame); ++i) ++sent;
  });
  for (auto until = std::chrono::steady_clock::now() + 10s;
       sent.load() <= static_cast<int>(wyre::kMaxWaitingMessages) &&
       std::chrono::steady_clock::now() < until;) {
    std::this_thread::sleep_for(1ms);
  }
  for (int i = 0; i < 20; ++i) {
    EXPECT_TRUE(servedWithin(2s)) << "request " << i << " waited behind the flood";
  }
  ::shutdown(flooder.fd(), SHUT_RDWR);
  flood.join();
  EXPECT_GT(sent.load(), static_cast<int>(wyre::kMaxWaitingMessages));
}

// A frame left half-sent is closed after 10 s; malformed frames close their connections without
// flooding the log.
TEST_F(HostileConnection, HalfSentAndMalformedFramesAreClosedAndLoggedSparingly) {
  std::vector<std::unique_ptr<RawClient>> holders;
  for (int i = 0; i < 4; ++i) {
    holders.push_back(std::make_unique<RawClient>(daemon_.socketPath()));
    std::vector<uint8_t> bytes(wyre::kHeaderSize + (8u << 20), 'x');
    wyre::encodeHeader({63u << 20, wyre::kFlagWantsReply, 1}, bytes.data());
    ASSERT_TRUE(holders.back()->sendBytes(bytes));
  }
  EXPECT_TRUE(servedWithin(2s));

  const size_t before = daemon_.log().size();
  const auto begun = std::chrono::steady_clock::now();
  std::vector<uint8_t> garbage(64, 0xff);
  wyre::encodeHeader({48, wyre::kFlagWantsReply, 1}, garbage.data());
  for (int i = 0; i < 2000; ++i) RawClient(daemon_.socketPath()).sendBytes(garbage);
  EXPECT_TRUE(servedWithin(5s));
  const auto seconds =
      std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - begun)
          .count();
  const std::string added = daemon_.log().substr(before);
  EXPECT_GE(occurrences(added, "closing connection from pid="), 1u);
  EXPECT_LE(occurrences(added, "closing connection from pid="), static_cast<size_t>(seconds + 2))
      << added;

  for (auto& holder : holders) EXPECT_TRUE(holder->closedByPeer(20s));
  EXPECT_GE(std::chrono::steady_clock::now() - begun, 9s);
  EXPECT_TRUE(daemon_.logShows("frame incomplete 10 s after it began"));
}

// Each bundle is registered alone; the hostile ones are refused with the reason logged.
TEST_F(HostileBundle, BundleFilesAreReadBeneathTheBundleAndBounded) {
  const fs::path secret = root_ / "secret";
  writeInfo(secret, plugInInfo("com.example.secret"));
  ASSERT_EQ(::chmod((secret / "Info.dmap").c_str(), 0600), 0);
  const struct {
    std::string name;
    std::function<void(const fs::path& bundle)> make;
    std::string reason;  // in the log; empty: registered
  } rows[] = {
      {"Huge",
       [](const fs::path& bundle) {
         writeInfo(bundle, plugInInfo("com.example.huge", "p", std::string(1 << 20, 'x')));
       },
       "exceeds the limit of 1048576"},
      {"Linked",
       [&](const fs::path& bundle) {
         fs::create_directories(bundle);
         fs::create_symlink(secret / "Info.dmap", bundle / "Info.dmap");
       },
       "leads out of " + plugIn("Linked").string()},
      {"Fifo",
       [](const fs::path& bundle) {
         fs::create_directories(bundle);
         ASSERT_EQ(::mkfifo((bundle / "Info.dmap").c_str(), 0600), 0);
       },
       "Info.dmap: not a regular file"},
      {"Good", [](const fs::path& bundle) { writeInfo(bundle, plugInInfo("g")); }, ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const fs::path bundle = plugIn(row.name);
    row.make(bundle);
    Value reply = add({Value(bundle.string())});
    if (row.reason.empty()) {
      EXPECT_EQ(replyErrorCode(reply), 0) << reply.description();
      EXPECT_TRUE(find(bundle).getString("uuid"));
      continue;
    }
    EXPECT_EQ(replyErrorCode(reply), 2) << reply.description();
    EXPECT_EQ(replyError(reply), "unable to register plug-in at " + bundle.string());
    EXPECT_TRUE(daemon_.logShows(row.reason)) << daemon_.log();
    EXPECT_EQ(replyErrorCode(find(bundle)), 15);
  }
  EXPECT_EQ(daemon_.log().find("com.example.secret"), std::string::npos);
}

TEST_F(HostileBundle, SwappedBundleDirectoryGetsNoToken) {
  const fs::path bundle = makePlugIn("Swapped");
  ASSERT_EQ(replyErrorCode(add({Value(bundle.string())})), 0);
  const Uuid uuid = uuidOf(bundle);
  auto access = [&] { return ask(request("access", {{"uuids", Value(Array{Value(uuid)})}})); };
  ASSERT_EQ(replyErrorCode(access()), 0);
  // Another directory, shaped like the bundle, now stands at its path.
  fs::rename(bundle, root_ / "Elsewhere");
  fs::create_symlink(root_ / "Elsewhere", bundle);
  EXPECT_EQ(find(bundle).getDictionary("extensions")->size(), 0u);
  Value refused = access();
  EXPECT_EQ(replyErrorCode(refused), 4) << refused.description();
  EXPECT_EQ(replyError(refused),
            "cannot create file extension to " + bundle.string() + ": " + std::to_string(ESTALE));
  EXPECT_EQ(refused.get("extensions"), nullptr);
}

// A long "add" goes on in slices: a "find" sent by another client once the add is under way is
// answered while the add is still at work.
TEST_F(HostileBundle, LongAddDoesNotHoldOtherClients) {
  // The host application is registered first, with one plug-in: registering it later would register
  // every plug-in in its folder at once, in the add's first step.
  ASSERT_EQ(replyErrorCode(add({Value(makePlugIn("Known").string())})), 0);
  Array paths;
  for (int i = 0; i < 1000; ++i)
    paths.emplace_back(makePlugIn("Many" + std::to_string(i)).string());
  RawClient adder(daemon_.socketPath());
  RawClient finder(daemon_.socketPath());
  ASSERT_TRUE(adder.sendMessage(request("add", {{"paths", Value(std::move(paths))}}), 1));
  // Asked until the add's first slice has registered the first plug-in.
  const Value first("file://" + plugIn("Many0").string());
  for (uint32_t id = 2;; ++id) {
    ASSERT_TRUE(finder.sendMessage(request("find", {{"paths", first}}), id));
    auto found = finder.readFrame(30s);
    ASSERT_TRUE(found) << daemon_.log();
    if (replyErrorCode(found->body) == 0) break;
    ASSERT_LT(id, 1000000u) << "the first plug-in was never registered";
  }
  pollfd pending{adder.fd(), POLLIN, 0};
  EXPECT_EQ(::poll(&pending, 1, 0), 0) << "the add was answered first";
  auto added = adder.readFrame(120s);
  ASSERT_TRUE(added) << daemon_.log();
  EXPECT_EQ(replyErrorCode(added->body), 0) << added->body.description();
  EXPECT_EQ(replyErrorCode(find(plugIn("Many999"))), 0);
}

TEST_F(HostileAnnotation, ValuesTheFileCannotHoldAreRefusedAndLoseNobodysChanges) {
  const std::string app = (root_ / "Viewer.app").string();
  ASSERT_EQ(replyErrorCode(add({Value(app)})), 0);
  const Uuid thumbs = uuidOf(app + "/PlugIns/Thumbs.appex");
  const Uuid share = uuidOf(app + "/PlugIns/Share.appex");
  auto annotate = [&](Dictionary annotations, const Uuid& uuid) {
    return ask(request("annotate", {{"annotations", Value(std::move(annotations))},
                                    {"uuids", Value(Array{Value(uuid)})}}));
  };
  auto extension = [](Value value) {
    return Dictionary{{"extension", Value(Dictionary{{"v", std::move(value)}})}};
  };
  const struct {
    const char* what;
    Dictionary annotations;
    int64_t code;
  } cases[] = {
      {"NaN election", {{"election", Value(std::numeric_limits<double>::quiet_NaN())}}, 4},
      {"control character", extension(Value("bell\x07")), 4},
      {"date after the year 9999", extension(Value(Date{253402300800})), 4},
      {"over 64 KiB", extension(Value(std::string(65 * 1024, 'x'))), 18},
      {"30 MB", extension(Value(std::string(30 << 20, 'x'))), 18},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    Value reply = annotate(c.annotations, thumbs);
    EXPECT_EQ(replyErrorCode(reply), c.code) << reply.description().substr(0, 300);
    if (const auto it = c.annotations.find("extension"); it != c.annotations.end()) {
      Value bulk = ask(request(
          "bulk-annotate", {{"annotations", Value(Dictionary{{thumbs.string(), it->second}})}}));
      EXPECT_EQ(replyErrorCode(bulk), 18) << bulk.description().substr(0, 300);
    }
  }
  // Other changes are kept, on disk: an election given as a boolean is the number.
  EXPECT_EQ(replyErrorCode(annotate({{"election", Value(true)}}, thumbs)), 0);
  const Dictionary kept{{"ok", Value(1)}};
  EXPECT_EQ(replyErrorCode(annotate({{"extension", Value(kept)}}, share)), 0);
  daemon_.kill9();
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  EXPECT_EQ(*find(app + "/PlugIns/Thumbs.appex").get("annotations"),
            Value(Dictionary{{"election", Value(1)}}));
  EXPECT_EQ(*find(app + "/PlugIns/Share.appex").get("annotations"),
            Value(Dictionary{{"extension", Value(kept)}}));
}

TEST_F(HostileAnnotation, DamagedRegistryLogIsReportedAndKeptAside) {
  ASSERT_EQ(replyErrorCode(add({Value((root_ / "Viewer.app").string())})), 0);
  // Killed before the registry went idle: its changes are still in the log.
  daemon_.kill9();
  const fs::path wal = root_ / "state/registry.db-wal";
  ASSERT_GT(fs::file_size(wal), 32u);
  std::fstream(wal, std::ios::in | std::ios::out | std::ios::binary) << std::string(32, 'x');
  ASSERT_TRUE(daemon_.start()) << daemon_.log();
  EXPECT_TRUE(daemon_.logShows("registry write-ahead log " + wal.string() + " is unusable"));
  bool keptAside = false;
  for (const auto& entry : fs::directory_iterator(root_ / "state")) {
    const std::string name = entry.path().filename().string();
    keptAside |= name.starts_with("registry.db.corrupt-") && name.ends_with("-wal");
  }
  EXPECT_TRUE(keptAside);
}

struct Target {
  Uuid uuid;
  uint64_t lastSent = 0;   // 0: nothing sent yet
  uint64_t lastAcked = 0;  // 0: nothing acknowledged yet
};

// The "n" of the extension the daemon answers for the plug-in; 0 when there is none.
uint64_t storedN(const EkdProcess& daemon, const Uuid& uuid) {
  auto reply = daemon.ask(request("find", {{"uuids", Value(uuid)}}));
  const Value* form = reply ? reply->get("matches") : nullptr;
  const Value* annotations = form ? form->get("annotations") : nullptr;
  const Value* extension = annotations ? annotations->get("extension") : nullptr;
  const uint64_t* n = extension ? extension->getUnsigned("n") : nullptr;
  return n ? *n : 0;
}

TEST(Durability, AcknowledgedAnnotationsSurviveSigkill) {
  const char* fixed = std::getenv("EKORA_DURABILITY_SEED");
  const uint64_t seed = fixed ? std::strtoull(fixed, nullptr, 10) : std::random_device{}();
  std::cout << "seed " << seed << " (set EKORA_DURABILITY_SEED to repeat the kill delays)\n";
  std::mt19937_64 random(seed);

  EkdProcess daemon;
  daemon.setEnvironment("EKORA_LOG", "default");
  const fs::path app = fs::canonical(daemon.root().path()) / "Viewer.app";
  fs::copy(fs::path(EXAMPLES_DIR) / "Applications/Viewer.app", app, fs::copy_options::recursive);
  ASSERT_TRUE(daemon.start()) << daemon.log();
  auto added = daemon.ask(request("add", {{"paths", Value(Array{Value(app.string())})}}));
  ASSERT_TRUE(added && replyErrorCode(*added) == 0) << daemon.log();
  std::vector<Target> targets;
  for (const char* bundle : {"/PlugIns/Thumbs.appex", "/PlugIns/Share.appex"}) {
    auto reply = daemon.ask(request("find", {{"paths", Value("file://" + app.string() + bundle)}}));
    const Value* form = reply ? reply->get("matches") : nullptr;
    ASSERT_TRUE(form && form->getString("uuid")) << bundle << "\n" << daemon.log();
    targets.push_back({*Uuid::parse(*form->getString("uuid"))});
  }

  uint64_t next = 0, acknowledged = 0;
  for (int round = 0; round < 100; ++round) {
    SCOPED_TRACE("round " + std::to_string(round) + ", seed " + std::to_string(seed));
    // The daemon must come back with at least every acknowledged change: its file loads.
    if (round > 0) {
      ASSERT_TRUE(daemon.start()) << daemon.log();
    }
    for (const Target& target : targets) {
      if (target.lastAcked == 0) continue;
      const uint64_t n = storedN(daemon, target.uuid);
      EXPECT_GE(n, target.lastAcked);
      EXPECT_LE(n, target.lastSent);
    }
    std::string unexpected;
    std::thread client([&] {
      RawClient connection(daemon.socketPath());
      while (connection.connected()) {
        const uint64_t n = ++next;
        Target& target = targets[n % targets.size()];
        Dictionary extension{{"n", Value(n)}, {"round", Value(round)}};
        target.lastSent = n;
        if (!connection.sendMessage(
                request("annotate",
                        {{"annotations", Value(Dictionary{{"extension", Value(extension)}})},
                         {"uuids", Value(Array{Value(target.uuid)})}}),
                n)) {
          return;
        }
        auto reply = connection.readFrame(std::chrono::seconds(5));
        if (!reply) return;
        if (reply->id != n || replyErrorCode(reply->body) != 0) {
          unexpected = reply->body.description();
          return;
        }
        target.lastAcked = n;
        ++acknowledged;
      }
    });
    std::this_thread::sleep_for(
        std::chrono::milliseconds(std::uniform_int_distribution<int>(0, 30)(random)));
    daemon.kill9();
    client.join();
    ASSERT_EQ(unexpected, "") << "unexpected reply";
  }
  std::cout << acknowledged << " acknowledged changes over 100 kills\n";
  EXPECT_GT(acknowledged, 0u) << "no change was ever acknowledged: the test proved nothing";
  EXPECT_EQ(daemon.log().find("unable to load annotation database"), std::string::npos);
  for (const auto& entry : fs::directory_iterator(daemon.root().path() / "state")) {
    EXPECT_EQ(entry.path().filename().string().find(".bad-"), std::string::npos) << entry.path();
  }
}

}  // namespace
}  // namespace ek::test
