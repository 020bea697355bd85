#include "platform/vantor/SqliteRegistry.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/dmap/Dmap.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/paths/Directories.h"

namespace ek::vantor {
namespace {

namespace fs = std::filesystem;

Dictionary plugInInfo(const std::string& identifier, const std::string& point,
                      Dictionary attributes = {}, Dictionary extension = {}) {
  extension.emplace("ZuExtensionPointIdentifier", point);
  extension.emplace("ZuExtensionAttributes", Value(std::move(attributes)));
  return {{"QvBundleIdentifier", Value(identifier)},
          {"QvBundleVersion", Value("1.0")},
          {"QvBundleName", Value(identifier)},
          {"ZuExtension", Value(std::move(extension))}};
}

void writeDmap(const std::string& path, const Dictionary& dictionary) {
  ASSERT_TRUE(paths::ensureDirectory(fs::path(path).parent_path().string()).ok());
  ASSERT_TRUE(dmap::writeFileAtomically(path, Value(dictionary)).ok());
}

void writeText(const std::string& path, std::string_view text) {
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

// Records every notice with where it ran and whether its plug-ins could be looked up then.
class Recorder : public RegistryObserver {
 public:
  struct Event {
    std::string kind;
    std::vector<Uuid> uuids;
    bool onQueue = false;
    bool registeredDuringNotice = false;
  };

  explicit Recorder(std::shared_ptr<SerialQueue> queue) : queue_(std::move(queue)) {}

  void attach(Registry* registry) {
    std::lock_guard lock(mutex_);
    registry_ = registry;
  }

  void pluginsDidInstall(const std::vector<PlugInProxyPtr>& plugIns) override {
    record("install", plugIns);
  }
  void pluginsWillUninstall(const std::vector<PlugInProxyPtr>& plugIns) override {
    record("uninstall", plugIns);
  }
  void localeDidChange() override { record("locale", {}); }

  // Waits until the queue ran everything posted so far, then answers what was recorded.
  std::vector<Event> drained() {
    queue_->sync([] {});
    std::lock_guard lock(mutex_);
    return events_;
  }
  void clear() {
    queue_->sync([] {});
    std::lock_guard lock(mutex_);
    events_.clear();
  }

 private:
  void record(const char* kind, const std::vector<PlugInProxyPtr>& plugIns) {
    std::lock_guard lock(mutex_);
    Event event{kind, {}, queue_->isCurrent(), true};
    for (const auto& plugIn : plugIns) {
      event.uuids.push_back(plugIn->uuid);
      if (registry_ != nullptr && !registry_->plugInByUuid(plugIn->uuid)) {
        event.registeredDuringNotice = false;
      }
    }
    events_.push_back(std::move(event));
  }

  const std::shared_ptr<SerialQueue> queue_;
  Registry* registry_ = nullptr;
  std::mutex mutex_;
  std::vector<Event> events_;
};

class SqliteRegistryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/vantor-test-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    root_ = pattern;
    state_ = root_ + "/state";
    system_ = root_ + "/System";
    apps_ = root_ + "/Applications";
    fs::create_directories(apps_);
    codeSigning_ = std::make_shared<FakeCodeSigning>();
    queue_ = SerialQueue::make("vantor-test");
    recorder_ = std::make_shared<Recorder>(queue_);
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) unsetenv(name);
    setenv("EKORA_LOCALE", "en_US.UTF-8", 1);
  }

  void TearDown() override {
    registry_.reset();
    unsetenv("EKORA_LOCALE");
    fs::remove_all(root_);
  }

  virtual SqliteRegistry::Options options() {
    SqliteRegistry::Options options;
    options.stateDir = state_;
    options.systemRoot = system_;
    options.codeSigning = codeSigning_;
    options.queue = queue_;
    options.observers = {recorder_};
    options.idleDelay = idleDelay_;
    return options;
  }

  SqliteRegistry& open() {
    // Notices of the start-up scan arrive before the new registry is known here.
    recorder_->attach(nullptr);
    registry_.reset();
    auto opened = SqliteRegistry::open(options());
    EXPECT_TRUE(opened.ok()) << (opened.ok() ? "" : opened.error().message);
    registry_ = opened.ok() ? opened.value() : nullptr;
    recorder_->attach(registry_.get());
    return *registry_;
  }

  std::string writePlugIn(const std::string& path, const Dictionary& info) {
    writeDmap(path + "/Info.dmap", info);
    return path;
  }

  std::string writeApp(const std::string& name, const std::string& identifier,
                       const std::vector<std::pair<std::string, Dictionary>>& plugIns = {}) {
    std::string path = apps_ + "/" + name;
    writeDmap(path + "/Info.dmap", {{"QvBundleIdentifier", Value(identifier)},
                                    {"QvBundleName", Value(name)},
                                    {"QvBundleExecutable", Value("run")}});
    for (const auto& [plugInName, info] : plugIns) {
      writePlugIn(path + "/PlugIns/" + plugInName, info);
    }
    return path;
  }

  std::string containerOf(const std::string& identifier) {
    return state_ + "/containers/" + identifier;
  }

  int64_t plugInRows() {
    sqlite3* db = nullptr;
    recorder_->attach(nullptr);
    registry_.reset();  // the registry holds the file exclusively
    EXPECT_EQ(sqlite3_open(paths::join(state_, "registry.db").c_str(), &db), SQLITE_OK);
    sqlite3_stmt* statement = nullptr;
    sqlite3_prepare_v2(db,
                       "SELECT (SELECT count(*) FROM plugins) + "
                       "(SELECT count(*) FROM applications)",
                       -1, &statement, nullptr);
    int64_t count = -1;
    if (sqlite3_step(statement) == SQLITE_ROW) count = sqlite3_column_int64(statement, 0);
    sqlite3_finalize(statement);
    sqlite3_close(db);
    return count;
  }

  std::string root_, state_, system_, apps_;
  std::shared_ptr<FakeCodeSigning> codeSigning_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Recorder> recorder_;
  std::shared_ptr<SqliteRegistry> registry_;
  std::chrono::milliseconds idleDelay_ = std::chrono::seconds(10);
};

