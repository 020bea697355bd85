#include "Ekora/EkPlugInCore.h"

#include <gtest/gtest.h>

#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "Ekora/EkPlugInKeys.h"
#include "platform/log/Log.h"
#include "platform/log/testing/CapturingSink.h"

namespace ek {
namespace {

constexpr std::string_view kAppexPath = "/apps/Viewer.app/PlugIns/Thumbs.appex";
constexpr std::string_view kSystemPath = "/System/Library/PlugIns/Indexer.bundle";

EkFileURL fileURL(std::string_view path) {
  return EkFileURL::fromPath(path).value();
}

// An application extension inside an application, as its bundle's Info.dmap says it.
Dictionary appexInfo() {
  return Dictionary{
      {"QvBundleIdentifier", "com.example.viewer.thumbs"},
      {"QvBundleDisplayName", "Thumbs"},
      {"QvBundleName", "Thumbs"},
      {"QvBundleShortVersionString", "2.1"},
      {"QvBundleExecutable", "Thumbs"},
      {"QvBundleInfoDmapURL", "file:///apps/Viewer.app/PlugIns/Thumbs.appex/Info.dmap"},
      {"ZuExtension",
       Dictionary{
           {"ZuExtensionPointIdentifier", "com.corvane.thumbnails"},
           {"ZuExtensionAttributes",
            Dictionary{{"ZuExtensionVersion", "2.1.0"},
                       {"SupportedContentTypes", Array{"public.image", "public.movie"}}}},
       }},
  };
}

// A system plug-in under the system root: it names its protocol and principal class.
Dictionary systemInfo() {
  return Dictionary{
      {"QvBundleIdentifier", "com.corvane.indexer"},
      {"QvBundleDisplayName", "Indexer"},
      {"ZuExtension",
       Dictionary{
           {"ZuExtensionPointIdentifier", "com.corvane.spotlight.import"},
           {"ZuExtensionProtocol", "IndexerProtocol"},
           {"PrincipalClass", "IndexerPrincipal"},
           {"ZuExtensionAttributes", Dictionary{{"Kinds", Array{"mail"}}}},
       }},
  };
}

std::shared_ptr<EkPlugInCore> fromInfo(const Dictionary& info, std::string_view path,
                                       std::optional<Uuid> uuid = std::nullopt) {
  const Value bundleInfo(info);
  return EkPlugInCore::createWithName(*info.at("QvBundleIdentifier").string(), fileURL(path),
                                      &bundleInfo, nullptr, uuid);
}

std::shared_ptr<EkPlugInCore> fromPlugInDictionary(const Dictionary& plugIn,
                                                   std::string_view path) {
  return EkPlugInCore::createWithName("com.example.plugin", fileURL(path), nullptr, &plugIn,
                                      std::nullopt);
}

using log::testing::CapturingSink;

class EkPlugInCoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log::configure("default");
    log::setSink(sink_);
  }
  void TearDown() override { log::setSink(nullptr); }

  std::shared_ptr<CapturingSink> sink_ = std::make_shared<CapturingSink>();
};

// A record whose registry knows one SDK.
class SdkRecord : public EkPlugInCore {
 public:
  static std::shared_ptr<SdkRecord> create(const Dictionary& info, std::string_view path,
                                           std::optional<Dictionary> sdk) {
    std::shared_ptr<SdkRecord> record(new SdkRecord(std::move(sdk)));
    const Value bundleInfo(info);
    if (!record->initWithName("com.example.sdk", fileURL(path), &bundleInfo, nullptr,
                              std::nullopt)) {
      return nullptr;
    }
    return record;
  }
  std::optional<Dictionary> readSDKDictionary(std::string_view extensionPoint) const override {
    asked.push_back(std::string(extensionPoint));
    return sdk_;
  }
  mutable std::vector<std::string> asked;

 private:
  explicit SdkRecord(std::optional<Dictionary> sdk) : sdk_(std::move(sdk)) {}
  std::optional<Dictionary> sdk_;
};

// ---- Set-up --------------------------------------------------------------------------------

TEST_F(EkPlugInCoreTest, SetsUpApplicationExtensionFromInfoDictionary) {
  const Dictionary info = appexInfo();
  auto record = fromInfo(info, kAppexPath);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->identifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(record->path(), std::string(kAppexPath));
  EXPECT_EQ(*record->bundleInfoDictionary(), info);
  EXPECT_EQ(*record->plugInDictionary(), *info.at("ZuExtension").dictionary());
  EXPECT_TRUE(record->isAppExtension());
  EXPECT_EQ(*record->protocolSpec(), Value("ZuObject"));
  EXPECT_EQ(*record->principalSpec(), Value("ZuObject"));
  EXPECT_EQ(*record->sdkSpec(), Value("com.corvane.thumbnails"));
  EXPECT_EQ(record->versionString(), "2.1.0");
  EXPECT_EQ(*record->attribute("SupportedContentTypes"),
            Value(Array{"public.image", "public.movie"}));
  EXPECT_EQ(*record->infoKey("QvBundleExecutable"), Value("Thumbs"));
  EXPECT_EQ(record->infoKey("NoSuchKey"), nullptr);
  EXPECT_FALSE(record->isData());
  EXPECT_FALSE(record->isDedicated());
  EXPECT_FALSE(record->isHybrid());
  EXPECT_FALSE(record->containingPath().has_value());
  EXPECT_FALSE(record->diagnose().has_value());
}

