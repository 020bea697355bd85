#include "platform/vantor/SqliteRegistry.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

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

Dictionary byPoint(Value pattern) {
  return {{"ZuExtensionPointIdentifier", std::move(pattern)}};
}

// A new file in place of the old, as installers write them.
void writeDmap(const std::string& path, const Dictionary& dictionary) {
  ASSERT_TRUE(writeFile(path + ".new", dmap::write(Value(dictionary)).value()));
  fs::rename(path + ".new", path);
}

// Records each notice as "kind count", and whether each ran on the registry's queue with its
// plug-ins still registered.
class Recorder : public RegistryObserver {
 public:
  explicit Recorder(std::shared_ptr<SerialQueue> queue) : queue_(std::move(queue)) {}
  void pluginsDidInstall(const PlugInProxies& plugIns) override { record("install", plugIns); }
  void pluginsWillUninstall(const PlugInProxies& plugIns) override { record("uninstall", plugIns); }
  void localeDidChange() override { record("locale", {}); }
  // The notices since the last call, once the queue ran everything posted so far.
  std::vector<std::string> drain() {
    queue_->sync([] {});
    std::lock_guard lock(mutex_);
    return std::exchange(events_, {});
  }
  std::atomic<Registry*> registry = nullptr;
  std::atomic<bool> onQueueAndRegistered = true;

 private:
  void record(const char* kind, const PlugInProxies& plugIns) {
    std::lock_guard lock(mutex_);
    events_.push_back(fmt::format("{} {}", kind, plugIns.size()));
    onQueueAndRegistered = onQueueAndRegistered && queue_->isCurrent();
    for (const auto& plugIn : plugIns) {
      if (registry && !registry.load()->plugInByUuid(plugIn->uuid)) onQueueAndRegistered = false;
    }
  }
  const std::shared_ptr<SerialQueue> queue_;
  std::mutex mutex_;
  std::vector<std::string> events_;
};

class SqliteRegistryTest : public ::testing::Test {
 protected:
  ~SqliteRegistryTest() override { close(); }
  SqliteRegistry::Options options() {
    return {.stateDir = state_,
            .systemRoot = system_,
            .codeSigning = codeSigning_,
            .queue = queue_,
            .observers = {recorder_},
            .scanOnOpen = false,
            .settleSeconds = settle_};
  }
  SqliteRegistry& open() {
    close();
    auto opened = SqliteRegistry::open(options());
    EXPECT_TRUE(opened.ok()) << (opened.ok() ? "" : opened.error().message);
    registry_ = opened.ok() ? opened.value() : nullptr;
    recorder_->registry = registry_.get();
    return *registry_;
  }
  void close() {
    recorder_->registry = nullptr;
    queue_->sync([] {});  // a notice under way may still be reading the registry
    registry_.reset();
  }
  std::string writeApp(const std::string& name,
                       const std::vector<std::pair<std::string, Dictionary>>& plugIns = {}) {
    std::string path = apps_ + "/" + name;
    writeDmap(path + "/Info.dmap", {{"QvBundleIdentifier", Value("app." + name)}});
    for (const auto& [plugIn, info] : plugIns)
      writeDmap(path + "/PlugIns/" + plugIn + "/Info.dmap", info);
    return path;
  }
  std::string containerOf(const std::string& identifier) {
    return state_ + "/containers/" + identifier;
  }

