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
#include "platform/cbor/Cbor.h"
#include "platform/testing/Files.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

constexpr std::string_view kChange = "com.corvane.ekora.annotation-change";
constexpr std::string_view kAutoElect = "com.corvane.developer.auto-elect-plugin";
constexpr std::string_view kReplacePlugIn = "com.corvane.developer.replace-plugin";

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

  // Installs a plug-in inside an application (so it passes the record's checks).
  vantor::PlugInProxy install(const std::string& identifier, Dictionary entitlements = {}) {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = proxy.originalIdentifier = identifier;
    proxy.path = "/Applications/Host.app/PlugIns/" + identifier + ".appex";
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.containingAppPath = "/Applications/Host.app";
    proxy.dataContainerPath = "/var/lib/ekora/containers/" + identifier;
    proxy.entitlements = std::move(entitlements);
    proxy.extensionPoint = "com.corvane.share";
    const Dictionary attributes{{"ZuExtensionPointIdentifier", Value("com.corvane.share")}};
    proxy.info = Dictionary{
        {"QvBundleIdentifier", Value(identifier)},
        {"ZuExtension", Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.corvane.share")},
                                         {"ZuExtensionAttributes", Value(attributes)}})}};
    registry_->install(proxy);
    return proxy;
  }
  std::shared_ptr<EkDPlugIn> plugIn(const std::string& identifier) {
    auto record = database().findPlugIn(install(identifier).uuid);
    EXPECT_NE(record, nullptr);
    return record;
  }
  std::shared_ptr<EkDPlugInHold> hold(std::vector<std::shared_ptr<EkDPlugIn>> plugIns,
                                      std::shared_ptr<EkDWyreClient> client) {
    return EkDPlugInHold::initWithPlugIns(std::move(plugIns), std::move(client), serviceManager_);
  }

  EkDatabase& database() { return server_->database(); }
  std::string annotationPath() { return database().annotations().annotationsURL(); }
  // The registry's notices, and the work they hand to the database's queue.
  void drainRegistry() {
    std::promise<void> drained;
    registry_->queue()->async([&] { drained.set_value(); });
    drained.get_future().wait();
    database().databaseQueue()->sync([] {});
  }
  // Changes the store as another request would, on the database's queue.
  void elect(const std::string& key, uint64_t election) {
    database().databaseQueue()->sync([&] {
      EXPECT_TRUE(database()
                      .annotations()
                      .setAnnotation(Dictionary{{"election", Value(election)}}, key)
                      .ok());
    });
  }
  std::optional<Value> storedElection(const std::string& key) {
    std::optional<Value> election;
    database().databaseQueue()->sync([&] {
      auto annotation = database().annotations().annotationForIdentifier(key);
      if (annotation && annotation->contains("election")) election = annotation->at("election");
    });
    return election;
  }
  std::vector<std::string> found(const Dictionary& query) {
    std::vector<std::string> identifiers;
    for (const auto& plugIn : database().findPlugIns(query).value_or(std::vector<EkDPlugInRef>{})) {
      identifiers.push_back(plugIn->identifier().value_or(""));
    }
    std::sort(identifiers.begin(), identifiers.end());
    return identifiers;
  }

  testing::TempDir dir_;
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<FakeSandboxCheck> sandbox_ = std::make_shared<FakeSandboxCheck>();
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<stard::FakeServiceManager> serviceManager_ =
      std::make_shared<stard::FakeServiceManager>();
  std::shared_ptr<notify::FakeNotifier> notifier_ = std::make_shared<notify::FakeNotifier>();
  std::shared_ptr<EkDServer> server_;
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

TEST_F(EkDServerTest, HangingUpStopsWorkAndReleasesTheClientsHolds) {
  auto client = connectClient();
  server_->addHold(hold({plugIn("com.example.a")}, client));
  EXPECT_TRUE(client->acceptWork());
  close(peers_.back());
  peers_.pop_back();
  EXPECT_TRUE(eventually([&] { return !client->acceptWork() && server_->holdCount() == 0; }));
}

// ---- The database -----------------------------------------------------------------------------

using DatabaseTest = EkDServerTest;

TEST_F(DatabaseTest, RecordsAreCachedByUuidAndPathAndPurgedPastTheLimit) {
  EXPECT_EQ(database().findPlugIn(Uuid::random()), nullptr);
  EXPECT_EQ(database().findPlugInAtPath("file:///nowhere/X.appex"), nullptr);
  std::vector<vantor::PlugInProxy> proxies;
  for (int i = 0; i < 4; ++i) proxies.push_back(install("com.example.p" + std::to_string(i)));
  auto first = database().findPlugIn(proxies[0].uuid);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(database().findPlugIn(proxies[0].uuid), first);
  EXPECT_EQ(database().findPlugInAtPath(proxies[0].url + "/"), first);
  EXPECT_EQ(database().findPlugInAtPath(proxies[0].path), first);

  database().setCacheLimit(2);
  for (int i = 1; i < 3; ++i) ASSERT_NE(database().findPlugIn(proxies[i].uuid), nullptr);
  EXPECT_EQ(database().cacheCount(), 3u);  // 2 is not greater than 2 when the third went in
  EXPECT_EQ(registry_->clearCachesCount(), 0);
  auto fourth = database().findPlugIn(proxies[3].uuid);
  EXPECT_EQ(database().cacheCount(), 1u);
  EXPECT_EQ(registry_->clearCachesCount(), 1);
  EXPECT_EQ(database().findPlugIn(proxies[3].uuid), fourth);

  registry_->changeLocale();
  drainRegistry();
  EXPECT_EQ(database().cacheCount(), 0u);
  EXPECT_EQ(registry_->clearCachesCount(), 2);
}