TEST_F(SqliteRegistryTest, RegisteredPlugInIsFoundByUuidPathAndUrl) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("My App.app", "com.example.app",
                             {{"Thumbs.appex", plugInInfo("com.example.thumbs", "com.x.thumb")}});
  std::string path = app + "/PlugIns/Thumbs.appex";
  ASSERT_TRUE(registry.registerBundle(path).ok());

  PlugInProxyPtr byPath = registry.plugInByUrl(path);
  ASSERT_TRUE(byPath);
  EXPECT_EQ(byPath->identifier, "com.example.thumbs");
  EXPECT_EQ(byPath->path, path);
  EXPECT_EQ(byPath->url, fileUrlForPath(path));
  EXPECT_EQ(byPath->containingAppPath, app);
  EXPECT_EQ(byPath->extensionPoint, "com.x.thumb");
  EXPECT_EQ(byPath->bundleVersion, "1.0");
  EXPECT_FALSE(byPath->onSystemVolume);
  EXPECT_GT(byPath->registrationDate.seconds, 1.6e9);
  PlugInProxyPtr byUuid = registry.plugInByUuid(byPath->uuid);
  ASSERT_TRUE(byUuid);
  EXPECT_EQ(byUuid->path, path);
  PlugInProxyPtr byUrl = registry.plugInByUrl(fileUrlForPath(path) + "/");
  ASSERT_TRUE(byUrl);
  EXPECT_EQ(byUrl->uuid, byPath->uuid);
  EXPECT_FALSE(registry.plugInByUuid(Uuid::random()));
}

TEST_F(SqliteRegistryTest, PlugInRegistersItsContainingApplicationWhenNew) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("Viewer.app", "com.example.viewer",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"B.appex", plugInInfo("com.example.b", "p")}});
  ASSERT_TRUE(registry.registerBundle(app + "/PlugIns/A.appex").ok());
  ApplicationProxyPtr proxy = registry.applicationByPath(app);
  ASSERT_TRUE(proxy);
  EXPECT_EQ(proxy->identifier, "com.example.viewer");
  EXPECT_EQ(proxy->plugInUuids.size(), 1u);  // only the plug-in that was registered
  EXPECT_EQ(registry.plugInsOfApplication(app).size(), 1u);
}

TEST_F(SqliteRegistryTest, ApplicationRegistersEveryPlugInOfItsPlugInsDirectory) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("Viewer.app", "com.example.viewer",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"B.appex", plugInInfo("com.example.b", "q")}});
  fs::create_directories(app + "/PlugIns/NotAPlugIn");
  ASSERT_TRUE(registry.registerBundle(app).ok());
  auto plugIns = registry.plugInsOfApplication(app);
  ASSERT_EQ(plugIns.size(), 2u);
  EXPECT_EQ(plugIns[0]->identifier, "com.example.a");
  EXPECT_EQ(plugIns[1]->identifier, "com.example.b");
  ApplicationProxyPtr byIdentifier = registry.applicationByIdentifier("com.example.viewer");
  ASSERT_TRUE(byIdentifier);
  EXPECT_EQ(byIdentifier->path, app);
  EXPECT_EQ(byIdentifier->plugInUuids, (std::vector<Uuid>{plugIns[0]->uuid, plugIns[1]->uuid}));
  EXPECT_EQ(byIdentifier->name, "Viewer.app");
  EXPECT_FALSE(registry.applicationByIdentifier("com.example.none"));
}

TEST_F(SqliteRegistryTest, ReRegisteringAPathKeepsItsUuid) {
  SqliteRegistry& registry = open();
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/P.appex", plugInInfo("com.example.p", "p"));
  writeApp("X.app", "com.example.x");
  ASSERT_TRUE(registry.registerBundle(path).ok());
  Uuid first = registry.plugInByUrl(path)->uuid;
  ASSERT_TRUE(registry.registerBundle(path).ok());
  EXPECT_EQ(registry.plugInByUrl(path)->uuid, first);
  open();
  ASSERT_TRUE(registry_->registerBundle(path).ok());
  EXPECT_EQ(registry_->plugInByUrl(path)->uuid, first);
}

TEST_F(SqliteRegistryTest, ChangedIdentifierGetsANewUuidAndTheOldOneIsUninstalled) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/P.appex", plugInInfo("com.example.p", "p"));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  Uuid first = registry.plugInByUrl(path)->uuid;
  recorder_->clear();
  writePlugIn(path, plugInInfo("com.example.renamed", "p"));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  PlugInProxyPtr now = registry.plugInByUrl(path);
  EXPECT_NE(now->uuid, first);
  EXPECT_EQ(now->identifier, "com.example.renamed");
  EXPECT_FALSE(registry.plugInByUuid(first));
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, "uninstall");
  EXPECT_EQ(events[0].uuids, std::vector<Uuid>{first});
  EXPECT_EQ(events[1].kind, "install");
  EXPECT_EQ(events[1].uuids, std::vector<Uuid>{now->uuid});
}

TEST_F(SqliteRegistryTest, SdkDictionaryIsMergedWithThePlugInsOwnValuesWinning) {
  writeDmap(
      system_ + "/Library/ExtensionPoints/com.x.share.dmap",
      {{"SdkTop", Value("sdk")},
       {"QvBundleVersion", Value("9.9")},
       {"ZuExtension",
        Value(Dictionary{{"ZuExtensionProtocol", Value("SdkProtocol")},
                         {"Dedicated", Value(true)},
                         {"ZuExtensionAttributes", Value(Dictionary{{"SdkAttribute", Value("a")},
                                                                    {"Mine", Value("sdk")}})}})}});
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/S.appex",
                  plugInInfo("com.example.s", "com.x.share", {{"Mine", Value("own")}},
                             {{"Dedicated", Value(false)}}));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  PlugInProxyPtr proxy = registry.plugInByUrl(path);
  ASSERT_TRUE(proxy);
  EXPECT_EQ(proxy->info.at("SdkTop"), Value("sdk"));
  EXPECT_EQ(proxy->info.at("QvBundleVersion"), Value("1.0"));
  const Dictionary* extension = proxy->extensionDictionary();
  ASSERT_NE(extension, nullptr);
  EXPECT_EQ(extension->at("ZuExtensionProtocol"), Value("SdkProtocol"));
  EXPECT_EQ(extension->at("Dedicated"), Value(false));
  const Dictionary* attributes = extension->at("ZuExtensionAttributes").dictionary();
  ASSERT_NE(attributes, nullptr);
  EXPECT_EQ(attributes->at("SdkAttribute"), Value("a"));
  EXPECT_EQ(attributes->at("Mine"), Value("own"));
  EXPECT_EQ(proxy->sdk.at("SdkTop"), Value("sdk"));
  auto sdk = registry.extensionPointSdk("com.x.share");
  ASSERT_TRUE(sdk);
  EXPECT_EQ(sdk->at("SdkTop"), Value("sdk"));
  EXPECT_FALSE(registry.extensionPointSdk("com.x.none"));
}

