#include "ekd/EkDPlugIn.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <functional>
#include <limits>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "Ekora/EkPlugInKeys.h"
#include "Ekora/EkSandboxKey.h"
#include "ekd/EkDFormCache.h"
#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"
#include "platform/vantor/FakeRegistry.h"

namespace ek {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kReplacePlugIn = "com.corvane.developer.replace-plugin";
constexpr double kRegistered = 1700000000.75;

fs::path examplesDir() {
  return EXAMPLES_DIR;
}

// The Info.dmap of one of the example bundles, as the registry would hand it out.
Dictionary exampleInfo(const std::string& relativeBundle) {
  Result<Value> info = dmap::readFile((examplesDir() / relativeBundle / "Info.dmap").string());
  EXPECT_TRUE(info.ok()) << (info.ok() ? "" : info.error().message);
  if (!info.ok() || info->dictionary() == nullptr) return {};
  return *info->dictionary();
}

const std::string* stringIn(const Dictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  return it == dictionary.end() ? nullptr : it->second.string();
}

Dictionary& extensionOf(Dictionary& info) {
  return *info.at("ZuExtension").dictionary();
}

// A proxy as the registry makes it for a bundle at path with that info dictionary: a data
// container unless the plug-in is data-only, localized names from the info dictionary.
vantor::PlugInProxy proxyFor(Dictionary info, const std::string& path) {
  vantor::PlugInProxy proxy;
  proxy.uuid = Uuid::random();
  if (const std::string* identifier = stringIn(info, "QvBundleIdentifier")) {
    proxy.identifier = *identifier;
  }
  proxy.originalIdentifier = proxy.identifier;
  proxy.path = path;
  proxy.url = vantor::fileUrlForPath(path);
  if (const std::string* name = stringIn(info, "QvBundleDisplayName")) proxy.localizedName = *name;
  if (const std::string* name = stringIn(info, "QvBundleName")) proxy.localizedShortName = *name;
  proxy.registrationDate = Date{kRegistered};
  const Dictionary* extension = info.at("ZuExtension").dictionary();
  const std::string* protocol = stringIn(*extension, "ZuExtensionProtocol");
  if (protocol == nullptr || *protocol != "#Data") {
    proxy.dataContainerPath = "/var/lib/ekora/containers/" + proxy.identifier;
  }
  if (const std::string* point = stringIn(*extension, "ZuExtensionPointIdentifier")) {
    proxy.extensionPoint = *point;
  }
  proxy.info = std::move(info);
  return proxy;
}

// Counts fresh lookups, so a test can tell a refresh from a cached answer.
class CountingRegistry : public vantor::FakeRegistry {
 public:
  vantor::PlugInProxyPtr plugInByUuid(const Uuid& uuid) override {
    ++byUuid;
    return FakeRegistry::plugInByUuid(uuid);
  }
  vantor::PlugInProxyPtr plugInByUrl(std::string_view urlOrPath) override {
    ++byUrl;
    return FakeRegistry::plugInByUrl(urlOrPath);
  }
  std::atomic<int> byUuid{0};
  std::atomic<int> byUrl{0};
};

class CapturingSink : public log::testing::CapturingSink {
 public:
  int countIn(log::Level level, std::string_view category) const {
    return countIf(
        [&](const Line& line) { return line.level == level && line.category == category; });
  }
};

class EkDPlugInTest : public ::testing::Test {
 public:
  void SetUp() override {
    log::configure("info");
    log::setSink(sink_);
    char pattern[] = "/tmp/ekdplugin-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    root_ = fs::canonical(pattern);
    systemRoot_ = root_ / "System";
    viewer_ = root_ / "Applications/Viewer.app";
    thumbs_ = viewer_ / "PlugIns/Thumbs.appex";
    spell_ = systemRoot_ / "Library/PlugIns/SpellCheck.bundle";
    fs::create_directories(thumbs_ / "Resources");
    fs::create_directories(spell_ / "Resources");
    fs::create_directories(root_ / "outside");
    std::ofstream(thumbs_ / "Resources/icon.png") << "png";
    std::ofstream(spell_ / "Resources/words.txt") << "words";
    std::ofstream(root_ / "outside/secret") << "secret";
    fs::create_directory_symlink(root_ / "outside", spell_ / "LinkOut");
  }
  void TearDown() override {
    log::setSink(nullptr);
    log::configure("default");
    std::error_code ignored;
    fs::remove_all(root_, ignored);
  }

  EkDPlugInContext context() const { return {registry_, sandbox_, systemRoot_.string()}; }

  // The example thumbnail extension of Viewer.app, placed in the temporary tree.
  vantor::PlugInProxy thumbsProxy() const {
    vantor::PlugInProxy proxy =
        proxyFor(exampleInfo("Applications/Viewer.app/PlugIns/Thumbs.appex"), thumbs_.string());
    proxy.containingAppPath = viewer_.string();
    proxy.containingAppName = "Viewer";
    proxy.entitlements = Dictionary{{"com.corvane.security.network.client", true}};
    return proxy;
  }
  // The example system spell checker, under the temporary system root.
  vantor::PlugInProxy spellProxy() const {
    vantor::PlugInProxy proxy =
        proxyFor(exampleInfo("System/Library/PlugIns/SpellCheck.bundle"), spell_.string());
    proxy.onSystemVolume = true;
    return proxy;
  }

