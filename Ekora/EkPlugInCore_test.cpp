#include "Ekora/EkPlugInCore.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"

namespace ek {
namespace {

constexpr std::string_view kAppexPath = "/apps/Viewer.app/PlugIns/Thumbs.appex";
constexpr std::string_view kSystemPath = "/System/Library/PlugIns/Indexer.bundle";

// An application extension inside an application, as its bundle's Info.dmap says it.
Dictionary appexInfo() {
  return Dictionary{
      {"QvBundleIdentifier", "com.example.viewer.thumbs"},
      {"QvBundleDisplayName", "Thumbs"},
      {"QvBundleShortVersionString", "2.1"},
      {"ZuExtension",
       Dictionary{{"ZuExtensionPointIdentifier", "com.corvane.thumbnails"},
                  {"ZuExtensionAttributes",
                   Dictionary{{"ZuExtensionVersion", "2.1.0"}, {"Types", Array{"public.image"}}}}}},
  };
}

std::shared_ptr<EkPlugInCore> make(const Value* bundleInfo, const Dictionary* plugIn,
                                   std::string_view path = kAppexPath,
                                   std::optional<std::string> identifier = "com.x") {
  return EkPlugInCore::createWithName(identifier, EkFileURL::fromPath(path).value(), bundleInfo,
                                      plugIn, std::nullopt);
}
std::shared_ptr<EkPlugInCore> fromInfo(const Dictionary& info, std::string_view path) {
  const Value bundleInfo(info);
  return make(&bundleInfo, nullptr, path, *info.at("QvBundleIdentifier").string());
}
std::shared_ptr<EkPlugInCore> fromPlugIn(const Dictionary& plugIn,
                                         std::string_view path = kSystemPath) {
  return make(nullptr, &plugIn, path);
}

class EkPlugInCoreTest : public ::testing::Test {
 protected:
  void SetUp() override { log::setSink(sink_); }
  void TearDown() override { log::setSink(nullptr); }
  std::shared_ptr<log::testing::CapturingSink> sink_ =
      std::make_shared<log::testing::CapturingSink>();
};

TEST_F(EkPlugInCoreTest, ApplicationExtensionReadsItsInfoAndDefaultsItsSpecs) {
  auto record = fromInfo(appexInfo(), kAppexPath);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->identifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(*record->plugInDictionary(), *appexInfo().at("ZuExtension").dictionary());
  EXPECT_EQ(*record->protocolSpec(), Value("ZuObject"));
  EXPECT_EQ(*record->principalSpec(), Value("ZuObject"));
  EXPECT_EQ(*record->sdkSpec(), Value("com.corvane.thumbnails"));
  EXPECT_EQ(record->versionString(), "2.1.0");
  EXPECT_EQ(*record->attribute("Types"), Value(Array{"public.image"}));
  EXPECT_EQ(*record->infoKey("QvBundleDisplayName"), Value("Thumbs"));
  EXPECT_FALSE(record->diagnose().has_value());
  // Outside an application extension nothing is defaulted.
  auto system = fromPlugIn(Dictionary{{"ZuExtensionAttributes", Dictionary{}}});
  EXPECT_EQ(system->protocolSpec(), nullptr);
  EXPECT_EQ(system->principalSpec(), nullptr);
  EXPECT_NE(system->uuid(), fromPlugIn(Dictionary{})->uuid());
}

TEST_F(EkPlugInCoreTest, PartsSetUpRefusesGiveNoRecord) {
  const Value text("not a dictionary");
  Dictionary badPlugIn = appexInfo();
  badPlugIn["ZuExtension"] = Array{"x"};
  const Value badInfo(badPlugIn);
  const Dictionary plugIn;
  EXPECT_EQ(EkPlugInCore::createWithName("com.x", std::nullopt, nullptr, &plugIn, std::nullopt),
            nullptr);
  EXPECT_EQ(make(nullptr, &plugIn, kAppexPath, std::nullopt), nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "missing identifier in plug-in at /apps/Viewer.app/PlugIns/Thumbs.appex"));
  EXPECT_EQ(make(&text, &plugIn), nullptr);
  EXPECT_EQ(make(&badInfo, &plugIn), nullptr);
  // A later malformed dictionary keeps the plug-in dictionary read before.
  auto record = fromInfo(appexInfo(), kAppexPath);
  EXPECT_FALSE(record->setDictionaries(badInfo));
  EXPECT_EQ(*record->plugInDictionary(), *appexInfo().at("ZuExtension").dictionary());
}

TEST_F(EkPlugInCoreTest, FlagsFollowPathAndPlugInKeys) {
  const struct {
    std::string path;
    Dictionary plugIn;
    bool appex, dedicated, data, hybrid;
  } rows[] = {
      {"/a/A.app/PlugIns/B.appex", {}, true, false, false, false},
      {"/a/A.app/PlugIns/B.appex/", {}, true, false, false, false},
      {"/a/A.app/PlugIns/B.APPEX", {}, false, false, false, false},
      {"/a/A.app/PlugIns/B.appex2", {}, false, false, false, false},
      {"/s/P", {{"Dedicated", true}}, false, true, false, false},
      {"/s/P", {{"Dedicated", 1}}, false, true, false, false},
      {"/s/P", {{"Dedicated", 0}}, false, false, false, false},
      {"/s/P", {{"Dedicated", "YES"}}, false, false, false, false},
      {"/s/P", {{"ZuExtensionProtocol", "#Data"}}, false, false, true, false},
      {"/s/P", {{"ZuExtensionProtocol", "#data"}}, false, false, false, false},
      {"/s/P", {{"EmbeddedCode", false}}, false, false, false, true},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.path + " " + Value(row.plugIn).description());
    auto record = fromPlugIn(row.plugIn, row.path);
    EXPECT_EQ(record->isAppExtension(), row.appex);
    EXPECT_EQ(record->isDedicated(), row.dedicated);
    EXPECT_EQ(record->isData(), row.data);
    EXPECT_EQ(record->isHybrid(), row.hybrid);
  }
}

