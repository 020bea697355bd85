#include "platform/vantor/SqliteRegistry.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "platform/dmap/Dmap.h"
#include "platform/testing/Files.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek::vantor {
namespace {

namespace fs = std::filesystem;
using ek::testing::writeFile;
using PlugInProxies = std::vector<PlugInProxyPtr>;

Dictionary plugInInfo(const std::string& identifier, const std::string& point,
                      Dictionary attributes = {}, Dictionary extension = {}) {
  extension.emplace("ZuExtensionPointIdentifier", point);
  extension.emplace("ZuExtensionAttributes", Value(std::move(attributes)));
  return {{"QvBundleIdentifier", Value(identifier)},
          {"QvBundleVersion", Value("1.0")},
          {"ZuExtension", Value(std::move(extension))}};
}

// A new file in place of the old, as installers write them.
void writeDmap(const std::string& path, const Dictionary& dictionary) {
  ASSERT_TRUE(writeFile(path + ".new", dmap::write(Value(dictionary)).value()));
  fs::rename(path + ".new", path);
}

// Records each notice, and whether it ran on the registry's queue with its plug-ins registered.
class Recorder : public RegistryObserver {
 public:
  struct Event {
    std::string kind;
    std::vector<Uuid> uuids;
    bool onQueueAndRegistered = true;
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
  // What was recorded since the last call, once the queue ran everything posted so far.
  std::vector<Event> drain() {
    queue_->sync([] {});
    std::lock_guard lock(mutex_);
    return std::exchange(events_, {});
  }

