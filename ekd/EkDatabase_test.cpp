#include "ekd/EkDatabase.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kAutoElect = "com.corvane.developer.auto-elect-plugin";
constexpr std::string_view kReplacePlugIn = "com.corvane.developer.replace-plugin";

// A database that is its own delegate.
class TestDatabase : public EkDatabase {
 public:
  void removedPlugIns(const std::vector<vantor::PlugInProxyPtr>& plugIns) {
    std::lock_guard lock(mutex);
    removed.push_back(plugIns);
  }
  std::mutex mutex;
  std::vector<std::vector<vantor::PlugInProxyPtr>> removed;
};

// Log lines of one test.
class CapturingSink : public log::Sink {
 public:
  void write(const log::Record& record) override {
    std::lock_guard lock(mutex_);
    lines_.emplace_back(record.message);
  }
  size_t count(std::string_view needle) const {
    std::lock_guard lock(mutex_);
    size_t n = 0;
    for (const auto& line : lines_) n += line.find(needle) != std::string::npos;
    return n;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

class DatabaseTest : public ::testing::Test {
 protected:
  void SetUp() override {
    directory_ = fs::temp_directory_path() /
                 ("ekdatabase-" + std::to_string(::getpid()) + "-" + Uuid::random().string());
    fs::create_directories(directory_);
    ::setenv("EKORA_STATE_DIR", directory_.c_str(), 1);
    registry_ = std::make_shared<vantor::FakeRegistry>();
    notifier_ = std::make_shared<notify::FakeNotifier>();
    sink_ = std::make_shared<CapturingSink>();
    log::setSink(sink_);
    log::configure("debug");
    open();
  }
  void TearDown() override {
    log::configure("default");
    log::setSink(nullptr);
    database_.reset();
    fs::remove_all(directory_);
  }

  void open() {
    database_ = std::make_shared<TestDatabase>();
    ASSERT_TRUE(
        database_->initWithDatabase(annotationPath(), {registry_, nullptr, "/System", notifier_}));
    database_->setDelegate([this](const auto& plugIns) { database_->removedPlugIns(plugIns); });
    registry_->addObserver(database_);
  }

  std::string annotationPath() const { return (directory_ / "Annotations").string(); }

  // Installs a plug-in inside an application (so it passes the record's checks).
  vantor::PlugInProxy install(const std::string& identifier, Dictionary entitlements = {}) {
    vantor::PlugInProxy proxy;
    proxy.uuid = Uuid::random();
    proxy.identifier = identifier;
    proxy.originalIdentifier = identifier;
    proxy.path = "/Applications/Host.app/PlugIns/" + identifier + ".appex";
    proxy.url = vantor::fileUrlForPath(proxy.path);
    proxy.containingAppPath = "/Applications/Host.app";
    proxy.dataContainerPath = "/var/lib/ekora/containers/" + identifier;
    proxy.entitlements = std::move(entitlements);
    proxy.extensionPoint = "com.corvane.share";
    proxy.info = Dictionary{
        {"QvBundleIdentifier", Value(identifier)},
        {"QvBundleVersion", Value("3")},
        {"ZuExtension",
         Value(Dictionary{
             {"ZuExtensionPointIdentifier", Value("com.corvane.share")},
             {"ZuExtensionAttributes",
              Value(Dictionary{{"ZuExtensionPointIdentifier", Value("com.corvane.share")}})},
         })},
    };
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

  std::optional<int64_t> storedElection(const std::string& key) {
    std::optional<int64_t> election;
    database_->databaseQueue()->sync([&] {
      auto annotation = database_->annotations().annotationForIdentifier(key);
      if (!annotation) return;
      auto it = annotation->find("election");
      if (it != annotation->end() && it->second.unsignedNumber()) {
        election = static_cast<int64_t>(*it->second.unsignedNumber());
      }
    });
    return election;
  }

  std::vector<std::string> identifiersOf(const std::optional<std::vector<EkDPlugInRef>>& found) {
    std::vector<std::string> identifiers;
    if (!found) return identifiers;
    for (const auto& plugIn : *found) identifiers.push_back(plugIn->identifier().value_or(""));
    std::sort(identifiers.begin(), identifiers.end());
    return identifiers;
  }

  fs::path directory_;
  std::shared_ptr<vantor::FakeRegistry> registry_;
  std::shared_ptr<notify::FakeNotifier> notifier_;
  std::shared_ptr<CapturingSink> sink_;
  std::shared_ptr<TestDatabase> database_;
};

TEST_F(DatabaseTest, FindPlugInCachesTheRecordByUuid) {
  auto proxy = install("com.example.a");
  auto first = database_->findPlugIn(proxy.uuid);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first->uuid(), proxy.uuid);
  EXPECT_EQ(database_->findPlugIn(proxy.uuid), first);
  EXPECT_EQ(database_->cacheCount(), 1u);
  EXPECT_EQ(sink_->count("createPlugInForProxy"), 1u);
}

TEST_F(DatabaseTest, UnknownUuidAndPathAnswerNothingAndLog) {
  EXPECT_EQ(database_->findPlugIn(Uuid::random()), nullptr);
  EXPECT_EQ(sink_->count("Vantor cannot find plug-in with UUID:"), 1u);
  EXPECT_EQ(database_->findPlugInAtPath("file:///nowhere/X.appex"), nullptr);
  EXPECT_EQ(sink_->count("Vantor cannot find plug-in at path:file:///nowhere/X.appex"), 1u);
  EXPECT_EQ(database_->cacheCount(), 0u);
}

TEST_F(DatabaseTest, FindPlugInAtPathUsesTheCache) {
  auto proxy = install("com.example.a");
  auto byUuid = database_->findPlugIn(proxy.uuid);
  EXPECT_EQ(database_->findPlugInAtPath(proxy.url + "/"), byUuid);
  EXPECT_EQ(database_->findPlugInAtPath(proxy.path), byUuid);
}

TEST_F(DatabaseTest, CacheLimitPurgesEverythingOnlyWhenExceeded) {
  database_->setCacheLimit(2);
  std::vector<vantor::PlugInProxy> proxies;
  for (int i = 0; i < 4; ++i) proxies.push_back(install("com.example.p" + std::to_string(i)));
  for (int i = 0; i < 3; ++i) ASSERT_NE(database_->findPlugIn(proxies[i].uuid), nullptr);
  EXPECT_EQ(database_->cacheCount(), 3u);  // 2 is not greater than 2 when the third went in
  EXPECT_EQ(registry_->clearCachesCount(), 0);
  auto fourth = database_->findPlugIn(proxies[3].uuid);
  EXPECT_EQ(database_->cacheCount(), 1u);
  EXPECT_EQ(registry_->clearCachesCount(), 1);
  EXPECT_EQ(sink_->count("purging cache for 3 > 2"), 1u);
  EXPECT_EQ(database_->findPlugIn(proxies[3].uuid), fourth);
}

TEST_F(DatabaseTest, CacheLimitZeroKeepsOnlyTheNewestRecord) {
  database_->setCacheLimit(0);
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  database_->findPlugIn(a.uuid);
  database_->findPlugIn(b.uuid);
  EXPECT_EQ(database_->cacheCount(), 1u);
}

TEST_F(DatabaseTest, FullCacheEvictsTheLeastRecentlyUsedRecord) {
  database_->setCacheCapacity(2);
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  auto keptA = database_->findPlugIn(a.uuid);
  database_->findPlugIn(b.uuid);
  EXPECT_EQ(database_->findPlugInAtPath(a.path), keptA);  // a is now the more recent
  database_->findPlugIn(install("com.example.c").uuid);
  EXPECT_EQ(database_->cacheCount(), 2u);
  EXPECT_EQ(database_->findPlugIn(a.uuid), keptA);
  EXPECT_NE(database_->findPlugIn(b.uuid), nullptr);  // built again
  EXPECT_EQ(sink_->count("createPlugInForProxy"), 4u);
}

TEST_F(DatabaseTest, LocaleChangeEmptiesTheCacheOnce) {
  for (int i = 0; i < 10; ++i)
    database_->findPlugIn(install("com.example.l" + std::to_string(i)).uuid);
  ASSERT_EQ(database_->cacheCount(), 10u);
  registry_->changeLocale();
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 0u);  // the purge was queued before this sync
  EXPECT_EQ(registry_->clearCachesCount(), 1);
  EXPECT_EQ(sink_->count("locale change detected; purging cache"), 1u);
}

TEST_F(DatabaseTest, UninstallDropsTheCachedRecordAndTellsTheDelegateOnce) {
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  database_->findPlugIn(a.uuid);
  drainRegistry();
  ASSERT_TRUE(registry_->uninstall(a.uuid));
  ASSERT_TRUE(registry_->uninstall(b.uuid));
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 0u);
  std::lock_guard lock(database_->mutex);
  ASSERT_EQ(database_->removed.size(), 2u);
  EXPECT_EQ(database_->removed[0].front()->uuid, a.uuid);
  EXPECT_EQ(sink_->count("plug-in UNINSTALLED:com.example.a"), 1u);
  EXPECT_EQ(sink_->count("plug-in INSTALLED:com.example.b"), 1u);
}

