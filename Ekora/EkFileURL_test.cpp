#include "Ekora/EkFileURL.h"

#include <gtest/gtest.h>

#include <string>

namespace ek {
namespace {

// Paths and the URLs written for them; each URL reads back to its path.
TEST(EkFileURL, PathsAndURLsRoundTripWithPercentEncoding) {
  std::string every = "/";
  for (int byte = 1; byte < 256; ++byte) every += byte == '/' ? '_' : static_cast<char>(byte);
  const std::pair<std::string, std::string> rows[] = {
      {"/", "file:///"},
      {"/opt/My App.app/B.appex/", "file:///opt/My%20App.app/B.appex"},
      {"/x/100%?#", "file:///x/100%25%3F%23"},
      {"/\xc3\xbc[]\\\"<>{}|^`\t", "file:///%C3%BC%5B%5D%5C%22%3C%3E%7B%7D%7C%5E%60%09"},
      {every, fileURLFromPath(every).value()},
  };
  for (const auto& [path, url] : rows) {
    EXPECT_EQ(fileURLFromPath(path).value(), url) << path;
    EXPECT_EQ(EkFileURL::parse(url).value(), EkFileURL::fromPath(path).value()) << url;
  }
  for (const char* other : {"FILE:///x", "file://LocalHost/x", "file:/x", "file:///x/"}) {
    EXPECT_EQ(pathFromFileURL(other).value(), "/x") << other;
  }
  EXPECT_EQ(pathFromFileURL("file:///%c3%bc b").value(), "/\xc3\xbc b");
  // Refused: relative paths, and URLs naming no local file.
  for (const std::string& path : {std::string(""), std::string("./x"), std::string("/a\0b", 4)}) {
    EXPECT_EQ(EkFileURL::fromPath(path).error().domain, kFormatErrorDomain) << path;
  }
  for (const std::string& url :
       {std::string(""), std::string("/plain/path"), std::string("http://host/x"),
        std::string("files:///x"), std::string("file://server/x"), std::string("file:relative"),
        std::string("file://localhost"), std::string("file:///a%2"), std::string("file:///a%zz"),
        std::string("file:///a%00b"), std::string("file:///a?query"), std::string("file:///a#f"),
        std::string("file:///a\0b", 11)}) {
    EXPECT_EQ(EkFileURL::parse(url).error().domain, kFormatErrorDomain) << url;
  }
}

}  // namespace
}  // namespace ek