TEST_F(EkPlugInCoreTest, DiagnoseAnswersTheFirstFailureInItsOrder) {
  const std::string principal = "Application Extensions may not use the \"PrincipalClass\" key";
  const std::string protocol = "missing \"ZuExtensionProtocol\" key in Info.dmap or SDK";
  const std::string attributes = "missing \"ZuExtensionAttributes\" key in Info.dmap or SDK";
  const std::string passProxy = "the \"PassProxy\" key is not supported on this platform";
  const Value a(Dictionary{});
  const std::string appex = "/a/A.app/PlugIns/B.appex";
  const struct {
    std::string path;
    Dictionary plugIn;
    std::string message;  // empty: valid
  } rows[] = {
      {appex, {{"ZuExtensionAttributes", a}, {"PrincipalClass", "ZuObject"}}, ""},
      {appex, {{"ZuExtensionAttributes", a}, {"PrincipalClass", 7}}, principal},
      {appex,
       {{"ZuExtensionAttributes", a}, {"PassProxy", true}, {"PrincipalClass", "X"}},
       principal},
      {"/a/A.app/PlugIns/B.APPEX", {{"ZuExtensionAttributes", a}}, protocol},
      {"/s/P", {}, protocol},
      {"/s/P", {{"ZuExtensionProtocol", "P"}}, attributes},
      {appex, {{"ZuExtensionAttributes", Array{}}}, attributes},
      {"/s/P", {{"ZuExtensionProtocol", "#Data"}, {"ZuExtensionAttributes", a}}, ""},
      {appex, {{"ZuExtensionAttributes", a}, {"PassProxy", false}, {"EmbeddedCode", 1}}, passProxy},
      {appex,
       {{"ZuExtensionAttributes", a}, {"EmbeddedCode", a}},
       "hybrid plug-ins are not supported on this platform"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.path + " " + Value(row.plugIn).description());
    std::optional<EkError> error = fromPlugIn(row.plugIn, row.path)->diagnose();
    EXPECT_EQ(error, row.message.empty() ? std::nullopt
                                         : std::optional(EkError{"Ekora", 12, row.message}));
  }
}

// A record whose registry knows one SDK.
class SdkRecord : public EkPlugInCore {
 public:
  explicit SdkRecord(const Dictionary& info) {
    const Value bundleInfo(info);
    initWithName("com.x", EkFileURL::fromPath(kSystemPath).value(), &bundleInfo, nullptr, {});
  }
  std::optional<Dictionary> readSDKDictionary(std::string_view point) const override {
    if (point != "com.corvane.import") return std::nullopt;
    return Dictionary{
        {"ZuExtension", Dictionary{{"CleanTimeout", 30},
                                   {"ZuExtensionProtocol", "SdkProtocol"},
                                   {"ZuExtensionAttributes", Dictionary{{"FromSdk", true}}}}}};
  }
};

