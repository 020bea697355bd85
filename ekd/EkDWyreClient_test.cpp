#include "ekd/EkDWyreClient.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <chrono>
#include <filesystem>
#include <mutex>
#include <thread>

#include "ekd/EkDServer.h"
#include "platform/log/Log.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    lines_.emplace_back(record.message);
  }
  size_t count(std::string_view prefix) {
    std::lock_guard lock(mutex_);
    size_t n = 0;
    for (const auto& line : lines_) n += line.rfind(prefix, 0) == 0;
    return n;
  }

 private:
  std::mutex mutex_;
  std::vector<std::string> lines_;
};

template <typename Predicate>
bool eventually(Predicate predicate) {
  for (int i = 0; i < 500; ++i) {
    if (predicate()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

class EkDWyreClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ekd-client-test-XXXXXX";
    ASSERT_TRUE(mkdtemp(pattern));
    dir_ = pattern;
    setenv("EKORA_RUNTIME_DIR", dir_.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir_.c_str(), 1);
    codeSigning_ = std::make_shared<FakeCodeSigning>();
    sandbox_ = std::make_shared<FakeSandboxCheck>();
    codeSigning_->setEntitlements(getpid(), Dictionary{{"false", false},
                                                       {"true", true},
                                                       {"zero", 0},
                                                       {"two", 2},
                                                       {"string", "x"},
                                                       {"array", Array{}}});
    sandbox_->setSandboxed(getpid(), true);
    server_ = EkDServer::initForService(
        "unit", std::nullopt, {codeSigning_, sandbox_, std::make_shared<vantor::FakeRegistry>()});
    ASSERT_TRUE(server_);

    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    peer_ = fds[1];
    asio::local::stream_protocol::socket socket(wyre::ioContext());
    socket.assign(asio::local::stream_protocol(), fds[0]);
    auto token = AuditToken::forSocket(fds[0]);
    ASSERT_TRUE(token);
    client_ = EkDWyreClient::initWithConnection(
        wyre::Connection::adopt(std::move(socket), std::move(*token)), server_);
  }
  void TearDown() override {
    if (peer_ >= 0) close(peer_);
    server_->stop();
    log::setSink(nullptr);
    log::configure("default");
    std::filesystem::remove_all(dir_);
  }
  void hangUp() {
    close(peer_);
    peer_ = -1;
  }

  std::string dir_;
  std::shared_ptr<FakeCodeSigning> codeSigning_;
  std::shared_ptr<FakeSandboxCheck> sandbox_;
  std::shared_ptr<EkDServer> server_;
  std::shared_ptr<EkDWyreClient> client_;
  int peer_ = -1;
};

// One rule for hosts and plug-ins: present and not boolean false (a number 0 holds it).
TEST_F(EkDWyreClientTest, EntitlementIsHeldUnlessAbsentOrFalse) {
  const auto& process = *client_->process();
  EXPECT_FALSE(process.hasEntitlement("false"));
  EXPECT_TRUE(process.hasEntitlement("zero"));
  EXPECT_FALSE(process.hasEntitlement("missing"));
  EXPECT_TRUE(process.hasEntitlement("true"));
  EXPECT_TRUE(process.hasEntitlement("two"));
  EXPECT_TRUE(process.hasEntitlement("string"));
  EXPECT_TRUE(process.hasEntitlement("array"));
  EXPECT_EQ(process.entitlementValueForKey("string"), Value("x"));
}

TEST_F(EkDWyreClientTest, EntitlementErrorsReadAsAbsent) {
  codeSigning_->failFor(getpid());
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  asio::local::stream_protocol::socket socket(wyre::ioContext());
  socket.assign(asio::local::stream_protocol(), fds[0]);
  auto failing = EkDWyreClient::initWithConnection(
      wyre::Connection::adopt(std::move(socket), *AuditToken::forSocket(fds[0])), server_);
  EXPECT_FALSE(failing->process()->entitlementValueForKey("true"));
  EXPECT_FALSE(failing->process()->hasEntitlement("true"));
  close(fds[1]);
}

TEST_F(EkDWyreClientTest, KnowsItsPeerAndSandbox) {
  EXPECT_EQ(client_->pid(), getpid());
  EXPECT_TRUE(client_->process()->isSandboxed());
  EXPECT_EQ(client_->process()->path(), std::filesystem::read_symlink("/proc/self/exe").string());
  EXPECT_NE(client_->description().find("pid=" + std::to_string(getpid())), std::string::npos);
}

TEST_F(EkDWyreClientTest, DeathStopsWorkAndForgetsTheConnection) {
  EXPECT_TRUE(client_->acceptWork());
  hangUp();
  EXPECT_TRUE(eventually([&] { return !client_->acceptWork(); }));
  EXPECT_TRUE(eventually([&] { return client_->connection() == nullptr; }));
  EXPECT_NE(client_->description().find(" NO CONNECTION>"), std::string::npos)
      << client_->description();
}

TEST_F(EkDWyreClientTest, EveryThousandthRequestIsLogged) {
  auto sink = std::make_shared<CapturingSink>();
  log::setSink(sink);
  log::configure("debug");
  std::vector<uint8_t> frames;
  for (int i = 0; i < 2500; ++i) {
    wyre::appendFrame(frames, Value(Dictionary{{"request", "x"}, {"version", 3}}),
                      wyre::kFlagWantsReply, static_cast<uint64_t>(i));
  }
  // Drain replies while sending so neither side's buffer fills.
  std::thread reader([&] {
    char buffer[65536];
    while (read(peer_, buffer, sizeof buffer) > 0) {
    }
  });
  ASSERT_EQ(write(peer_, frames.data(), frames.size()), static_cast<ssize_t>(frames.size()));
  EXPECT_TRUE(eventually([&] { return client_->requestCount() == 2500; }));
  shutdown(peer_, SHUT_RDWR);
  reader.join();
  std::string prefix = "client " + std::to_string(getpid()) + " used ";
  EXPECT_EQ(sink->count(prefix + "1000 requests so far"), 1u);
  EXPECT_EQ(sink->count(prefix + "2000 requests so far"), 1u);
  EXPECT_EQ(sink->count(prefix), 2u);
}

}  // namespace
}  // namespace ek
