#include "ekd/EkDatabase.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

constexpr std::string_view kAutoElect = "com.corvane.developer.auto-elect-plugin";
constexpr std::string_view kReplacePlugIn = "com.corvane.developer.replace-plugin";

class DatabaseTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ::setenv("EKORA_STATE_DIR", dir_.path().c_str(), 1);
    ASSERT_TRUE(
        database_->initWithDatabase(annotationPath(), {registry_, nullptr, "/System", notifier_}));
    database_->setDelegate([this](const std::vector<vantor::PlugInProxyPtr>& plugIns) {
      std::lock_guard lock(mutex_);
      for (const auto& proxy : plugIns) removed_.push_back(proxy->uuid);
    });
    registry_->addObserver(database_);
  }

  std::string annotationPath() const { return dir_.file("Annotations"); }

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

  // The registry's notices, and the work they hand to the database's queue.
  void drainRegistry() {
    std::promise<void> drained;
    registry_->queue()->async([&] { drained.set_value(); });
    drained.get_future().wait();
    database_->databaseQueue()->sync([] {});
  }
  // Changes the store as another request would, on the database's queue.
  void elect(const std::string& key, uint64_t election) {
    database_->databaseQueue()->sync([&] {
      EXPECT_TRUE(database_->annotations()
                      .setAnnotation(Dictionary{{"election", Value(election)}}, key)
                      .ok());
    });
  }
  std::optional<Value> storedElection(const std::string& key) {
    std::optional<Value> election;
    database_->databaseQueue()->sync([&] {
      auto annotation = database_->annotations().annotationForIdentifier(key);
      if (annotation && annotation->contains("election")) election = annotation->at("election");
    });
    return election;
  }
  std::vector<std::string> found(const Dictionary& query) {
    std::vector<std::string> identifiers;
    for (const auto& plugIn : database_->findPlugIns(query).value_or(std::vector<EkDPlugInRef>{})) {
      identifiers.push_back(plugIn->identifier().value_or(""));
    }
    std::sort(identifiers.begin(), identifiers.end());
    return identifiers;
  }

  testing::TempDir dir_;
  std::shared_ptr<vantor::FakeRegistry> registry_ = std::make_shared<vantor::FakeRegistry>();
  std::shared_ptr<notify::FakeNotifier> notifier_ = std::make_shared<notify::FakeNotifier>();
  std::shared_ptr<EkDatabase> database_ = std::make_shared<EkDatabase>();
  std::mutex mutex_;
  std::vector<Uuid> removed_;
};

TEST_F(DatabaseTest, RecordsAreCachedByUuidAndPathAndPurgedPastTheLimit) {
  EXPECT_EQ(database_->findPlugIn(Uuid::random()), nullptr);
  EXPECT_EQ(database_->findPlugInAtPath("file:///nowhere/X.appex"), nullptr);
  std::vector<vantor::PlugInProxy> proxies;
  for (int i = 0; i < 4; ++i) proxies.push_back(install("com.example.p" + std::to_string(i)));
  auto first = database_->findPlugIn(proxies[0].uuid);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(database_->findPlugIn(proxies[0].uuid), first);
  EXPECT_EQ(database_->findPlugInAtPath(proxies[0].url + "/"), first);
  EXPECT_EQ(database_->findPlugInAtPath(proxies[0].path), first);

  database_->setCacheLimit(2);
  for (int i = 1; i < 3; ++i) ASSERT_NE(database_->findPlugIn(proxies[i].uuid), nullptr);
  EXPECT_EQ(database_->cacheCount(), 3u);  // 2 is not greater than 2 when the third went in
  EXPECT_EQ(registry_->clearCachesCount(), 0);
  auto fourth = database_->findPlugIn(proxies[3].uuid);
  EXPECT_EQ(database_->cacheCount(), 1u);
  EXPECT_EQ(registry_->clearCachesCount(), 1);
  EXPECT_EQ(database_->findPlugIn(proxies[3].uuid), fourth);

  registry_->changeLocale();
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 0u);
  EXPECT_EQ(registry_->clearCachesCount(), 2);
}

TEST_F(DatabaseTest, FullCacheEvictsTheLeastRecentlyUsedRecord) {
  database_->setCacheCapacity(2);
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  auto keptA = database_->findPlugIn(a.uuid);
  auto keptB = database_->findPlugIn(b.uuid);
  EXPECT_EQ(database_->findPlugInAtPath(a.path), keptA);  // a is now the more recent
  database_->findPlugIn(install("com.example.c").uuid);
  EXPECT_EQ(database_->cacheCount(), 2u);
  EXPECT_EQ(database_->findPlugIn(a.uuid), keptA);
  EXPECT_NE(database_->findPlugIn(b.uuid), keptB);  // built again
}

TEST_F(DatabaseTest, UninstallDropsTheCachedRecordAndTellsTheDelegateOnce) {
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  database_->findPlugIn(a.uuid);
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 1u);  // an install notice leaves the cache alone
  ASSERT_TRUE(registry_->uninstall(a.uuid));
  ASSERT_TRUE(registry_->uninstall(b.uuid));
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 0u);
  std::lock_guard lock(mutex_);
  EXPECT_EQ(removed_, (std::vector<Uuid>{a.uuid, b.uuid}));
}