TEST_F(EkPlugInCoreTest, ResolveSdkMergesTheRegisteredSdkUnderThePlugInsOwnValues) {
  auto record = std::make_shared<SdkRecord>(
      Dictionary{{"ZuExtension", Dictionary{{"ZuExtensionPointIdentifier", "com.corvane.import"},
                                            {"CleanTimeout", 5},
                                            {"ZuExtensionProtocol", "Own"},
                                            {"ZuExtensionAttributes", Dictionary{{"Kinds", 1}}}}}});
  record->resolveSDK();
  EXPECT_EQ(*record->pluginKey("CleanTimeout"), Value(30));
  EXPECT_EQ(*record->protocolSpec(), Value("Own"));
  EXPECT_EQ(*record->attributes(),
            (Dictionary{{"FromSdk", true}, {"Kinds", 1}, {"ZuExtensionVersion", "1"}}));
  Dictionary unknown = appexInfo();
  (*unknown["ZuExtension"].dictionary())["ZuExtensionAttributes"] = Dictionary{};
  auto appex = fromInfo(unknown, kAppexPath);
  appex->resolveSDK();
  EXPECT_TRUE(sink_->has(log::Level::Default, "ops",
                         "plug-in sdk \"com.corvane.thumbnails\" not registered"));
  EXPECT_EQ(appex->versionString(), "2.1");
}

TEST_F(EkPlugInCoreTest, CanonicalizeGivesEveryPlugInAVersion) {
  const struct {
    std::optional<Value> shortVersion;
    std::optional<Dictionary> attributes;
    Value version;
  } rows[] = {
      {Value("9"), Dictionary{{"ZuExtensionVersion", "3.0"}}, Value("3.0")},
      {Value("2.5"), std::nullopt, Value("2.5")},
      {std::nullopt, Dictionary{{"Other", 1}}, Value("1")},
      {std::nullopt, Dictionary{{"ZuExtensionVersion", 4}}, Value(4)},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.version.description());
    Dictionary plugIn{{"ZuExtensionProtocol", "P"}};
    if (row.attributes) plugIn["ZuExtensionAttributes"] = *row.attributes;
    Dictionary info{{"QvBundleIdentifier", "com.x"}, {"ZuExtension", plugIn}};
    if (row.shortVersion) info["QvBundleShortVersionString"] = *row.shortVersion;
    auto record = fromInfo(info, kSystemPath);
    record->canonicalize();
    EXPECT_EQ(*record->version(), row.version);
    EXPECT_EQ(*record->bundleInfoDictionary(), info);
  }
}