TEST_F(SqliteRegistryTest, ExtensionPointIsCopiedIntoAttributesOnlyWhenMissing) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string plain =
      writePlugIn(apps_ + "/X.app/PlugIns/A.appex", plugInInfo("com.example.a", "p1"));
  std::string own =
      writePlugIn(apps_ + "/X.app/PlugIns/B.appex",
                  plugInInfo("com.example.b", "p1", {{"ZuExtensionPointIdentifier", Value("p2")}}));
  ASSERT_TRUE(registry.registerBundle(apps_ + "/X.app").ok());
  auto attribute = [&](const std::string& path) -> std::optional<Value> {
    PlugInProxyPtr proxy = registry.plugInByUrl(path);
    const Value* value =
        proxy->extensionDictionary()->at("ZuExtensionAttributes").get("ZuExtensionPointIdentifier");
    if (value == nullptr) return std::nullopt;
    return *value;
  };
  EXPECT_EQ(attribute(plain), Value("p1"));
  EXPECT_EQ(attribute(own), Value("p2"));
}

TEST_F(SqliteRegistryTest, ContainersAreCreatedWithTmpAndKeptOnUnregister) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/A.appex", plugInInfo("com.example.a", "p"));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  EXPECT_EQ(registry.plugInByUrl(path)->dataContainerPath, containerOf("com.example.a"));
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
  ASSERT_TRUE(registry.unregisterBundle(path).ok());
  EXPECT_FALSE(registry.plugInByUrl(path));
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
}

TEST_F(SqliteRegistryTest, DataOnlyPlugInGetsNoContainer) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path = writePlugIn(
      apps_ + "/X.app/PlugIns/D.appex",
      plugInInfo("com.example.data", "p", {}, {{"ZuExtensionProtocol", Value("#Data")}}));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  EXPECT_EQ(registry.plugInByUrl(path)->dataContainerPath, std::nullopt);
  EXPECT_FALSE(fs::exists(containerOf("com.example.data")));
}

TEST_F(SqliteRegistryTest, EscapingIdentifiersAreRefusedAndNothingIsWritten) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  const std::string tooLong(256, 'z');
  for (const std::string& identifier : {std::string(".."), std::string("."), std::string(""),
                                        std::string("../../etc"), std::string("a/b"), tooLong}) {
    std::string path = writePlugIn(apps_ + "/X.app/PlugIns/Bad.appex", plugInInfo(identifier, "p"));
    Uuid knowledge = registry.knowledgeUuid();
    auto result = registry.registerBundle(path);
    ASSERT_FALSE(result.ok()) << identifier;
    EXPECT_EQ(result.error().code, kInvalidIdentifier) << identifier;
    EXPECT_FALSE(registry.plugInByUrl(path));
    EXPECT_FALSE(registry.applicationByPath(apps_ + "/X.app"));
    EXPECT_EQ(registry.knowledgeUuid(), knowledge);
  }
  EXPECT_FALSE(fs::exists(state_ + "/containers"));
  EXPECT_FALSE(fs::exists(root_ + "/etc"));
  EXPECT_TRUE(recorder_->drained().empty());
}

TEST_F(SqliteRegistryTest, MalformedInfoDmapLeavesNothingHalfRegistered) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("X.app", "com.example.x",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"C.appex", plugInInfo("com.example.c", "p")}});
  writeText(app + "/PlugIns/B.appex/Info.dmap", "<dmap version=\"1.0\"><dict><key>x</key>");
  auto result = registry.registerBundle(app);
  ASSERT_FALSE(result.ok());
  EXPECT_EQ(result.error().code, kMalformedBundle);
  EXPECT_NE(result.error().message.find("B.appex"), std::string::npos);
  EXPECT_FALSE(registry.applicationByPath(app));
  EXPECT_TRUE(registry.installedPlugIns().empty());

  // A registered application stays exactly as it was when its update is malformed.
  fs::remove_all(app + "/PlugIns/B.appex");
  ASSERT_TRUE(registry.registerBundle(app).ok());
  auto before = registry.plugInsOfApplication(app);
  ASSERT_EQ(before.size(), 2u);
  fs::remove_all(app + "/PlugIns/C.appex");
  writeDmap(app + "/PlugIns/A.appex/Info.dmap", {{"QvBundleIdentifier", Value("com.example.a")}});
  recorder_->clear();
  ASSERT_FALSE(registry.registerBundle(app).ok());
  auto after = registry.plugInsOfApplication(app);
  ASSERT_EQ(after.size(), 2u);
  EXPECT_EQ(after[0]->uuid, before[0]->uuid);
  EXPECT_EQ(after[1]->uuid, before[1]->uuid);
  EXPECT_TRUE(recorder_->drained().empty());
  EXPECT_EQ(plugInRows(), 3);
}

TEST_F(SqliteRegistryTest, ReRegisteringAnApplicationDropsPlugInsItNoLongerHas) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("X.app", "com.example.x",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"B.appex", plugInInfo("com.example.b", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  Uuid b = registry.plugInByUrl(app + "/PlugIns/B.appex")->uuid;
  fs::remove_all(app + "/PlugIns/B.appex");
  recorder_->clear();
  ASSERT_TRUE(registry.registerBundle(app).ok());
  EXPECT_FALSE(registry.plugInByUuid(b));
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, "uninstall");
  EXPECT_EQ(events[0].uuids, std::vector<Uuid>{b});
}

TEST_F(SqliteRegistryTest, UnregisteringAnUnknownPathFails) {
  SqliteRegistry& registry = open();
  auto result = registry.unregisterBundle(apps_ + "/Nothing.app");
  ASSERT_FALSE(result.ok());
  EXPECT_EQ(result.error().code, kNotRegistered);
  EXPECT_FALSE(registry.registerBundle("relative/Thing.appex").ok());
  EXPECT_FALSE(registry.registerBundle(apps_ + "/Missing.appex").ok());
}

TEST_F(SqliteRegistryTest, UnregisteringAnApplicationRemovesItsPlugIns) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("X.app", "com.example.x",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"B.appex", plugInInfo("com.example.b", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  recorder_->clear();
  ASSERT_TRUE(registry.unregisterBundle(fileUrlForPath(app)).ok());
  EXPECT_FALSE(registry.applicationByPath(app));
  EXPECT_TRUE(registry.installedPlugIns().empty());
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].uuids.size(), 2u);
}

