#include "platform/dmap/Dmap.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cmath>
#include <filesystem>
#include <limits>

#include "platform/testing/Files.h"

namespace ek::dmap {
namespace {

using ek::testing::TempDir;
using ek::testing::writeFile;

std::string document(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n" +
         std::string(body) + "\n</dmap>\n";
}

std::string repeat(std::string_view text, size_t times) {
  std::string all;
  for (size_t i = 0; i < times; ++i) all += text;
  return all;
}

Value nestedArrays(size_t depth) {
  Value deep = Value(Array{});
  for (size_t i = 1; i < depth; ++i) deep = Value(Array{std::move(deep)});
  return deep;
}

TEST(Dmap, WritesTheExactFormAndReadsItBack) {
  const Dictionary dict{{"b", Array{1, Dictionary{}}}, {"a", "x&y"}, {"c", Array{}}};
  EXPECT_EQ(write(Value(dict)).value(),
            document("<dict>\n\t<key>a</key>\n\t<string>x&amp;y</string>\n\t<key>b</key>\n"
                     "\t<array>\n\t\t<integer>1</integer>\n\t\t<dict/>\n\t</array>\n"
                     "\t<key>c</key>\n\t<array/>\n</dict>"));
  const struct {
    Value value;
    std::string element;
  } rows[] = {
      {"a < \" ' ]]> \t\n\xe2\x82\xac", "<string>a &lt; \" ' ]]&gt; \t\n\xe2\x82\xac</string>"},
      {Data{'h', 'i', '!'}, "<data>aGkh</data>"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(write(row.value).value(), document(row.element));
    EXPECT_EQ(parse(document(row.element)).value(), row.value);
  }
  EXPECT_EQ(write(Value(Date{1700000000.75})).value(),
            document("<date>2023-11-14T22:13:20Z</date>"));
  EXPECT_EQ(parse(write(nestedArrays(kMaxDepth)).value()).value(), nestedArrays(kMaxDepth));
}

TEST(Dmap, WriteAndItsCheckRefuseWhatTheFormatCannotCarry) {
  for (const Value& value :
       {Value(std::string("nul\0", 4)), Value("bell\x07"), Value("\xff"), Value("\xed\xa0\x80"),
        Value("\xef\xbf\xbf"), Value(Dictionary{{"key\x01", 1}}), Value(std::nan("")),
        Value(Date{253402300800}), nestedArrays(kMaxDepth + 1)}) {
    Result<std::string> written = write(value);
    ASSERT_FALSE(written.ok()) << value.description();
    EXPECT_EQ(checkWritable(value).error(), written.error());
  }
  // Depth counts from where the value will sit.
  EXPECT_FALSE(checkWritable(nestedArrays(kMaxDepth), 1).ok());
  EXPECT_FALSE(writeEntry("key", nestedArrays(kMaxDepth - 1), 2).ok());
  EXPECT_FALSE(write(Value(std::string(kMaxFileSize, 'a'))).ok());
}

TEST(Dmap, RefusesMalformedDocumentsNamingTheLine) {
  const std::string head = "<?xml version=\"1.0\"?>\n";
  const struct {
    std::string bytes;
    std::string message;  // the start of the error message
  } rows[] = {
      {"", "line 1: empty document"},
      {document("<integer>18446744073709551616</integer>"), "line 3: "},
      {document("<dict>\n<key>x</key><true/>\n<key>x</key><false/>\n</dict>"),
       "line 5: duplicate key \"x\""},
      {head + "<!DOCTYPE dmap [<!ENTITY a \"lol\">]>\n<dmap "
              "version=\"1.0\"><string>&a;</string></dmap>",
       "line 2: "},
      {head + "<!DOCTYPE dmap [<!ENTITY x SYSTEM \"file:///etc/passwd\">]>\n<dmap "
              "version=\"1.0\"><string>&x;</string></dmap>",
       "line 2: "},
      {document(repeat("<array>", kMaxDepth + 1) + repeat("</array>", kMaxDepth + 1)),
       "line 3: nesting deeper than 512 levels"},
  };
  for (const auto& row : rows) {
    Result<Value> read = parse(row.bytes);
    ASSERT_FALSE(read.ok()) << row.bytes;
    EXPECT_EQ(read.error().domain, kFormatErrorDomain);
    EXPECT_EQ(read.error().message.rfind(row.message, 0), 0u) << read.error().message;
  }
  EXPECT_FALSE(parse(document("<string>" + std::string(kMaxFileSize, 'a') + "</string>")).ok());
  EXPECT_EQ(
      parse("<!DOCTYPE dmap>\n<dmap version=\"1.0\"><data>aGVs\n\t bG8=</data></dmap>").value(),
      Value(Data{'h', 'e', 'l', 'l', 'o'}));
}

TEST(DmapFile, ReadsWhatWasWrittenAtomicallyAndNamesTheFileOfAnError) {
  TempDir dir;
  const std::string path = dir.file("prefs.dmap");
  const Value value(Dictionary{{"k", 1}});
  writeFile(path, "old");
  ASSERT_TRUE(writeFileAtomically(path, value, 0640, Durability::RuntimeOnly).ok());
  EXPECT_EQ(readFile(path).value(), value);
  EXPECT_EQ(std::filesystem::status(path).permissions(), std::filesystem::perms(0640));
  // A failure leaves the old file and no temporary beside it.
  EXPECT_EQ(writeFileAtomically(path, Value("bad\x01")).error().domain, kFormatErrorDomain);
  ASSERT_EQ(::mkdir(dir.file("dir").c_str(), 0700), 0);
  writeFile(dir.file("dir/child"), "");
  EXPECT_EQ(writeBytesAtomically(dir.file("dir"), "x").error().domain, kPosixErrorDomain);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()), {}), 2);
  EXPECT_EQ(readFile(path).value(), value);