  std::shared_ptr<EkDPlugIn> build(const vantor::PlugInProxy& proxy) {
    registry_->install(proxy);
    return EkDPlugIn::createWithVRData(proxy, context());
  }

  std::optional<EkSandboxGrant> consume(const std::string& token) {
    int64_t handle = sandbox_->consume(token);
    if (handle < 0) return std::nullopt;
    return sandbox_->grant(handle);
  }

  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
  std::shared_ptr<CountingRegistry> registry_ = std::make_shared<CountingRegistry>();
  std::shared_ptr<EkSandbox> sandbox_ =
      std::make_shared<EkSandbox>(EkSandboxMemoryKeySource::random());
  fs::path root_;
  fs::path systemRoot_;
  fs::path viewer_;
  fs::path thumbs_;
  fs::path spell_;
};

// ---- Building --------------------------------------------------------------------------------

TEST_F(EkDPlugInTest, BuildsApplicationExtensionFromRegistryFacts) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.originalIdentifier = "com.corvane.example.viewer.thumbs-old";
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);

  EXPECT_EQ(record->identifier(), "com.corvane.example.viewer.thumbs");
  EXPECT_EQ(record->uuid(), proxy.uuid);
  EXPECT_EQ(record->path(), thumbs_.string());
  EXPECT_EQ(record->containingPath(), viewer_.string());
  EXPECT_EQ(record->lastModified(), 1700000000);
  EXPECT_FALSE(record->onSystemVolume());
  EXPECT_EQ(record->localizedName(), "Thumbnails");
  EXPECT_EQ(record->localizedShortName(), "Thumbs");
  EXPECT_EQ(record->localizedContainingName(), "Viewer");
  EXPECT_EQ(record->originalIdentifier(), "com.corvane.example.viewer.thumbs-old");
  ASSERT_TRUE(record->dataContainerURL());
  EXPECT_EQ(record->dataContainerURL()->path(),
            "/var/lib/ekora/containers/com.corvane.example.viewer.thumbs");
  ASSERT_NE(record->entitlements(), nullptr);
  EXPECT_EQ(*record->entitlements(), proxy.entitlements);
  EXPECT_EQ(record->hubProtocolVersion(), 2u);
  EXPECT_TRUE(record->isAppExtension());
  EXPECT_FALSE(record->isData());
  EXPECT_EQ(record->versionString(), "1.0");
  EXPECT_TRUE(record->isStillValid());
  ASSERT_NE(record->plugInDictionary(), nullptr);
  EXPECT_EQ(*record->plugInDictionary(), *proxy.extensionDictionary());
}

TEST_F(EkDPlugInTest, BuildsSystemPlugInOutsideAnyApplication) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  EXPECT_FALSE(record->containingUrl());
  EXPECT_TRUE(record->onSystemVolume());
  EXPECT_FALSE(record->isAppExtension());
  EXPECT_EQ(record->identifier(), "com.corvane.spellcheck");
}

TEST_F(EkDPlugInTest, ProxyWithoutBundleURLGivesNoRecordSilently) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.path.clear();
  proxy.url.clear();
  sink_->clear();
  EXPECT_EQ(EkDPlugIn::createWithVRData(proxy, context()), nullptr);
  EXPECT_EQ(sink_->countIn(log::Level::Info, "ops"), 0);
  EXPECT_EQ(sink_->countIn(log::Level::Error, "ops"), 0);
}

TEST_F(EkDPlugInTest, ProxyWithOnlyAPathStillLocatesTheBundle) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.url.clear();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->path(), thumbs_.string());
}

TEST_F(EkDPlugInTest, ProxyWithoutIdentifierGivesNoRecord) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.identifier.clear();
  EXPECT_EQ(build(proxy), nullptr);
  EXPECT_TRUE(
      sink_->has(log::Level::Error, "ops", "missing identifier in plug-in at " + thumbs_.string()));
}

TEST_F(EkDPlugInTest, RegistrationDateOutsideThe32BitRangeSticksToItsEnd) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.registrationDate = Date{1e12};
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->lastModified(), std::numeric_limits<int32_t>::max());
}

TEST_F(EkDPlugInTest, HubProtocolVersionComesFromExtensionDictionaryElseOldStyleMarker) {
  struct Case {
    const char* name;
    std::optional<uint64_t> declared;
    bool oldStyle;
    uint32_t expected;
  };
  const Case cases[] = {
      {"declared wins over marker", 3, true, 3},
      {"declared without marker", 3, false, 3},
      {"old-style marker", std::nullopt, true, 1},
      {"neither", std::nullopt, false, 2},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Dictionary info = exampleInfo("Applications/Viewer.app/PlugIns/Thumbs.appex");
    if (c.declared) extensionOf(info)["HubProtocolVersion"] = *c.declared;
    if (c.oldStyle) info["Ekora"] = Dictionary{{"Protocol", "Old"}};
    vantor::PlugInProxy proxy = proxyFor(info, thumbs_.string());
    proxy.containingAppPath = viewer_.string();
    auto record = build(proxy);
    ASSERT_NE(record, nullptr);
    EXPECT_EQ(record->hubProtocolVersion(), c.expected);
  }
}