  ek::testing::TempDir root_;
  const std::string state_ = root_.file("state"), system_ = root_.file("System"),
                    apps_ = root_.file("Applications");
  std::shared_ptr<FakeCodeSigning> fakeSigning_ = std::make_shared<FakeCodeSigning>();
  std::shared_ptr<CodeSigning> codeSigning_ = fakeSigning_;
  int64_t settle_ = 0;
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
    recorder_->registry = registry = fake_.get();
  }
  // Registers an application of plug-ins {identifier, extension points}; a plug-in of several
  // points declares the first as its own and all of them in its attributes.
  std::string add(const std::string& app,
                  const std::vector<std::pair<std::string, std::vector<std::string>>>& plugIns) {
    const std::string path = apps_ + "/" + app;
    std::vector<std::pair<std::string, Dictionary>> bundles;
    if (fake_) fake_->addApplication({.identifier = "app." + app, .path = path});
    for (const auto& [id, points] : plugIns) {
      Dictionary attributes;
      Array all(points.begin(), points.end());
      if (fake_ || points.size() > 1) attributes.emplace("ZuExtensionPointIdentifier", all);
      bundles.emplace_back(id + ".appex", plugInInfo(id, points[0], attributes));
      if (!fake_) continue;
      fake_->install({.uuid = Uuid::random(),
                      .identifier = id,
                      .path = path + "/PlugIns/" + id + ".appex",
                      .containingAppPath = path,
                      .info = bundles.back().second});
    }
    EXPECT_TRUE(fake_ || registry->registerBundle(writeApp(app, bundles)).ok());
    return path;
  }
  void remove(const std::string& app) {
    EXPECT_TRUE(fake_ || registry->unregisterBundle(app).ok());
    for (const auto& proxy : fake_ ? fake_->plugInsOfApplication(app) : PlugInProxies{}) {
      fake_->uninstall(proxy->uuid);
    }
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

TEST_P(RegistryContract, LookupsQueriesAndNoticesFollowEveryChange) {
  Uuid knowledge = registry->knowledgeUuid();
  const std::string x = add("X.app", {{"a", {"share"}},
                                      {"b", {"share"}},
                                      {"c", {"thumb", "edit"}},
                                      {"d", {"edit"}},
                                      {"e", {"v01"}},
                                      {"f", {"ab"}},
                                      {"g", {"bc"}}});
  EXPECT_NE(registry->knowledgeUuid(), knowledge);
  const PlugInProxies ofX = registry->plugInsOfApplication(fileUrlForPath(x));
  ASSERT_EQ(ofX.size(), 7u);
  EXPECT_EQ(registry->plugInByUuid(ofX[0]->uuid)->identifier, "a");
  EXPECT_EQ(registry->plugInByUrl(fileUrlForPath(ofX[1]->path) + "/")->uuid, ofX[1]->uuid);
  EXPECT_EQ(registry->applicationByIdentifier("app.X.app")->path, x);
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
      {byPoint("<>share"), "a b c d e f g"},
      {byPoint(true), "a b c d e f g"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(names(row.rules), row.names) << Value(row.rules).description();
  }
  EXPECT_EQ(names(byPoint("share"), [](const PlugInProxy& p) { return p.identifier == "b"; }), "b");

  // An application sorting after the first, then the first goes.
  add("Y.app", {{"y", {"share"}}});
  EXPECT_EQ(names(byPoint("share")), "a b y");
  EXPECT_EQ(registry->plugInsOfApplication(x).size(), 7u);
  knowledge = registry->knowledgeUuid();
  remove(x);
  EXPECT_NE(registry->knowledgeUuid(), knowledge);
  EXPECT_EQ(names(byPoint("share")), "y");
  EXPECT_EQ(names({}), "y");
  std::map<std::string, int> noticed;
  for (const std::string& event : recorder_->drain()) {
    noticed[event.substr(0, event.find(' '))] += std::stoi(event.substr(event.find(' ')));
  }
  EXPECT_EQ(noticed, (std::map<std::string, int>{{"install", 8}, {"uninstall", 7}}));
  EXPECT_TRUE(recorder_->onQueueAndRegistered);
  registry->removeObserver(recorder_);
  add("Z.app", {{"z", {"share"}}});
  EXPECT_TRUE(recorder_->drain().empty());
}

INSTANTIATE_TEST_SUITE_P(Registries, RegistryContract, ::testing::Values(true, false),
                         [](const auto& info) { return info.param ? "Sqlite" : "Fake"; });

TEST_F(SqliteRegistryTest, RegistrationReadsBundlesInTheCurrentLanguageAndKeepsTheirUuids) {
  writeDmap(system_ + "/Library/ExtensionPoints/q.dmap",
            {{"SdkTop", Value("sdk")},
             {"ZuExtension", Dictionary{{"ZuExtensionProtocol", "#Data"}, {"Own", true}}}});
  SqliteRegistry& registry = open();
  Dictionary a = plugInInfo("com.example.a", "p"), b = plugInInfo("b", "q", {}, {{"Own", false}});
  a.emplace("QvBundleExecutable", "run");
  a.emplace("QvBundleDisplayName", "Display");
  const std::string app = writeApp("My App.app", {{"A.appex", a}, {"B.appex", b}});
  writeDmap(app + "/PlugIns/A.appex/fr.lproj/InfoDmap.strings",
            {{"QvBundleDisplayName", Value("Affichage")}});
  fakeSigning_->setExecutableEntitlements(app + "/PlugIns/A.appex/run", {{"ent", Value(true)}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  const PlugInProxies plugIns = registry.plugInsOfApplication(app);
  ASSERT_EQ(plugIns.size(), 2u);
  const PlugInProxy& first = *plugIns[0];
  EXPECT_EQ(first.entitlements, (Dictionary{{"ent", Value(true)}}));
  EXPECT_EQ(first.dataContainerPath, containerOf("com.example.a"));
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
  // The extension point's SDK is merged in, the plug-in's own values winning: data-only.
  EXPECT_EQ(plugIns[1]->info.at("SdkTop"), Value("sdk"));
  EXPECT_EQ(plugIns[1]->extensionDictionary()->at("Own"), Value(false));
  EXPECT_EQ(plugIns[1]->dataContainerPath, std::nullopt);
  // Names follow the language; the locale file overrides the environment, and each change of
  // it is a notice, also to a query that reads no proxy.
  recorder_->drain();
  setenv("EKORA_LOCALE", "fr_FR.UTF-8", 1);
  EXPECT_EQ(registry.plugInByUrl(first.path)->localizedName, "Affichage");
  EXPECT_EQ(registry.localizedStrings(first.uuid, "InfoDmap", {"QvBundleDisplayName", "X"}),
            (Dictionary{{"QvBundleDisplayName", Value("Affichage")}}));
  ASSERT_TRUE(dmap::writeBytesAtomically(state_ + "/locale", "de\n").ok());
  EXPECT_EQ(registry.plugInByUrl(first.path)->localizedName, "Display");
  fs::remove(state_ + "/locale");
  EXPECT_EQ(registry.queryUuids({}).size(), 2u);
  unsetenv("EKORA_LOCALE");
  EXPECT_EQ(recorder_->drain(), (std::vector<std::string>{"locale 0", "locale 0"}));

  // Again after reopening: the same UUIDs, the same knowledge.
  const Uuid knowledge = registry.knowledgeUuid();
  open();
  EXPECT_EQ(registry_->knowledgeUuid(), knowledge);
  ASSERT_TRUE(registry_->registerBundle(app).ok());
  EXPECT_EQ(registry_->plugInByUrl(first.path)->uuid, first.uuid);
  // A changed identifier is another plug-in; a bundle gone from the application is dropped.
  recorder_->drain();
  writeDmap(first.path + "/Info.dmap", plugInInfo("com.example.renamed", "p"));
  fs::remove_all(app + "/PlugIns/B.appex");
  ASSERT_TRUE(registry_->registerBundle(app).ok());
  EXPECT_NE(registry_->plugInByUrl(first.path)->uuid, first.uuid);
  EXPECT_EQ(recorder_->drain(), (std::vector<std::string>{"uninstall 2", "install 1"}));
  // Unregistered: the containers stay.
  ASSERT_TRUE(registry_->unregisterBundle(fileUrlForPath(app)).ok());
  EXPECT_TRUE(registry_->installedPlugIns().empty());
  EXPECT_TRUE(fs::is_directory(containerOf("com.example.a") + "/tmp"));
}

TEST_F(SqliteRegistryTest, RefusedBundlesLeaveEverythingAsItWas) {
  SqliteRegistry& registry = open();
  const std::string app = writeApp("X.app", {{"A.appex", plugInInfo("com.example.a", "p")}});
  ASSERT_TRUE(registry.registerBundle(app).ok());
  const Uuid a = registry.plugInsOfApplication(app).at(0)->uuid;
  Dictionary escaping = plugInInfo("com.example.bad", "p");
  escaping.emplace("QvBundleExecutable", "../../escape");
  const struct {
    std::string info;  // of Bad.appex
    std::string path;
    int code;
  } rows[] = {
      {dmap::write(Value(plugInInfo("../../etc", "p"))).value(), app, kInvalidIdentifier},
      {dmap::write(Value(escaping)).value(), app, kMalformedBundle},
      {"<dmap version=\"1.0\"><dict><key>x</key>", app, kMalformedBundle},
  };
  recorder_->drain();
  for (const auto& row : rows) {
    writeFile(app + "/PlugIns/Bad.appex/Info.dmap", row.info);
    const Uuid knowledge = registry.knowledgeUuid();
    auto result = registry.registerBundle(row.path);
    ASSERT_FALSE(result.ok()) << row.info;
    EXPECT_EQ(result.error().code, row.code) << row.info;
    EXPECT_EQ(registry.knowledgeUuid(), knowledge) << row.info;
    EXPECT_EQ(registry.installedPlugIns().size(), 1u) << row.info;
    EXPECT_EQ(registry.plugInsOfApplication(app).at(0)->uuid, a) << row.info;
  }
  EXPECT_TRUE(recorder_->drain().empty());
  EXPECT_FALSE(fs::exists(root_.file("etc")));
  EXPECT_EQ(registry.unregisterBundle(apps_ + "/Nothing.app").error().code, kNotRegistered);
  EXPECT_EQ(SqliteRegistry::open(options()).error().code, kInUse);  // held by this one
}

// The start-up scan as the daemon runs it, with entitlements from files.
TEST_F(SqliteRegistryTest, StartUpScanReadsOnlyBundlesWithAChangedFile) {
  codeSigning_ = CodeSigning::system();
  const std::string bundle = system_ + "/Library/PlugIns/SpellCheck.bundle";
  auto spellInfo = [](const char* version) {
    Dictionary info = plugInInfo("com.example.spell", "x");
    info["QvBundleExecutable"] = Value("spell");
    info["QvBundleVersion"] = Value(version);
    return info;
  };
  writeDmap(bundle + "/Info.dmap", spellInfo("1.0"));
  writeFile(bundle + "/spell", "#!/bin/sh\n");
  // Reopens and answers how many system bundles the scan read rather than left alone.
  auto reopenCountingReads = [&] { return open().rescanSystemVolume().read; };
  EXPECT_EQ(reopenCountingReads(), 1u);
  PlugInProxyPtr spell = registry_->plugInByUrl(bundle);
  EXPECT_TRUE(spell->onSystemVolume);

  const std::pair<const char*, std::function<void()>> changes[] = {
      {"Info.dmap rewritten in place",
       [&] { writeFile(bundle + "/Info.dmap", dmap::write(Value(spellInfo("2.0"))).value()); }},
      {"entitlements added", [&] { writeDmap(bundle + "/spell.entitlements", {}); }},
      {"executable writable by others", [&] { ::chmod((bundle + "/spell").c_str(), 0777); }},
      {"too fresh to be trusted",
       [&] {
         writeDmap(bundle + "/Info.dmap", spellInfo("3.0"));
         settle_ = 3600;
         EXPECT_EQ(reopenCountingReads(), 1u);
         settle_ = 0;
       }},
  };
  for (const auto& [what, change] : changes) {
    change();
    EXPECT_EQ(reopenCountingReads(), 1u) << what;
    EXPECT_EQ(reopenCountingReads(), 0u) << what;
  }
  spell = registry_->plugInByUrl(bundle);
  EXPECT_EQ(spell->bundleVersion, "3.0");
  EXPECT_TRUE(spell->entitlements.empty());  // the executable is no longer to be trusted
  // A vanished bundle goes.
  fs::remove_all(bundle);
  recorder_->drain();
  EXPECT_EQ(reopenCountingReads(), 0u);
  EXPECT_TRUE(registry_->installedPlugIns().empty());
  EXPECT_EQ(recorder_->drain(), std::vector<std::string>{"uninstall 1"});
}

}  // namespace
}  // namespace ek::vantor