std::shared_ptr<EkPlugInCore> fullRecord() {
  auto record = fromInfo(appexInfo(), kAppexPath);
  record->setUuid(Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f").value());
  record->setOriginalIdentifier("com.example.original");
  record->setHubProtocolVersion(2);
  record->setOnSystemVolume(true);
  record->setLastModified(-5);
  record->setEntitlements(std::make_shared<const Dictionary>(Dictionary{{"e", true}}));
  record->setContainingUrl(EkFileURL::fromPath("/apps/Viewer.app").value());
  record->setLocalizedName("Vorschau");
  record->setLocalizedShortName("Vor");
  record->setLocalizedContainingName("Betrachter");
  record->setLocalizedFileProviderActionNames(
      std::make_shared<const Dictionary>(Dictionary{{"Rename", "Umbenennen"}}));
  record->setAnnotations(std::make_shared<const Dictionary>(Dictionary{{"election", 1}}));
  return record;
}

TEST_F(EkPlugInCoreTest, FormCarriesEveryKeyAndReadsBackToItself) {
  EkPlugInCore::FormExport exported = fullRecord()->exportForm();
  EXPECT_FALSE(exported.error.has_value());
  Dictionary bundleInfo = appexInfo();
  bundleInfo["QvBundleDisplayName"] = "Vorschau";
  EXPECT_EQ(
      exported.form,
      (Dictionary{{"hubProtocolVersion", 2},
                  {"path", std::string(kAppexPath)},
                  {"systemResident", true},
                  {"identifier", "com.example.viewer.thumbs"},
                  {"original-identifier", "com.example.original"},
                  {"version", "2.1.0"},
                  {"bundleInfo", bundleInfo},
                  {"info", *appexInfo().at("ZuExtension").dictionary()},
                  {"uuid", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},
                  {"lastmodified", -5},
                  {"annotations", Dictionary{{"election", 1}}},
                  {"entitlements", Dictionary{{"e", true}}},
                  {"containingPath", "/apps/Viewer.app"},
                  {"localizedContainingDisplayName", "Betrachter"},
                  {"localizedDisplayName", "Vorschau"},
                  {"localizedShortName", "Vor"},
                  {"localizedFileProviderActionNames", Dictionary{{"Rename", "Umbenennen"}}}}));
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(exported.form);
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(read.value()->exportForm().form, exported.form);
  EXPECT_EQ(read.value()->lastModified(), -5);

  auto bare = fromPlugIn(Dictionary{});
  exported = bare->exportForm();
  EXPECT_EQ(exported.form.at("version"), Value("<none>"));
  EXPECT_FALSE(exported.form.contains("entitlements"));
  EXPECT_EQ(exported.error->message,
            "incomplete form for plug-in com.x: missing \"original-identifier\", \"bundleInfo\"");
}

TEST_F(EkPlugInCoreTest, FormsWithAKeyOfTheWrongTypeAreRefused) {
  const Dictionary minimal{{"identifier", "com.x"}, {"path", "/System/X/"}, {"uuid", "none"}};
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(minimal);
  ASSERT_TRUE(read.ok());
  EXPECT_EQ(read.value()->path(), "/System/X");
  EXPECT_EQ(read.value()->hubProtocolVersion(), 1u);
  EXPECT_FALSE(read.value()->uuid().isNull());
  const std::pair<const char*, std::optional<Value>> rows[] = {
      {"identifier", std::nullopt},
      {"identifier", Value(5)},
      {"path", Value("relative/X")},
      {"bundleInfo", Value(Dictionary{{"ZuExtension", "text"}})},
      {"info", Value(Array{})},
      {"hubProtocolVersion", Value(uint64_t{1} << 32)},
      {"hubProtocolVersion", Value(-1)},
      {"lastmodified", Value(uint64_t{1} << 31)},
      {"lastmodified", Value(1.5)},
      {"systemResident", Value("yes")},
      {"hash", Value("0102")},
      {"requirement", Value(true)},
      {"annotations", Value(Array{})},
      {"containingPath", Value("apps/A.app")},
      {"localizedShortName", Value(Data{})},
  };
  for (const auto& [key, value] : rows) {
    Dictionary form = minimal;
    value ? void(form[key] = *value) : void(form.erase(key));
    read = EkPlugInCore::createWithForm(form);
    ASSERT_FALSE(read.ok()) << key << " = " << (value ? value->description() : "absent");
    EXPECT_EQ(read.error().domain, kFormatErrorDomain) << key;
  }
}

TEST_F(EkPlugInCoreTest, AnnotationsChangeOneKeyAtATimeAndNoneIsLost) {
  auto record = fullRecord();
  DictionaryRef before = record->annotations();
  record->setAnnotation("election", std::nullopt);
  record->updateFromForm(Dictionary{{"annotations", Dictionary{{"x", 0}}}});
  EXPECT_EQ(*record->annotations(), (Dictionary{{"x", 0}}));
  EXPECT_EQ(*before, (Dictionary{{"election", 1}}));
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 200; ++i) {
        record->setAnnotation(std::to_string(t) + "-" + std::to_string(i), Value(i));
        EXPECT_TRUE(record->exportForm().form.contains("annotations"));
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(record->annotations()->size(), 801u);
  record->updateFromForm(Dictionary{});
  record->setAnnotation("election", Value(1));
  EXPECT_EQ(record->annotations(), nullptr);
}

TEST_F(EkPlugInCoreTest, LocalizedNamesStandInForTheInfoNames) {
  const std::vector<std::string> keys{"QvBundleName", "QvBundleDisplayName",
                                      "QvBundleShortVersionString", "Missing"};
  EXPECT_EQ(fullRecord()->localizedInfoDictionaryForKeys(keys).value(),
            (Dictionary{{"QvBundleName", "Vor"},
                        {"QvBundleDisplayName", "Vorschau"},
                        {"QvBundleShortVersionString", "2.1"}}));
  EXPECT_EQ(fromInfo(appexInfo(), kAppexPath)->localizedInfoDictionaryForKeys(keys).value(),
            (Dictionary{{"QvBundleDisplayName", "Thumbs"}, {"QvBundleShortVersionString", "2.1"}}));
  int calls = 0;
  fromPlugIn(Dictionary{})
      ->localizedInfoDictionaryForKeys(
          keys, [&](std::optional<Dictionary> values, std::optional<EkError> error) {
            ++calls;
            EXPECT_FALSE(values.has_value());
            EXPECT_EQ(error, (EkError{"Ekora", -1, "Unable to resolve plugin for com.x"}));
          });
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace ek