  writeFile(path, document("<dict>\n<key>a</key><true/>\n<key>a</key><true/>\n</dict>"));
  EXPECT_EQ(readFile(path).error().message, path + ": line 5: duplicate key \"a\"");
  EXPECT_TRUE(readFile(dir.file("absent")).error().isPosix(ENOENT));
  ASSERT_EQ(::mkfifo(dir.file("fifo").c_str(), 0600), 0);
  EXPECT_EQ(readFile(dir.file("fifo")).error().domain, kFormatErrorDomain);  // without blocking
  ASSERT_EQ(::truncate(path.c_str(), static_cast<off_t>(kMaxFileSize) + 1), 0);
  EXPECT_TRUE(readFile(path).error().isPosix(EFBIG));
}

// What a hostile bundle may hold: links out and in, "..", a FIFO, a directory, a file over the
// bundle limit; each read beneath it is refused naming the file and the reason.
TEST(DmapFile, ReadsBeneathADirectoryOnly) {
  TempDir dir;
  const std::string secret = dir.file("secret.dmap"), bundle = dir.file("B.appex");
  writeFile(secret, document("<string>secret</string>"));
  writeFile(bundle + "/Info.dmap", document("<string>own</string>"));
  writeFile(bundle + "/Big.dmap",
            document("<string>" + std::string(kMaxBundleFileSize, 'a') + "</string>"));
  ASSERT_EQ(::symlink(secret.c_str(), (bundle + "/Out.dmap").c_str()), 0);
  ASSERT_EQ(::mkfifo((bundle + "/Fifo.dmap").c_str(), 0600), 0);
  const struct {
    std::string relative;
    int code;  // 1: a format error
    std::string reason;
  } rows[] = {
      {"Out.dmap", EXDEV, "leads out of"},
      {"../B.appex/Info.dmap", EXDEV, "leads out of"},
      {secret, EXDEV, "not a path beneath"},
      {"Fifo.dmap", 1, "not a regular file"},
      {"Big.dmap", EFBIG, "exceeds the limit of 1048576"},
  };
  for (const auto& row : rows) {
    Result<Value> read = readFileBeneath(bundle, row.relative);
    ASSERT_FALSE(read.ok()) << row.relative;
    EXPECT_EQ(read.error().domain, row.code == 1 ? kFormatErrorDomain : kPosixErrorDomain);
    EXPECT_EQ(read.error().code, row.code) << read.error().message;
    EXPECT_NE(read.error().message.find(row.reason), std::string::npos) << read.error().message;
    EXPECT_EQ(read.error().message.find("secret</string>"), std::string::npos);
  }
}

}  // namespace
}  // namespace ek::dmap