TEST_F(EkPlugInCoreTest, SetsUpSystemPlugInFromInfoDictionary) {
  auto record = fromInfo(systemInfo(), kSystemPath);
  ASSERT_NE(record, nullptr);
  EXPECT_FALSE(record->isAppExtension());
  EXPECT_EQ(*record->protocolSpec(), Value("IndexerProtocol"));
  EXPECT_EQ(*record->principalSpec(), Value("IndexerPrincipal"));
  EXPECT_EQ(record->version(), nullptr);
  EXPECT_FALSE(record->diagnose().has_value());
}

TEST_F(EkPlugInCoreTest, SpecsHaveNoDefaultOutsideApplicationExtensions) {
  auto record =
      fromPlugInDictionary(Dictionary{{"ZuExtensionAttributes", Dictionary{}}}, kSystemPath);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->protocolSpec(), nullptr);
  EXPECT_EQ(record->principalSpec(), nullptr);
}

TEST_F(EkPlugInCoreTest, KeepsGivenUuidOrMakesRandomOne) {
  const Uuid given = Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F").value();
  EXPECT_EQ(fromInfo(appexInfo(), kAppexPath, given)->uuid(), given);
  EXPECT_NE(fromInfo(appexInfo(), kAppexPath)->uuid(), fromInfo(appexInfo(), kAppexPath)->uuid());
}

TEST_F(EkPlugInCoreTest, NoUrlGivesNoRecordSilently) {
  const Value info(appexInfo());
  EXPECT_EQ(EkPlugInCore::createWithName("com.x", std::nullopt, &info, nullptr, std::nullopt),
            nullptr);
  EXPECT_TRUE(sink_->lines().empty());
}

TEST_F(EkPlugInCoreTest, NoIdentifierGivesNoRecordAndErrorLog) {
  const Value info(appexInfo());
  EXPECT_EQ(
      EkPlugInCore::createWithName(std::nullopt, fileURL(kAppexPath), &info, nullptr, std::nullopt),
      nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "missing identifier in plug-in at /apps/Viewer.app/PlugIns/Thumbs.appex"));
}

TEST_F(EkPlugInCoreTest, BundleInfoThatIsNotDictionaryGivesNoRecord) {
  const Value info("not a dictionary");
  EXPECT_EQ(
      EkPlugInCore::createWithName("com.x", fileURL(kAppexPath), &info, nullptr, std::nullopt),
      nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Default, "ops",
                         "malformed plug-in dictionary in plug-in com.x at "
                         "file:///apps/Viewer.app/PlugIns/Thumbs.appex: \"not a dictionary\""));
}

TEST_F(EkPlugInCoreTest, PlugInDictionaryThatIsNotDictionaryGivesNoRecord) {
  Dictionary info = appexInfo();
  info["ZuExtension"] = Array{"x"};
  const Value bundleInfo(info);
  const Dictionary fallback{{"ZuExtensionAttributes", Dictionary{}}};
  EXPECT_EQ(EkPlugInCore::createWithName("com.x", fileURL(kAppexPath), &bundleInfo, &fallback,
                                         std::nullopt),
            nullptr);
  ASSERT_EQ(sink_->lines().size(), 1u);
  EXPECT_EQ(sink_->lines()[0].level, log::Level::Default);
  EXPECT_TRUE(
      sink_->lines()[0].message.starts_with("malformed plug-in dictionary in plug-in com.x"));
}

TEST_F(EkPlugInCoreTest, InfoBecomesPlugInDictionaryWithoutBundleInfo) {
  const Dictionary plugIn = *appexInfo().at("ZuExtension").dictionary();
  auto record = fromPlugInDictionary(plugIn, kAppexPath);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->bundleInfoDictionary(), nullptr);
  EXPECT_EQ(*record->plugInDictionary(), plugIn);
  EXPECT_FALSE(record->diagnose().has_value());
}

TEST_F(EkPlugInCoreTest, BundleInfoPlugInDictionaryWinsOverInfo) {
  const Value bundleInfo(appexInfo());
  const Dictionary other{{"ZuExtensionAttributes", Dictionary{{"Other", true}}}};
  auto record =
      EkPlugInCore::createWithName("com.x", fileURL(kAppexPath), &bundleInfo, &other, std::nullopt);
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(*record->plugInDictionary(), *appexInfo().at("ZuExtension").dictionary());
}