 private:
  void record(const char* kind, const std::vector<PlugInProxyPtr>& plugIns) {
    std::lock_guard lock(mutex_);
    Event event{kind, {}, queue_->isCurrent()};
    for (const auto& plugIn : plugIns) {
      event.uuids.push_back(plugIn->uuid);
      if (registry_ && !registry_->plugInByUuid(plugIn->uuid)) event.onQueueAndRegistered = false;
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
  SqliteRegistryTest() {
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) unsetenv(name);
    setenv("EKORA_LOCALE", "en_US.UTF-8", 1);
  }
  ~SqliteRegistryTest() override {
    close();
    unsetenv("EKORA_LOCALE");
  }

  virtual SqliteRegistry::Options options() {
    SqliteRegistry::Options options;
    options.stateDir = state_;
    options.systemRoot = system_;
    options.codeSigning = codeSigning_;
    options.queue = queue_;
    options.observers = {recorder_};
    return options;
  }
  SqliteRegistry& open() {
    close();  // notices of the start-up scan come before the registry is known here
    auto opened = SqliteRegistry::open(options());
    EXPECT_TRUE(opened.ok()) << (opened.ok() ? "" : opened.error().message);
    registry_ = opened.ok() ? opened.value() : nullptr;
    recorder_->attach(registry_.get());
    return *registry_;
  }
  void close() {
    recorder_->attach(nullptr);
    registry_.reset();
  }
  std::string writePlugIn(const std::string& path, const Dictionary& info) {
    writeDmap(path + "/Info.dmap", info);
    return path;
  }
  std::string writeApp(const std::string& name, const std::string& identifier,
                       const std::vector<std::pair<std::string, Dictionary>>& plugIns = {}) {
    std::string path = apps_ + "/" + name;
    writeDmap(path + "/Info.dmap", {{"QvBundleIdentifier", Value(identifier)}});
    for (const auto& [plugIn, info] : plugIns) writePlugIn(path + "/PlugIns/" + plugIn, info);
    return path;
  }
  std::string containerOf(const std::string& identifier) {
    return state_ + "/containers/" + identifier;
  }
  size_t asideDatabases() {
    size_t count = 0;
    for (const auto& entry : fs::directory_iterator(state_)) {
      std::string name = entry.path().filename().string();
      count += name.find(".corrupt-") != std::string::npos && !name.ends_with("-wal");
    }
    return count;
  }

  ek::testing::TempDir root_;
  const std::string state_ = root_.file("state"), system_ = root_.file("System"),
                    apps_ = root_.file("Applications");
  std::shared_ptr<FakeCodeSigning> codeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::make("vantor-test");
  std::shared_ptr<Recorder> recorder_ = std::make_shared<Recorder>(queue_);
  std::shared_ptr<SqliteRegistry> registry_;
};

// The rules every registry follows: the SQLite registry, registering bundles from disk, and
// the fake the daemon's tests use, given proxies directly.
class RegistryContract : public SqliteRegistryTest, public ::testing::WithParamInterface<bool> {
 protected:
  void SetUp() override {
    if (GetParam()) {
      registry = &open();
      return;
    }
    fake_ = std::make_shared<FakeRegistry>(queue_);
    fake_->addObserver(recorder_);
    recorder_->attach(fake_.get());
    registry = fake_.get();
  }
  // Registers an application of plug-ins {identifier, extension points}; a plug-in of several
  // points declares the first as its own and all of them in its attributes.
  std::string add(const std::string& app,
                  const std::vector<std::pair<std::string, std::vector<std::string>>>& plugIns) {
    std::vector<std::pair<std::string, Dictionary>> bundles;
    for (const auto& [identifier, points] : plugIns) {
      Dictionary attributes;
      Array all(points.begin(), points.end());
      if (fake_ || points.size() > 1) attributes.emplace("ZuExtensionPointIdentifier", all);
      bundles.emplace_back(identifier + ".appex", plugInInfo(identifier, points[0], attributes));
    }
    const std::string path = apps_ + "/" + app;
    if (!fake_) {
      writeApp(app, "app." + app, bundles);
      EXPECT_TRUE(registry->registerBundle(path).ok());
      return path;
    }
    fake_->addApplication({.identifier = "app." + app, .path = path});
    for (const auto& [name, info] : bundles) {
      PlugInProxy proxy{.uuid = Uuid::random(), .path = path + "/PlugIns/" + name};
      proxy.identifier = *info.at("QvBundleIdentifier").string();
      proxy.containingAppPath = path;
      proxy.info = info;
      fake_->install(std::move(proxy));
    }
    return path;
  }
  void remove(const std::string& app) {
    if (!fake_) {
      EXPECT_TRUE(registry->unregisterBundle(app).ok());
      return;
    }
    for (const auto& proxy : fake_->plugInsOfApplication(app)) fake_->uninstall(proxy->uuid);
  }
  // The identifiers a query answers, sorted; queryUuids must name the unfiltered candidates.
  std::string names(const Dictionary& rules, const PlugInFilter& filter = {}) {
    std::vector<Uuid> unfiltered;
    for (const auto& proxy : registry->query(rules, nullptr)) unfiltered.push_back(proxy->uuid);
    EXPECT_EQ(registry->queryUuids(rules), unfiltered) << Value(rules).description();
    std::vector<std::string> names;
    for (const auto& proxy : registry->query(rules, filter)) names.push_back(proxy->identifier);
    std::sort(names.begin(), names.end());
    return fmt::format("{}", fmt::join(names, " "));
  }
  Registry* registry = nullptr;
  std::shared_ptr<FakeRegistry> fake_;
};

Dictionary byPoint(Value pattern) {
  return {{"ZuExtensionPointIdentifier", std::move(pattern)}};
}

TEST_P(RegistryContract, LookupsQueriesAndNoticesFollowEveryChange) {
  Uuid knowledge = registry->knowledgeUuid();
  const std::string x = add("X.app", {{"a", {"share"}}, {"b", {"share"}}});
  EXPECT_NE(registry->knowledgeUuid(), knowledge);
  const PlugInProxies ofX = registry->plugInsOfApplication(fileUrlForPath(x));
  ASSERT_EQ(ofX.size(), 2u);
  EXPECT_EQ(ofX[0]->path, x + "/PlugIns/a.appex");
  EXPECT_EQ(registry->plugInByUuid(ofX[0]->uuid)->identifier, "a");
  EXPECT_EQ(registry->plugInByUrl(fileUrlForPath(ofX[1]->path) + "/")->uuid, ofX[1]->uuid);
  EXPECT_FALSE(registry->plugInByUuid(Uuid::random()));
  EXPECT_EQ(registry->applicationByPath(x)->identifier, "app.X.app");
  EXPECT_EQ(registry->applicationByIdentifier("app.X.app")->path, x);
  EXPECT_EQ(names(byPoint("share")), "a b");
  EXPECT_EQ(names({}), "a b");

  // An application sorting after the first, then the first goes.
  add("Y.app", {{"c", {"share"}}});
  EXPECT_EQ(names(byPoint("share")), "a b c");
  EXPECT_EQ(registry->plugInsOfApplication(x).size(), 2u);
  knowledge = registry->knowledgeUuid();
  remove(x);
  EXPECT_NE(registry->knowledgeUuid(), knowledge);
  EXPECT_EQ(names(byPoint("share")), "c");
  EXPECT_EQ(names({}), "c");
  EXPECT_TRUE(registry->plugInsOfApplication(x).empty());

  std::map<std::string, size_t> noticed;
  for (const auto& event : recorder_->drain()) {
    noticed[event.kind] += event.uuids.size();
    EXPECT_TRUE(event.onQueueAndRegistered) << event.kind;
  }
  EXPECT_EQ(noticed, (std::map<std::string, size_t>{{"install", 3}, {"uninstall", 2}}));
  registry->removeObserver(recorder_);
  add("Z.app", {{"d", {"share"}}});
  EXPECT_TRUE(recorder_->drain().empty());
}

TEST_P(RegistryContract, QueriesNarrowByExtensionPointAlone) {
  add("X.app", {{"a", {"share"}},
                {"b", {"share"}},
                {"c", {"thumb", "edit"}},
                {"d", {"edit"}},
                {"e", {"v01"}},
                {"f", {"ab"}},
                {"g", {"bc"}}});
  const std::string all = "a b c d e f g";
  const struct {
    Dictionary rules;
    std::string names;
  } rows[] = {
      {byPoint("share"), "a b"},
      {byPoint("none"), ""},
      {byPoint("edit"), "c d"},
      {byPoint(Array{"thumb", "edit"}), "c d"},
      {byPoint("v1"), "e"},  // digit runs compare by number
      {byPoint(Array{"ab", "c"}), "f"},
      {byPoint(Array{"a", "bc"}), "g"},
      {{{"ZuExtensionPointIdentifier", "share"}, {"ZuExtensionIdentifier", "x"}}, "a b"},
      {byPoint("<>share"), all},
      {byPoint(true), all},
      {{}, all},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(names(row.rules), row.names) << Value(row.rules).description();
  }
  std::vector<std::string> seen;
  EXPECT_EQ(names(byPoint("share"),
                  [&](const PlugInProxy& proxy) {
                    seen.push_back(proxy.identifier);
                    return proxy.identifier == "b";
                  }),
            "b");
  EXPECT_EQ(seen.size(), 2u);
}

INSTANTIATE_TEST_SUITE_P(Registries, RegistryContract, ::testing::Values(true, false),
                         [](const auto& info) { return info.param ? "Sqlite" : "Fake"; });

TEST_F(SqliteRegistryTest, RegistrationReadsBundlesAndKeepsTheirUuids) {
  SqliteRegistry& registry = open();
  const std::string app = writeApp("My App.app", "com.example.app",
                                   {{"A.appex", plugInInfo("com.example.a", "p")},
                                    {"B.appex", plugInInfo("com.example.b", "q")}});
  fs::create_directories(app + "/PlugIns/NotAPlugIn");
  // A plug-in registers its application with itself alone; the application, all of them.
  ASSERT_TRUE(registry.registerBundle(app + "/PlugIns/A.appex").ok());
  EXPECT_EQ(registry.applicationByPath(app)->plugInUuids.size(), 1u);
  ASSERT_TRUE(registry.registerBundle(app).ok());
  const PlugInProxies plugIns = registry.plugInsOfApplication(app);
  ASSERT_EQ(plugIns.size(), 2u);
  const PlugInProxy& a = *plugIns[0];
  EXPECT_EQ(a.url, fileUrlForPath(app + "/PlugIns/A.appex"));
  EXPECT_EQ(a.containingAppPath, app);
  EXPECT_EQ(a.extensionPoint, "p");
  EXPECT_EQ(a.bundleVersion, "1.0");
  EXPECT_FALSE(a.onSystemVolume);
  EXPECT_EQ(a.dataContainerPath, containerOf("com.example.a"));
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
  EXPECT_EQ(registry.applicationByPath(app)->plugInUuids,
            (std::vector<Uuid>{a.uuid, plugIns[1]->uuid}));

  // Again after reopening: the same UUIDs, the same knowledge.
  const Uuid knowledge = registry.knowledgeUuid();
  open();
  EXPECT_EQ(registry_->knowledgeUuid(), knowledge);
  ASSERT_TRUE(registry_->registerBundle(app).ok());
  EXPECT_EQ(registry_->plugInByUrl(a.path)->uuid, a.uuid);
  // A changed identifier is another plug-in; a bundle gone from the application is dropped.
  recorder_->drain();
  writePlugIn(a.path, plugInInfo("com.example.renamed", "p"));
  fs::remove_all(app + "/PlugIns/B.appex");
  ASSERT_TRUE(registry_->registerBundle(app).ok());
  EXPECT_NE(registry_->plugInByUrl(a.path)->uuid, a.uuid);
  auto events = recorder_->drain();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, "uninstall");
  EXPECT_EQ(events[0].uuids.size(), 2u);
  EXPECT_EQ(events[1].kind, "install");
  // Unregistered: the containers stay.
  ASSERT_TRUE(registry_->unregisterBundle(fileUrlForPath(app)).ok());
  EXPECT_TRUE(registry_->installedPlugIns().empty());
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
}

TEST_F(SqliteRegistryTest, ExtensionPointSdkAndEntitlementsAreReadIn) {
  writeDmap(system_ + "/Library/ExtensionPoints/com.x.data.dmap",
            {{"SdkTop", Value("sdk")},
             {"ZuExtension", Value(Dictionary{{"ZuExtensionProtocol", Value("#Data")},
                                              {"Dedicated", Value(true)}})}});
  SqliteRegistry& registry = open();
  Dictionary data = plugInInfo("com.example.data", "com.x.data", {}, {{"Dedicated", false}});
  Dictionary own = plugInInfo("com.example.own", "p");
  own.emplace("QvBundleExecutable", "A");
  const std::string app = writeApp("X.app", "com.example.x", {{"D.appex", data}, {"O.appex", own}});
  codeSigning_->setExecutableEntitlements(app + "/PlugIns/O.appex/A", {{"ent", Value(true)}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  PlugInProxyPtr merged = registry.plugInByUrl(app + "/PlugIns/D.appex");
  EXPECT_EQ(merged->info.at("SdkTop"), Value("sdk"));
  EXPECT_EQ(merged->extensionDictionary()->at("Dedicated"), Value(false));
  EXPECT_EQ(registry.extensionPointSdk("com.x.data")->at("SdkTop"), Value("sdk"));
  EXPECT_FALSE(registry.extensionPointSdk("com.x.none"));
  // Data-only by its SDK: no container.
  EXPECT_EQ(merged->dataContainerPath, std::nullopt);
  EXPECT_FALSE(fs::exists(containerOf("com.example.data")));
  EXPECT_TRUE(merged->entitlements.empty());
  EXPECT_EQ(registry.plugInByUrl(app + "/PlugIns/O.appex")->entitlements,
            (Dictionary{{"ent", Value(true)}}));
}

TEST_F(SqliteRegistryTest, RefusedBundlesLeaveEverythingAsItWas) {
  SqliteRegistry& registry = open();
  const std::string app =
      writeApp("X.app", "com.example.x", {{"A.appex", plugInInfo("com.example.a", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  const Uuid a = registry.plugInsOfApplication(app).at(0)->uuid;
  const std::string bad = app + "/PlugIns/Bad.appex";
  Dictionary escaping = plugInInfo("com.example.bad", "p");
  escaping.emplace("QvBundleExecutable", "../../escape");
  const struct {
    const char* what;
    std::string info;  // of Bad.appex
    std::string path;
    int code;
  } rows[] = {
      {"identifier leading out", dmap::write(Value(plugInInfo("../../etc", "p"))).value(), app,
       kInvalidIdentifier},
      {"identifier of two names", dmap::write(Value(plugInInfo("a/b", "p"))).value(), bad,
       kInvalidIdentifier},
      {"executable leading out", dmap::write(Value(escaping)).value(), app, kMalformedBundle},
      {"malformed Info.dmap", "<dmap version=\"1.0\"><dict><key>x</key>", app, kMalformedBundle},
      {"relative path", "", "relative/X.app", 0},
      {"missing bundle", "", apps_ + "/Missing.app", 0},
  };
  recorder_->drain();
  for (const auto& row : rows) {
    if (!row.info.empty()) writeFile(bad + "/Info.dmap", row.info);
    const Uuid knowledge = registry.knowledgeUuid();
    auto result = registry.registerBundle(row.path);
    ASSERT_FALSE(result.ok()) << row.what;
    EXPECT_TRUE(!row.code || result.error().code == row.code) << row.what;
    EXPECT_EQ(registry.knowledgeUuid(), knowledge) << row.what;
    EXPECT_EQ(registry.installedPlugIns().size(), 1u) << row.what;
    EXPECT_EQ(registry.plugInsOfApplication(app).at(0)->uuid, a) << row.what;
  }
  EXPECT_TRUE(recorder_->drain().empty());
  EXPECT_FALSE(fs::exists(root_.file("etc")));
  EXPECT_EQ(registry.unregisterBundle(apps_ + "/Nothing.app").error().code, kNotRegistered);
  auto second = SqliteRegistry::open(options());
  ASSERT_FALSE(second.ok());
  EXPECT_EQ(second.error().code, kInUse);
}

TEST_F(SqliteRegistryTest, NamesFollowTheLanguageOfTheEnvironmentOrTheLocaleFile) {
  const std::string path = apps_ + "/X.app/PlugIns/A.appex";
  Dictionary info = plugInInfo("com.example.a", "p");
  info["QvBundleDisplayName"] = Value("Display");
  info["QvBundleName"] = Value("Plain");
  writeApp("X.app", "com.example.x", {{"A.appex", info}});
  writeDmap(path + "/fr.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Affichage")}});
  writeDmap(path + "/en_GB.lproj/InfoDmap.strings", {{"QvBundleDisplayName", Value("Colour")}});
  writeDmap(path + "/de.lproj/InfoDmap.strings", {{"QvBundleName", Value("Kurz")}});
  writeDmap(path + "/de.lproj/Localizable.strings", {{"Rename", Value("Umbenennen")}});
  SqliteRegistry& registry = open();
  ASSERT_TRUE(registry.registerBundle(path).ok());
  const struct {
    const char* language;
    const char* file;  // the locale file's text, when there is one
    const char* name;
    const char* shortName;
  } rows[] = {
      {"fr_FR.UTF-8", nullptr, "Affichage", "Plain"},
      {"en_GB", nullptr, "Colour", "Plain"},
      {"en_US", nullptr, "Display", "Plain"},
      {"C", nullptr, "Display", "Plain"},
      {"de_AT", nullptr, "Kurz", "Kurz"},
      {"de_AT", "fr\nignored\n", "Affichage", "Plain"},
      {"fr", "en_GB\n", "Colour", "Plain"},
      {"fr", "de\n", "Kurz", "Kurz"},
  };
  for (const auto& row : rows) {
    setenv("EKORA_LOCALE", row.language, 1);
    if (row.file) writeFile(state_ + "/locale", row.file);
    PlugInProxyPtr proxy = registry.plugInByUrl(path);
    EXPECT_EQ(proxy->localizedName, row.name) << row.language;
    EXPECT_EQ(proxy->localizedShortName, row.shortName) << row.language;
  }
  EXPECT_EQ(registry.localizedStrings(registry.plugInByUrl(path)->uuid, "Localizable",
                                      {"Rename", "Missing"}),
            (Dictionary{{"Rename", Value("Umbenennen")}}));
  // Each change of the locale file is a notice, also to a query that reads no proxy.
  EXPECT_EQ(recorder_->drain().size(), 4u);  // the install and three changes
  fs::remove(state_ + "/locale");
  EXPECT_EQ(registry.queryUuids({}).size(), 1u);
  EXPECT_EQ(recorder_->drain().size(), 1u);
}

TEST_F(SqliteRegistryTest, DatabaseThatCannotBeUsedIsMovedAsideAndRebuilt) {
  const std::string file = state_ + "/registry.db";
  auto sql = [&](const char* statements) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(file.c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db, statements, nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(db);
  };
  const struct {
    const char* what;
    std::function<void()> spoil;
  } rows[] = {
      {"not a database", [&] { writeFile(file, std::string(8192, 'g')); }},
      {"another schema", [&] { sql("CREATE TABLE t(x); PRAGMA user_version=99;"); }},
      {"pages overwritten",
       [&] {
         std::vector<std::pair<std::string, Dictionary>> plugIns;
         for (int i = 0; i < 40; ++i) {
           plugIns.emplace_back(fmt::format("P{}.appex", i),
                                plugInInfo(fmt::format("p{}", i), std::string(200, 'x')));
         }
         ASSERT_TRUE(open().registerBundle(writeApp("X.app", "com.example.x", plugIns)).ok());
         close();
         std::fstream bytes(file, std::ios::in | std::ios::out | std::ios::binary);
         bytes.seekp(static_cast<std::streamoff>(fs::file_size(file) / 2));
         bytes << std::string(4096, '\x5a');
       }},
  };
  for (size_t i = 0; i < std::size(rows); ++i) {
    fs::remove_all(apps_);
    rows[i].spoil();
    EXPECT_EQ(open().installedPlugIns().size(), 0u) << rows[i].what;
    EXPECT_EQ(asideDatabases(), i + 1) << rows[i].what;
    close();
  }
}

TEST_F(SqliteRegistryTest, LogIsMovedIntoTheFileAndFreedSpaceIsGivenBack) {
  const std::string file = state_ + "/registry.db";
  SqliteRegistry& registry = open();
  std::vector<std::pair<std::string, Dictionary>> plugIns;
  for (int i = 0; i < 100; ++i) {
    plugIns.emplace_back(fmt::format("P{}.appex", i),
                         plugInInfo(fmt::format("p{}", i), "p", {{"pad", std::string(4000, 'p')}}));
  }
  ASSERT_TRUE(registry.registerBundle(writeApp("X.app", "com.example.x", plugIns)).ok());
  registry.checkpoint();
  EXPECT_EQ(fs::file_size(file + "-wal"), 0u);
  const auto full = fs::file_size(file);
  ASSERT_TRUE(registry.unregisterBundle(apps_ + "/X.app").ok());
  registry.checkpoint();
  EXPECT_EQ(fs::file_size(file + "-wal"), 0u);
  EXPECT_LT(fs::file_size(file) * 4, full);
}

// The start-up scan with trusted stamps and entitlements from files, as in the daemon.
class StartUpScanTest : public SqliteRegistryTest {
 protected:
  void SetUp() override {
    writePlugIn(spell_, spellInfo("1.0"));
    writeFile(spell_ + "/spell", "#!/bin/sh\n");
  }
  static Dictionary spellInfo(const char* version) {
    Dictionary info = plugInInfo("com.example.spell", "com.x.spell");
    info["QvBundleExecutable"] = Value("spell");
    info["QvBundleVersion"] = Value(version);
    return info;
  }
  SqliteRegistry::Options options() override {
    SqliteRegistry::Options options = SqliteRegistryTest::options();
    options.codeSigning = CodeSigning::system();
    options.settleSeconds = settle_;
    options.scanOnOpen = false;
    return options;
  }
  // Reopens and answers how many system bundles the scan read rather than left alone.
  size_t reopenCountingReads() { return open().rescanSystemVolume().read; }

  const std::string spell_ = system_ + "/Library/PlugIns/SpellCheck.bundle";
  int64_t settle_ = 0;
};

TEST_F(StartUpScanTest, OnlyBundlesWithAChangedFileAreReadAgain) {
  EXPECT_EQ(reopenCountingReads(), 1u);
  PlugInProxyPtr spell = registry_->plugInByUrl(spell_);
  ASSERT_TRUE(spell);
  EXPECT_TRUE(spell->onSystemVolume);
  EXPECT_EQ(spell->containingAppPath, std::nullopt);
  const Uuid knowledge = registry_->knowledgeUuid();
  EXPECT_EQ(reopenCountingReads(), 0u);
  EXPECT_EQ(registry_->knowledgeUuid(), knowledge);

  const std::string points = system_ + "/Library/ExtensionPoints/com.x.spell.dmap";
  const Dictionary principal{{"ZuExtension", Dictionary{{"ZuExtensionPrincipalClass", "B"}}}};
  const struct {
    const char* what;
    std::function<void()> change;
    std::function<bool(const PlugInProxy&)> seen;
  } rows[] = {
      {"Info.dmap", [&] { writePlugIn(spell_, spellInfo("2.0")); },
       [](const PlugInProxy& p) { return p.bundleVersion == "2.0"; }},
      {"entitlements",
       [&] {
         writeDmap(spell_ + "/spell.entitlements", {{"granted", true}});
       },
       [](const PlugInProxy& p) { return p.entitlements.contains("granted"); }},
      {"strings", [&] { writeDmap(spell_ + "/ja.lproj/InfoDmap.strings", {}); },
       [](const PlugInProxy&) { return true; }},
      {"extension point", [&] { writeDmap(points, principal); },
       [](const PlugInProxy& p) {
         return p.extensionDictionary()->contains("ZuExtensionPrincipalClass");
       }},
      {"executable writable by others", [&] { ::chmod((spell_ + "/spell").c_str(), 0777); },
       [](const PlugInProxy& p) { return p.entitlements.empty(); }},
      {"unregistered by hand", [&] { ASSERT_TRUE(registry_->unregisterBundle(spell_).ok()); },
       [](const PlugInProxy&) { return true; }},
      {"read when too fresh to be trusted",
       [&] {
         writePlugIn(spell_, spellInfo("3.0"));
         settle_ = 3600;
         EXPECT_EQ(reopenCountingReads(), 1u);
         settle_ = 0;
       },
       [](const PlugInProxy& p) { return p.bundleVersion == "3.0"; }},
  };
  for (const auto& row : rows) {
    row.change();
    EXPECT_EQ(reopenCountingReads(), 1u) << row.what;
    spell = registry_->plugInByUrl(spell_);
    ASSERT_TRUE(spell) << row.what;
    EXPECT_TRUE(row.seen(*spell)) << row.what;
    EXPECT_EQ(reopenCountingReads(), 0u) << row.what;
  }
  // A removed container is made again by a scan that reads nothing; a vanished bundle goes.
  fs::remove_all(containerOf("com.example.spell"));
  EXPECT_EQ(reopenCountingReads(), 0u);
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.spell") + "/tmp"));
  fs::remove_all(spell_);
  recorder_->drain();
  EXPECT_EQ(reopenCountingReads(), 0u);
  EXPECT_TRUE(registry_->installedPlugIns().empty());
  ASSERT_EQ(recorder_->drain().size(), 1u);
}

TEST_F(StartUpScanTest, ManyBundlesAreCheckedTogetherAndAChangeInAnyShareIsSeen) {
  constexpr int kBundles = 1100;  // enough for the check to be shared among threads
  for (int i = 0; i < kBundles; ++i) {
    writePlugIn(fmt::format("{}/Library/PlugIns/P{:04}.bundle", system_, i),
                plugInInfo(fmt::format("p{}", i), "many"));
  }
  EXPECT_EQ(reopenCountingReads(), kBundles + 1u);
  const std::vector<int> changed = {0, kBundles / 3, kBundles / 2 + 1, kBundles - 1};
  for (int i : changed) {
    Dictionary info = plugInInfo(fmt::format("p{}", i), "many");
    info["QvBundleVersion"] = Value("7.0");
    writePlugIn(fmt::format("{}/Library/PlugIns/P{:04}.bundle", system_, i), info);
  }
  EXPECT_EQ(reopenCountingReads(), changed.size());
  for (int i : changed) {
    EXPECT_EQ(registry_->plugInByUrl(fmt::format("{}/Library/PlugIns/P{:04}.bundle", system_, i))
                  ->bundleVersion,
              "7.0");
  }
}

TEST_F(StartUpScanTest, RegistriesOfEarlierSchemasAreUpgradedInPlace) {
  // Versions before 4 kept no record of the bundle directories: their bundles are read again.
#define DROP_IDENTITY                                                               \
  "ALTER TABLE plugins DROP COLUMN device; ALTER TABLE plugins DROP COLUMN inode; " \
  "ALTER TABLE plugins DROP COLUMN real_path; "
  const char* downgrades[] = {
      DROP_IDENTITY
      "DROP INDEX plugins_uuid_path; DROP TRIGGER plugins_forget_sources; "
      "DROP TABLE plugin_sources; PRAGMA user_version=1;",
      DROP_IDENTITY "DROP INDEX plugins_uuid_path; PRAGMA user_version=2;",
      DROP_IDENTITY "PRAGMA user_version=3;",
  };
#undef DROP_IDENTITY
  EXPECT_EQ(reopenCountingReads(), 1u);
  const Uuid uuid = registry_->plugInByUrl(spell_)->uuid;
  for (const char* downgrade : downgrades) {
    close();
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open((state_ + "/registry.db").c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db, downgrade, nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(db);
    EXPECT_EQ(reopenCountingReads(), 1u) << downgrade;
    EXPECT_EQ(asideDatabases(), 0u);
    EXPECT_EQ(registry_->plugInByUrl(spell_)->bundleIdentity, bundleIdentityOf(spell_));
    EXPECT_EQ(registry_->queryUuids(byPoint("com.x.spell")), std::vector<Uuid>{uuid});
    EXPECT_EQ(reopenCountingReads(), 0u);
  }
}

TEST_F(SqliteRegistryTest, ExamplesTreeRegisters) {
  const std::string examples = EKORA_EXAMPLES_DIR;
  SqliteRegistry::Options options = this->options();
  options.systemRoot = examples + "/System";
  auto opened = SqliteRegistry::open(options);
  ASSERT_TRUE(opened.ok());
  SqliteRegistry& registry = **opened;
  EXPECT_TRUE(registry.plugInByUrl(examples + "/System/Library/PlugIns/SpellCheck.bundle"));
  ASSERT_TRUE(registry.registerBundle(examples + "/Applications/Viewer.app").ok());
  ASSERT_TRUE(registry.registerBundle(examples + "/Applications/Notes.app").ok());
  for (const auto& share : registry.query(byPoint("com.corvane.share"), {})) {
    EXPECT_TRUE(share->extensionDictionary()->contains("ZuExtensionProtocol"));
  }
  auto thumbs = registry.query(byPoint("com.corvane.thumbnail"), {});
  ASSERT_EQ(thumbs.size(), 1u);
  EXPECT_EQ(thumbs[0]->localizedName, "Viewer Thumbnails");
}

}  // namespace
}  // namespace ek::vantor