TEST_F(DatabaseTest, InstallNoticeLeavesTheCacheAlone) {
  install("com.example.a");
  drainRegistry();
  EXPECT_EQ(database_->cacheCount(), 0u);
  EXPECT_EQ(sink_->count("plug-in INSTALLED:com.example.a com.example.a(3)"), 0u);
  EXPECT_EQ(sink_->count("plug-in INSTALLED:com.example.a com.example.a("), 1u);
}

TEST_F(DatabaseTest, AutoElectionElectsOnlyWithoutAChoice) {
  Dictionary autoElect{{std::string(kAutoElect), Value(true)}};
  auto fresh = install("com.example.fresh", autoElect);
  auto two = install("com.example.two", autoElect);
  auto zero = install("com.example.zero", autoElect);
  auto off = install("com.example.off", Dictionary{{std::string(kAutoElect), Value(false)}});
  database_->annotations();  // touched only on the queue below
  database_->databaseQueue()->sync([&] {
    EXPECT_TRUE(database_->annotations()
                    .setAnnotation(Dictionary{{"election", Value(uint64_t{2})},
                                              {"extension", Value(Dictionary{})}},
                                   "com.example.two")
                    .ok());
    EXPECT_TRUE(database_->annotations()
                    .setAnnotation(Dictionary{{"election", Value(uint64_t{0})}}, "com.example.zero")
                    .ok());
  });
  for (const auto& proxy : {fresh, two, zero, off}) {
    ASSERT_NE(database_->findPlugIn(proxy.uuid), nullptr);
  }
  EXPECT_EQ(storedElection("com.example.fresh"), 1);
  EXPECT_EQ(storedElection("com.example.two"), 2);
  EXPECT_EQ(storedElection("com.example.zero"), 1);
  EXPECT_EQ(storedElection("com.example.off"), std::nullopt);
  EXPECT_EQ(notifier_->posts().size(), 0u);  // auto-election posts nothing

  // Written through: a fresh store on the same file sees the elections.
  auto reopened = EkDAnnotationStore::initWithDatabase(annotationPath());
  auto annotation = reopened->annotationForIdentifier("com.example.fresh");
  ASSERT_TRUE(annotation.has_value());
  EXPECT_EQ(annotation->at("election"), Value(uint64_t{1}));
}