TEST_F(EkPlugInCoreTest, MultipleKeyIsLoggedAndAccepted) {
  Dictionary info = appexInfo();
  (*info["ZuExtension"].dictionary())["Multiple"] = true;
  auto record = fromInfo(info, kAppexPath);
  ASSERT_NE(record, nullptr);
  EXPECT_FALSE(record->diagnose().has_value());
  EXPECT_TRUE(sink_->has(log::Level::Default, "ops",
                         "multiplexed plug-ins (Multiple key) obsolete and ignored"));
}

TEST_F(EkPlugInCoreTest, SetDictionariesKeepsOldPlugInDictionaryWhenNewIsMalformed) {
  auto record = fromInfo(appexInfo(), kAppexPath);
  ASSERT_NE(record, nullptr);
  const Dictionary broken{{"QvBundleDisplayName", "Broken"}, {"ZuExtension", "text"}};
  EXPECT_FALSE(record->setDictionaries(Value(broken)));
  EXPECT_EQ(*record->bundleInfoDictionary(), broken);
  EXPECT_EQ(*record->plugInDictionary(), *appexInfo().at("ZuExtension").dictionary());
  EXPECT_FALSE(record->setDictionaries(Value(Array{})));
  EXPECT_EQ(*record->bundleInfoDictionary(), broken);
}

TEST_F(EkPlugInCoreTest, RecordsAreEqualByUuidAlone) {
  const Uuid uuid = Uuid::random();
  auto a = fromInfo(appexInfo(), kAppexPath, uuid);
  auto b = fromInfo(systemInfo(), kSystemPath, uuid);
  auto c = fromInfo(appexInfo(), kAppexPath);
  EXPECT_TRUE(a->isEqual(*b));
  EXPECT_EQ(a->hash(), b->hash());
  EXPECT_FALSE(a->isEqual(*c));
}

// ---- Flags ---------------------------------------------------------------------------------

TEST_F(EkPlugInCoreTest, ApplicationExtensionSuffixIsCaseSensitive) {
  const Dictionary plugIn{{"ZuExtensionAttributes", Dictionary{}}};
  EXPECT_TRUE(fromPlugInDictionary(plugIn, "/apps/A.app/PlugIns/B.appex")->isAppExtension());
  EXPECT_TRUE(fromPlugInDictionary(plugIn, "/apps/A.app/PlugIns/B.appex/")->isAppExtension());
  EXPECT_FALSE(fromPlugInDictionary(plugIn, "/apps/A.app/PlugIns/B.APPEX")->isAppExtension());
  EXPECT_FALSE(fromPlugInDictionary(plugIn, "/apps/A.app/PlugIns/B.appex2")->isAppExtension());
}

TEST_F(EkPlugInCoreTest, DedicatedReadsAsBoolean) {
  struct Case {
    std::optional<Value> value;
    bool dedicated;
  };
  const Case cases[] = {{std::nullopt, false}, {Value(true), true}, {Value(false), false},
                        {Value(1), true},      {Value(0), false},   {Value("YES"), false}};
  for (const Case& c : cases) {
    Dictionary plugIn{{"ZuExtensionAttributes", Dictionary{}}};
    if (c.value) plugIn["Dedicated"] = *c.value;
    EXPECT_EQ(fromPlugInDictionary(plugIn, kSystemPath)->isDedicated(), c.dedicated)
        << (c.value ? c.value->description() : "absent");
  }
}

TEST_F(EkPlugInCoreTest, DataProtocolMarksDataPlugIn) {
  auto data = fromPlugInDictionary(
      Dictionary{{"ZuExtensionProtocol", "#Data"}, {"ZuExtensionAttributes", Dictionary{}}},
      kSystemPath);
  EXPECT_TRUE(data->isData());
  EXPECT_FALSE(
      fromPlugInDictionary(Dictionary{{"ZuExtensionProtocol", "#data"}}, kSystemPath)->isData());
}

TEST_F(EkPlugInCoreTest, EmbeddedCodeOfAnyValueMarksHybrid) {
  EXPECT_TRUE(fromPlugInDictionary(Dictionary{{"EmbeddedCode", false}}, kSystemPath)->isHybrid());
}

// ---- Validation ----------------------------------------------------------------------------

struct DiagnoseCase {
  const char* name;
  std::string path;
  Dictionary plugIn;
  std::string message;  // empty: valid
};