// ---- Validation ------------------------------------------------------------------------------

TEST_F(EkDPlugInTest, RefusesMisconfiguredPlugInsWithTheirReasonLogged) {
  struct Case {
    const char* name;
    std::function<vantor::PlugInProxy(EkDPlugInTest&)> proxy;
    std::string reason;
  };
  const Case cases[] = {
      {"plug-in with code but no data container",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.thumbsProxy();
         p.dataContainerPath.reset();
         return p;
       },
       "this plug-in has no sandbox data container"},
      {"outside any application and off the system volume",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.spellProxy();
         p.path = (t.root_ / "var/SpellCheck.bundle").string();
         p.url = vantor::fileUrlForPath(p.path);
         return p;
       },
       "plug-ins outside containing apps must be in /System"},
      {"climbing out of the system volume",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.spellProxy();
         p.path = (t.systemRoot_ / "../var/SpellCheck.bundle").string();
         p.url = vantor::fileUrlForPath(p.path);
         return p;
       },
       "plug-ins outside containing apps must be in /System"},
      {"the system root itself",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.spellProxy();
         p.path = t.systemRoot_.string();
         p.url = vantor::fileUrlForPath(p.path);
         return p;
       },
       "plug-ins outside containing apps must be in /System"},
      {"application extension naming a principal class",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.thumbsProxy();
         (*p.info.at("ZuExtension").dictionary())["PrincipalClass"] = "MyPrincipal";
         return p;
       },
       "Application Extensions may not use the \"PrincipalClass\" key"},
      {"pass-proxy key",
       [](EkDPlugInTest& t) {
         vantor::PlugInProxy p = t.spellProxy();
         (*p.info.at("ZuExtension").dictionary())["PassProxy"] = true;
         return p;
       },
       "the \"PassProxy\" key is not supported on this platform"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    sink_->clear();
    vantor::PlugInProxy proxy = c.proxy(*this);
    EXPECT_EQ(build(proxy), nullptr);
    EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                           "ignoring mis-configured plug-in at " + proxy.path + ": " + c.reason));
  }
}

TEST_F(EkDPlugInTest, DataOnlyPlugInNeedsNoDataContainer) {
  Dictionary info = exampleInfo("System/Library/PlugIns/SpellCheck.bundle");
  extensionOf(info)["ZuExtensionProtocol"] = "#Data";
  extensionOf(info).erase("PrincipalClass");
  vantor::PlugInProxy proxy = proxyFor(info, spell_.string());
  ASSERT_FALSE(proxy.dataContainerPath);
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EXPECT_TRUE(record->isData());
  EXPECT_FALSE(record->dataContainerURL());
}

TEST_F(EkDPlugInTest, DiagnoseJudgesTheRegistrysCurrentInfoDictionary) {
  vantor::PlugInProxy proxy = spellProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EXPECT_FALSE(record->diagnose());

  extensionOf(proxy.info)["EmbeddedCode"] = "yes";
  registry_->install(proxy);
  std::optional<EkError> error = record->diagnose();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "Ekora");
  EXPECT_EQ(error->code, 12);
  EXPECT_EQ(error->message, "hybrid plug-ins are not supported on this platform");
}

// ---- Entitlements ----------------------------------------------------------------------------

TEST_F(EkDPlugInTest, EntitlementIsHeldWhenPresentAndNotFalse) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.entitlements = Dictionary{
      {"yes", true}, {"no", false}, {"text", "com.example.other"}, {"zero", 0}, {"list", Array{}}};
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  struct Case {
    const char* key;
    bool held;
  };
  for (const Case& c : {Case{"yes", true}, Case{"no", false}, Case{"text", true},
                        Case{"zero", true}, Case{"list", true}, Case{"absent", false}}) {
    SCOPED_TRACE(c.key);
    EXPECT_EQ(record->hasEntitlement(c.key), c.held);
  }
  ASSERT_NE(record->valueForEntitlement("text"), nullptr);
  EXPECT_EQ(*record->valueForEntitlement("text"), Value("com.example.other"));
  EXPECT_EQ(record->valueForEntitlement("absent"), nullptr);
}