TEST_F(DatabaseTest, ElectionValuesNormalise) {
  EXPECT_EQ(EkDatabase::normalizeElection(Value("=1")), "1");
  EXPECT_EQ(EkDatabase::normalizeElection(Value("1")), "1");
  EXPECT_EQ(EkDatabase::normalizeElection(Value("a7")), "a7");
  EXPECT_EQ(EkDatabase::normalizeElection(Value("<2")), std::nullopt);
  EXPECT_EQ(EkDatabase::normalizeElection(Value("!1")), std::nullopt);
  EXPECT_EQ(EkDatabase::normalizeElection(Value("")), std::nullopt);
  EXPECT_EQ(EkDatabase::normalizeElection(Value(uint64_t{1})), std::nullopt);

  auto list = [](Value value) {
    return EkDatabase::electionList(Dictionary{{"ZuUserElection", std::move(value)}});
  };
  EXPECT_EQ(list(Value("=1")), (std::vector<std::string>{"1"}));
  EXPECT_EQ(list(Value(Array{Value("1"), Value("=0")})), (std::vector<std::string>{"1", "0"}));
  EXPECT_EQ(list(Value(Array{Value("1"), Value("<2")})), std::nullopt);
  EXPECT_EQ(list(Value(uint64_t{1})), std::nullopt);
  EXPECT_EQ(EkDatabase::electionList(Dictionary{}), std::nullopt);
}