TEST_F(SqliteRegistryTest, EntitlementsComeFromTheDeclaredExecutable) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  Dictionary info = plugInInfo("com.example.a", "p");
  info.emplace("QvBundleExecutable", "A");
  std::string path = writePlugIn(apps_ + "/X.app/PlugIns/A.appex", info);
  codeSigning_->setExecutableEntitlements(path + "/A", {{"com.example.ent", Value(true)}});
  std::string other =
      writePlugIn(apps_ + "/X.app/PlugIns/B.appex", plugInInfo("com.example.b", "p"));
  ASSERT_TRUE(registry.registerBundle(apps_ + "/X.app").ok());
  EXPECT_EQ(registry.plugInByUrl(path)->entitlements,
            (Dictionary{{"com.example.ent", Value(true)}}));
  EXPECT_TRUE(registry.plugInByUrl(other)->entitlements.empty());

  info["QvBundleExecutable"] = Value("../../escape");
  writePlugIn(path, info);
  EXPECT_EQ(registry.registerBundle(path).error().code, kMalformedBundle);
}

TEST_F(SqliteRegistryTest, KnowledgeUuidChangesWithEveryChangeAndSurvivesReopening) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/A.appex", plugInInfo("com.example.a", "p"));
  Uuid k0 = registry.knowledgeUuid();
  ASSERT_TRUE(registry.registerBundle(path).ok());
  Uuid k1 = registry.knowledgeUuid();
  EXPECT_NE(k1, k0);
  ASSERT_TRUE(registry.unregisterBundle(path).ok());
  Uuid k2 = registry.knowledgeUuid();
  EXPECT_NE(k2, k1);
  open();
  EXPECT_EQ(registry_->knowledgeUuid(), k2);
}

TEST_F(SqliteRegistryTest, InstallNoticesComeAfterCommitOnTheRegistryQueue) {
  SqliteRegistry& registry = open();
  std::string app = writeApp("X.app", "com.example.x",
                             {{"A.appex", plugInInfo("com.example.a", "p")},
                              {"B.appex", plugInInfo("com.example.b", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].kind, "install");
  EXPECT_EQ(events[0].uuids.size(), 2u);
  EXPECT_TRUE(events[0].onQueue);
  EXPECT_TRUE(events[0].registeredDuringNotice);
}

TEST_F(SqliteRegistryTest, UninstallNoticesComeBeforeTheRowsAreDeleted) {
  SqliteRegistry& registry = open();
  writeApp("X.app", "com.example.x");
  std::string path =
      writePlugIn(apps_ + "/X.app/PlugIns/A.appex", plugInInfo("com.example.a", "p"));
  ASSERT_TRUE(registry.registerBundle(path).ok());
  Uuid uuid = registry.plugInByUrl(path)->uuid;
  recorder_->clear();
  ASSERT_TRUE(registry.unregisterBundle(path).ok());
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].kind, "uninstall");
  EXPECT_EQ(events[0].uuids, std::vector<Uuid>{uuid});
  EXPECT_TRUE(events[0].onQueue);
  EXPECT_TRUE(events[0].registeredDuringNotice);
  EXPECT_FALSE(registry.plugInByUuid(uuid));
}