TEST_F(DatabaseTest, AutoElectionElectsOnlyWithoutAChoiceAndWritesThrough) {
  const Dictionary autoElect{{std::string(kAutoElect), Value(true)}};
  const auto proxies = {install("com.example.fresh", autoElect),
                        install("com.example.two", autoElect),
                        install("com.example.zero", autoElect),
                        install("com.example.off", {{std::string(kAutoElect), Value(false)}})};
  elect("com.example.two", 2);
  elect("com.example.zero", 0);
  for (const auto& proxy : proxies) ASSERT_NE(database_->findPlugIn(proxy.uuid), nullptr);
  EXPECT_EQ(storedElection("com.example.fresh"), Value(uint64_t{1}));
  EXPECT_EQ(storedElection("com.example.two"), Value(uint64_t{2}));
  EXPECT_EQ(storedElection("com.example.zero"), Value(uint64_t{1}));
  EXPECT_EQ(storedElection("com.example.off"), std::nullopt);
  EXPECT_EQ(notifier_->posts().size(), 0u);  // auto-election posts nothing
  auto reopened = EkDAnnotationStore::initWithDatabase(annotationPath());
  EXPECT_EQ(reopened->annotationForIdentifier("com.example.fresh"),
            (Dictionary{{"election", Value(uint64_t{1})}}));
}

TEST_F(DatabaseTest, QueryElectionsNormaliseOrTurnTheFilterOff) {
  struct Row {
    Value election;
    std::optional<std::vector<std::string>> list;
  };
  const Row rows[] = {
      {Value("=1"), std::vector<std::string>{"1"}},
      {Value("a7"), std::vector<std::string>{"a7"}},
      {Value(Array{Value("1"), Value("=0")}), std::vector<std::string>{"1", "0"}},
      {Value("<2"), std::nullopt},
      {Value("!1"), std::nullopt},
      {Value(""), std::nullopt},
      {Value(Array{Value("1"), Value("<2")}), std::nullopt},
      {Value(uint64_t{1}), std::nullopt},
  };
  for (const Row& row : rows) {
    EXPECT_EQ(EkDatabase::electionList(Dictionary{{"ZuUserElection", row.election}}), row.list)
        << row.election.description();
  }
  EXPECT_EQ(EkDatabase::electionList(Dictionary{}), std::nullopt);
}

TEST_F(DatabaseTest, QueryElectionFilterUsesStoredElectionsAutoElectAndReplacement) {
  EXPECT_EQ(database_->findPlugIns({}), std::nullopt);
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
  EXPECT_EQ(database_->findPlugIns({{"ZuUserElection", Value("01")}}), std::nullopt);

  // Every record is cached now; the filter still reads the elections as they are.
  elect("com.example.none", 1);
  elect("com.example.auto", 0);
  EXPECT_EQ(found(elected),
            (std::vector<std::string>{"com.example.elected", "com.example.none",
                                      "com.example.replacement", "com.example.wide"}));
  EXPECT_EQ(found(unelected), (std::vector<std::string>{"com.example.auto"}));
}

TEST_F(DatabaseTest, EncodedAnnotationsFollowEveryChangeOfTheStore) {
  auto original = database_->findPlugIn(install("com.example.shared").uuid);
  // Files its annotations under the identifier it replaces: one entry for both records.
  auto replacement = database_->findPlugIn(
      install("com.example.replacement", {{std::string(kReplacePlugIn), "com.example.shared"}})
          .uuid);
  auto other = database_->findPlugIn(install("com.example.other").uuid);
  ASSERT_TRUE(original && replacement && other);
  const std::vector<const EkDPlugIn*> records = {original.get(), replacement.get(), other.get()};
  auto annotations = [&] {
    std::vector<Dictionary> decoded;
    for (const auto& encoded : database_->encodedAnnotationsForPlugIns(records)) {
      Result<Value> value = cbor::decode(encoded.span());
      decoded.push_back(value.ok() && value->dictionary() ? *value->dictionary()
                                                          : Dictionary{{"undecodable", true}});
    }
    return decoded;
  };
  const Dictionary none;
  const Dictionary one{{"election", Value(uint64_t{1})}};
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));
  // Through either record, and asked twice: the second answer comes from what was kept.
  EXPECT_TRUE(database_->setAnnotation(one, *replacement).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
  EXPECT_EQ(notifier_->count("com.corvane.ekora.annotation-change"), 0u);
  EXPECT_TRUE(database_->setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));
  // Straight through the store, and by loading another file.
  elect("com.example.other", 1);
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, one}));
  const std::string file = dir_.file("Other");
  ASSERT_TRUE(testing::writeFile(
      file, dmap::write(Value(Dictionary{{"version", Value(uint64_t{16})},
                                         {"data", Dictionary{{"com.example.shared", one}}}}))
                .value()));
  database_->databaseQueue()->sync(
      [&] { EXPECT_TRUE(database_->annotations().loadDb(file).ok()); });
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));

  // Changes whose save fails are undone, and so is what the records noted of them meanwhile.
  std::filesystem::remove(annotationPath());
  std::filesystem::create_directories(annotationPath() + "/in-the-way");
  const Dictionary seven{{"election", Value(uint64_t{7})}};
  database_->beginAnnotationChanges();
  EXPECT_TRUE(database_->setAnnotation(seven, *other).ok());
  EXPECT_TRUE(database_->setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, seven}));
  EXPECT_FALSE(database_->commitAnnotationChanges().ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{one, one, none}));
}

}  // namespace
}  // namespace ek