TEST_F(DatabaseTest, QueryElectionFilterUsesStoredElectionsAutoElectAndReplacement) {
  install("com.example.elected");
  install("com.example.none");
  install("com.example.wide");
  install("com.example.auto", Dictionary{{std::string(kAutoElect), Value(uint64_t{1})}});
  install("com.example.replacement",
          Dictionary{{std::string(kReplacePlugIn), Value("com.example.elected")}});
  database_->databaseQueue()->sync([&] {
    EXPECT_TRUE(
        database_->annotations()
            .setAnnotation(Dictionary{{"election", Value(uint64_t{1})}}, "com.example.elected")
            .ok());
    // Only the low 8 bits take part: 257 counts as 1.
    EXPECT_TRUE(
        database_->annotations()
            .setAnnotation(Dictionary{{"election", Value(uint64_t{257})}}, "com.example.wide")
            .ok());
  });
  Dictionary elected{{"ZuExtensionPointIdentifier", Value("com.corvane.share")},
                     {"ZuUserElection", Value("=1")}};
  EXPECT_EQ(identifiersOf(database_->findPlugIns(elected)),
            (std::vector<std::string>{"com.example.auto", "com.example.elected",
                                      "com.example.replacement", "com.example.wide"}));

  Dictionary unelected{{"ZuUserElection", Value("0")}};
  EXPECT_EQ(identifiersOf(database_->findPlugIns(unelected)),
            (std::vector<std::string>{"com.example.none"}));

  // A value that does not normalise turns the filter off for the whole query.
  Dictionary off{{"ZuUserElection", Value(Array{Value("1"), Value("<2")})}};
  EXPECT_EQ(identifiersOf(database_->findPlugIns(off)).size(), 5u);
  // Decimal text without leading zeros: "01" matches nothing.
  Dictionary padded{{"ZuUserElection", Value("01")}};
  EXPECT_EQ(database_->findPlugIns(padded), std::nullopt);

  // Every record is cached now; the filter still reads the elections as they are.
  EXPECT_EQ(database_->cacheCount(), 5u);
  database_->databaseQueue()->sync([&] {
    EXPECT_TRUE(database_->annotations()
                    .setAnnotation(Dictionary{{"election", Value(uint64_t{1})}}, "com.example.none")
                    .ok());
    EXPECT_TRUE(database_->annotations()
                    .setAnnotation(Dictionary{{"election", Value(uint64_t{0})}}, "com.example.auto")
                    .ok());
  });
  EXPECT_EQ(identifiersOf(database_->findPlugIns(elected)),
            (std::vector<std::string>{"com.example.elected", "com.example.none",
                                      "com.example.replacement", "com.example.wide"}));
  EXPECT_EQ(identifiersOf(database_->findPlugIns(unelected)),
            (std::vector<std::string>{"com.example.auto"}));
}