TEST_F(EkPlugInCoreTest, DiagnoseAnswersFirstFailureWithExactMessage) {
  const Dictionary attributes{{"ZuExtensionVersion", "1.0"}};
  const std::string appex = "/apps/A.app/PlugIns/B.appex";
  const DiagnoseCase cases[] = {
      {"appex without protocol or principal", appex, {{"ZuExtensionAttributes", attributes}}, ""},
      {"appex naming ZuObject",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PrincipalClass", "ZuObject"}},
       ""},
      {"appex naming another principal",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PrincipalClass", "MyPrincipal"}},
       "Application Extensions may not use the \"PrincipalClass\" key"},
      {"appex principal that is not text",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PrincipalClass", 7}},
       "Application Extensions may not use the \"PrincipalClass\" key"},
      {"upper-case suffix is no appex",
       "/apps/A.app/PlugIns/B.APPEX",
       {{"ZuExtensionAttributes", attributes}},
       "missing \"ZuExtensionProtocol\" key in Info.dmap or SDK"},
      {"system plug-in without protocol",
       std::string(kSystemPath),
       {{"ZuExtensionAttributes", attributes}, {"PrincipalClass", "P"}},
       "missing \"ZuExtensionProtocol\" key in Info.dmap or SDK"},
      {"protocol checked before attributes",
       std::string(kSystemPath),
       {},
       "missing \"ZuExtensionProtocol\" key in Info.dmap or SDK"},
      {"system plug-in without attributes",
       std::string(kSystemPath),
       {{"ZuExtensionProtocol", "P"}},
       "missing \"ZuExtensionAttributes\" key in Info.dmap or SDK"},
      {"attributes that are not a dictionary",
       appex,
       {{"ZuExtensionAttributes", Array{"x"}}},
       "missing \"ZuExtensionAttributes\" key in Info.dmap or SDK"},
      {"system plug-in with its own principal",
       std::string(kSystemPath),
       {{"ZuExtensionProtocol", "P"},
        {"ZuExtensionAttributes", attributes},
        {"PrincipalClass", "Q"}},
       ""},
      {"PassProxy",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PassProxy", false}},
       "the \"PassProxy\" key is not supported on this platform"},
      {"PassProxy before hybrid",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PassProxy", true}, {"EmbeddedCode", "x"}},
       "the \"PassProxy\" key is not supported on this platform"},
      {"principal before PassProxy",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"PassProxy", true}, {"PrincipalClass", "X"}},
       "Application Extensions may not use the \"PrincipalClass\" key"},
      {"hybrid",
       appex,
       {{"ZuExtensionAttributes", attributes}, {"EmbeddedCode", Dictionary{}}},
       "hybrid plug-ins are not supported on this platform"},
      {"data plug-in",
       std::string(kSystemPath),
       {{"ZuExtensionProtocol", "#Data"}, {"ZuExtensionAttributes", attributes}},
       ""},
  };
  for (const DiagnoseCase& c : cases) {
    auto record = fromPlugInDictionary(c.plugIn, c.path);
    ASSERT_NE(record, nullptr) << c.name;
    std::optional<EkError> error = record->diagnose();
    if (c.message.empty()) {
      EXPECT_FALSE(error.has_value()) << c.name << ": " << error->message;
      continue;
    }
    ASSERT_TRUE(error.has_value()) << c.name;
    EXPECT_EQ(error->domain, "Ekora") << c.name;
    EXPECT_EQ(error->code, 12) << c.name;
    EXPECT_EQ(error->message, c.message) << c.name;
  }
}

TEST_F(EkPlugInCoreTest, DiagnoseReportsMissingIdentifierFirst) {
  auto record = fromPlugInDictionary(Dictionary{}, kSystemPath);
  record->setIdentifier(std::nullopt);
  std::optional<EkError> error = record->diagnose();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(error->code, 12);
  EXPECT_EQ(error->message,
            "missing identifier (no ZuExtensionIdentifier, nor even QvBundleIdentifier)");
}

// ---- SDK merge -----------------------------------------------------------------------------

TEST_F(EkPlugInCoreTest, ResolveSdkMergesRegisteredSdkAndCanonicalizes) {
  Dictionary info = systemInfo();
  (*info["ZuExtension"].dictionary())["CleanTimeout"] = 5;
  const Dictionary sdk{
      {"ZuExtension", Dictionary{{"CleanTimeout", 30},
                                 {"ZuExtensionProtocol", "SdkProtocol"},
                                 {"ZuExtensionAttributes", Dictionary{{"FromSdk", true}}}}}};
  auto record = SdkRecord::create(info, kSystemPath, sdk);
  ASSERT_NE(record, nullptr);
  record->resolveSDK();
  EXPECT_EQ(record->asked, std::vector<std::string>{"com.corvane.spotlight.import"});
  EXPECT_EQ(*record->pluginKey("CleanTimeout"), Value(30));
  EXPECT_EQ(*record->protocolSpec(), Value("IndexerProtocol"));
  EXPECT_EQ(*record->attribute("FromSdk"), Value(true));
  EXPECT_EQ(*record->attribute("Kinds"), Value(Array{"mail"}));
  // No short version string: the default version.
  EXPECT_EQ(record->versionString(), "1");
  // The bundle info holds the merge; only the plug-in dictionary holds the default version.
  const Dictionary& bundlePlugIn = *record->bundleInfoDictionary()->at("ZuExtension").dictionary();
  EXPECT_EQ(bundlePlugIn.at("CleanTimeout"), Value(30));
  EXPECT_EQ(bundlePlugIn.at("ZuExtensionAttributes").get("ZuExtensionVersion"), nullptr);
}