TEST_F(EkDPlugInTest, AnnotationKeyFollowsTheReplacementEntitlementOnlyWhenItIsAString) {
  struct Case {
    const char* name;
    std::optional<Value> entitlement;
    std::string expected;
  };
  const Case cases[] = {
      {"absent", std::nullopt, "com.corvane.example.viewer.thumbs"},
      {"boolean true", Value(true), "com.corvane.example.viewer.thumbs"},
      {"string", Value("com.example.old"), "com.example.old"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    vantor::PlugInProxy proxy = thumbsProxy();
    if (c.entitlement) proxy.entitlements[std::string(kReplacePlugIn)] = *c.entitlement;
    auto record = build(proxy);
    ASSERT_NE(record, nullptr);
    EXPECT_EQ(record->annotationKey(), c.expected);
  }
}

// ---- Info dictionary refresh -----------------------------------------------------------------

TEST_F(EkDPlugInTest, ProxyThatSaysWhenItWasReadIsNotFetchedAgainUntilTheRegistryChanges) {
  vantor::PlugInProxy proxy = thumbsProxy();
  registry_->install(proxy);
  proxy.knowledge = registry_->knowledgeUuid();
  const int before = registry_->byUuid.load() + registry_->byUrl.load();
  auto record = EkDPlugIn::createWithVRData(proxy, context());
  ASSERT_NE(record, nullptr);
  ASSERT_NE(record->attribute("ThumbnailMinimumDimension"), nullptr);
  EXPECT_EQ(registry_->byUuid.load() + registry_->byUrl.load(), before);
  // The plug-in dictionary of the form is the info dictionary's own.
  ASSERT_NE(record->plugInDictionary(), nullptr);
  EXPECT_EQ(record->plugInDictionary().get(), record->infoDmap()->at("ZuExtension").dictionary());

  auto attributes = extensionOf(proxy.info)["ZuExtensionAttributes"].dictionary();
  (*attributes)["ThumbnailMinimumDimension"] = 64;
  registry_->install(proxy);
  EXPECT_EQ(*record->attribute("ThumbnailMinimumDimension"), Value(64));
  EXPECT_EQ(registry_->byUuid.load(), before + 1);

  // A proxy read at another time than now is fetched again at the first read.
  proxy.knowledge = Uuid::random();
  auto stale = build(proxy);
  ASSERT_NE(stale, nullptr);
  EXPECT_EQ(registry_->byUuid.load(), before + 2);
}

TEST_F(EkDPlugInTest, InfoDictionaryIsFetchedAgainOnlyWhenTheRegistryChanges) {
  vantor::PlugInProxy proxy = thumbsProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->vrKnowledgeUUID(), registry_->knowledgeUuid());
  const int lookups = registry_->byUuid.load();
  ASSERT_NE(record->attribute("ThumbnailMinimumDimension"), nullptr);
  EXPECT_EQ(*record->attribute("ThumbnailMinimumDimension"), Value(16));
  EXPECT_EQ(registry_->byUuid.load(), lookups);

  auto attributes = extensionOf(proxy.info)["ZuExtensionAttributes"].dictionary();
  (*attributes)["ThumbnailMinimumDimension"] = 64;
  registry_->install(proxy);
  EXPECT_EQ(*record->attribute("ThumbnailMinimumDimension"), Value(64));
  EXPECT_EQ(registry_->byUuid.load(), lookups + 1);
  EXPECT_EQ(record->vrKnowledgeUUID(), registry_->knowledgeUuid());
  ASSERT_NE(record->infoDmap(), nullptr);
  EXPECT_EQ(*record->infoDmap(), proxy.info);
}

TEST_F(EkDPlugInTest, LookupsReadTheRegistryNotTheStoredPlugInDictionary) {
  vantor::PlugInProxy proxy = thumbsProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  extensionOf(proxy.info)["Dedicated"] = true;
  proxy.info["QvBundleShortVersionString"] = "9.9";
  registry_->install(proxy);
  EXPECT_TRUE(record->isDedicated());
  ASSERT_NE(record->infoKey("QvBundleShortVersionString"), nullptr);
  EXPECT_EQ(*record->infoKey("QvBundleShortVersionString"), Value("9.9"));
  EXPECT_FALSE(record->plugInDictionary()->contains("Dedicated"));
}

TEST_F(EkDPlugInTest, CurrentInfoKeepsOneFetchAndTheNextFollowsTheRegistry) {
  vantor::PlugInProxy proxy = thumbsProxy();
  const Dictionary original = proxy.info;
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EkDPlugIn::CurrentInfoRef before = record->currentInfo();
  ASSERT_NE(before->info, nullptr);
  EXPECT_FALSE(before->dedicated);
  EXPECT_FALSE(before->data);
  EXPECT_EQ(before->hostEntitlement, nullptr);
  ASSERT_NE(before->bundleIdentifier, nullptr);
  EXPECT_EQ(*before->bundleIdentifier, proxy.info.at("QvBundleIdentifier"));

  Dictionary& extension = extensionOf(proxy.info);
  extension["Dedicated"] = 1;
  extension["ZuExtensionProtocol"] = "#Data";
  extension["ZuExtensionHostEntitlement"] = "com.example.host";
  extension["Shared"] = Array{Value("Resources")};
  (*extension["ZuExtensionAttributes"].dictionary())["ZuExtensionVersion"] = "2.5";
  registry_->install(proxy);

  EkDPlugIn::CurrentInfoRef after = record->currentInfo();
  EXPECT_TRUE(after->dedicated);
  EXPECT_TRUE(after->data);
  ASSERT_NE(after->hostEntitlement, nullptr);
  EXPECT_EQ(*after->hostEntitlement, Value("com.example.host"));
  ASSERT_NE(after->shared, nullptr);
  EXPECT_EQ(*after->shared, Value(Array{Value("Resources")}));
  ASSERT_NE(after->version, nullptr);
  EXPECT_EQ(*after->version, Value("2.5"));
  EXPECT_TRUE(record->match(nullptr, *after));
  Dictionary rules{{"ZuExtensionVersion", Value("2.5")}};
  EXPECT_TRUE(record->match(&rules, *after));
  // What one request was checking against stays as it was.
  EXPECT_FALSE(record->match(&rules, *before));
  EXPECT_FALSE(before->dedicated);
  EXPECT_EQ(*before->info, original);
}