TEST_F(SqliteRegistryTest, RemovedObserverHearsNothing) {
  SqliteRegistry& registry = open();
  registry.removeObserver(recorder_);
  std::string app =
      writeApp("X.app", "com.example.x", {{"A.appex", plugInInfo("com.example.a", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  EXPECT_TRUE(recorder_->drained().empty());
}

TEST_F(SqliteRegistryTest, OpeningRegistersSystemPlugInsAndDropsVanishedBundles) {
  std::string spell = writePlugIn(system_ + "/Library/PlugIns/SpellCheck.bundle",
                                  plugInInfo("com.example.spell", "com.x.spell"));
  writeText(system_ + "/Library/PlugIns/Broken.bundle/Info.dmap", "not dmap");
  SqliteRegistry& registry = open();
  PlugInProxyPtr proxy = registry.plugInByUrl(spell);
  ASSERT_TRUE(proxy);
  EXPECT_TRUE(proxy->onSystemVolume);
  EXPECT_EQ(proxy->containingAppPath, std::nullopt);
  EXPECT_EQ(registry.installedPlugIns().size(), 1u);
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].kind, "install");

  std::string app =
      writeApp("X.app", "com.example.x", {{"A.appex", plugInInfo("com.example.a", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  Uuid spellUuid = proxy->uuid;
  registry_.reset();
  fs::remove_all(spell);
  fs::remove_all(app);
  recorder_->clear();
  SqliteRegistry& reopened = open();
  EXPECT_TRUE(reopened.installedPlugIns().empty());
  EXPECT_FALSE(reopened.applicationByPath(app));
  events = recorder_->drained();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, "uninstall");
  EXPECT_EQ(events[1].kind, "uninstall");
  EXPECT_TRUE(events[0].uuids == std::vector<Uuid>{spellUuid} ||
              events[1].uuids == std::vector<Uuid>{spellUuid});
}

TEST_F(SqliteRegistryTest, SystemPlugInsKeepTheirUuidAcrossRestarts) {
  std::string spell = writePlugIn(system_ + "/Library/PlugIns/SpellCheck.bundle",
                                  plugInInfo("com.example.spell", "com.x.spell"));
  Uuid first = open().plugInByUrl(spell)->uuid;
  EXPECT_EQ(open().plugInByUrl(spell)->uuid, first);
}

std::vector<std::string> asideFiles(const std::string& dir) {
  std::vector<std::string> names;
  for (const auto& entry : fs::directory_iterator(dir)) {
    std::string name = entry.path().filename().string();
    if (name.find(".corrupt-") != std::string::npos) names.push_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

size_t asideDatabases(const std::string& dir) {
  size_t count = 0;
  for (const std::string& name : asideFiles(dir)) {
    if (!name.ends_with("-wal") && !name.ends_with("-shm")) ++count;
  }
  return count;
}

// The start-up scan with trusted stamps (no settling time) and entitlements from files, as in
// the daemon: what it leaves alone and what it reads again.
class StartUpScanTest : public SqliteRegistryTest {
 protected:
  void SetUp() override {
    SqliteRegistryTest::SetUp();
    log::configure("info");
    log::setSink(sink_);
    Dictionary info = plugInInfo("com.example.spell", "com.x.spell");
    info["QvBundleExecutable"] = Value("spell");
    spell_ = writePlugIn(system_ + "/Library/PlugIns/SpellCheck.bundle", info);
    writeText(spell_ + "/spell", "#!/bin/sh\n");
    writeDmap(spell_ + "/fr.lproj/InfoDmap.strings",
              {{"QvBundleDisplayName", Value("Orthographe")}});
    writeDmap(system_ + "/Library/ExtensionPoints/com.x.spell.dmap",
              {{"ZuExtension", Value(Dictionary{{"ZuExtensionPrincipalClass", Value("A")}})}});
  }
  void TearDown() override {
    log::setSink(nullptr);
    SqliteRegistryTest::TearDown();
  }
  SqliteRegistry::Options options() override {
    SqliteRegistry::Options options = SqliteRegistryTest::options();
    options.codeSigning = CodeSigning::system();
    options.settleSeconds = 0;
    return options;
  }
  // Reopens and answers how many system bundles the scan read rather than left alone.
  int reopenCountingReads() {
    sink_->clear();
    open();
    for (const auto& line : sink_->lines()) {
      int total = 0, unchanged = 0, read = 0;
      if (std::sscanf(line.message.c_str(),
                      "%d system bundles: %d unchanged since they were last read, %d read", &total,
                      &unchanged, &read) == 3) {
        return read;
      }
    }
    ADD_FAILURE() << "the scan did not report what it read";
    return -1;
  }
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
  std::string spell_;
};

TEST_F(StartUpScanTest, UnchangedBundlesAreNotReadAgainAndEveryChangedFileIsSeen) {
  EXPECT_EQ(reopenCountingReads(), 1);
  Uuid uuid = registry_->plugInByUrl(spell_)->uuid;
  Uuid knowledge = registry_->knowledgeUuid();
  EXPECT_EQ(reopenCountingReads(), 0);
  EXPECT_EQ(registry_->plugInByUrl(spell_)->uuid, uuid);
  EXPECT_EQ(registry_->knowledgeUuid(), knowledge);

  // Each file the bundle was read from, changed in turn: the next start reads it again and
  // registers what it now says.
  Dictionary info = plugInInfo("com.example.spell", "com.x.spell");
  info["QvBundleExecutable"] = Value("spell");
  info["QvBundleVersion"] = Value("2.0");
  writePlugIn(spell_, info);
  EXPECT_EQ(reopenCountingReads(), 1);
  EXPECT_EQ(registry_->plugInByUrl(spell_)->bundleVersion, "2.0");
  EXPECT_EQ(registry_->plugInByUrl(spell_)->uuid, uuid);
  EXPECT_EQ(reopenCountingReads(), 0);

  writeDmap(spell_ + "/spell.entitlements", {{"com.example.granted", Value(true)}});
  EXPECT_EQ(reopenCountingReads(), 1);
  EXPECT_TRUE(registry_->plugInByUrl(spell_)->entitlements.contains("com.example.granted"));

  // Rewritten in place, as an editor would.
  writeText(spell_ + "/fr.lproj/InfoDmap.strings",
            dmap::write(Value(Dictionary{{"QvBundleDisplayName", Value("Correcteur")}})).value());
  EXPECT_EQ(reopenCountingReads(), 1);
  setenv("EKORA_LOCALE", "fr", 1);
  EXPECT_EQ(registry_->plugInByUrl(spell_)->localizedName, "Correcteur");

  writeDmap(spell_ + "/de.lproj/InfoDmap.strings",
            {{"QvBundleDisplayName", Value("Rechtschreibung")}});
  EXPECT_EQ(reopenCountingReads(), 1);
  setenv("EKORA_LOCALE", "de", 1);
  EXPECT_EQ(registry_->plugInByUrl(spell_)->localizedName, "Rechtschreibung");

  writeDmap(system_ + "/Library/ExtensionPoints/com.x.spell.dmap",
            {{"ZuExtension", Value(Dictionary{{"ZuExtensionPrincipalClass", Value("B")}})}});
  EXPECT_EQ(reopenCountingReads(), 1);
  PlugInProxyPtr proxy = registry_->plugInByUrl(spell_);
  ASSERT_TRUE(proxy);
  const Value* principal = proxy->info.at("ZuExtension").get("ZuExtensionPrincipalClass");
  ASSERT_NE(principal, nullptr);
  EXPECT_EQ(*principal->string(), "B");

  ::chmod((spell_ + "/spell").c_str(), 0777);  // the entitlements are no longer trusted
  EXPECT_EQ(reopenCountingReads(), 1);
  EXPECT_TRUE(registry_->plugInByUrl(spell_)->entitlements.empty());
}

TEST_F(StartUpScanTest, ManyBundlesAreCheckedTogetherAndEachChangeIsSeenWherever) {
  // Enough bundles for the check to be shared among threads; a change in any share is seen.
  constexpr int kBundles = 1200;
  std::vector<std::string> bundles;
  for (int i = 0; i < kBundles; ++i) {
    bundles.push_back(writePlugIn(fmt::format("{}/Library/PlugIns/P{:04}.bundle", system_, i),
                                  plugInInfo(fmt::format("com.example.p{}", i), "com.x.many")));
  }
  EXPECT_EQ(reopenCountingReads(), kBundles + 1);
  EXPECT_EQ(reopenCountingReads(), 0);

  std::vector<int> changed = {0, kBundles / 3, kBundles / 2 + 1, kBundles - 1};
  for (int i : changed) {
    Dictionary info = plugInInfo(fmt::format("com.example.p{}", i), "com.x.many");
    info["QvBundleVersion"] = Value("7.0");
    writePlugIn(bundles[i], info);
  }
  // A bundle replaced by another directory of the same name, as an installer swaps them in.
  const std::string swapped = bundles[kBundles / 4];
  const std::string fresh = system_ + "/Library/swap.tmp";
  Dictionary info = plugInInfo(fmt::format("com.example.p{}", kBundles / 4), "com.x.many");
  info["QvBundleVersion"] = Value("8.0");
  writePlugIn(fresh, info);
  fs::remove_all(swapped);
  fs::rename(fresh, swapped);

  EXPECT_EQ(reopenCountingReads(), static_cast<int>(changed.size()) + 1);
  for (int i : changed) {
    ASSERT_TRUE(registry_->plugInByUrl(bundles[i])) << bundles[i];
    EXPECT_EQ(registry_->plugInByUrl(bundles[i])->bundleVersion, "7.0") << bundles[i];
  }
  ASSERT_TRUE(registry_->plugInByUrl(swapped));
  EXPECT_EQ(registry_->plugInByUrl(swapped)->bundleVersion, "8.0");
  EXPECT_EQ(registry_->plugInByUrl(bundles[1])->bundleVersion, "1.0");
  EXPECT_EQ(reopenCountingReads(), 0);
}

TEST_F(StartUpScanTest, BundlesAreReadAgainWhenTheirRecordCannotBeTrusted) {
  open();
  // Unregistered by hand: the next scan registers it again, unchanged files or not.
  ASSERT_TRUE(registry_->unregisterBundle(spell_).ok());
  EXPECT_EQ(reopenCountingReads(), 1);
  ASSERT_TRUE(registry_->plugInByUrl(spell_));

  // A removed container is made again by a scan that reads nothing.
  fs::remove_all(containerOf("com.example.spell"));
  EXPECT_EQ(reopenCountingReads(), 0);
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.spell") + "/tmp"));

  // Files changed just now may change again unseen within the same tick of the file
  // system's clock: their stamps are not trusted until they have settled.
  recorder_->attach(nullptr);
  registry_.reset();
  SqliteRegistry::Options unsettled = options();
  unsettled.settleSeconds = 3600;
  writePlugIn(spell_, plugInInfo("com.example.spell", "com.x.spell"));
  ASSERT_TRUE(SqliteRegistry::open(unsettled).ok());
  EXPECT_EQ(reopenCountingReads(), 1);
  EXPECT_EQ(reopenCountingReads(), 0);
}

TEST_F(StartUpScanTest, RegistriesOfEarlierSchemasAreUpgradedInPlace) {
  // Versions before 4 kept no record of the bundle directories: their bundles are read again.
  struct Earlier {
    const char* downgrade;
    int bundlesRead;
  };
#define DROP_IDENTITY                                                               \
  "ALTER TABLE plugins DROP COLUMN device; ALTER TABLE plugins DROP COLUMN inode; " \
  "ALTER TABLE plugins DROP COLUMN real_path; "
  const Earlier earlier[] = {
      {DROP_IDENTITY "DROP INDEX plugins_uuid_path; DROP TRIGGER plugins_forget_sources; "
                     "DROP TABLE plugin_sources; PRAGMA user_version=1;",
       1},
      {DROP_IDENTITY "DROP INDEX plugins_uuid_path; PRAGMA user_version=2;", 1},
      {DROP_IDENTITY "PRAGMA user_version=3;", 1},
  };
#undef DROP_IDENTITY
  Uuid uuid = open().plugInByUrl(spell_)->uuid;
  const Dictionary byPoint{{"ZuExtensionPointIdentifier", Value("com.x.spell")}};
  for (const Earlier& schema : earlier) {
    registry_.reset();
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(paths::join(state_, "registry.db").c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db, schema.downgrade, nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(db);
    EXPECT_EQ(reopenCountingReads(), schema.bundlesRead) << schema.downgrade;
    EXPECT_EQ(asideDatabases(state_), 0u);
    EXPECT_EQ(registry_->plugInByUrl(spell_)->uuid, uuid);
    EXPECT_EQ(registry_->plugInByUrl(spell_)->bundleIdentity, bundleIdentityOf(spell_));
    EXPECT_EQ(registry_->queryUuids(byPoint), std::vector<Uuid>{uuid});
    EXPECT_EQ(reopenCountingReads(), 0);
  }
}

TEST_F(SqliteRegistryTest, FileThatIsNotADatabaseIsMovedAsideAndRebuilt) {
  std::string spell = writePlugIn(system_ + "/Library/PlugIns/SpellCheck.bundle",
                                  plugInInfo("com.example.spell", "com.x.spell"));
  std::string garbage(8192, 'g');
  writeText(state_ + "/registry.db", garbage);
  writeText(state_ + "/registry.db-wal", "junk");
  SqliteRegistry& registry = open();
  EXPECT_TRUE(registry.plugInByUrl(spell));
  auto aside = asideFiles(state_);
  ASSERT_EQ(aside.size(), 2u);
  EXPECT_EQ(aside[0].rfind("registry.db.corrupt-", 0), 0u);
  EXPECT_EQ(aside[1], aside[0] + "-wal");
  std::ifstream kept(state_ + "/" + aside[0]);
  std::string content((std::istreambuf_iterator<char>(kept)), std::istreambuf_iterator<char>());
  EXPECT_EQ(content, garbage);
}

TEST_F(SqliteRegistryTest, DatabaseOfAnotherSchemaVersionIsMovedAsideAndRebuilt) {
  fs::create_directories(state_);
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open((state_ + "/registry.db").c_str(), &db), SQLITE_OK);
  ASSERT_EQ(
      sqlite3_exec(db, "CREATE TABLE t(x); PRAGMA user_version=99;", nullptr, nullptr, nullptr),
      SQLITE_OK);
  sqlite3_close(db);
  SqliteRegistry& registry = open();
  EXPECT_EQ(asideDatabases(state_), 1u);
  writeApp("X.app", "com.example.x", {{"A.appex", plugInInfo("com.example.a", "p")}});
  EXPECT_TRUE(registry.registerBundle(apps_ + "/X.app").ok());
}

TEST_F(SqliteRegistryTest, DatabaseFailingItsCheckIsMovedAsideAndRebuilt) {
  SqliteRegistry& registry = open();
  for (int i = 0; i < 40; ++i) {
    std::string name = "P" + std::to_string(i) + ".appex";
    writePlugIn(apps_ + "/X.app/PlugIns/" + name,
                plugInInfo("com.example.p" + std::to_string(i), "p" + std::string(200, 'x')));
  }
  writeApp("X.app", "com.example.x");
  ASSERT_TRUE(registry.registerBundle(apps_ + "/X.app").ok());
  registry_.reset();
  // Overwrite the middle of the file (index and table pages) with noise.
  std::string path = state_ + "/registry.db";
  auto size = fs::file_size(path);
  ASSERT_GT(size, 16384u);
  {
    std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(static_cast<std::streamoff>(size / 2));
    std::string noise(4096, '\x5a');
    file.write(noise.data(), static_cast<std::streamsize>(noise.size()));
  }
  open();
  EXPECT_EQ(asideDatabases(state_), 1u);
  EXPECT_TRUE(registry_->installedPlugIns().empty());
}

TEST_F(SqliteRegistryTest, LogIsMovedIntoTheFileWhenIdleAndFreedSpaceIsGivenBack) {
  const std::string file = state_ + "/registry.db";
  // A file of before incremental vacuum is rebuilt with it.
  open();
  registry_.reset();
  {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(file.c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db, "PRAGMA auto_vacuum=NONE; VACUUM;", nullptr, nullptr, nullptr),
              SQLITE_OK);
    sqlite3_close(db);
  }
  idleDelay_ = std::chrono::milliseconds(20);
  SqliteRegistry& registry = open();
  std::vector<std::pair<std::string, Dictionary>> plugIns;
  for (int i = 0; i < 100; ++i) {
    plugIns.push_back({"P" + std::to_string(i) + ".appex",
                       plugInInfo("com.example.p" + std::to_string(i), "com.x.p",
                                  {{"padding", Value(std::string(4000, 'p'))}})});
  }
  ASSERT_TRUE(registry.registerBundle(writeApp("X.app", "com.example.x", plugIns)).ok());
  // Nothing else changes: the log is soon empty, and the file alone holds the registry.
  for (int i = 0; i < 500 && fs::file_size(file + "-wal") > 0; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  EXPECT_EQ(fs::file_size(file + "-wal"), 0u);
  const auto full = fs::file_size(file);

  ASSERT_TRUE(registry.unregisterBundle(apps_ + "/X.app").ok());
  registry.checkpoint();
  EXPECT_EQ(fs::file_size(file + "-wal"), 0u);
  EXPECT_LT(fs::file_size(file) * 4, full);
}

TEST_F(SqliteRegistryTest, SecondOpenWhileHeldFailsWithoutTouchingTheFile) {
  open();
  auto second = SqliteRegistry::open(options());
  ASSERT_FALSE(second.ok());
  EXPECT_EQ(second.error().code, kInUse);
  EXPECT_TRUE(asideFiles(state_).empty());
}

TEST_F(SqliteRegistryTest, LocalizedNamesFollowTheCurrentLanguage) {
  writeApp("X.app", "com.example.x");
  std::string path = apps_ + "/X.app/PlugIns/A.appex";
  Dictionary info = plugInInfo("com.example.a", "p");
  info["QvBundleDisplayName"] = Value("Display");
  info["QvBundleName"] = Value("Plain");
  writePlugIn(path, info);
  writeDmap(path + "/fr.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Affichage")}});
  writeDmap(path + "/en_GB.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Colour")}});
  writeDmap(path + "/de.lproj/InfoDmap.strings", {{"QvBundleName", Value("Kurz")}});
  SqliteRegistry& registry = open();
  ASSERT_TRUE(registry.registerBundle(path).ok());
  struct Case {
    const char* language;
    const char* name;
    const char* shortName;
  };
  const Case cases[] = {
      {"fr_FR.UTF-8", "Affichage", "Plain"},
      {"fr", "Affichage", "Plain"},
      {"en_GB", "Colour", "Plain"},
      {"en_US", "Display", "Plain"},
      {"de_AT", "Kurz", "Kurz"},
      {"C", "Display", "Plain"},
  };
  for (const Case& c : cases) {
    setenv("EKORA_LOCALE", c.language, 1);
    PlugInProxyPtr proxy = registry.plugInByUrl(path);
    EXPECT_EQ(proxy->localizedName, c.name) << c.language;
    EXPECT_EQ(proxy->localizedShortName, c.shortName) << c.language;
  }
  info.erase("QvBundleDisplayName");
  writePlugIn(path, info);
  ASSERT_TRUE(registry.registerBundle(path).ok());
  setenv("EKORA_LOCALE", "ja", 1);
  EXPECT_EQ(registry.plugInByUrl(path)->localizedName, "Plain");
  EXPECT_EQ(registry.plugInByUrl(path)->containingAppName, "X.app");
}

TEST_F(SqliteRegistryTest, LocaleFileOverridesTheEnvironmentAndItsChangeIsANotice) {
  writeApp("X.app", "com.example.x");
  std::string path = apps_ + "/X.app/PlugIns/A.appex";
  writePlugIn(path, plugInInfo("com.example.a", "p"));
  writeDmap(path + "/fr.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Affichage")}});
  writeDmap(path + "/it.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Schermo")}});
  writeDmap(path + "/it.lproj/Localizable.strings", {{"Rename", Value("Rinomina")}});
  SqliteRegistry& registry = open();
  ASSERT_TRUE(registry.registerBundle(path).ok());
  recorder_->clear();
  EXPECT_EQ(registry.plugInByUrl(path)->localizedName, "com.example.a");

  ASSERT_TRUE(dmap::writeBytesAtomically(state_ + "/locale", "fr_FR.UTF-8\nignored\n").ok());
  EXPECT_EQ(registry.plugInByUrl(path)->localizedName, "Affichage");
  ASSERT_TRUE(dmap::writeBytesAtomically(state_ + "/locale", "it\n").ok());
  PlugInProxyPtr proxy = registry.plugInByUrl(path);
  EXPECT_EQ(proxy->localizedName, "Schermo");
  EXPECT_EQ(registry.localizedStrings(proxy->uuid, "Localizable", {"Rename", "Missing"}),
            (Dictionary{{"Rename", Value("Rinomina")}}));
  auto events = recorder_->drained();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, "locale");
  EXPECT_EQ(events[1].kind, "locale");
  registry.checkLocale();
  EXPECT_EQ(recorder_->drained().size(), 2u);  // nothing changed since
  fs::remove(state_ + "/locale");
  registry.checkLocale();
  EXPECT_EQ(recorder_->drained().size(), 3u);
  // A query that reads no proxy still notices the change, as the daemon's matches rely on.
  ASSERT_TRUE(dmap::writeBytesAtomically(state_ + "/locale", "fr\n").ok());
  EXPECT_EQ(registry.queryUuids({}).size(), 1u);
  EXPECT_EQ(recorder_->drained().size(), 4u);
}

