#include "platform/dmap/Dmap.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>

#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

namespace ek::dmap {
namespace {

std::string document(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n" +
         std::string(body) + "\n</dmap>\n";
}

std::string nested(size_t depth, std::string_view open, std::string_view close,
                   std::string_view inner = "") {
  std::string text;
  for (size_t i = 0; i < depth; ++i) text += open;
  text += inner;
  for (size_t i = 0; i < depth; ++i) text += close;
  return text;
}

Value mustParse(std::string_view bytes) {
  Result<Value> value = parse(bytes);
  EXPECT_TRUE(value.ok()) << (value.ok() ? "" : value.error().message) << "\n" << bytes;
  return value.ok() ? std::move(value).value() : Value();
}

class TempDir {
 public:
  TempDir() {
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base != nullptr ? base : "/tmp") + "/dmap-test-XXXXXX";
    path_ = ::mkdtemp(pattern.data());
  }
  ~TempDir() {
    ::chmod(path_.c_str(), 0700);
    std::system(("rm -rf '" + path_ + "'").c_str());
  }
  const std::string& path() const { return path_; }
  std::string file(std::string_view name) const { return path_ + "/" + std::string(name); }
  std::vector<std::string> entries() const {
    std::vector<std::string> names;
    DIR* dir = ::opendir(path_.c_str());
    if (dir == nullptr) return names;
    while (dirent* entry = ::readdir(dir)) {
      const std::string name = entry->d_name;
      if (name != "." && name != "..") names.push_back(name);
    }
    ::closedir(dir);
    return names;
  }