TEST_F(EkDPlugInTest, FallsBackToTheBundleURLWhenTheUUIDIsGone) {
  vantor::PlugInProxy proxy = thumbsProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  ASSERT_TRUE(registry_->uninstall(proxy.uuid));
  vantor::PlugInProxy reinstalled = proxy;
  reinstalled.uuid = Uuid::random();
  reinstalled.info["QvBundleDisplayName"] = "Thumbnails 2";
  registry_->install(reinstalled);

  DictionaryRef info = record->bundleInfoDictionary();
  ASSERT_NE(info, nullptr);
  EXPECT_EQ(*info, reinstalled.info);
  EXPECT_EQ(registry_->byUrl.load(), 1);
  EXPECT_TRUE(sink_->has(log::Level::Default, "vr",
                         log::format("Failed to find Plugin by %{uuid_t}.16P fallback to path %@",
                                     proxy.uuid, proxy.url)));
}

TEST_F(EkDPlugInTest, FailedRefreshEmptiesTheInfoDictionaryUntilTheRegistryChanges) {
  vantor::PlugInProxy proxy = thumbsProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  ASSERT_TRUE(registry_->uninstall(proxy.uuid));

  EXPECT_EQ(record->bundleInfoDictionary(), nullptr);
  EXPECT_EQ(record->pluginKey("ZuExtensionPointIdentifier"), nullptr);
  EXPECT_EQ(record->vrKnowledgeUUID(), registry_->knowledgeUuid());
  EXPECT_EQ(sink_->count(log::Level::Error, "ops",
                         "could not obtain fresh proxy for " + proxy.uuid.string()),
            1);

  registry_->install(proxy);
  ASSERT_NE(record->bundleInfoDictionary(), nullptr);
  EXPECT_EQ(*record->pluginKey("ZuExtensionPointIdentifier"), Value("com.corvane.thumbnail"));
}

TEST_F(EkDPlugInTest, ConcurrentReadersSeeOneOfTheRegisteredInfoDictionaries) {
  vantor::PlugInProxy proxy = thumbsProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  std::atomic<bool> stop{false};
  std::atomic<int> unexpected{0};
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&] {
      while (!stop.load()) {
        ValueRef size = record->attribute("ThumbnailMinimumDimension");
        const uint64_t* number = size ? size->unsignedNumber() : nullptr;
        if (number == nullptr || *number < 16 || *number >= 16 + 50) ++unexpected;
      }
    });
  }
  for (int round = 1; round < 50; ++round) {
    (*extensionOf(proxy.info)["ZuExtensionAttributes"].dictionary())["ThumbnailMinimumDimension"] =
        16 + round;
    registry_->install(proxy);
  }
  stop = true;
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(unexpected.load(), 0);
  EXPECT_EQ(*record->attribute("ThumbnailMinimumDimension"), Value(16 + 49));
}

TEST_F(EkDPlugInTest, ReadsTheSDKDictionaryFromTheRegistry) {
  auto record = build(thumbsProxy());
  ASSERT_NE(record, nullptr);
  const Dictionary sdk{{"ZuExtension", Dictionary{{"CleanTimeout", 30}}}};
  registry_->setExtensionPointSdk("com.corvane.thumbnail", sdk);
  EXPECT_EQ(record->readSDKDictionary("com.corvane.thumbnail"), sdk);
  EXPECT_FALSE(record->readSDKDictionary("com.corvane.unknown"));
  EXPECT_TRUE(
      sink_->has(log::Level::Default, "ops", "plug-in sdk \"com.corvane.unknown\" not registered"));
}

// ---- Localized names -------------------------------------------------------------------------

TEST_F(EkDPlugInTest, FileProviderActionsMapToLocalizedTitlesAndSkipUnnamedOnes) {
  Dictionary info = exampleInfo("Applications/Viewer.app/PlugIns/Thumbs.appex");
  extensionOf(info)["ZuExtensionFileProviderActions"] =
      Array{Dictionary{{"ZuExtensionFileProviderActionName", "Rename"}}, Dictionary{},
            Dictionary{{"ZuExtensionFileProviderActionName", "Trash"}}, "not a dictionary"};
  vantor::PlugInProxy proxy = proxyFor(info, thumbs_.string());
  proxy.containingAppPath = viewer_.string();
  registry_->setLocalizedStrings(proxy.uuid, "Localizable", Dictionary{{"Rename", "Renommer"}});

  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  ASSERT_NE(record->localizedFileProviderActionNames(), nullptr);
  EXPECT_EQ(*record->localizedFileProviderActionNames(),
            (Dictionary{{"Rename", "Renommer"}, {"Trash", "Trash"}}));
  EXPECT_EQ(
      sink_->count(log::Level::Error, "vr",
                   "missing ZuExtensionFileProviderActionName for plugin " + proxy.description()),
      2);
}

