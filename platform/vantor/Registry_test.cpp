#include "platform/vantor/Registry.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace ek::vantor {
namespace {

TEST(PlugInIdentifier, RefusesNamesThatEscapeTheContainersDirectory) {
  const std::string nul("a\0b", 3);
  const std::string tooLong(256, 'x');
  for (const std::string& bad : {std::string(), std::string("."), std::string(".."),
                                 std::string("a/b"), std::string("/"), nul, tooLong}) {
    auto checked = checkPlugInIdentifier(bad);
    ASSERT_FALSE(checked.ok()) << bad;
    EXPECT_EQ(checked.error().domain, kErrorDomain);
    EXPECT_EQ(checked.error().code, kInvalidIdentifier);
  }
  for (const std::string& good :
       {std::string("com.example.x"), std::string("..a"), std::string(255, 'y')}) {
    EXPECT_TRUE(checkPlugInIdentifier(good).ok()) << good;
  }
}

TEST(IndexedExtensionPoints, NarrowOnlyForPlainStringsOrArraysOfThem) {
  struct Case {
    Value pattern;
    std::optional<std::vector<std::string>> expected;
  };
  const std::vector<Case> cases = {
      {Value("com.a"), std::vector<std::string>{"com.a"}},
      {Value(""), std::vector<std::string>{""}},
      {Value(Array{Value("com.a"), Value("com.b")}), std::vector<std::string>{"com.a", "com.b"}},
      {Value(Array{Value("com.a"), Value(5)}), std::vector<std::string>{"com.a"}},
      {Value(Array{}), std::vector<std::string>{}},
      {Value("=com.a"), std::nullopt},
      {Value("<>com.a"), std::nullopt},
      {Value(">com.a"), std::nullopt},
      {Value("?TY-IS:x"), std::nullopt},
      {Value(Array{Value("com.a"), Value("<b")}), std::nullopt},
      {Value(true), std::nullopt},
      {Value(Dictionary{{"public.image", Value(1)}}), std::nullopt},
      {Value(7), std::nullopt},
  };
  for (const Case& c : cases) {
    Dictionary rules{{"ZuExtensionPointIdentifier", c.pattern}, {"Other", Value("x")}};
    EXPECT_EQ(indexedExtensionPoints(rules), c.expected) << c.pattern.description();
  }
  EXPECT_EQ(indexedExtensionPoints(Dictionary{{"Other", Value("x")}}), std::nullopt);
}

TEST(IndexValues, FollowTheAttributeThenTheTopLevelKey) {
  Dictionary info{
      {"ZuExtension",
       Value(Dictionary{{"ZuExtensionAttributes",
                         Value(Dictionary{{"ZuExtensionPointIdentifier",
                                           Value(Array{Value("a"), Value(3), Value("b")})}})}})}};
  EXPECT_EQ(extensionPointIndexValues(info), (std::vector<std::string>{"a", "b"}));
  Dictionary top{{"ZuExtensionPointIdentifier", Value("t")}};
  EXPECT_EQ(extensionPointIndexValues(top), (std::vector<std::string>{"t"}));
  EXPECT_TRUE(extensionPointIndexValues(Dictionary{}).empty());
}

TEST(IndexKey, DropsLeadingZerosOfDigitRuns) {
  EXPECT_EQ(extensionPointIndexKey("com.x01.y007"), "com.x1.y7");
  EXPECT_EQ(extensionPointIndexKey("v0"), "v0");
  EXPECT_EQ(extensionPointIndexKey("000"), "0");
  EXPECT_EQ(extensionPointIndexKey("plain"), "plain");
}

// Each row merges one SDK "ZuExtension" into one of the plug-in's and names what comes out.
TEST(MergeSdk, FollowsTheRuleOfEachKey) {
  using D = Dictionary;
  using A = Array;
  struct Row {
    const char* name;
    D sdk;
    D own;
    D expected;
  };
  const Row rows[] = {
      {"CleanTimeout: the SDK's replaces the plug-in's", D{{"CleanTimeout", 30}},
       D{{"CleanTimeout", 5}}, D{{"CleanTimeout", 30}}},
      {"Shared: lists united, sorted, once each", D{{"Shared", A{"a", "c"}}},
       D{{"Shared", A{"c", "b"}}}, D{{"Shared", A{"a", "b", "c"}}}},
      {"Shared: a string is a one-element list", D{{"Shared", "a"}}, D{{"Shared", A{"b", 7}}},
       D{{"Shared", A{"a", "b"}}}},
      {"any other key: the plug-in's own value", D{{"Dedicated", true}}, D{{"Dedicated", false}},
       D{{"Dedicated", false}}},
      {"an SDK-only key is copied whole", D{{"SdkOnly", D{{"n", A{1, 2}}}}, {"Shared", "a"}}, D{},
       D{{"SdkOnly", D{{"n", A{1, 2}}}}, {"Shared", "a"}}},
      {"dictionaries merge key by key, the rules at every depth",
       D{{"ZuExtensionAttributes", D{{"Sdk", "s"}, {"Both", "sdk"}, {"CleanTimeout", 1}}}},
       D{{"ZuExtensionAttributes", D{{"Both", "own"}, {"CleanTimeout", 2}}}},
       D{{"ZuExtensionAttributes", D{{"Both", "own"}, {"CleanTimeout", 1}, {"Sdk", "s"}}}}},
      {"the plug-in's non-dictionary stays under an SDK dictionary",
       D{{"ZuExtensionAttributes", D{{"k", 1}}}}, D{{"ZuExtensionAttributes", "own"}},
       D{{"ZuExtensionAttributes", "own"}}},
  };
  for (const Row& row : rows) {
    const D merged = mergeSdk(D{{"ZuExtension", row.sdk}, {"QvBundleName", "sdk"}},
                              D{{"ZuExtension", row.own}, {"QvBundleName", "own"}});
    EXPECT_EQ(merged, (D{{"ZuExtension", row.expected}, {"QvBundleName", "own"}})) << row.name;
  }
}

TEST(FileUrl, RoundTripsPathsWithSpecialCharacters) {
  const std::string path = "/opt/My App.app/PlugIns/Thümbs%.appex";
  std::string url = fileUrlForPath(path);
  EXPECT_EQ(url, "file:///opt/My%20App.app/PlugIns/Th%C3%BCmbs%25.appex");
  EXPECT_EQ(pathFromUrlOrPath(url), path);
  EXPECT_EQ(pathFromUrlOrPath(url + "/"), path);
  EXPECT_EQ(pathFromUrlOrPath("file://localhost/a/b/"), "/a/b");
  EXPECT_EQ(pathFromUrlOrPath("/a/./b//c/"), "/a/b/c");
}

TEST(FileUrl, RefusesWhatDoesNotLocateALocalBundle) {
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
      {"fr_CA", {"fr_CA", "fr"}},
      {"de", {"de"}},
      {"sr_RS@latin", {"sr_RS", "sr"}},
      {"C", {"en"}},
      {"POSIX", {"en"}},
      {"C.UTF-8", {"en"}},
      {"../evil", {"en"}},
      {"", {"en"}},
  };
  for (const Case& c : cases) EXPECT_EQ(languageCandidates(c.language), c.expected) << c.language;
}

TEST(Language, EnvironmentOrderIsEkoraLocaleThenLcAllThenLcMessagesThenLang) {
  unsetenv("EKORA_LOCALE");
  unsetenv("LC_ALL");
  unsetenv("LC_MESSAGES");
  unsetenv("LANG");
  EXPECT_EQ(environmentLanguage(), "en");
  setenv("LANG", "de_DE.UTF-8", 1);
  EXPECT_EQ(environmentLanguage(), "de_DE.UTF-8");
  setenv("LC_MESSAGES", "it", 1);
  EXPECT_EQ(environmentLanguage(), "it");
  setenv("LC_ALL", "es", 1);
  EXPECT_EQ(environmentLanguage(), "es");
  setenv("EKORA_LOCALE", "fr", 1);
  EXPECT_EQ(environmentLanguage(), "fr");
  setenv("EKORA_LOCALE", "", 1);
  EXPECT_EQ(environmentLanguage(), "es");
  unsetenv("EKORA_LOCALE");
  unsetenv("LC_ALL");
  unsetenv("LC_MESSAGES");
  unsetenv("LANG");
}

}  // namespace
}  // namespace ek::vantor
