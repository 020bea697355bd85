#include "platform/vantor/Registry.h"

#include <gtest/gtest.h>

namespace ek::vantor {
namespace {

TEST(PlugInIdentifier, RefusesNamesThatEscapeTheContainersDirectory) {
  for (const std::string& bad :
       {std::string(), std::string("."), std::string(".."), std::string("a/b"),
        std::string("a\0b", 3), std::string(256, 'x')}) {
    auto checked = checkPlugInIdentifier(bad);
    ASSERT_FALSE(checked.ok()) << bad;
    EXPECT_EQ(checked.error().code, kInvalidIdentifier);
  }
  for (const std::string& good : {std::string("..a"), std::string(255, 'y')}) {
    EXPECT_TRUE(checkPlugInIdentifier(good).ok()) << good;
  }
}

// Each row merges one SDK "ZuExtension" into one of the plug-in's and names what comes out.
// CleanTimeout: the SDK's wins; Shared: lists united, sorted, once each; any other key: the
// plug-in's own; dictionaries merge key by key, with these rules at every depth.
TEST(MergeSdk, FollowsTheRuleOfEachKey) {
  using D = Dictionary;
  const D sdk{{"CleanTimeout", 30},
              {"Shared", Array{"a", "c"}},
              {"Own", 1},
              {"Sdk", 1},
              {"ZuExtensionAttributes", D{{"CleanTimeout", 1}, {"Own", 1}}}};
  const D own{{"CleanTimeout", 5},
              {"Shared", Array{"c", "b"}},
              {"Own", 2},
              {"ZuExtensionAttributes", D{{"CleanTimeout", 2}, {"Own", 2}}}};
  const D merged{{"CleanTimeout", 30},
                 {"Shared", Array{"a", "b", "c"}},
                 {"Own", 2},
                 {"Sdk", 1},
                 {"ZuExtensionAttributes", D{{"CleanTimeout", 1}, {"Own", 2}}}};
  EXPECT_EQ(mergeSdk({{"ZuExtension", sdk}, {"QvBundleName", "sdk"}},
                     {{"ZuExtension", own}, {"QvBundleName", "own"}}),
            (D{{"ZuExtension", merged}, {"QvBundleName", "own"}}));
}

TEST(FileUrl, RoundTripsPathsAndRefusesWhatDoesNotLocateALocalBundle) {
  const std::string path = "/opt/My App.app/PlugIns/Thümbs%.appex";
  std::string url = fileUrlForPath(path);
  EXPECT_EQ(url, "file:///opt/My%20App.app/PlugIns/Th%C3%BCmbs%25.appex");
  EXPECT_EQ(pathFromUrlOrPath(url), path);
  EXPECT_EQ(pathFromUrlOrPath(url + "/"), path);
  EXPECT_EQ(pathFromUrlOrPath("/a/./b//c/"), "/a/b/c");
  for (const char* bad : {"relative/path", "http://host/a", "file://otherhost/a", "file:///a%2",
                          "file:///a%zz", "file:///a%00b", ""}) {
    EXPECT_EQ(pathFromUrlOrPath(bad), std::nullopt) << bad;
  }
}

TEST(Language, CandidatesStripEncodingAndFallBackToTheBaseLanguage) {
  struct Case {
    const char* language;
    std::vector<std::string> expected;
  };
  const Case cases[] = {
      {"en_US.UTF-8", {"en_US", "en"}},
      {"../evil", {"en"}},
  };
  for (const Case& c : cases) EXPECT_EQ(languageCandidates(c.language), c.expected) << c.language;
}

}  // namespace
}  // namespace ek::vantor