TEST_F(EkDPlugInTest, FileProviderActionsThatAreNotAnArrayGiveAnEmptyDictionary) {
  vantor::PlugInProxy proxy = thumbsProxy();
  EXPECT_TRUE(localizedFileProviderActionNamesForEkDict(proxy, nullptr, *registry_).empty());
  Dictionary extension{{"ZuExtensionFileProviderActions", "Rename"}};
  EXPECT_TRUE(localizedFileProviderActionNamesForEkDict(proxy, &extension, *registry_).empty());
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  ASSERT_NE(record->localizedFileProviderActionNames(), nullptr);
  EXPECT_TRUE(record->localizedFileProviderActionNames()->empty());
}

TEST_F(EkDPlugInTest, LocalizedNamesCanBeReplacedAndReachTheForm) {
  auto record = build(thumbsProxy());
  ASSERT_NE(record, nullptr);
  record->setLocalizedName("Vignettes");
  record->setLocalizedShortName("Vign");
  record->setLocalizedContainingName("Visionneuse");
  Dictionary form = record->exportForm().form;
  EXPECT_EQ(form.at("localizedDisplayName"), Value("Vignettes"));
  EXPECT_EQ(form.at("localizedShortName"), Value("Vign"));
  EXPECT_EQ(form.at("localizedContainingDisplayName"), Value("Visionneuse"));
  EXPECT_EQ(*form.at("bundleInfo").getString("QvBundleDisplayName"), "Vignettes");
}

// ---- Form --------------------------------------------------------------------------------------

TEST_F(EkDPlugInTest, AugmentedFormRoundTripsThroughTheCoreRecord) {
  vantor::PlugInProxy proxy = thumbsProxy();
  proxy.info["QvBundleInfoDmapURL"] = vantor::fileUrlForPath(thumbs_.string() + "/Info.dmap");
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  record->setAnnotations(std::make_shared<const Dictionary>(Dictionary{{"election", 1}}));

  EkPlugInCore::FormExport exported = record->exportForm();
  ASSERT_FALSE(exported.error) << exported.error->message;
  Dictionary form = exported.form;
  record->augmentForm(form);
  EXPECT_TRUE(form.contains("extensions"));
  EXPECT_TRUE(form.contains("service-extension"));
  EXPECT_FALSE(form.at("bundleInfo").dictionary()->contains("QvBundleInfoDmapURL"));

  Result<std::shared_ptr<EkPlugInCore>> copy = EkPlugInCore::createWithForm(form);
  ASSERT_TRUE(copy.ok()) << copy.error().message;
  const EkPlugInCore& read = **copy;
  EXPECT_TRUE(read.isEqual(*record));
  EXPECT_EQ(read.identifier(), record->identifier());
  EXPECT_EQ(read.originalIdentifier(), record->originalIdentifier());
  EXPECT_EQ(read.path(), record->path());
  EXPECT_EQ(read.containingPath(), record->containingPath());
  EXPECT_EQ(read.hubProtocolVersion(), 2u);
  EXPECT_EQ(read.lastModified(), 1700000000);
  EXPECT_EQ(read.localizedName(), "Thumbnails");
  EXPECT_EQ(read.localizedContainingName(), "Viewer");
  ASSERT_NE(read.entitlements(), nullptr);
  EXPECT_EQ(*read.entitlements(), proxy.entitlements);
  EXPECT_EQ(read.versionString(), "1.0");
  EXPECT_EQ(read.exportForm().form, exported.form);
}

TEST_F(EkDPlugInTest, ApplicationExtensionFormGrantsOnlyItsBundleWhateverSharedSays) {
  vantor::PlugInProxy proxy = thumbsProxy();
  extensionOf(proxy.info)["Shared"] = Array{"Resources"};
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);

  Dictionary form;
  record->augmentForm(form);
  const Dictionary* extensions = form.at("extensions").dictionary();
  ASSERT_NE(extensions, nullptr);
  ASSERT_EQ(extensions->size(), 1u);
  std::optional<EkSandboxGrant> grant = consume(*extensions->at(".").string());
  ASSERT_TRUE(grant);
  EXPECT_EQ(grant->extensionClass, "com.corvane.sandbox.read-only");
  EXPECT_EQ(grant->subject, thumbs_.string());

  std::optional<EkSandboxGrant> service = consume(*form.at("service-extension").string());
  ASSERT_TRUE(service);
  EXPECT_EQ(service->extensionClass, "com.corvane.ekora.plugin-service");
  EXPECT_EQ(service->subject, "com.corvane.example.viewer.thumbs");
  EXPECT_EQ(service->flags, 0u);
}