class QueryTest : public SqliteRegistryTest {
 protected:
  void SetUp() override {
    SqliteRegistryTest::SetUp();
    writeApp("X.app", "com.example.x",
             {{"A.appex", plugInInfo("com.example.a", "com.x.share")},
              {"B.appex", plugInInfo("com.example.b", "com.x.share")},
              {"C.appex", plugInInfo("com.example.c", "com.x.thumb")},
              {"D.appex", plugInInfo("com.example.d", "com.x.edit")},
              {"E.appex", plugInInfo("com.example.e", "com.x.v01")}});
    ASSERT_TRUE(open().registerBundle(apps_ + "/X.app").ok());
  }

  // Also checks that queryUuids names the same candidates, in the same order, as an
  // unfiltered query.
  std::vector<std::string> identifiers(const Dictionary& rules, const PlugInFilter& filter = {}) {
    std::vector<Uuid> unfiltered;
    for (const auto& proxy : registry_->query(rules, nullptr)) unfiltered.push_back(proxy->uuid);
    EXPECT_EQ(registry_->queryUuids(rules), unfiltered) << Value(rules).description();
    std::vector<std::string> names;
    for (const auto& proxy : registry_->query(rules, filter)) names.push_back(proxy->identifier);
    std::sort(names.begin(), names.end());
    return names;
  }
};

