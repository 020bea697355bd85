#include "ekd/EkDServer.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/local/stream_protocol.hpp>
#include <chrono>
#include <filesystem>
#include <future>
#include <thread>

#include "ekd/EkDPlugInHold.h"
#include "ekd/EkDWyreClient.h"
#include "platform/testing/Files.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

constexpr std::string_view kChange = "com.corvane.ekora.annotation-change";

template <typename Predicate>
bool eventually(Predicate predicate) {
  for (int i = 0; i < 1000 && !predicate(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return predicate();
}

class EkDServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("EKORA_RUNTIME_DIR", dir_.path().c_str(), 1);
    setenv("EKORA_STATE_DIR", dir_.path().c_str(), 1);
    codeSigning_->setEntitlements(
        getpid(), Dictionary{{"false", false}, {"zero", 0}, {"string", "x"}, {"array", Array{}}});
    sandbox_->setSandboxed(getpid(), true);
    server_ =
        EkDServer::initForService("unit-server", std::nullopt,
                                  {codeSigning_, sandbox_, registry_, serviceManager_, notifier_});
    ASSERT_TRUE(server_);
  }
  void TearDown() override {
    for (int fd : peers_) close(fd);
    server_->stop();
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
    proxy.identifier = proxy.originalIdentifier = identifier;
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
    EXPECT_NE(record, nullptr);
    return record;
  }
  std::shared_ptr<EkDPlugInHold> hold(std::vector<std::shared_ptr<EkDPlugIn>> plugIns,
                                      std::shared_ptr<EkDWyreClient> client) {
    return EkDPlugInHold::initWithPlugIns(std::move(plugIns), std::move(client), serviceManager_);
  }

  testing::TempDir dir_;
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<FakeSandboxCheck> sandbox_ = std::make_shared<FakeSandboxCheck>();
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<stard::FakeServiceManager> serviceManager_ =
      std::make_shared<stard::FakeServiceManager>();
  std::shared_ptr<notify::FakeNotifier> notifier_ = std::make_shared<notify::FakeNotifier>();
  std::shared_ptr<EkDServer> server_;
  std::vector<vantor::PlugInProxyPtr> proxies_;
  std::vector<int> peers_;
};

TEST_F(EkDServerTest, HoldBlocksUntilEveryHoldOnThePlugInIsReleased) {
  auto client = connectClient();
  auto a = plugIn("com.example.a");
  auto b = plugIn("com.example.b");
  auto first = hold({a, b}, client);
  auto second = hold({a}, client);
  Uuid firstToken = first->uuid(), secondToken = second->uuid();
  EXPECT_EQ(serviceManager_->transactionCount(), 2);
  server_->addHold(std::move(first));
  server_->addHold(std::move(second));
  EXPECT_EQ(notifier_->count(kChange), 2u);

  server_->unholdToken(Uuid::random());
  EXPECT_EQ(notifier_->count(kChange), 2u);
  server_->unholdToken(firstToken);
  EXPECT_TRUE(server_->holdOnPlugIn(*a));
  EXPECT_FALSE(server_->holdOnPlugIn(*b));
  server_->unholdToken(secondToken);
  EXPECT_FALSE(server_->holdOnPlugIn(*a));
  EXPECT_EQ(notifier_->count(kChange), 4u);
  // The list owned the holds: their keep-alive transactions are over.
  EXPECT_EQ(serviceManager_->transactionCount(), 0);
}

TEST_F(EkDServerTest, DeadClientReleasesOnlyItsOwnHoldsAndPlacesNoMore) {
  auto dying = connectClient();
  auto other = connectClient();
  auto a = plugIn("com.example.a");
  server_->addHold(hold({a}, dying));
  server_->addHold(hold({a}, other));
  server_->addHold(hold({a}, dying));
  size_t posts = notifier_->count(kChange);
  dying->dead();
  EXPECT_EQ(server_->holdCount(), 1u);
  EXPECT_EQ(notifier_->count(kChange), posts + 2);
  EXPECT_TRUE(server_->holdOnPlugIn(*a));

  // A hold request that passed its client's check before the client died must not outlive it.
  auto b = plugIn("com.example.b");
  server_->addHold(hold({b}, dying));
  EXPECT_EQ(server_->holdCount(), 1u);
  EXPECT_FALSE(server_->holdOnPlugIn(*b));
  EXPECT_EQ(notifier_->count(kChange), posts + 2);
}

TEST_F(EkDServerTest, StopReleasesEveryHoldAndPostsOnce) {
  auto client = connectClient();
  auto a = plugIn("com.example.a");
  server_->addHold(hold({a}, client));
  server_->addHold(hold({a}, client));
  size_t posts = notifier_->count(kChange);
  server_->stop();
  EXPECT_EQ(server_->holdCount(), 0u);
  EXPECT_EQ(notifier_->count(kChange), posts + 1);
}

TEST_F(EkDServerTest, TerminationCompletesAfterEveryAnswer) {
  plugIn("com.example.zero");
  plugIn("com.example.none", std::nullopt);
  plugIn("com.example.five");
  serviceManager_->setRemovalAnswer("com.example.none", 3);
  serviceManager_->setRemovalAnswer("com.example.five", 5);
  std::promise<void> completed;
  server_->terminatePlugIns(proxies_, [&] { completed.set_value(); });
  ASSERT_EQ(completed.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
  auto removals = serviceManager_->removals();
  ASSERT_EQ(removals.size(), 3u);
  EXPECT_EQ(removals[0].version, "7");
  EXPECT_EQ(removals[1].version, "1");  // a plug-in without a version is named with "1"
}

// One rule for hosts and plug-ins: present and not boolean false (a number 0 holds it).
TEST_F(EkDServerTest, ClientKnowsItsPeerSandboxAndEntitlements) {
  auto client = connectClient();
  const auto& process = *client->process();
  EXPECT_EQ(client->pid(), getpid());
  EXPECT_TRUE(process.isSandboxed());
  EXPECT_EQ(process.path(), std::filesystem::read_symlink("/proc/self/exe").string());
  for (const char* held : {"zero", "string", "array"}) EXPECT_TRUE(process.hasEntitlement(held));
  for (const char* absent : {"false", "missing"}) EXPECT_FALSE(process.hasEntitlement(absent));
  EXPECT_EQ(process.entitlementValueForKey("string"), Value("x"));

  codeSigning_->failFor(getpid());
  auto failing = connectClient();
  EXPECT_FALSE(failing->process()->hasEntitlement("string"));
}

TEST_F(EkDServerTest, HangingUpStopsWorkAndReleasesTheClientsHolds) {
  auto client = connectClient();
  server_->addHold(hold({plugIn("com.example.a")}, client));
  EXPECT_TRUE(client->acceptWork());
  close(peers_.back());
  peers_.pop_back();
  EXPECT_TRUE(eventually([&] { return !client->acceptWork() && server_->holdCount() == 0; }));
  EXPECT_TRUE(eventually([&] { return client->connection() == nullptr; }));
}

}  // namespace
}  // namespace ek
