#include "ekd/EkDServer.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <chrono>
#include <filesystem>
#include <future>
#include <mutex>
#include <thread>

#include <fmt/format.h>

#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDWyreClient.h"
#include "platform/log/Log.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

constexpr std::string_view kChange = "com.corvane.ekora.annotation-change";

class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    lines_.emplace_back(fmt_level(record.level) + std::string(record.message));
  }
  // Lines containing needle.
  size_t count(std::string_view needle) const {
    std::lock_guard lock(mutex_);
    size_t n = 0;
    for (const auto& line : lines_) n += line.find(needle) != std::string::npos;
    return n;
  }
  std::vector<std::string> lines() const {
    std::lock_guard lock(mutex_);
    return lines_;
  }

 private:
  static std::string fmt_level(log::Level level) {
    return std::string(log::levelName(level)) + " ";
  }
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

class EkDServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/ekd-server-test-XXXXXX";
    ASSERT_TRUE(mkdtemp(pattern));
    dir_ = pattern;
    setenv("EKORA_RUNTIME_DIR", dir_.c_str(), 1);
    setenv("EKORA_STATE_DIR", dir_.c_str(), 1);
    sink_ = std::make_shared<CapturingSink>();
    log::setSink(sink_);
    log::configure("debug");
    registry_ = std::make_shared<vantor::FakeRegistry>();
    serviceManager_ = std::make_shared<stard::FakeServiceManager>();
    notifier_ = std::make_shared<notify::FakeNotifier>();
    EkDPlatform platform;
    platform.codeSigning = std::make_shared<FakeCodeSigning>();
    platform.sandbox = std::make_shared<FakeSandboxCheck>();
    platform.registry = registry_;
    platform.serviceManager = serviceManager_;
    platform.notifier = notifier_;
    server_ = EkDServer::initForService("unit-server", std::nullopt, platform);
    ASSERT_TRUE(server_);
  }
  void TearDown() override {
    for (int fd : peers_) close(fd);
    server_->stop();
    log::setSink(nullptr);
    log::configure("default");
    std::filesystem::remove_all(dir_);
  }

  std::shared_ptr<EkDWyreClient> connectClient() {
    int fds[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    peers_.push_back(fds[1]);
    asio::local::stream_protocol::socket socket(wyre::ioContext());
    socket.assign(asio::local::stream_protocol(), fds[0]);
    auto token = AuditToken::forSocket(fds[0]);
    EXPECT_TRUE(token);
    return EkDWyreClient::initWithConnection(
        wyre::Connection::adopt(std::move(socket), std::move(*token)), server_);
  }

  std::shared_ptr<EkDPlugIn> plugIn(const std::string& identifier,
                                    std::optional<std::string> version = "7") {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = identifier;
    proxy.originalIdentifier = identifier;
    proxy.path = "/Applications/Host.app/PlugIns/" + identifier + ".appex";
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.containingAppPath = "/Applications/Host.app";
    proxy.dataContainerPath = "/var/lib/ekora/containers/" + identifier;
    Dictionary attributes{{"ZuExtensionPointIdentifier", Value("com.corvane.share")}};
    proxy.info = Dictionary{
        {"QvBundleIdentifier", Value(identifier)},
        {"ZuExtension", Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.corvane.share")},
                                         {"ZuExtensionAttributes", Value(attributes)}})}};
    if (version) proxy.info.emplace("QvBundleVersion", Value(*version));
    registry_->install(proxy);
    proxies_.push_back(registry_->plugInByUuid(proxy.uuid));
    auto record = server_->database().findPlugIn(proxy.uuid);
    EXPECT_NE(record, nullptr) << sink_->lines().back();
    return record;
  }

  // Runs terminatePlugIns and waits for its completion.
  void terminate(const std::vector<vantor::PlugInProxyPtr>& proxies) {
    std::promise<void> completed;
    server_->terminatePlugIns(proxies, [&] { completed.set_value(); });
    ASSERT_EQ(completed.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
  }

  std::string dir_;
  std::shared_ptr<CapturingSink> sink_;
  std::shared_ptr<vantor::FakeRegistry> registry_;
  std::shared_ptr<stard::FakeServiceManager> serviceManager_;
  std::shared_ptr<notify::FakeNotifier> notifier_;
  std::shared_ptr<EkDServer> server_;
  std::vector<vantor::PlugInProxyPtr> proxies_;
  std::vector<int> peers_;
};

TEST_F(EkDServerTest, HoldBlocksUntilEveryHoldOnThePlugInIsReleased) {
  auto client = connectClient();
  auto a = plugIn("com.example.a");
  auto b = plugIn("com.example.b");
  auto first = EkDPlugInHold::initWithPlugIns({a, b}, client, serviceManager_);
  auto second = EkDPlugInHold::initWithPlugIns({a}, client, serviceManager_);
  Uuid firstToken = first->uuid(), secondToken = second->uuid();
  EXPECT_NE(firstToken, secondToken);
  EXPECT_EQ(serviceManager_->transactionCount(), 2);
  server_->addHold(std::move(first));
  server_->addHold(std::move(second));
  EXPECT_EQ(notifier_->count(kChange), 2u);

  EXPECT_TRUE(server_->holdOnPlugIn(*a));
  server_->unholdToken(firstToken);
  EXPECT_TRUE(server_->holdOnPlugIn(*a));
  EXPECT_FALSE(server_->holdOnPlugIn(*b));
  server_->unholdToken(secondToken);
  EXPECT_FALSE(server_->holdOnPlugIn(*a));
  EXPECT_EQ(notifier_->count(kChange), 4u);
  EXPECT_EQ(sink_->count("at client's request"), 2u);
  // The list owned the holds: their keep-alive transactions are over.
  EXPECT_EQ(serviceManager_->transactionCount(), 0);
}