TEST_F(QueryTest, StringExtensionPointSelectsFromTheIndex) {
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier", Value("com.x.share")}}),
            (std::vector<std::string>{"com.example.a", "com.example.b"}));
  EXPECT_TRUE(identifiers({{"ZuExtensionPointIdentifier", Value("com.x.none")}}).empty());
}

TEST_F(QueryTest, ArrayOfExtensionPointsSelectsTheirUnion) {
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier",
                          Value(Array{Value("com.x.thumb"), Value("com.x.edit")})}}),
            (std::vector<std::string>{"com.example.c", "com.example.d"}));
}

TEST_F(QueryTest, OtherKeysAreLeftToTheCaller) {
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier", Value("com.x.share")},
                         {"ZuExtensionIdentifier", Value("com.example.nothing")},
                         {"ZuUserElection", Value("1")}}),
            (std::vector<std::string>{"com.example.a", "com.example.b"}));
  EXPECT_EQ(identifiers({{"Anything", Value("x")}}).size(), 5u);
  EXPECT_EQ(identifiers({}).size(), 5u);
}

TEST_F(QueryTest, OperatorPatternsAreNotNarrowed) {
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier", Value("<>com.x.share")}}).size(), 5u);
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier", Value(true)}}).size(), 5u);
}