TEST_F(EkDPlugInTest, SystemPlugInFormGrantsItsSharedPaths) {
  vantor::PlugInProxy proxy = spellProxy();
  extensionOf(proxy.info)["Shared"] = "Resources";
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);

  Dictionary form;
  record->augmentForm(form);
  const Dictionary* extensions = form.at("extensions").dictionary();
  ASSERT_NE(extensions, nullptr);
  ASSERT_EQ(extensions->size(), 1u);
  std::optional<EkSandboxGrant> grant = consume(*extensions->at("Resources").string());
  ASSERT_TRUE(grant);
  EXPECT_EQ(grant->subject, (spell_ / "Resources").string());
}

TEST_F(EkDPlugInTest, FormWithoutSharedPathsHasNoExtensionsKey) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  Dictionary form;
  record->augmentForm(form);
  EXPECT_FALSE(form.contains("extensions"));
  EXPECT_TRUE(form.contains("service-extension"));
}

TEST_F(EkDPlugInTest, DataOnlyPlugInGetsNoServiceExtension) {
  Dictionary info = exampleInfo("System/Library/PlugIns/SpellCheck.bundle");
  extensionOf(info)["ZuExtensionProtocol"] = "#Data";
  extensionOf(info)["Shared"] = Array{"Resources"};
  auto record = build(proxyFor(info, spell_.string()));
  ASSERT_NE(record, nullptr);
  Dictionary form;
  record->augmentForm(form);
  EXPECT_FALSE(form.contains("service-extension"));
  EXPECT_TRUE(form.contains("extensions"));
}

TEST_F(EkDPlugInTest, ServiceExtensionFailureIsLoggedAndLeftOut) {
  vantor::PlugInProxy proxy = spellProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  proxy.info.erase("QvBundleIdentifier");
  registry_->install(proxy);

  Dictionary form;
  record->augmentForm(form);
  EXPECT_FALSE(form.contains("service-extension"));
  EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                         "failed to make service extension for (null) in plug-in at " +
                             spell_.string() + ": Invalid argument"));
}

// ---- Resource extensions ---------------------------------------------------------------------

TEST_F(EkDPlugInTest, ResourceExtensionForTheBundleItself) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  std::optional<Dictionary> extensions = record->issueResourceExtensions(Value("."));
  ASSERT_TRUE(extensions);
  ASSERT_EQ(extensions->size(), 1u);
  std::optional<EkSandboxGrant> grant = consume(*extensions->at(".").string());
  ASSERT_TRUE(grant);
  EXPECT_EQ(grant->subject, spell_.string());
}

TEST_F(EkDPlugInTest, ResourceExtensionsConsiderOnlyStringsAndLeaveFailuresOut) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  std::optional<Dictionary> extensions =
      record->issueResourceExtensions(Value(Array{"Resources", 7, "Missing"}));
  ASSERT_TRUE(extensions);
  ASSERT_EQ(extensions->size(), 1u);
  EXPECT_TRUE(extensions->contains("Resources"));
  EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                         "failed to make extension for " + (spell_ / "Missing").string() +
                             " in plug-in at " + spell_.string() + ": No such file or directory"));
}

TEST_F(EkDPlugInTest, ResourceExtensionsAreIssuedOnlyInsideTheBundle) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  std::optional<Dictionary> extensions = record->issueResourceExtensions(
      Value(Array{"../../../../outside", "LinkOut", "LinkOut/secret", "Resources/../Resources"}));
  ASSERT_TRUE(extensions);
  EXPECT_EQ(extensions->size(), 1u);
  EXPECT_TRUE(extensions->contains("Resources/../Resources"));
  for (const char* escaping : {"../../../../outside", "LinkOut", "LinkOut/secret"}) {
    SCOPED_TRACE(escaping);
    EXPECT_TRUE(sink_->has(log::Level::Info, "ops",
                           "failed to make extension for " + (spell_ / escaping).string() +
                               " in plug-in at " + spell_.string() + ": Operation not permitted"));
  }
}

TEST_F(EkDPlugInTest, ResourceExtensionsOfAnythingButStringsOrArraysAreAbsent) {
  auto record = build(spellProxy());
  ASSERT_NE(record, nullptr);
  EXPECT_FALSE(record->issueResourceExtensions(Value(3)));
  EXPECT_FALSE(record->issueResourceExtensions(Value(Dictionary{{"a", "b"}})));
  std::optional<Dictionary> none = record->issueResourceExtensions(Value(Array{}));
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->empty());
}

TEST_F(EkDPlugInTest, NonStringSharedValueGivesNoExtensionsKey) {
  vantor::PlugInProxy proxy = spellProxy();
  extensionOf(proxy.info)["Shared"] = 5;
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  Dictionary form;
  record->augmentForm(form);
  EXPECT_FALSE(form.contains("extensions"));
}

// ---- Forms kept encoded ----------------------------------------------------------------------

// The form a kept encoding stands for.
Dictionary decodeKept(const EkDFormCache::EncodedForm& form) {
  std::vector<uint8_t> bytes;
  cbor::encodeMapHead(form.count, bytes);
  bytes.insert(bytes.end(), form.members.begin(), form.members.end());
  Result<Value> decoded = cbor::decode(bytes);
  EXPECT_TRUE(decoded.ok()) << (decoded.ok() ? "" : decoded.error().message);
  if (!decoded.ok() || decoded->dictionary() == nullptr) return {};
  return *decoded->dictionary();
}