TEST_F(DatabaseTest, EmptyQueryAnswersEveryInstalledPlugInAndNothingWhenNoneIs) {
  EXPECT_EQ(database_->findPlugIns({}), std::nullopt);
  install("com.example.a");
  install("com.example.b");
  EXPECT_EQ(identifiersOf(database_->findPlugIns({})),
            (std::vector<std::string>{"com.example.a", "com.example.b"}));
}

TEST_F(DatabaseTest, PlaceholderApplicationsPlugInsAreSkipped) {
  vantor::ApplicationProxy app;
  app.identifier = "com.example.host";
  app.path = "/Applications/Host.app";
  app.url = vantor::fileUrlForPath(app.path);
  app.isPlaceholder = true;
  registry_->addApplication(app);
  install("com.example.a");
  EXPECT_EQ(database_->findPlugIns({}).value_or(std::vector<EkDPlugInRef>{}).size(), 0u);
  EXPECT_EQ(database_->cacheCount(), 0u);
  EXPECT_EQ(sink_->count("because its app is a placeholder"), 1u);

  // A record cached by a lookup by UUID is still left out of queries.
  auto other = install("com.example.b");
  ASSERT_NE(database_->findPlugIn(other.uuid), nullptr);
  EXPECT_EQ(database_->findPlugIns({}).value_or(std::vector<EkDPlugInRef>{}).size(), 0u);
  EXPECT_EQ(sink_->count("because its app is a placeholder"), 3u);
}

TEST_F(DatabaseTest, PlugInsWithinApplication) {
  EXPECT_EQ(database_->plugInsWithinApplication("/Applications/Empty.app"), std::nullopt);
  vantor::ApplicationProxy app;
  app.identifier = "com.example.host";
  app.path = "/Applications/Host.app";
  app.url = vantor::fileUrlForPath(app.path);
  auto a = install("com.example.a");
  auto b = install("com.example.b");
  app.plugInUuids = {a.uuid, b.uuid};
  registry_->addApplication(app);
  auto found = database_->plugInsWithinApplication(app.url);
  ASSERT_TRUE(found.has_value());
  EXPECT_EQ(identifiersOf(found), (std::vector<std::string>{"com.example.a", "com.example.b"}));
}

TEST_F(DatabaseTest, RegistrationErrorsCarryCodeTwo) {
  EXPECT_EQ(database_->addPlugIn("file:///Applications/X.app/PlugIns/Y.appex"), std::nullopt);
  registry_->setRegisterResult(vantor::makeError(vantor::kMalformedBundle, "bad"));
  registry_->setUnregisterResult(vantor::makeError(vantor::kNotRegistered, "unknown"));
  auto added = database_->addPlugIn("file:///Applications/X.app/PlugIns/Y.appex");
  ASSERT_TRUE(added.has_value());
  EXPECT_EQ(added->code, 2);
  EXPECT_EQ(added->message, "Vantor failed to register the plug-in");
  auto removed = database_->removePlugIn("file:///Applications/X.app/PlugIns/Y.appex");
  ASSERT_TRUE(removed.has_value());
  EXPECT_EQ(removed->code, 2);
  EXPECT_EQ(removed->message, "Vantor failed to deregister the plug-in");
}

TEST_F(DatabaseTest, AnnotationsMergeThroughTheDatabaseAndPostOnlyWhenAsked) {
  auto proxy = install("com.example.a");
  auto plugIn = database_->findPlugIn(proxy.uuid);
  EXPECT_TRUE(
      database_
          ->setAnnotation(Dictionary{{"extension", Value(Dictionary{{"k", Value("v")}})}}, *plugIn)
          .ok());
  EXPECT_TRUE(database_->setAnnotation(Dictionary{{"election", Value(uint64_t{1})}}, *plugIn).ok());
  auto annotation = database_->annotationForPlugIn(*plugIn);
  ASSERT_TRUE(annotation.has_value());
  EXPECT_EQ(annotation->size(), 2u);
  EXPECT_EQ(notifier_->count("com.corvane.ekora.annotation-change"), 0u);
  database_->notifyAnnotationChange();
  EXPECT_EQ(notifier_->count("com.corvane.ekora.annotation-change"), 1u);
  EXPECT_TRUE(database_->setAnnotation(std::nullopt, *plugIn).ok());
  EXPECT_EQ(database_->annotationForPlugIn(*plugIn), std::nullopt);
}