TEST_F(EkPlugInCoreTest, ResolveSdkWithUnknownSdkStillCanonicalizes) {
  Dictionary info = appexInfo();
  (*info["ZuExtension"].dictionary())["ZuExtensionAttributes"] = Dictionary{};
  auto record = fromInfo(info, kAppexPath);
  record->resolveSDK();
  EXPECT_TRUE(sink_->has(log::Level::Default, "ops",
                         "plug-in sdk \"com.corvane.thumbnails\" not registered"));
  EXPECT_EQ(*record->bundleInfoDictionary(), info);
  EXPECT_EQ(record->versionString(), "2.1");
}

TEST_F(EkPlugInCoreTest, ResolveSdkStopsAtSdkKeyThatIsNotText) {
  Dictionary info = systemInfo();
  (*info["ZuExtension"].dictionary())["ZuExtensionPointIdentifier"] = 42;
  auto record = SdkRecord::create(info, kSystemPath, Dictionary{});
  record->resolveSDK();
  EXPECT_TRUE(record->asked.empty());
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops", "invalid SDK key:42"));
  // No canonicalisation either.
  EXPECT_EQ(record->version(), nullptr);
}

TEST_F(EkPlugInCoreTest, ResolveSdkWithoutBundleInfoIsBrokenInvariant) {
  auto record = fromPlugInDictionary(Dictionary{}, kSystemPath);
  try {
    record->resolveSDK();
    FAIL() << "no exception";
  } catch (const std::logic_error& error) {
    EXPECT_STREQ(error.what(), "cannot resolve SDK without materialized Info.dmap");
  }
}

TEST_F(EkPlugInCoreTest, CanonicalizeDefaultsVersionAndAttributes) {
  struct Case {
    const char* name;
    std::optional<Value> shortVersion;
    std::optional<Dictionary> attributes;
    Value version;
  };
  const Case cases[] = {
      {"own version kept", Value("9"), Dictionary{{"ZuExtensionVersion", "3.0"}}, Value("3.0")},
      {"short version string", Value("2.5"), Dictionary{}, Value("2.5")},
      {"no attributes at all", Value("2.5"), std::nullopt, Value("2.5")},
      {"nothing: one", std::nullopt, Dictionary{{"Other", 1}}, Value("1")},
      {"version number kept", std::nullopt, Dictionary{{"ZuExtensionVersion", 4}}, Value(4)},
  };
  for (const Case& c : cases) {
    Dictionary plugIn{{"ZuExtensionProtocol", "P"}};
    if (c.attributes) plugIn["ZuExtensionAttributes"] = *c.attributes;
    Dictionary info{{"QvBundleIdentifier", "com.x"}, {"ZuExtension", plugIn}};
    if (c.shortVersion) info["QvBundleShortVersionString"] = *c.shortVersion;
    auto record = fromInfo(info, kSystemPath);
    record->canonicalize();
    ASSERT_NE(record->version(), nullptr) << c.name;
    EXPECT_EQ(*record->version(), c.version) << c.name;
    EXPECT_EQ(*record->pluginKey("ZuExtensionProtocol"), Value("P")) << c.name;
    EXPECT_EQ(*record->bundleInfoDictionary(), info) << c.name;
  }
}

TEST_F(EkPlugInCoreTest, CanonicalizeWithoutPlugInDictionaryChangesNothing) {
  auto record =
      EkPlugInCore::createWithName("com.x", fileURL(kSystemPath), nullptr, nullptr, std::nullopt);
  ASSERT_NE(record, nullptr);
  record->canonicalize();
  EXPECT_EQ(record->plugInDictionary(), nullptr);
}

// ---- Forms ---------------------------------------------------------------------------------