TEST_F(EkDPlugInTest, KeptFormIsTheExportedFormWithoutWhatEachReplyAdds) {
  auto record = build(thumbsProxy());
  ASSERT_NE(record, nullptr);
  record->setAnnotations(std::make_shared<const Dictionary>(Dictionary{{"election", 1}}));
  EkDFormCache cache(1 << 20);
  auto kept = cache.formFor(record);
  ASSERT_NE(kept, nullptr);
  EXPECT_FALSE(kept->error);

  Dictionary expected = record->exportForm().form;
  ASSERT_TRUE(expected.contains("annotations"));
  expected.erase("annotations");
  EXPECT_EQ(decodeKept(*kept), expected);
  // Asked again for the same record, the same bytes come back without a new export.
  EXPECT_EQ(cache.formFor(record), kept);
  EXPECT_EQ(cache.count(), 1u);
  EXPECT_EQ(cache.bytes(), kept->members.capacity());
}

TEST_F(EkDPlugInTest, KeptFormIsMadeAgainAfterARegistryChangeOrForANewRecord) {
  vantor::PlugInProxy proxy = spellProxy();
  auto record = build(proxy);
  ASSERT_NE(record, nullptr);
  EkDFormCache cache(1 << 20);
  auto first = cache.formFor(record);
  const std::string* version = stringIn(proxy.info, "QvBundleVersion");
  ASSERT_NE(version, nullptr);
  ASSERT_NE(*version, "9.9");
  const Dictionary firstForm = decodeKept(*first);
  const std::string* keptVersion = firstForm.at("bundleInfo").getString("QvBundleVersion");
  ASSERT_NE(keptVersion, nullptr);
  EXPECT_EQ(*keptVersion, *version);

  // The registry now holds another info dictionary for the plug-in.
  vantor::PlugInProxy changed = proxy;
  changed.info["QvBundleVersion"] = Value("9.9");
  registry_->install(changed);
  auto second = cache.formFor(record);
  ASSERT_NE(second, first);
  const Dictionary secondForm = decodeKept(*second);
  const Value& bundleInfo = secondForm.at("bundleInfo");
  ASSERT_NE(bundleInfo.getString("QvBundleVersion"), nullptr);
  EXPECT_EQ(*bundleInfo.getString("QvBundleVersion"), "9.9");
  EXPECT_EQ(cache.formFor(record), second);

  // A record built again for the same UUID (a locale change does that) gets its own form.
  auto rebuilt = EkDPlugIn::createWithVRData(changed, context());
  ASSERT_NE(rebuilt, nullptr);
  EXPECT_NE(cache.formFor(rebuilt), second);
  EXPECT_EQ(cache.count(), 1u);
}

TEST_F(EkDPlugInTest, FormsBeyondTheLimitAreDroppedLeastRecentlyUsedFirst) {
  std::vector<std::shared_ptr<EkDPlugIn>> records;
  for (int i = 0; i < 3; ++i) {
    vantor::PlugInProxy proxy = spellProxy();
    proxy.uuid = Uuid::random();
    records.push_back(build(proxy));
    ASSERT_NE(records.back(), nullptr);
  }
  const size_t size = EkDFormCache(1 << 20).formFor(records[0])->members.capacity();
  EkDFormCache cache(2 * size + size / 2);
  auto form0 = cache.formFor(records[0]);
  auto form1 = cache.formFor(records[1]);
  EXPECT_EQ(cache.formFor(records[0]), form0);  // 0 is now the most recently used
  cache.formFor(records[2]);                    // drops 1, not 0
  EXPECT_EQ(cache.count(), 2u);
  EXPECT_LE(cache.bytes(), 2 * size + size / 2);
  EXPECT_EQ(cache.formFor(records[0]), form0);
  EXPECT_NE(cache.formFor(records[1]), form1);

  // A form larger than the whole cache is answered and not kept.
  EkDFormCache tiny(size / 2);
  EXPECT_NE(tiny.formFor(records[0]), nullptr);
  EXPECT_EQ(tiny.count(), 0u);
  EXPECT_EQ(tiny.bytes(), 0u);
}

TEST_F(EkDPlugInTest, FormsOfRecordsThatAreGoneAreDropped) {
  auto spellWithOwnUuid = [&] {
    vantor::PlugInProxy proxy = spellProxy();
    proxy.uuid = Uuid::random();
    return build(proxy);
  };
  EkDFormCache cache(64 << 20);
  {
    auto gone = spellWithOwnUuid();
    ASSERT_NE(gone, nullptr);
    cache.formFor(gone);
  }
  // Gone records are swept now and then, not on every insert: by the 256th at the latest.
  std::vector<std::shared_ptr<EkDPlugIn>> live;
  for (int i = 0; i < 256; ++i) {
    live.push_back(spellWithOwnUuid());
    ASSERT_NE(live.back(), nullptr);
    cache.formFor(live.back());
  }
  EXPECT_EQ(cache.count(), 256u);
}

}  // namespace
}  // namespace ek
