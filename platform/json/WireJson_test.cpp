#include "platform/json/WireJson.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

namespace ek::wirejson {
namespace {

Uuid sampleUuid() {
  return *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
}

struct Parsed {
  const char* name;
  std::string text;
  Value value;
};

TEST(WireJson, ParsesEachJsonFormIntoTheValueModel) {
  const Parsed cases[] = {
      {"string", R"("hello")", "hello"},
      {"escapedString", R"("a\"b\\c\n\u00e9\ud83d\ude00")", "a\"b\\c\n\u00e9\U0001F600"},
      {"nulCharacter", R"("a\u0000b")", Value(std::string("a\0b", 3))},
      {"zero", "0", 0},
      {"minusZero", "-0", 0},
      {"unsigned", "18446744073709551615", std::numeric_limits<uint64_t>::max()},
      {"negative", "-42", -42},
      {"minInt64", "-9223372036854775808", std::numeric_limits<int64_t>::min()},
      {"plainFraction", "2.5", 2.5},
      {"plainExponent", "1e3", 1000.0},
      {"plainNegativeFraction", "-0.125", -0.125},
      {"true", "true", true},
      {"false", "false", false},
      {"emptyArray", "[]", Array{}},
      {"array", R"([1, "a", [true]])", Array{1, "a", Array{true}}},
      {"emptyObject", "{}", Dictionary{}},
      {"object", R"({"b": 1, "a": {"c": []}})",
       Dictionary{{"a", Dictionary{{"c", Array{}}}}, {"b", 1}}},
      {"whitespace", " \t\n[ 1 ,\r\n2 ] \n", Array{1, 2}},
      {"uuidUpper", R"({"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"})", sampleUuid()},
      {"uuidLower", R"({"$uuid": "e621e1f8-c36c-495a-93fc-0c247a3e6e5f"})", sampleUuid()},
      {"dataEmpty", R"({"$data": ""})", Data{}},
      {"dataOnePad", R"({"$data": "QUI="})", Data{'A', 'B'}},
      {"dataTwoPads", R"({"$data": "QQ=="})", Data{'A'}},
      {"dataNoPad", R"({"$data": "QUJD"})", Data{'A', 'B', 'C'}},
      {"dataBinary", R"({"$data": "AP+A/w=="})", Data{0x00, 0xFF, 0x80, 0xFF}},
      {"dateInteger", R"({"$date": 1700000000})", Date{1700000000}},
      {"dateFraction", R"({"$date": -0.5})", Date{-0.5}},
      {"realInteger", R"({"$real": 3})", 3.0},
      {"realNegativeInteger", R"({"$real": -3})", -3.0},
      {"realFraction", R"({"$real": 0.1})", 0.1},
      {"realInfinity", R"({"$real": "Infinity"})", std::numeric_limits<double>::infinity()},
      {"realMinusInfinity", R"({"$real": "-Infinity"})", -std::numeric_limits<double>::infinity()},
      {"reservedNameAmongOthers", R"({"$uuid": 1, "x": 2})", Dictionary{{"$uuid", 1}, {"x", 2}}},
      {"otherDollarName", R"({"$other": 1})", Dictionary{{"$other", 1}}},
      {"typedInsideContainers", R"({"list": [{"$real": 1.5}, {"$date": 0}]})",
       Dictionary{{"list", Array{1.5, Date{0}}}}},
  };
  for (const Parsed& c : cases) {
    auto parsed = parse(c.text);
    ASSERT_TRUE(parsed.ok()) << c.name << ": " << parsed.error().message;
    EXPECT_EQ(*parsed, c.value) << c.name << ": " << parsed->description();
  }
}

TEST(WireJson, ParsesNotANumberAsTypedReal) {
  auto parsed = parse(R"({"$real": "NaN"})");
  ASSERT_TRUE(parsed.ok());
  ASSERT_NE(parsed->doubleNumber(), nullptr);
  EXPECT_TRUE(std::isnan(*parsed->doubleNumber()));
}

struct Refusal {
  const char* name;
  std::string text;
  const char* message;  // a fragment of the expected message
};

TEST(WireJson, RefusesMalformedInput) {
  const Refusal cases[] = {
      {"empty", "", "malformed"},
      {"null", "null", "null has no counterpart"},
      {"nullInArray", "[1, null]", "null"},
      {"trailingText", "1 2", "malformed"},
      {"trailingComma", "[1,]", "malformed"},
      {"unterminatedString", R"("abc)", "malformed"},
      {"unterminatedArray", "[1", "malformed"},
      {"singleQuotes", "'a'", "malformed"},
      {"comment", "/* c */ 1", "malformed"},
      {"controlCharacterInString", "\"a\x01\"", "malformed"},
      {"invalidUtf8", "\"\xff\"", "malformed"},
      {"loneSurrogate", R"("\ud800")", "malformed"},
      {"nan", "NaN", "malformed"},
      {"duplicateKey", R"({"a": 1, "a": 2})", "repeats the key \"a\""},
      {"integerAboveUnsigned", "18446744073709551616", "outside the 64-bit range"},
      {"integerBelowSigned", "-9223372036854775809", "outside the 64-bit range"},
      {"overflowingFraction", "1e400", "overflow"},
      {"uuidNotText", R"({"$uuid": 5})", "$uuid"},
      {"uuidMalformed", R"({"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5"})", "$uuid"},
      {"dataNotText", R"({"$data": []})", "$data"},
      {"dataBadCharacter", R"({"$data": "QQ!="})", "$data"},
      {"dataBadLength", R"({"$data": "QQ"})", "$data"},
      {"dataThreePads", R"({"$data": "Q==="})", "$data"},
      {"dataPadInMiddle", R"({"$data": "QQ==QUJD"})", "$data"},
      {"dataWhitespace", R"({"$data": " QQ=="})", "$data"},
      {"dataNewline", R"({"$data": "QQ==\n"})", "$data"},
      {"dateNotNumber", R"({"$date": "yesterday"})", "$date is not a number"},
      {"dateBool", R"({"$date": true})", "$date is not a number"},
      {"realNotNumber", R"({"$real": "1.5"})", "$real is not a number"},
      {"realOfTypedReal", R"({"$real": {"$real": 1}})", "holds a typed value"},
      {"dateOfTypedReal", R"({"$date": {"$real": 1}})", "holds a typed value"},
      {"realOfObject", R"({"$real": {"a": 1}})", "$real is not a number"},
  };
  for (const Refusal& c : cases) {
    auto parsed = parse(c.text);
    ASSERT_FALSE(parsed.ok()) << c.name << " parsed as " << parsed->description();
    EXPECT_EQ(parsed.error().domain, kFormatErrorDomain) << c.name;
    EXPECT_NE(parsed.error().message.find(c.message), std::string::npos)
        << c.name << ": " << parsed.error().message;
  }
}

std::string nestedArrays(size_t depth) {
  return std::string(depth, '[') + std::string(depth, ']');
}

TEST(WireJson, AcceptsNestingAtTheDepthLimit) {
  auto parsed = parse(nestedArrays(kMaxDepth));
  ASSERT_TRUE(parsed.ok()) << parsed.error().message;
}

TEST(WireJson, RefusesNestingBeyondTheDepthLimit) {
  for (std::string text : {nestedArrays(kMaxDepth + 1),
                           std::string(kMaxDepth, '[') + "{\"a\": 1}" + std::string(kMaxDepth, ']'),
                           std::string(100000, '[')}) {
    auto parsed = parse(text);
    ASSERT_FALSE(parsed.ok());
    EXPECT_NE(parsed.error().message.find("deeper than 512"), std::string::npos)
        << parsed.error().message;
  }
}

TEST(WireJson, TypedLeafAtTheDepthLimitIsNotAnExtraLevel) {
  std::string text =
      std::string(kMaxDepth, '[') + R"({"$real": 1.5})" + std::string(kMaxDepth, ']');
  auto parsed = parse(text);
  ASSERT_TRUE(parsed.ok()) << parsed.error().message;
  EXPECT_EQ(write(*parsed), text.erase(text.find(' '), 1));
}

struct Written {
  const char* name;
  Value value;
  std::string text;
};

TEST(WireJson, WritesCompactSortedOutput) {
  const Written cases[] = {
      {"string", "a\"b\\c", R"("a\"b\\c")"},
      {"controlCharacters", "\n\t\x01\x1f", R"("\n\t\u0001\u001f")"},
      {"nonAsciiKeptAsIs", "\u00e9", "\"\u00e9\""},
      {"unsigned", std::numeric_limits<uint64_t>::max(), "18446744073709551615"},
      {"negative", std::numeric_limits<int64_t>::min(), "-9223372036854775808"},
      {"bool", true, "true"},
      {"real", 0.1, R"({"$real":0.1})"},
      {"realIntegral", 2.0, R"({"$real":2.0})"},
      {"realMinusZero", -0.0, R"({"$real":-0.0})"},
      {"realLarge", 1e300, R"({"$real":1e+300})"},
      {"realNaN", std::numeric_limits<double>::quiet_NaN(), R"({"$real":"NaN"})"},
      {"realInfinity", std::numeric_limits<double>::infinity(), R"({"$real":"Infinity"})"},
      {"uuidUpperCase", *Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"),
       R"({"$uuid":"E621E1F8-C36C-495A-93FC-0C247A3E6E5F"})"},
      {"data", Data{'A', 'B'}, R"({"$data":"QUI="})"},
      {"dataEmpty", Data{}, R"({"$data":""})"},
      {"date", Date{1700000000.25}, R"({"$date":1700000000.25})"},
      {"sortedMembers", Dictionary{{"b", 1}, {"a", 2}, {"B", 3}}, R"({"B":3,"a":2,"b":1})"},
      {"nested", Array{Dictionary{}, Array{}}, "[{},[]]"},
  };
  for (const Written& c : cases) EXPECT_EQ(write(c.value), c.text) << c.name;
}

TEST(WireJson, WritesPlainJsonWithTypedValuesAsText) {
  const Written cases[] = {
      {"real", 0.1, "0.1"},
      {"realNaN", std::numeric_limits<double>::quiet_NaN(), "null"},
      {"uuidUpperCase", *Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"),
       R"("E621E1F8-C36C-495A-93FC-0C247A3E6E5F")"},
      {"data", Data{'A', 'B'}, R"("QUI=")"},
      {"date", Date{1700000000}, R"("2023-11-14T22:13:20Z")"},
      {"dateFraction", Date{1700000000.25}, R"("2023-11-14T22:13:20.250Z")"},
      {"dateBeforeEpoch", Date{-1}, R"("1969-12-31T23:59:59Z")"},
      {"dateOutOfRange", Date{1e18}, "1e+18"},
      {"nested", Dictionary{{"u", Array{Date{0}}}}, R"({"u":["1970-01-01T00:00:00Z"]})"},
  };
  for (const Written& c : cases) EXPECT_EQ(writePlain(c.value), c.text) << c.name;
}

TEST(WireJson, WritesPrettyOutputWithTwoSpaces) {
  Value value(Dictionary{{"b", Array{1, true}}, {"a", 2.5}, {"e", Array{}}});
  EXPECT_EQ(write(value, true),
            "{\n"
            "  \"a\": {\n"
            "    \"$real\": 2.5\n"
            "  },\n"
            "  \"b\": [\n"
            "    1,\n"
            "    true\n"
            "  ],\n"
            "  \"e\": []\n"
            "}");
}

TEST(WireJson, RoundTripsEveryValue) {
  Data allBytes;
  for (int i = 0; i < 256; ++i) allBytes.push_back(static_cast<uint8_t>(i));
  Data large(100000);
  for (size_t i = 0; i < large.size(); ++i) large[i] = static_cast<uint8_t>(i * 7);
  Value everything(Dictionary{
      {"string", std::string("h\u00e9llo \"\0\x7f\x1b", 12)},
      {"unsigned", uint64_t{1} << 63},
      {"negative", -1},
      {"doubles", Array{0.1, -0.0, 1e-310, 5e-324, 1.7976931348623157e308, 123456789012345678.0,
                        std::numeric_limits<double>::infinity()}},
      {"bool", false},
      {"data", allBytes},
      {"oneByte", Data{7}},
      {"twoBytes", Data{7, 8}},
      {"large", large},
      {"uuid", sampleUuid()},
      {"dates", Array{Date{0}, Date{-1e9}, Date{1.5e-3}}},
      {"nested", Array{Array{Array{}}, Dictionary{{"", Dictionary{{"$x", 1}}}}}},
  });
  for (bool pretty : {false, true}) {
    std::string text = write(everything, pretty);
    auto parsed = parse(text);
    ASSERT_TRUE(parsed.ok()) << parsed.error().message;
    EXPECT_EQ(*parsed, everything) << text.substr(0, 200);
    EXPECT_EQ(text.find('\n') == std::string::npos, !pretty);
  }
}

TEST(WireJson, InvalidUtf8InAStringIsReplacedWhenWritten) {
  std::string text =
      write(Value(std::string("a\xff"
                              "b")));
  EXPECT_EQ(text,
            "\"a\xef\xbf\xbd"
            "b\"");
  EXPECT_TRUE(parse(text).ok());
}

}  // namespace
}  // namespace ek::wirejson
