#include "Ekora/EkFileURL.h"

#include <gtest/gtest.h>

#include <string>

namespace ek {
namespace {

struct PathCase {
  std::string path;
  std::string url;
};

TEST(EkFileURL, WritesPercentEncodedFileURL) {
  const PathCase cases[] = {
      {"/", "file:///"},
      {"/opt/My App.app/PlugIns/Thumbs.appex", "file:///opt/My%20App.app/PlugIns/Thumbs.appex"},
      {"/a/B.appex/", "file:///a/B.appex"},
      {"/a/B.appex///", "file:///a/B.appex"},
      {"/x/100%", "file:///x/100%25"},
      {"/a?b#c", "file:///a%3Fb%23c"},
      {"/\xc3\xbc", "file:///%C3%BC"},
      {"/a:b@c!$&'()*+,;=-._~", "file:///a:b@c!$&'()*+,;=-._~"},
      {"/a[b]\\\"<>{}|^`", "file:///a%5Bb%5D%5C%22%3C%3E%7B%7D%7C%5E%60"},
      {"/tab\there\n", "file:///tab%09here%0A"},
  };
  for (const PathCase& c : cases) {
    Result<std::string> url = fileURLFromPath(c.path);
    ASSERT_TRUE(url.ok()) << c.path;
    EXPECT_EQ(*url, c.url) << c.path;
  }
}

TEST(EkFileURL, RefusesPathsThatAreNotAbsolute) {
  const std::string paths[] = {"", "relative/path", "./x", "~/x", std::string("/a\0b", 4)};
  for (const std::string& path : paths) {
    Result<EkFileURL> url = EkFileURL::fromPath(path);
    ASSERT_FALSE(url.ok()) << path;
    EXPECT_EQ(url.error().domain, kFormatErrorDomain);
  }
}

TEST(EkFileURL, ParsesFileURLs) {
  const PathCase cases[] = {
      {"/opt/My App.app", "file:///opt/My%20App.app"},
      {"/x", "FILE:///x"},
      {"/x", "File:///x"},
      {"/x", "file://localhost/x"},
      {"/x", "file://LocalHost/x"},
      {"/x", "file:/x"},
      {"/a/B.appex", "file:///a/B.appex/"},
      {"/\xc3\xbc", "file:///%c3%bc"},
      {"/", "file:///"},
      {"/a b", "file:///a b"},
      {"/%", "file:///%25"},
  };
  for (const PathCase& c : cases) {
    Result<std::string> path = pathFromFileURL(c.url);
    ASSERT_TRUE(path.ok()) << c.url;
    EXPECT_EQ(*path, c.path) << c.url;
  }
}

TEST(EkFileURL, RefusesOtherURLs) {
  const std::string urls[] = {
      "",
      "/plain/path",
      "http://host/x",
      "files:///x",
      "fil:///x",
      "file://server/x",
      "file:relative",
      "file://",
      "file://localhost",
      "file:///a%2",
      "file:///a%",
      "file:///a%zz",
      "file:///a%00b",
      "file:///a?query",
      "file:///a#fragment",
      std::string("file:///a\0b", 11),
  };
  for (const std::string& url : urls) {
    Result<EkFileURL> parsed = EkFileURL::parse(url);
    ASSERT_FALSE(parsed.ok()) << url;
    EXPECT_EQ(parsed.error().domain, kFormatErrorDomain) << url;
  }
}

TEST(EkFileURL, EveryByteSurvivesTheRoundTrip) {
  std::string path = "/";
  for (int byte = 1; byte < 256; ++byte) {
    if (byte != '/') path.push_back(static_cast<char>(byte));
  }
  Result<EkFileURL> url = EkFileURL::fromPath(path);
  ASSERT_TRUE(url.ok());
  Result<EkFileURL> parsed = EkFileURL::parse(url->string());
  ASSERT_TRUE(parsed.ok());
  EXPECT_EQ(parsed->path(), path);
  EXPECT_EQ(*parsed, *url);
}

TEST(EkFileURL, TrailingSlashNamesTheSameBundle) {
  Result<EkFileURL> plain = EkFileURL::parse("file:///apps/A.app/PlugIns/B.appex");
  Result<EkFileURL> slashed = EkFileURL::parse("file:///apps/A.app/PlugIns/B.appex/");
  ASSERT_TRUE(plain.ok() && slashed.ok());
  EXPECT_EQ(*plain, *slashed);
  EXPECT_EQ(slashed->path(), "/apps/A.app/PlugIns/B.appex");
}

}  // namespace
}  // namespace ek