TEST_F(EkDServerTest, UnknownTokenChangesNothingAndPostsNothing) {
  auto client = connectClient();
  server_->addHold(
      EkDPlugInHold::initWithPlugIns({plugIn("com.example.a")}, client, serviceManager_));
  size_t posts = notifier_->count(kChange);
  server_->unholdToken(Uuid::random());
  EXPECT_EQ(server_->holdCount(), 1u);
  EXPECT_EQ(notifier_->count(kChange), posts);
  EXPECT_EQ(sink_->count("releasing plug-in hold"), 0u);
}

TEST_F(EkDServerTest, HoldPlacedAfterItsClientDiedIsDropped) {
  // A hold request that passed its client's check before the client died must not outlive it.
  auto dying = connectClient();
  auto a = plugIn("com.example.a");
  dying->dead();
  size_t posts = notifier_->count(kChange);
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, dying, serviceManager_));
  EXPECT_EQ(server_->holdCount(), 0u);
  EXPECT_FALSE(server_->holdOnPlugIn(*a));
  EXPECT_EQ(notifier_->count(kChange), posts);
}

TEST_F(EkDServerTest, DeadClientReleasesOnlyItsOwnHoldsOnePostEach) {
  auto dying = connectClient();
  auto other = connectClient();
  auto a = plugIn("com.example.a");
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, dying, serviceManager_));
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, other, serviceManager_));
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, dying, serviceManager_));
  size_t posts = notifier_->count(kChange);
  dying->dead();
  EXPECT_EQ(server_->holdCount(), 1u);
  EXPECT_EQ(notifier_->count(kChange), posts + 2);
  EXPECT_EQ(sink_->count(fmt::format("for dead client pid {}", dying->pid())), 2u);
  EXPECT_TRUE(server_->holdOnPlugIn(*a));
}

TEST_F(EkDServerTest, HangingUpReleasesTheHoldsThroughTheConnection) {
  auto client = connectClient();
  server_->addHold(
      EkDPlugInHold::initWithPlugIns({plugIn("com.example.a")}, client, serviceManager_));
  close(peers_.back());
  peers_.pop_back();
  for (int i = 0; i < 1000 && server_->holdCount() != 0; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_EQ(server_->holdCount(), 0u);
}

TEST_F(EkDServerTest, StopReleasesEveryHoldAndPostsOnceEvenWhenEmpty) {
  auto client = connectClient();
  auto a = plugIn("com.example.a");
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, client, serviceManager_));
  server_->addHold(EkDPlugInHold::initWithPlugIns({a}, client, serviceManager_));
  size_t posts = notifier_->count(kChange);
  server_->stop();
  EXPECT_EQ(server_->holdCount(), 0u);
  EXPECT_EQ(notifier_->count(kChange), posts + 1);
  EXPECT_EQ(sink_->count("because server is stopping"), 2u);
  server_->stop();
  EXPECT_EQ(notifier_->count(kChange), posts + 2);
}

TEST_F(EkDServerTest, TerminatingNothingStillCompletes) {
  terminate({});
  EXPECT_EQ(sink_->count("waiting for 0 termination replies"), 1u);
  EXPECT_EQ(sink_->count("awaiting termination reply"), 0u);
  EXPECT_EQ(sink_->count("sending termination reply"), 1u);
}

TEST_F(EkDServerTest, TerminationLogsEachAnswerAndCompletesAfterAll) {
  plugIn("com.example.zero");
  plugIn("com.example.none", std::nullopt);
  plugIn("com.example.five");
  serviceManager_->setRemovalAnswer("com.example.zero", 0);
  serviceManager_->setRemovalAnswer("com.example.none", 3);
  serviceManager_->setRemovalAnswer("com.example.five", 5);
  terminate(proxies_);
  EXPECT_EQ(sink_->count("info one or more plug-ins have been terminated for uuid="), 1u);
  EXPECT_EQ(sink_->count("debug stard reported no plug-ins on record for uuid="), 1u);
  EXPECT_EQ(sink_->count("error stard error attempting to terminate plug-ins: error=5"), 1u);
  EXPECT_EQ(sink_->count("awaiting termination reply #"), 3u);
  EXPECT_EQ(sink_->count("sending termination reply"), 1u);
  // A plug-in without a version is named with "1".
  auto removals = serviceManager_->removals();
  ASSERT_EQ(removals.size(), 3u);
  EXPECT_EQ(removals[0].version, "7");
  EXPECT_EQ(removals[1].version, "1");
}

TEST_F(EkDServerTest, TerminationWaitsForAnOutstandingAnswer) {
  plugIn("com.example.slow");
  serviceManager_->holdAnswers("com.example.slow");
  std::promise<void> completed;
  auto future = completed.get_future();
  server_->terminatePlugIns(proxies_, [&] { completed.set_value(); });
  EXPECT_EQ(future.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
  serviceManager_->releaseHeldAnswers();
  EXPECT_EQ(future.wait_for(std::chrono::seconds(30)), std::future_status::ready);
}

TEST_F(EkDServerTest, UninstallEndsThePlugInsInstances) {
  auto a = plugIn("com.example.a");
  registry_->uninstall(a->uuid());
  for (int i = 0; i < 1000 && sink_->count("removal complete for") == 0; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  auto removals = serviceManager_->removals();
  ASSERT_EQ(removals.size(), 1u);
  EXPECT_EQ(removals[0].bundleIdentifier, "com.example.a");
  EXPECT_EQ(sink_->count("removal complete for"), 1u);
}

}  // namespace
}  // namespace ek