TEST_F(QueryTest, DigitRunsCompareByNumber) {
  EXPECT_EQ(identifiers({{"ZuExtensionPointIdentifier", Value("com.x.v1")}}),
            std::vector<std::string>{"com.example.e"});
}

TEST_F(QueryTest, AnswersFollowEveryChange) {
  const Dictionary share{{"ZuExtensionPointIdentifier", Value("com.x.share")}};
  ASSERT_EQ(identifiers(share).size(), 2u);
  ASSERT_EQ(identifiers({}).size(), 5u);
  writeApp("Y.app", "com.example.y", {{"F.appex", plugInInfo("com.example.f", "com.x.share")}});
  ASSERT_TRUE(registry_->registerBundle(apps_ + "/Y.app").ok());
  EXPECT_EQ(identifiers(share),
            (std::vector<std::string>{"com.example.a", "com.example.b", "com.example.f"}));
  EXPECT_EQ(identifiers({}).size(), 6u);
  ASSERT_TRUE(registry_->unregisterBundle(apps_ + "/X.app").ok());
  EXPECT_EQ(identifiers(share), std::vector<std::string>{"com.example.f"});
  EXPECT_EQ(identifiers({}).size(), 1u);
}

TEST_F(QueryTest, FilterRunsPerCandidateAndDecides) {
  std::vector<std::string> seen;
  auto names = identifiers({{"ZuExtensionPointIdentifier", Value("com.x.share")}},
                           [&](const PlugInProxy& proxy) {
                             seen.push_back(proxy.identifier);
                             return proxy.identifier == "com.example.b";
                           });
  EXPECT_EQ(names, std::vector<std::string>{"com.example.b"});
  std::sort(seen.begin(), seen.end());
  EXPECT_EQ(seen, (std::vector<std::string>{"com.example.a", "com.example.b"}));
}

TEST_F(SqliteRegistryTest, ExamplesTreeRegisters) {
  const std::string examples = EKORA_EXAMPLES_DIR;
  system_ = examples + "/System";
  SqliteRegistry& registry = open();
  PlugInProxyPtr spell = registry.plugInByUrl(system_ + "/Library/PlugIns/SpellCheck.bundle");
  ASSERT_TRUE(spell);
  EXPECT_TRUE(spell->onSystemVolume);
  ASSERT_TRUE(registry.registerBundle(examples + "/Applications/Viewer.app").ok());
  ASSERT_TRUE(registry.registerBundle(examples + "/Applications/Notes.app").ok());

  auto viewer = registry.applicationByIdentifier("com.corvane.example.viewer");
  ASSERT_TRUE(viewer);
  EXPECT_EQ(viewer->plugInUuids.size(), 2u);
  auto shares = registry.query({{"ZuExtensionPointIdentifier", Value("com.corvane.share")}}, {});
  ASSERT_EQ(shares.size(), 2u);
  for (const auto& share : shares) {
    // From the SDK dictionary of the share extension point.
    const Dictionary* extension = share->extensionDictionary();
    ASSERT_NE(extension, nullptr);
    EXPECT_TRUE(extension->contains("ZuExtensionProtocol")) << share->identifier;
    EXPECT_TRUE(share->dataContainerPath.has_value());
  }
  auto actions =
      registry.query({{"ZuExtensionPointIdentifier", Value("com.corvane.ui-action")}}, {});
  ASSERT_EQ(actions.size(), 1u);
  const Value* rule = actions[0]
                          ->extensionDictionary()
                          ->at("ZuExtensionAttributes")
                          .get("ZuExtensionActivationRule");
  ASSERT_NE(rule, nullptr);
  EXPECT_NE(rule->dictionary(), nullptr);
  auto thumbs =
      registry.query({{"ZuExtensionPointIdentifier", Value("com.corvane.thumbnail")}}, {});
  ASSERT_EQ(thumbs.size(), 1u);
  EXPECT_EQ(thumbs[0]->localizedName, "Viewer Thumbnails");
  EXPECT_EQ(thumbs[0]->containingAppName, "Viewer");
}

}  // namespace
}  // namespace ek::vantor