std::shared_ptr<EkPlugInCore> fullRecord() {
  auto record = fromInfo(appexInfo(), kAppexPath,
                         Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f").value());
  record->setOriginalIdentifier("com.example.viewer.thumbs.original");
  record->setHubProtocolVersion(2);
  record->setOnSystemVolume(true);
  record->setLastModified(1790000000);
  record->setEntitlements(std::make_shared<const Dictionary>(
      Dictionary{{"com.corvane.developer.replace-plugin", "com.example.old"}}));
  record->setContainingUrl(fileURL("/apps/Viewer.app"));
  record->setLocalizedName("Vorschau");
  record->setLocalizedShortName("Vor");
  record->setLocalizedContainingName("Betrachter");
  record->setLocalizedFileProviderActionNames(
      std::make_shared<const Dictionary>(Dictionary{{"Rename", "Umbenennen"}}));
  record->setAnnotations(std::make_shared<const Dictionary>(Dictionary{{"election", 1}}));
  return record;
}

TEST_F(EkPlugInCoreTest, ExportWritesEveryKey) {
  auto record = fullRecord();
  EkPlugInCore::FormExport exported = record->exportForm();
  EXPECT_FALSE(exported.error.has_value());
  Dictionary bundleInfo = appexInfo();
  bundleInfo.erase("QvBundleInfoDmapURL");
  bundleInfo["QvBundleDisplayName"] = "Vorschau";
  const Dictionary expected{
      {"hubProtocolVersion", 2},
      {"path", "/apps/Viewer.app/PlugIns/Thumbs.appex"},
      {"systemResident", true},
      {"identifier", "com.example.viewer.thumbs"},
      {"original-identifier", "com.example.viewer.thumbs.original"},
      {"version", "2.1.0"},
      {"bundleInfo", bundleInfo},
      {"info", *appexInfo().at("ZuExtension").dictionary()},
      {"uuid", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"},
      {"lastmodified", 1790000000},
      {"annotations", Dictionary{{"election", 1}}},
      {"entitlements", Dictionary{{"com.corvane.developer.replace-plugin", "com.example.old"}}},
      {"containingPath", "/apps/Viewer.app"},
      {"localizedContainingDisplayName", "Betrachter"},
      {"localizedDisplayName", "Vorschau"},
      {"localizedShortName", "Vor"},
      {"localizedFileProviderActionNames", Dictionary{{"Rename", "Umbenennen"}}},
  };
  EXPECT_EQ(exported.form, expected);
  // The record itself keeps its bundle's values.
  EXPECT_EQ(*record->bundleInfoDictionary(), appexInfo());
}

TEST_F(EkPlugInCoreTest, ExportOfBareRecordUsesDefaultsAndReportsMissingKeys) {
  Dictionary info = systemInfo();
  auto record = fromInfo(info, kSystemPath);
  EkPlugInCore::FormExport exported = record->exportForm();
  EXPECT_EQ(exported.form.at("version"), Value("<none>"));
  EXPECT_EQ(exported.form.at("annotations"), Value(Dictionary{}));
  EXPECT_EQ(exported.form.at("bundleInfo"), Value(info));
  EXPECT_EQ(exported.form.at("hubProtocolVersion"), Value(0));
  EXPECT_EQ(exported.form.at("systemResident"), Value(false));
  for (const char* key : {"original-identifier", "entitlements", "containingPath",
                          "localizedDisplayName", "localizedShortName",
                          "localizedContainingDisplayName", "localizedFileProviderActionNames"}) {
    EXPECT_FALSE(exported.form.contains(key)) << key;
  }
  ASSERT_TRUE(exported.error.has_value());
  EXPECT_EQ(exported.error->domain, "Ekora");
  EXPECT_EQ(exported.error->code, 4);
  EXPECT_EQ(exported.error->message,
            "incomplete form for plug-in com.corvane.indexer: missing \"original-identifier\"");
}

TEST_F(EkPlugInCoreTest, ExportWithoutBundleInfoLeavesDisplayNameOut) {
  auto record =
      fromPlugInDictionary(Dictionary{{"ZuExtensionAttributes", Dictionary{}}}, kAppexPath);
  record->setOriginalIdentifier("o");
  record->setLocalizedName("Mail Tools");
  EkPlugInCore::FormExport exported = record->exportForm();
  EXPECT_FALSE(exported.form.contains("bundleInfo"));
  EXPECT_EQ(exported.form.at("localizedDisplayName"), Value("Mail Tools"));
  ASSERT_TRUE(exported.error.has_value());
  EXPECT_EQ(exported.error->message,
            "incomplete form for plug-in com.example.plugin: missing \"bundleInfo\"");
}

TEST_F(EkPlugInCoreTest, FormReadsBackToTheSameForm) {
  const Dictionary form = fullRecord()->exportForm().form;
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(form);
  ASSERT_TRUE(read.ok()) << read.error().message;
  const auto& record = read.value();
  EXPECT_EQ(record->uuid(), fullRecord()->uuid());
  EXPECT_TRUE(record->isEqual(*fullRecord()));
  EXPECT_EQ(record->identifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(record->originalIdentifier(), "com.example.viewer.thumbs.original");
  EXPECT_EQ(record->hubProtocolVersion(), 2u);
  EXPECT_EQ(record->lastModified(), 1790000000);
  EXPECT_TRUE(record->onSystemVolume());
  EXPECT_EQ(record->containingPath(), "/apps/Viewer.app");
  EXPECT_EQ(record->localizedShortName(), "Vor");
  EXPECT_EQ(record->exportForm().form, form);
}

TEST_F(EkPlugInCoreTest, CanonicalizedRecordReadsBackWithItsVersion) {
  Dictionary info = systemInfo();
  info["QvBundleShortVersionString"] = "7.2";
  auto record = fromInfo(info, kSystemPath);
  record->resolveSDK();
  record->setOriginalIdentifier("com.corvane.indexer");
  record->setLastModified(-5);
  const Dictionary form = record->exportForm().form;
  EXPECT_EQ(form.at("version"), Value("7.2"));
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(form);
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(read.value()->versionString(), "7.2");
  EXPECT_EQ(read.value()->lastModified(), -5);
  EXPECT_EQ(read.value()->exportForm().form, form);
}

TEST_F(EkPlugInCoreTest, FormWithoutBundleInfoUsesInfo) {
  const Dictionary plugIn{{"ZuExtensionAttributes", Dictionary{{"ZuExtensionVersion", "3"}}}};
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(
      Dictionary{{"identifier", "com.x"}, {"path", std::string(kAppexPath)}, {"info", plugIn}});
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(*read.value()->plugInDictionary(), plugIn);
  EXPECT_EQ(read.value()->bundleInfoDictionary(), nullptr);
  EXPECT_EQ(read.value()->versionString(), "3");
}

TEST_F(EkPlugInCoreTest, MinimalFormReadsWithDefaults) {
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(
      Dictionary{{"identifier", "com.x"}, {"path", "/System/Library/PlugIns/X.bundle/"}});
  ASSERT_TRUE(read.ok()) << read.error().message;
  const auto& record = read.value();
  EXPECT_EQ(record->hubProtocolVersion(), 1u);
  EXPECT_EQ(record->path(), "/System/Library/PlugIns/X.bundle");
  EXPECT_EQ(record->lastModified(), 0);
  EXPECT_FALSE(record->onSystemVolume());
  EXPECT_EQ(record->annotations(), nullptr);
  EXPECT_EQ(record->entitlements(), nullptr);
  EXPECT_FALSE(record->originalIdentifier().has_value());
  EXPECT_FALSE(record->containingUrl().has_value());
  EXPECT_FALSE(record->cdhash().has_value());
}

TEST_F(EkPlugInCoreTest, FormReadsHashAndRequirement) {
  Result<std::shared_ptr<EkPlugInCore>> read =
      EkPlugInCore::createWithForm(Dictionary{{"identifier", "com.x"},
                                              {"path", "/System/X"},
                                              {"hash", Data{1, 2, 3}},
                                              {"requirement", "anchor trusted"},
                                              {"uuid", "e621e1f8-c36c-495a-93fc-0c247a3e6e5f"}});
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(read.value()->cdhash(), (Data{1, 2, 3}));
  EXPECT_EQ(read.value()->requirement(), "anchor trusted");
  EXPECT_EQ(read.value()->uuid().string(), "E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
}

TEST_F(EkPlugInCoreTest, FormUuidThatIsNotUuidTextGivesFreshUuid) {
  const Dictionary form{{"identifier", "com.x"}, {"path", "/System/X"}, {"uuid", "none"}};
  Result<std::shared_ptr<EkPlugInCore>> first = EkPlugInCore::createWithForm(form);
  Result<std::shared_ptr<EkPlugInCore>> second = EkPlugInCore::createWithForm(form);
  ASSERT_TRUE(first.ok() && second.ok());
  EXPECT_FALSE(first.value()->uuid().isNull());
  EXPECT_NE(first.value()->uuid(), second.value()->uuid());
}

TEST_F(EkPlugInCoreTest, MalformedFormsAreRefused) {
  const Dictionary valid{{"identifier", "com.x"}, {"path", "/System/X"}};
  struct Case {
    const char* key;
    std::optional<Value> value;  // absent: remove the key
  };
  const Case cases[] = {
      {"identifier", std::nullopt},
      {"identifier", Value(5)},
      {"path", std::nullopt},
      {"path", Value("relative/X")},
      {"path", Value(Array{"/System/X"})},
      {"bundleInfo", Value("text")},
      {"bundleInfo", Value(Dictionary{{"ZuExtension", "text"}})},
      {"bundleInfo", Value(Dictionary{{"QvBundleIdentifier", "com.x"}})},
      {"info", Value(Array{})},
      {"hubProtocolVersion", Value("3")},
      {"hubProtocolVersion", Value(uint64_t{1} << 32)},
      {"hubProtocolVersion", Value(-1)},
      {"lastmodified", Value(uint64_t{1} << 31)},
      {"lastmodified", Value(int64_t{-2147483649})},
      {"lastmodified", Value(1.5)},
      {"systemResident", Value("yes")},
      {"hash", Value("0102")},
      {"requirement", Value(true)},
      {"original-identifier", Value(Dictionary{})},
      {"entitlements", Value("none")},
      {"annotations", Value(Array{})},
      {"containingPath", Value("apps/A.app")},
      {"localizedDisplayName", Value(1)},
      {"localizedShortName", Value(Data{})},
      {"localizedContainingDisplayName", Value(false)},
      {"localizedFileProviderActionNames", Value(Array{})},
  };
  for (const Case& c : cases) {
    Dictionary form = valid;
    if (c.value) {
      form[c.key] = *c.value;
    } else {
      form.erase(c.key);
    }
    Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(form);
    ASSERT_FALSE(read.ok()) << c.key << " = " << (c.value ? c.value->description() : "absent");
    EXPECT_EQ(read.error().domain, kFormatErrorDomain) << c.key;
  }
  EXPECT_TRUE(EkPlugInCore::createWithForm(valid).ok());
}

// ---- Annotations ---------------------------------------------------------------------------

TEST_F(EkPlugInCoreTest, UpdateFromFormTakesAnnotations) {
  auto record = fullRecord();
  record->updateFromForm(Dictionary{{"annotations", Dictionary{{"election", 0}}}});
  EXPECT_EQ(*record->annotations(), (Dictionary{{"election", 0}}));
  record->updateFromForm(Dictionary{});
  EXPECT_EQ(record->annotations(), nullptr);
}

TEST_F(EkPlugInCoreTest, SetAnnotationChangesOneKey) {
  auto record = fullRecord();
  DictionaryRef before = record->annotations();
  record->setAnnotation("extension", Value(Dictionary{{"k", "v"}}));
  EXPECT_EQ(*record->annotations(),
            (Dictionary{{"election", 1}, {"extension", Dictionary{{"k", "v"}}}}));
  record->setAnnotation("election", std::nullopt);
  EXPECT_EQ(*record->annotations(), (Dictionary{{"extension", Dictionary{{"k", "v"}}}}));
  // Values handed out earlier do not change.
  EXPECT_EQ(*before, (Dictionary{{"election", 1}}));
}

TEST_F(EkPlugInCoreTest, SetAnnotationWithoutAnnotationsChangesNothing) {
  auto record = fromInfo(appexInfo(), kAppexPath);
  record->setAnnotation("election", Value(1));
  EXPECT_EQ(record->annotations(), nullptr);
}

TEST_F(EkPlugInCoreTest, ConcurrentAnnotationChangesAreNotLost) {
  auto record = fullRecord();
  record->setAnnotations(std::make_shared<const Dictionary>());
  constexpr int kPerThread = 200;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        record->setAnnotation("key-" + std::to_string(t) + "-" + std::to_string(i), Value(i));
        // Readers see whole dictionaries and whole forms while writers replace them.
        DictionaryRef snapshot = record->annotations();
        EXPECT_NE(snapshot, nullptr);
        EXPECT_TRUE(record->exportForm().form.contains("annotations"));
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(record->annotations()->size(), 4u * kPerThread);
}

// ---- Localized values ----------------------------------------------------------------------

TEST_F(EkPlugInCoreTest, LocalizedValuesPreferLocalizedNames) {
  auto record = fullRecord();
  Result<Dictionary> values = record->localizedInfoDictionaryForKeys(
      {"QvBundleName", "QvBundleDisplayName", "QvBundleShortVersionString", "Missing"});
  ASSERT_TRUE(values.ok());
  EXPECT_EQ(*values, (Dictionary{{"QvBundleName", "Vor"},
                                 {"QvBundleDisplayName", "Vorschau"},
                                 {"QvBundleShortVersionString", "2.1"}}));
}

TEST_F(EkPlugInCoreTest, LocalizedValuesFallBackToInfoWithoutLocalizedNames) {
  auto record = fromInfo(appexInfo(), kAppexPath);
  int calls = 0;
  record->localizedInfoDictionaryForKeys(
      {"QvBundleName", "QvBundleDisplayName"},
      [&](std::optional<Dictionary> values, std::optional<EkError> error) {
        ++calls;
        EXPECT_FALSE(error.has_value());
        ASSERT_TRUE(values.has_value());
        EXPECT_EQ(*values,
                  (Dictionary{{"QvBundleName", "Thumbs"}, {"QvBundleDisplayName", "Thumbs"}}));
      });
  EXPECT_EQ(calls, 1);
}

TEST_F(EkPlugInCoreTest, LocalizedValuesNeedStoredBundleInfo) {
  auto record = fromPlugInDictionary(Dictionary{}, kSystemPath);
  int calls = 0;
  record->localizedInfoDictionaryForKeys(
      {"QvBundleName"}, [&](std::optional<Dictionary> values, std::optional<EkError> error) {
        ++calls;
        EXPECT_FALSE(values.has_value());
        ASSERT_TRUE(error.has_value());
        EXPECT_EQ(error->domain, "Ekora");
        EXPECT_EQ(error->code, -1);
        EXPECT_EQ(error->message, "Unable to resolve plugin for com.example.plugin");
      });
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace ek