// The annotations a reply carries encoded, which records keep between replies.
Dictionary decodedAnnotation(const EkDatabase::EncodedAnnotation& encoded) {
  if (!encoded.bytes) return Dictionary{{"missing", Value(true)}};
  Result<Value> value = cbor::decode(encoded.span());
  if (!value.ok() || !value->dictionary()) return Dictionary{{"undecodable", Value(true)}};
  return *value->dictionary();
}

TEST_F(DatabaseTest, EncodedAnnotationsFollowEveryChangeOfTheStore) {
  auto original = database_->findPlugIn(install("com.example.shared").uuid);
  // Files its annotations under the identifier it replaces: one entry for both records.
  auto replacement = database_->findPlugIn(
      install("com.example.replacement",
              Dictionary{{std::string(kReplacePlugIn), Value("com.example.shared")}})
          .uuid);
  auto other = database_->findPlugIn(install("com.example.other").uuid);
  ASSERT_TRUE(original && replacement && other);
  const std::vector<const EkDPlugIn*> records = {original.get(), replacement.get(), other.get()};
  auto annotations = [&] {
    std::vector<Dictionary> decoded;
    for (const auto& encoded : database_->encodedAnnotationsForPlugIns(records)) {
      decoded.push_back(decodedAnnotation(encoded));
    }
    return decoded;
  };
  const Dictionary none;
  const Dictionary elected{{"election", Value(uint64_t{1})}};
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));

  // Through either record, and asked twice: the second answer comes from what was kept.
  EXPECT_TRUE(database_->setAnnotation(elected, *replacement).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{elected, elected, none}));
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{elected, elected, none}));
  EXPECT_TRUE(database_->setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, none}));

  // Straight through the store, and by loading another file.
  database_->databaseQueue()->sync([&] {
    EXPECT_TRUE(
        database_->annotations().setAnnotation(elected, std::string("com.example.other")).ok());
  });
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, elected}));
  const std::string file = (directory_ / "Other").string();
  Dictionary data{{"com.example.shared", Value(elected)}};
  ASSERT_TRUE(dmap::writeFileAtomically(file, Value(Dictionary{{"version", Value(uint64_t{16})},
                                                               {"data", Value(std::move(data))}}))
                  .ok());
  database_->databaseQueue()->sync(
      [&] { ASSERT_TRUE(database_->annotations().loadDb(file).ok()); });
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{elected, elected, none}));

  // Changes whose save fails are undone, and so is what the records noted of them meanwhile.
  fs::remove(annotationPath());
  fs::create_directories(fs::path(annotationPath()) / "in-the-way");
  const Dictionary seven{{"election", Value(uint64_t{7})}};
  database_->beginAnnotationChanges();
  EXPECT_TRUE(database_->setAnnotation(seven, *other).ok());
  EXPECT_TRUE(database_->setAnnotation(std::nullopt, *original).ok());
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{none, none, seven}));
  Result<void> committed = database_->commitAnnotationChanges();
  ASSERT_FALSE(committed.ok());
  EXPECT_EQ(committed.error().domain, kPosixErrorDomain);
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{elected, elected, none}));
  Result<void> single = database_->setAnnotation(seven, *other);
  ASSERT_FALSE(single.ok());
  EXPECT_EQ(single.error().domain, kPosixErrorDomain);
  EXPECT_EQ(annotations(), (std::vector<Dictionary>{elected, elected, none}));
}

}  // namespace
}  // namespace ek