 private:
  std::string path_;
};

std::string slurp(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

void spit(const std::string& path, std::string_view bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

// ---------------------------------------------------------------------------------------------
// Round trips

TEST(Dmap, RoundTripsEveryTypeAndNesting) {
  const Data bytes256 = [] {
    Data data;
    for (int i = 0; i < 256; ++i) data.push_back(static_cast<uint8_t>(i));
    return data;
  }();
  const std::vector<Value> values = {
      Value(""),
      Value("plain"),
      Value("a & b < c > d \" e ' f ]]> g"),
      Value("tab\tnewline\ncarriage\rreturn\r\nend"),
      Value("  leading and trailing spaces  "),
      Value("\xc3\xa9t\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80 \xc2\x85"),
      Value(0),
      Value(1),
      Value(std::numeric_limits<int64_t>::max()),
      Value(std::numeric_limits<uint64_t>::max()),
      Value(-1),
      Value(std::numeric_limits<int64_t>::min()),
      Value(0.0),
      Value(1.0),
      Value(-2.5),
      Value(0.1),
      Value(1e300),
      Value(-1.7976931348623157e308),
      Value(5e-324),
      Value(123456789.123456789),
      Value(true),
      Value(false),
      Value(Data{}),
      Value(Data{0x01}),
      Value(Data{0x01, 0x02}),
      Value(Data{0x01, 0x02, 0x03}),
      Value(bytes256),
      Value(Date{0}),
      Value(Date{-86400}),
      Value(Date{1700000000}),
      Value(Date{253402300799}),  // 9999-12-31T23:59:59Z
      Value(Date{-62135596800}),  // 0001-01-01T00:00:00Z
      Value(Array{}),
      Value(Dictionary{}),
      Value(Array{Value(1), Value("two"), Value(Array{Value(3.5), Value(Dictionary{})})}),
      Value(Dictionary{
          {"", Value("empty key")},
          {"a<&>\"'", Value(Array{Value(true), Value(Data{0xff})})},
          {"nested", Value(Dictionary{{"deeper", Value(Dictionary{{"x", Value(-5)}})}})},
          {"when", Value(Date{86399})},
      }),
  };
  for (const Value& value : values) {
    Result<std::string> written = write(value);
    ASSERT_TRUE(written.ok()) << value.description() << ": " << written.error().message;
    Result<Value> read = parse(*written);
    ASSERT_TRUE(read.ok()) << *written << "\n" << read.error().message;
    EXPECT_EQ(*read, value) << *written;
  }
}

TEST(Dmap, WritesTheExactFormIndentedWithTabs) {
  const Value value(Dictionary{
      {"b", Value(Array{Value(1), Value(Dictionary{})})},
      {"a", Value("x&y")},
      {"c", Value(Array{})},
      {"d", Value(Dictionary{{"r", Value(1.0)}, {"t", Value(true)}})},
  });
  const std::string expected =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<dmap version=\"1.0\">\n"
      "<dict>\n"
      "\t<key>a</key>\n"
      "\t<string>x&amp;y</string>\n"
      "\t<key>b</key>\n"
      "\t<array>\n"
      "\t\t<integer>1</integer>\n"
      "\t\t<dict/>\n"
      "\t</array>\n"
      "\t<key>c</key>\n"
      "\t<array/>\n"
      "\t<key>d</key>\n"
      "\t<dict>\n"
      "\t\t<key>r</key>\n"
      "\t\t<real>1</real>\n"
      "\t\t<key>t</key>\n"
      "\t\t<true/>\n"
      "\t</dict>\n"
      "</dict>\n"
      "</dmap>\n";
  Result<std::string> written = write(value);
  ASSERT_TRUE(written.ok());
  EXPECT_EQ(*written, expected);
}

TEST(Dmap, WritesScalarsInTheirDocumentedForm) {
  struct Case {
    Value value;
    std::string element;
  };
  const std::vector<Case> cases = {
      {Value(-42), "<integer>-42</integer>"},
      {Value(0.5), "<real>0.5</real>"},
      {Value(false), "<false/>"},
      {Value(Data{'h', 'i', '!'}), "<data>aGkh</data>"},
      {Value(Date{1700000000.75}), "<date>2023-11-14T22:13:20Z</date>"},
      {Value(Date{-0.5}), "<date>1969-12-31T23:59:59Z</date>"},
      {Value(*Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f")),
       "<string>E621E1F8-C36C-495A-93FC-0C247A3E6E5F</string>"},
      {Value("\r"), "<string>&#13;</string>"},
  };
  for (const Case& c : cases) {
    Result<std::string> written = write(c.value);
    ASSERT_TRUE(written.ok()) << c.element;
    EXPECT_EQ(*written, document(c.element)) << c.element;
  }
}

TEST(Dmap, WriteRefusesValuesTheFormatCannotCarry) {
  Value deep = Value(Array{});
  for (size_t i = 1; i < kMaxDepth + 1; ++i) deep = Value(Array{std::move(deep)});
  const std::vector<Value> values = {
      Value(std::string("nul\0byte", 8)),
      Value("bell\x07"),
      Value("form\x0c"
            "feed"),
      Value("\xff\xfe"),
      Value("truncated \xe2\x82"),
      Value("overlong \xc0\xaf"),
      Value("surrogate \xed\xa0\x80"),
      Value("nonchar \xef\xbf\xbf"),
      Value(Dictionary{{"key\x01", Value(1)}}),
      Value(std::nan("")),
      Value(std::numeric_limits<double>::infinity()),
      Value(Date{std::numeric_limits<double>::infinity()}),
      Value(Date{253402300800}),  // 10000-01-01
      Value(Date{-62135596801}),  // before year 0001
      deep,                       // kMaxDepth + 1 nested arrays
  };
  for (const Value& value : values) {
    Result<std::string> written = write(value);
    ASSERT_FALSE(written.ok()) << value.description();
    EXPECT_EQ(written.error().domain, kFormatErrorDomain);
    // The check refuses what the writer refuses, with the same error, wherever it sits.
    Result<void> checked = checkWritable(value);
    ASSERT_FALSE(checked.ok()) << value.description();
    EXPECT_EQ(checked.error(), written.error());
    EXPECT_FALSE(checkWritable(Value(Dictionary{{"k", Value(Array{value})}})).ok());
  }
  // Depth counts where the value will sit: the deepest that fits at the root is one too deep
  // a level further down.
  const Value fits = deep.array()->front();
  EXPECT_TRUE(checkWritable(fits).ok());
  EXPECT_TRUE(write(fits).ok());
  EXPECT_FALSE(checkWritable(fits, 1).ok());
  EXPECT_FALSE(checkWritable(Value(Dictionary{{"k", fits}})).ok());
  EXPECT_TRUE(checkWritable(Value("tab\tline\nreturn\r & <escaped>"), kMaxDepth).ok());
}

TEST(Dmap, WriteRefusesDocumentsOverTheSizeLimit) {
  const Value big(
      Array{Value(std::string(kMaxFileSize / 2, 'a')), Value(std::string(kMaxFileSize / 2, 'b'))});
  Result<std::string> written = write(big);
  ASSERT_FALSE(written.ok());
  EXPECT_EQ(written.error().domain, kFormatErrorDomain);
  EXPECT_TRUE(write(Value(std::string(kMaxFileSize / 2, 'a'))).ok());
}

TEST(Dmap, AssembledDocumentIsWhatWriteGives) {
  const std::vector<Dictionary> tables = {
      {},
      {{"com.example.one", Value(Dictionary{{"election", Value(1)}})}},
      {{"a&b", Value(Dictionary{{"x<y", Value("tab\there")}, {"n", Value(Array{})}})},
       {"com.example.two",
        Value(Dictionary{{"extension", Value(Dictionary{{"deep", Value(Array{Value(2.5)})}})}})},
       {"empty", Value(Dictionary{})},
       {"z", Value(true)}},
  };
  for (const Dictionary& table : tables) {
    std::vector<std::string> texts;
    for (const auto& [key, value] : table) {
      Result<std::string> entry = writeEntry(key, value, 2);
      ASSERT_TRUE(entry.ok()) << key;
      texts.push_back(std::move(entry).value());
    }
    std::vector<const std::string*> entries;
    for (const std::string& text : texts) entries.push_back(&text);
    const Dictionary root{{"data", Value(Dictionary{})}, {"version", Value(16)}};
    Result<std::string> assembled = writeAssembled(root, "data", entries);
    ASSERT_TRUE(assembled.ok());
    Dictionary whole = root;
    whole["data"] = Value(table);
    EXPECT_EQ(*assembled, write(Value(whole)).value()) << table.size() << " entries";
  }
}

TEST(Dmap, EntriesAreHeldToTheRulesOfWrite) {
  EXPECT_FALSE(writeEntry("bad\x01key", Value(1), 2).ok());
  EXPECT_FALSE(writeEntry("key", Value("\xff"), 2).ok());
  EXPECT_FALSE(writeEntry("key", Value(1), 0).ok());
  // The level counts towards the nesting limit as it would inside the document.
  Value deep = Value(Array{});
  for (size_t i = 1; i < kMaxDepth - 2; ++i) deep = Value(Array{std::move(deep)});
  EXPECT_TRUE(writeEntry("key", deep, 2).ok());
  EXPECT_FALSE(writeEntry("key", Value(Array{deep}), 2).ok());
  const std::string big(kMaxFileSize / 2 + 1, 'a');
  const std::vector<const std::string*> entries = {&big, &big};
  EXPECT_FALSE(writeAssembled({{"data", Value(Dictionary{})}}, "data", entries).ok());
}

// ---------------------------------------------------------------------------------------------
// Reading

TEST(Dmap, ParsesElementsIntoValues) {
  struct Case {
    std::string body;
    Value expected;
  };
  const std::vector<Case> cases = {
      {"<string>&lt;&gt;&amp;&quot;&apos;&#65;&#x42;&#xe9;</string>", Value("<>&\"'AB\xc3\xa9")},
      {"<string><![CDATA[<raw> & ]]></string>", Value("<raw> & ")},
      {"<string>a<!-- comment -->b</string>", Value("ab")},
      {"<string/>", Value("")},
      {"<integer> 17 </integer>", Value(17)},
      {"<integer>-0</integer>", Value(0)},
      {"<integer>007</integer>", Value(7)},
      {"<real>1</real>", Value(1.0)},
      {"<real>-1.5e3</real>", Value(-1500.0)},
      {"<real>.5</real>", Value(0.5)},
      {"<real>5.</real>", Value(5.0)},
      {"<real>1e-400</real>", Value(0.0)},
      {"<true></true>", Value(true)},
      {"<false/>", Value(false)},
      {"<date>1970-01-01T00:00:00Z</date>", Value(Date{0})},
      {"<date>2000-02-29T12:34:56Z</date>", Value(Date{951827696})},
      {"<date>1969-12-31T23:59:59Z</date>", Value(Date{-1})},
      {"<data>aGVs\n\t bG8=\r\n</data>", Value(Data{'h', 'e', 'l', 'l', 'o'})},
      {"<data>aGk=</data>", Value(Data{'h', 'i'})},
      {"<data>aA==</data>", Value(Data{'h'})},
      {"<data></data>", Value(Data{})},
      {"<array>\n<integer>1</integer>\n<array/>\n</array>", Value(Array{Value(1), Value(Array{})})},
      {"<dict><key>k</key><dict><key>a</key><string>b</string></dict></dict>",
       Value(Dictionary{{"k", Value(Dictionary{{"a", Value("b")}})}})},
      {"<dict><key/><false/></dict>", Value(Dictionary{{"", Value(false)}})},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(mustParse(document(c.body)), c.expected) << c.body;
  }
}

TEST(Dmap, IntegerEdgeValues) {
  struct Case {
    std::string text;
    std::optional<Value> expected;  // absent: refused
  };
  const std::vector<Case> cases = {
      {"-9223372036854775808", Value(std::numeric_limits<int64_t>::min())},
      {"-9223372036854775809", std::nullopt},
      {"9223372036854775807", Value(std::numeric_limits<int64_t>::max())},
      {"9223372036854775808", Value(uint64_t{1} << 63)},
      {"18446744073709551615", Value(std::numeric_limits<uint64_t>::max())},
      {"18446744073709551616", std::nullopt},
      {"99999999999999999999999", std::nullopt},
      {"", std::nullopt},
      {"-", std::nullopt},
      {"+1", std::nullopt},
      {"1.0", std::nullopt},
      {"0x10", std::nullopt},
      {"1 2", std::nullopt},
  };
  for (const Case& c : cases) {
    Result<Value> read = parse(document("<integer>" + c.text + "</integer>"));
    if (c.expected) {
      ASSERT_TRUE(read.ok()) << c.text << ": " << read.error().message;
      EXPECT_EQ(*read, *c.expected) << c.text;
      EXPECT_EQ(read->type(), c.expected->type()) << c.text;
    } else {
      ASSERT_FALSE(read.ok()) << c.text;
      EXPECT_EQ(read.error().domain, kFormatErrorDomain);
      EXPECT_NE(read.error().message.find("line 3: "), std::string::npos) << read.error().message;
    }
  }
}

TEST(Dmap, RefusesInvalidDatesAndReals) {
  const std::vector<std::string> bodies = {
      "<date>2023-02-29T00:00:00Z</date>",  // not a leap year
      "<date>1900-02-29T00:00:00Z</date>",  // not a leap year either
      "<date>2023-13-01T00:00:00Z</date>",
      "<date>2023-00-01T00:00:00Z</date>",
      "<date>2023-04-31T00:00:00Z</date>",
      "<date>2023-01-00T00:00:00Z</date>",
      "<date>2023-01-01T24:00:00Z</date>",
      "<date>2023-01-01T00:60:00Z</date>",
      "<date>2023-01-01T00:00:60Z</date>",
      "<date>2023-01-01T00:00:00</date>",
      "<date>2023-01-01 00:00:00Z</date>",
      "<date>2023-1-01T00:00:00Z</date>",
      "<date>12023-01-01T00:00:00Z</date>",
      "<date>0000-12-31T23:59:59Z</date>",  // before the first year a writer can give
      "<date></date>",
      "<real>nan</real>",
      "<real>inf</real>",
      "<real>0x1p3</real>",
      "<real>1e</real>",
      "<real>.</real>",
      "<real></real>",
      "<real>1e400</real>",
      "<real>-1e400</real>",
      "<data>aGk</data>",
      "<data>a===</data>",
      "<data>aG=k</data>",
      "<data>a!==</data>",
  };
  for (const std::string& body : bodies) {
    Result<Value> read = parse(document(body));
    ASSERT_FALSE(read.ok()) << body;
    EXPECT_EQ(read.error().domain, kFormatErrorDomain);
    EXPECT_EQ(read.error().message.rfind("line 3: ", 0), 0u) << read.error().message;
  }
}

TEST(Dmap, RefusesMalformedDocumentsNamingTheLine) {
  struct Case {
    std::string bytes;
    std::string message;  // the start of the error message
  };
  const std::string head = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
  const std::vector<Case> cases = {
      {"", "line 1: empty document"},
      {" \n\t", "line 1: empty document"},
      {head + "<plist version=\"1.0\"><true/></plist>", "line 2: root element <plist>"},
      {head + "<dmap version=\"1.0\">\n<dict>\n<key>x</key><true/>\n<key>x</key><false/>\n"
              "</dict>\n</dmap>",
       "line 5: duplicate key \"x\""},
      {head + "<dmap version=\"1.0\">\n<array>\n<bogus/>\n</array>\n</dmap>",
       "line 4: unknown element <bogus>"},
      {head + "<dmap>\n<true/>\n</dmap>", "line 2: <dmap> has no version"},
      {head + "<dmap version=\"2.0\"><true/></dmap>", "line 2: unsupported dmap version"},
      {head + "<dmap version=\"1.0\" extra=\"1\"><true/></dmap>", "line 2: unknown attribute"},
      {head + "<dmap version=\"1.0\">\n<string lang=\"en\">x</string></dmap>",
       "line 3: unknown attribute \"lang\" on <string>"},
      {head + "<dmap version=\"1.0\">\n<dict>\n<key>a</key>\n</dict>\n</dmap>",
       "line 3: key \"a\" has no value"},
      {head + "<dmap version=\"1.0\">\n<dict>\n<key>a</key>\n<key>b</key><true/></dict></dmap>",
       "line 5: key \"a\" has no value"},
      {head + "<dmap version=\"1.0\">\n<dict>\n<true/>\n</dict>\n</dmap>",
       "line 4: <true> in a dictionary without a key"},
      {head + "<dmap version=\"1.0\">\n<array><key>a</key></array></dmap>",
       "line 3: <key> outside a dictionary"},
      {head + "<dmap version=\"1.0\">\n<true/>\n<false/>\n</dmap>",
       "line 4: more than one value in <dmap>"},
      {head + "<dmap version=\"1.0\">\n</dmap>", "line 2: <dmap> holds no value"},
      {head + "<dmap version=\"1.0\">\nstray<true/></dmap>", "line 3: text outside a value"},
      {head + "<dmap version=\"1.0\">\n<array>\n<true/>stray</array></dmap>",
       "line 4: text outside a value"},
      {head + "<dmap version=\"1.0\">\n<true>yes</true></dmap>", "line 3: text inside <true/>"},
      {head + "<dmap version=\"1.0\">\n<string>a<b/></string></dmap>",
       "line 3: unknown element <b>"},
      {head + "<dmap version=\"1.0\">\n<string>a<true/></string></dmap>",
       "line 3: <true> inside <string>"},
      {head + "<dmap version=\"1.0\">\n<string>&nbsp;</string></dmap>", "line 3: "},
      {head + "<dmap version=\"1.0\">\n<string>&#1;</string></dmap>", "line 3: "},
      {head + "<dmap version=\"1.0\">\n<dmap version=\"1.0\"/></dmap>",
       "line 3: unknown element <dmap>"},
      {head + "<dmap version=\"1.0\"><true/></dmap>\n<dmap version=\"1.0\"/>", "line 3: "},
      {head + "<dmap version=\"1.0\">\n<string>unclosed</dmap>", "line 3: "},
      {"<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?>\n<dmap version=\"1.0\"><true/></dmap>",
       "line 1: unsupported encoding"},
      {head + "<dmap version=\"1.0\">\n<string>\xff</string></dmap>", "line 3: "},
  };
  for (const Case& c : cases) {
    Result<Value> read = parse(c.bytes);
    ASSERT_FALSE(read.ok()) << c.bytes;
    EXPECT_EQ(read.error().domain, kFormatErrorDomain) << c.bytes;
    EXPECT_EQ(read.error().message.rfind(c.message, 0), 0u)
        << "expected \"" << c.message << "\" got \"" << read.error().message << "\"";
  }
}

TEST(Dmap, RefusesEntityDeclarationsAndExternalReferences) {
  const std::vector<std::string> documents = {
      // Billion laughs.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE dmap [\n<!ENTITY a \"lol\">\n"
      "<!ENTITY b \"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\">\n"
      "<!ENTITY c \"&b;&b;&b;&b;&b;&b;&b;&b;&b;&b;\">\n]>\n"
      "<dmap version=\"1.0\"><string>&c;</string></dmap>",
      // External entity: never fetched.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE dmap [<!ENTITY x SYSTEM \"file:///etc/passwd\">]>\n"
      "<dmap version=\"1.0\"><string>&x;</string></dmap>",
      // Parameter entity pointing outside.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE dmap [<!ENTITY % p SYSTEM \"http://example.invalid/\">"
      "%p;]>\n<dmap version=\"1.0\"><true/></dmap>",
      // External DTD subset.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE dmap SYSTEM \"dmap.dtd\">\n"
      "<dmap version=\"1.0\"><string>&x;</string></dmap>",
      // An internal subset without entities is refused as well.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE dmap [<!ELEMENT dmap ANY>]>\n"
      "<dmap version=\"1.0\"><true/></dmap>",
      // A DOCTYPE for another root.
      "<?xml version=\"1.0\"?>\n<!DOCTYPE plist>\n<dmap version=\"1.0\"><true/></dmap>",
  };
  for (const std::string& bytes : documents) {
    Result<Value> read = parse(bytes);
    ASSERT_FALSE(read.ok()) << bytes;
    EXPECT_EQ(read.error().domain, kFormatErrorDomain);
    EXPECT_EQ(read.error().message.rfind("line 2: ", 0), 0u) << read.error().message;
  }
}

TEST(Dmap, AcceptsABareDoctype) {
  EXPECT_EQ(
      mustParse("<?xml version=\"1.0\"?>\n<!DOCTYPE dmap>\n<dmap version=\"1.0\"><true/></dmap>"),
      Value(true));
}

TEST(Dmap, NestingIsLimitedTo512Levels) {
  for (const auto& [open, close, inner] :
       {std::tuple<std::string, std::string, std::string>{"<array>", "</array>", ""},
        {"<array>", "</array>", "<string>leaf</string>"},
        {"<dict><key>k</key>", "</dict>", "<true/>"}}) {
    Result<Value> limit = parse(document(nested(kMaxDepth, open, close, inner)));
    ASSERT_TRUE(limit.ok()) << open << ": " << limit.error().message;
    Result<std::string> rewritten = write(*limit);
    ASSERT_TRUE(rewritten.ok()) << rewritten.error().message;
    EXPECT_EQ(mustParse(*rewritten), *limit);

    Result<Value> deeper = parse(document(nested(kMaxDepth + 1, open, close, inner)));
    ASSERT_FALSE(deeper.ok()) << open;
    EXPECT_EQ(deeper.error().message, "line 3: nesting deeper than 512 levels");
  }
}

TEST(Dmap, RefusesOversizedInput) {
  std::string huge = document("<string>" + std::string(kMaxFileSize, 'a') + "</string>");
  Result<Value> read = parse(huge);
  ASSERT_FALSE(read.ok());
  EXPECT_EQ(read.error().domain, kFormatErrorDomain);
}

// ---------------------------------------------------------------------------------------------
// Files

TEST(DmapFile, ReadsAWrittenFile) {
  TempDir dir;
  const Value value(Dictionary{{"QvBundleIdentifier", Value("com.example.viewer")}});
  ASSERT_TRUE(writeFileAtomically(dir.file("Info.dmap"), value).ok());
  Result<Value> read = readFile(dir.file("Info.dmap"));
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(*read, value);
}

TEST(DmapFile, MissingFileIsENOENT) {
  TempDir dir;
  Result<Value> read = readFile(dir.file("absent.dmap"));
  ASSERT_FALSE(read.ok());
  EXPECT_TRUE(read.error().isPosix(ENOENT)) << read.error().message;
}

TEST(DmapFile, ContentErrorsNameTheFileAndLine) {
  TempDir dir;
  const std::string path = dir.file("broken.dmap");
  spit(path, document("<dict>\n<key>a</key><true/>\n<key>a</key><true/>\n</dict>"));
  Result<Value> read = readFile(path);
  ASSERT_FALSE(read.ok());
  EXPECT_EQ(read.error().domain, kFormatErrorDomain);
  EXPECT_EQ(read.error().message, path + ": line 5: duplicate key \"a\"");
}

TEST(DmapFile, RefusesDirectoriesAndFifosWithoutBlocking) {
  TempDir dir;
  const std::string fifo = dir.file("fifo");
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  for (const std::string& path : {dir.path(), fifo}) {
    Result<Value> read = readFile(path);
    ASSERT_FALSE(read.ok()) << path;
    EXPECT_EQ(read.error().domain, kFormatErrorDomain) << read.error().message;
  }
}

// A bundle directory holding what a hostile bundle may: links out and in, "..", a FIFO, a
// directory and a file just over the bundle limit; each read beneath it either succeeds or is
// refused with the file named and the reason.
TEST(DmapFile, ReadsBeneathADirectoryOnly) {
  TempDir outside;
  const std::string secret = outside.file("secret.dmap");
  spit(secret, document("<string>secret</string>"));
  TempDir dir;
  const std::string bundle = dir.file("B.appex");
  ASSERT_EQ(::mkdir(bundle.c_str(), 0700), 0);
  ASSERT_EQ(::mkdir((bundle + "/en.lproj").c_str(), 0700), 0);
  spit(bundle + "/Info.dmap", document("<string>own</string>"));
  ASSERT_EQ(::symlink(secret.c_str(), (bundle + "/Out.dmap").c_str()), 0);
  ASSERT_EQ(::symlink("Info.dmap", (bundle + "/In.dmap").c_str()), 0);
  ASSERT_EQ(::symlink("/proc/self/root/etc/hostname", (bundle + "/Magic.dmap").c_str()), 0);
  ASSERT_EQ(::mkfifo((bundle + "/Fifo.dmap").c_str(), 0600), 0);
  spit(bundle + "/Big.dmap",
       document("<string>" + std::string(kMaxBundleFileSize, 'a') + "</string>"));

  struct Case {
    std::string relative;
    std::string domain;  // empty: read
    int code;
    std::string reason;
  };
  const std::vector<Case> cases{
      {"Info.dmap", "", 0, ""},
      {"In.dmap", "", 0, ""},
      {"Out.dmap", std::string(kPosixErrorDomain), EXDEV, "leads out of"},
      {"Magic.dmap", std::string(kPosixErrorDomain), EXDEV, "leads out of"},
      {"../B.appex/Info.dmap", std::string(kPosixErrorDomain), EXDEV, "leads out of"},
      {secret, std::string(kPosixErrorDomain), EXDEV, "not a path beneath"},
      {"Fifo.dmap", std::string(kFormatErrorDomain), 1, "not a regular file"},
      {"en.lproj", std::string(kFormatErrorDomain), 1, "not a regular file"},
      {"Big.dmap", std::string(kPosixErrorDomain), EFBIG, "exceeds the limit of 1048576"},
      {"Absent.dmap", std::string(kPosixErrorDomain), ENOENT, "Absent.dmap"},
  };
  for (const Case& test : cases) {
    Result<Value> read = readFileBeneath(bundle, test.relative);
    if (test.domain.empty()) {
      ASSERT_TRUE(read.ok()) << test.relative << ": " << read.error().message;
      EXPECT_EQ(*read, Value("own"));
      continue;
    }
    ASSERT_FALSE(read.ok()) << test.relative;
    EXPECT_EQ(read.error().domain, test.domain) << test.relative << ": " << read.error().message;
    EXPECT_EQ(read.error().code, test.code) << test.relative << ": " << read.error().message;
    EXPECT_NE(read.error().message.find(test.reason), std::string::npos) << read.error().message;
    EXPECT_EQ(read.error().message.find("secret</string>"), std::string::npos);
  }
}

TEST(DmapFile, RefusesFilesOverTheSizeLimitAsEFBIG) {
  TempDir dir;
  const std::string path = dir.file("big.dmap");
  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::ftruncate(fd, static_cast<off_t>(kMaxFileSize) + 1), 0);  // sparse
  ::close(fd);
  Result<Value> read = readFile(path);
  ASSERT_FALSE(read.ok());
  EXPECT_TRUE(read.error().isPosix(EFBIG)) << read.error().message;
}

TEST(DmapFile, AtomicWriteReplacesTheFileWithTheGivenMode) {
  TempDir dir;
  const std::string path = dir.file("prefs.dmap");
  spit(path, "old");
  ASSERT_TRUE(writeBytesAtomically(path, "new contents", 0600).ok());
  EXPECT_EQ(slurp(path), "new contents");
  struct stat status;
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_EQ(dir.entries(), std::vector<std::string>{"prefs.dmap"});
}

TEST(DmapFile, RuntimeOnlyWriteStillReplacesAtomicallyWithTheGivenMode) {
  TempDir dir;
  const std::string path = dir.file("declaration.dmap");
  spit(path, "old");
  ASSERT_TRUE(
      writeFileAtomically(path, Value(Dictionary{{"k", Value(1)}}), 0640, Durability::RuntimeOnly)
          .ok());
  Result<Value> read = readFile(path);
  ASSERT_TRUE(read.ok()) << read.error().message;
  EXPECT_EQ(*read, Value(Dictionary{{"k", Value(1)}}));
  struct stat status;
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0640u);
  EXPECT_EQ(dir.entries(), std::vector<std::string>{"declaration.dmap"});
  Result<void> missing =
      writeBytesAtomically(dir.file("missing/x.dmap"), "x", 0644, Durability::RuntimeOnly);
  ASSERT_FALSE(missing.ok());
  EXPECT_TRUE(missing.error().isPosix(ENOENT)) << missing.error().message;
}

TEST(DmapFile, AtomicWriteInAReadOnlyDirectoryKeepsTheOldFile) {
  if (::geteuid() == 0) GTEST_SKIP() << "root bypasses directory permissions";
  TempDir dir;
  const std::string path = dir.file("consent.dmap");
  spit(path, "old");
  ASSERT_EQ(::chmod(dir.path().c_str(), 0500), 0);
  Result<void> written = writeFileAtomically(path, Value(Dictionary{{"k", Value(true)}}));
  ::chmod(dir.path().c_str(), 0700);
  ASSERT_FALSE(written.ok());
  EXPECT_TRUE(written.error().isPosix(EACCES)) << written.error().message;
  EXPECT_EQ(slurp(path), "old");
  EXPECT_EQ(dir.entries(), std::vector<std::string>{"consent.dmap"});
}

TEST(DmapFile, FailedRenameRemovesTheTemporaryFile) {
  TempDir dir;
  const std::string path = dir.file("target");
  ASSERT_EQ(::mkdir(path.c_str(), 0700), 0);
  ASSERT_EQ(::mkdir((path + "/child").c_str(), 0700), 0);  // a non-empty directory
  Result<void> written = writeBytesAtomically(path, "bytes");
  ASSERT_FALSE(written.ok());
  EXPECT_EQ(written.error().domain, kPosixErrorDomain);
  EXPECT_EQ(dir.entries(), std::vector<std::string>{"target"});
}

TEST(DmapFile, AtomicWriteIntoAMissingDirectoryIsENOENT) {
  TempDir dir;
  Result<void> written = writeBytesAtomically(dir.file("missing/file.dmap"), "bytes");
  ASSERT_FALSE(written.ok());
  EXPECT_TRUE(written.error().isPosix(ENOENT)) << written.error().message;
}

TEST(DmapFile, UnwritableValueLeavesTheOldFile) {
  TempDir dir;
  const std::string path = dir.file("prefs.dmap");
  spit(path, "old");
  Result<void> written = writeFileAtomically(path, Value("bad\x01"));
  ASSERT_FALSE(written.ok());
  EXPECT_EQ(written.error().domain, kFormatErrorDomain);
  EXPECT_EQ(slurp(path), "old");
  EXPECT_EQ(dir.entries(), std::vector<std::string>{"prefs.dmap"});
}

TEST(DmapFile, StaleTemporariesOfTheTargetAloneAreRemoved) {
  TempDir dir;
  const std::string path = dir.file("Annotations");
  for (const char* name : {"Annotations", ".Annotations.a1B2c3", ".Annotations.ZZZZZZ",
                           "Annotations.bad-20260101T000000Z", ".Annotations.short",
                           ".Annotations.toolong1", ".Other.a1B2c3"}) {
    spit(dir.file(name), "x");
  }
  ASSERT_EQ(::mkdir(dir.file(".Annotations.dir123").c_str(), 0700), 0);
  ASSERT_EQ(::symlink(path.c_str(), dir.file(".Annotations.link12").c_str()), 0);
  Result<size_t> removed = removeStaleTemporaries(path);
  ASSERT_TRUE(removed.ok()) << removed.error().message;
  EXPECT_EQ(*removed, 2u);
  std::vector<std::string> left = dir.entries();
  std::sort(left.begin(), left.end());
  EXPECT_EQ(left, (std::vector<std::string>{".Annotations.dir123", ".Annotations.link12",
                                            ".Annotations.short", ".Annotations.toolong1",
                                            ".Other.a1B2c3", "Annotations",
                                            "Annotations.bad-20260101T000000Z"}));
}

}  // namespace
}  // namespace ek::dmap