TEST_F(DatabaseTest, UninstallDropsTheCachedRecordAndEndsItsInstances) {
  auto a = install("com.example.a");
  database().findPlugIn(a.uuid);
  drainRegistry();
  EXPECT_EQ(database().cacheCount(), 1u);  // an install notice leaves the cache alone
  ASSERT_TRUE(registry_->uninstall(a.uuid));
  drainRegistry();
  EXPECT_EQ(database().cacheCount(), 0u);
  EXPECT_TRUE(eventually([&] { return serviceManager_->removals().size() == 1; }));
  EXPECT_EQ(serviceManager_->removals()[0].bundleIdentifier, "com.example.a");
}

TEST_F(DatabaseTest, AutoElectionElectsOnlyWithoutAChoice) {
  const Dictionary autoElect{{std::string(kAutoElect), Value(true)}};
  const auto proxies = {install("com.example.fresh", autoElect),
                        install("com.example.two", autoElect),
                        install("com.example.zero", autoElect),
                        install("com.example.off", {{std::string(kAutoElect), Value(false)}})};
  elect("com.example.two", 2);
  elect("com.example.zero", 0);
  for (const auto& proxy : proxies) ASSERT_NE(database().findPlugIn(proxy.uuid), nullptr);
  EXPECT_EQ(storedElection("com.example.fresh"), Value(uint64_t{1}));
  EXPECT_EQ(storedElection("com.example.two"), Value(uint64_t{2}));
  EXPECT_EQ(storedElection("com.example.zero"), Value(uint64_t{1}));
  EXPECT_EQ(storedElection("com.example.off"), std::nullopt);
  EXPECT_EQ(notifier_->posts().size(), 0u);  // auto-election posts nothing
}

TEST_F(DatabaseTest, QueryElectionFilterUsesStoredElectionsAutoElectAndReplacement) {
  EXPECT_EQ(database().findPlugIns({}), std::nullopt);
  install("com.example.elected");
  install("com.example.none");
  install("com.example.wide");
  install("com.example.auto", {{std::string(kAutoElect), Value(uint64_t{1})}});
  install("com.example.replacement", {{std::string(kReplacePlugIn), Value("com.example.elected")}});
  elect("com.example.elected", 1);
  elect("com.example.wide", 257);  // only the low 8 bits take part: 257 counts as 1
  const Dictionary elected{{"ZuExtensionPointIdentifier", Value("com.corvane.share")},
                           {"ZuUserElection", Value("=1")}};
  const Dictionary unelected{{"ZuUserElection", Value("0")}};
  EXPECT_EQ(found(elected),
            (std::vector<std::string>{"com.example.auto", "com.example.elected",
                                      "com.example.replacement", "com.example.wide"}));
  EXPECT_EQ(found(unelected), (std::vector<std::string>{"com.example.none"}));
  EXPECT_EQ(found({{"ZuUserElection", Value(Array{Value("1"), Value("<2")})}}).size(), 5u);
  EXPECT_EQ(database().findPlugIns({{"ZuUserElection", Value("01")}}), std::nullopt);

  // Every record is cached now; the filter still reads the elections as they are.
  elect("com.example.none", 1);
  elect("com.example.auto", 0);
  EXPECT_EQ(found(elected),
            (std::vector<std::string>{"com.example.elected", "com.example.none",
                                      "com.example.replacement", "com.example.wide"}));
  EXPECT_EQ(found(unelected), (std::vector<std::string>{"com.example.auto"}));
}

TEST_F(DatabaseTest, EncodedAnnotationsFollowEveryChangeOfTheStore) {
  auto original = database().findPlugIn(install("com.example.shared").uuid);
  // Files its annotations under the identifier it replaces: one entry for both records.
  auto replacement = database().findPlugIn(
      install("com.example.replacement", {{std::string(kReplacePlugIn), "com.example.shared"}})
          .uuid);
  auto other = database().findPlugIn(install("com.example.other").uuid);
  ASSERT_TRUE(original && replacement && other);
  const std::vector<const EkDPlugIn*> records = {original.get(), replacement.get(), other.get()};
  auto annotations = [&] {
    std::vector<Dictionary> decoded;
    for (const auto& encoded : database().encodedAnnotationsForPlugIns(records)) {
      Result<Value> value = cbor::decode(encoded.span());
      decoded.push_back(value.ok() && value->dictionary() ? *value->dictionary()
                                                          : Dictionary{{"undecodable", true}});
    }
    return decoded;
  };
  const Dictionary none;
  const Dictionary one{{"election", Value(uint64_t{1})}};
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));
  // Through either record.
  EXPECT_TRUE(database().setAnnotation(one, *replacement).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
  EXPECT_EQ(notifier_->count("com.corvane.ekora.annotation-change"), 0u);
  EXPECT_TRUE(database().setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));
  elect("com.example.shared", 1);  // straight through the store
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
  // Changes whose save fails are undone, and so is what the records noted of them meanwhile.
  std::filesystem::remove(annotationPath());
  std::filesystem::create_directories(annotationPath() + "/in-the-way");
  const Dictionary seven{{"election", Value(uint64_t{7})}};
  database().beginAnnotationChanges();
  EXPECT_TRUE(database().setAnnotation(seven, *other).ok());
  EXPECT_TRUE(database().setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, seven}));
  EXPECT_FALSE(database().commitAnnotationChanges().ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
}

}  // namespace
}  // namespace ek
