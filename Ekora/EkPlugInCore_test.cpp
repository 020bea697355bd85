#include "Ekora/EkPlugInCore.h"

#include <gtest/gtest.h>

#include <string>
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
                  {"ZuExtensionAttributes", Dictionary{{"ZuExtensionVersion", "2.1.0"}}}}},
  };
}

std::shared_ptr<EkPlugInCore> make(const Value* bundleInfo, const Dictionary* plugIn,
                                   std::string_view path = kAppexPath,
                                   std::optional<std::string> identifier = "com.x") {
  return EkPlugInCore::createWithName(identifier, EkFileURL::fromPath(path).value(), bundleInfo,
                                      plugIn, std::nullopt);
}
std::shared_ptr<EkPlugInCore> fromInfo(const Dictionary& info, std::string_view path = kAppexPath) {
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

TEST_F(EkPlugInCoreTest, SetUpReadsTheInfoAndDefaultsTheSpecsOfApplicationExtensions) {
  auto record = fromInfo(appexInfo());
  EXPECT_EQ(*record->principalSpec(), Value("ZuObject"));
  EXPECT_EQ(record->versionString(), "2.1.0");
  EXPECT_FALSE(record->diagnose().has_value());
  // Outside an application extension nothing is defaulted.
  EXPECT_EQ(fromPlugIn(Dictionary{})->principalSpec(), nullptr);
  // Parts set-up refuses give no record.
  const Value badInfo(Dictionary{{"ZuExtension", Array{"x"}}});
  const Dictionary plugIn;
  EXPECT_EQ(EkPlugInCore::createWithName("com.x", std::nullopt, nullptr, &plugIn, std::nullopt),
            nullptr);
  EXPECT_EQ(make(nullptr, &plugIn, kAppexPath, std::nullopt), nullptr);
  EXPECT_TRUE(sink_->has(log::Level::Error, "ops",
                         "missing identifier in plug-in at /apps/Viewer.app/PlugIns/Thumbs.appex"));
  EXPECT_EQ(make(&badInfo, &plugIn), nullptr);
  // A later malformed dictionary keeps the plug-in dictionary read before.
  EXPECT_FALSE(record->setDictionaries(badInfo));
  EXPECT_EQ(*record->plugInDictionary(), *appexInfo().at("ZuExtension").dictionary());
}

// Each row: the flags read from the path and the plug-in dictionary, and the first reason, in a
// fixed order, why the definition is invalid.
TEST_F(EkPlugInCoreTest, FlagsAndDiagnoseFollowPathAndPlugInKeys) {
  const std::string principal = "Application Extensions may not use the \"PrincipalClass\" key";
  const std::string protocol = "missing \"ZuExtensionProtocol\" key in Info.dmap or SDK";
  const std::string attributes = "missing \"ZuExtensionAttributes\" key in Info.dmap or SDK";
  const Value a(Dictionary{});
  const std::string appex = "/a/A.app/PlugIns/B.appex";
  const struct {
    std::string path;
    Dictionary plugIn;
    std::string flags, message;  // message empty: valid
  } rows[] = {
      {appex, {{"ZuExtensionAttributes", a}, {"PrincipalClass", "ZuObject"}}, "appex", ""},
      {appex, {{"ZuExtensionAttributes", a}, {"PrincipalClass", 7}}, "appex", principal},
      {appex + "2", {{"ZuExtensionAttributes", a}}, "", protocol},
      {"/a/A.app/PlugIns/B.APPEX", {{"Dedicated", 1}}, "dedicated", protocol},
      {"/s/P", {{"ZuExtensionProtocol", "P"}, {"Dedicated", "YES"}}, "", attributes},
      {"/s/P", {{"ZuExtensionProtocol", "#Data"}, {"ZuExtensionAttributes", a}}, "data", ""},
      {"/s/P", {{"ZuExtensionProtocol", "#data"}, {"ZuExtensionAttributes", a}}, "", ""},
      {appex,
       {{"ZuExtensionAttributes", a}, {"PassProxy", false}, {"EmbeddedCode", 1}},
       "appex hybrid",
       "the \"PassProxy\" key is not supported on this platform"},
      {appex,
       {{"ZuExtensionAttributes", a}, {"EmbeddedCode", false}},
       "appex hybrid",
       "hybrid plug-ins are not supported on this platform"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.path + " " + Value(row.plugIn).description());
    auto record = fromPlugIn(row.plugIn, row.path);
    std::string flags;
    for (auto [name, set] : {std::pair{"appex", record->isAppExtension()},
                             {"dedicated", record->isDedicated()},
                             {"data", record->isData()},
                             {"hybrid", record->isHybrid()}}) {
      if (set) flags += (flags.empty() ? "" : " ") + std::string(name);
    }
    EXPECT_EQ(flags, row.flags);
    EXPECT_EQ(record->diagnose(), row.message.empty()
                                      ? std::nullopt
                                      : std::optional(EkError{"Ekora", 12, row.message}));
  }
}

std::shared_ptr<EkPlugInCore> fullRecord() {
  auto record = fromInfo(appexInfo());
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
  std::vector<std::string> keys;
  for (const auto& [key, value] : exported.form) keys.push_back(key);
  EXPECT_EQ(keys,
            (std::vector<std::string>{
                "annotations", "bundleInfo", "containingPath", "entitlements", "hubProtocolVersion",
                "identifier", "info", "lastmodified", "localizedContainingDisplayName",
                "localizedDisplayName", "localizedFileProviderActionNames", "localizedShortName",
                "original-identifier", "path", "systemResident", "uuid", "version"}));
  // The host shows the localized name as the bundle's display name.
  EXPECT_EQ(*exported.form.at("bundleInfo").getString("QvBundleDisplayName"), "Vorschau");
  EXPECT_EQ(exported.form.at("uuid"), Value("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"));
  Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(exported.form);
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(read.value()->exportForm().form, exported.form);
  EXPECT_EQ(read.value()->lastModified(), -5);

  auto bare = fromPlugIn(Dictionary{});
  exported = bare->exportForm();
  EXPECT_EQ(exported.form.at("version"), Value("<none>"));
  EXPECT_EQ(exported.error->message,
            "incomplete form for plug-in com.x: missing \"original-identifier\", \"bundleInfo\"");
}

TEST_F(EkPlugInCoreTest, FormsWithAKeyOfTheWrongTypeAreRefused) {
  const Dictionary minimal{{"identifier", "com.x"}, {"path", "/System/X/"}, {"uuid", "none"}};
  EXPECT_EQ(EkPlugInCore::createWithForm(minimal).value()->path(), "/System/X");
  const std::pair<const char*, std::optional<Value>> rows[] = {
      {"identifier", std::nullopt},
      {"path", Value("relative/X")},
      {"bundleInfo", Value(Dictionary{{"ZuExtension", "text"}})},
      {"lastmodified", Value(uint64_t{1} << 31)},
      {"systemResident", Value("yes")},
      {"annotations", Value(Array{})},
  };
  for (const auto& [key, value] : rows) {
    Dictionary form = minimal;
    value ? void(form[key] = *value) : void(form.erase(key));
    Result<std::shared_ptr<EkPlugInCore>> read = EkPlugInCore::createWithForm(form);
    ASSERT_FALSE(read.ok()) << key << " = " << (value ? value->description() : "absent");
    EXPECT_EQ(read.error().domain, kFormatErrorDomain) << key;
  }
}

TEST_F(EkPlugInCoreTest, AnnotationsChangeOneKeyAtATimeAndOnlyWhenPresent) {
  auto record = fullRecord();
  DictionaryRef before = record->annotations();
  record->setAnnotation("election", std::nullopt);
  record->setAnnotation("x", Value(0));
  EXPECT_EQ(*record->annotations(), (Dictionary{{"x", 0}}));
  EXPECT_EQ(*before, (Dictionary{{"election", 1}}));
  record->updateFromForm(Dictionary{{"annotations", Dictionary{{"y", 1}}}});
  EXPECT_EQ(*record->annotations(), (Dictionary{{"y", 1}}));
  record->updateFromForm(Dictionary{});
  record->setAnnotation("election", Value(1));  // no dictionary, none made
  EXPECT_EQ(record->annotations(), nullptr);
}

}  // namespace
}  // namespace ek
