#include "platform/cbor/Cbor.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <span>
#include <string>

namespace ek::cbor {
namespace {

std::vector<uint8_t> fromHex(std::string_view hex) {
  std::vector<uint8_t> bytes;
  for (size_t i = 0; i + 1 < hex.size(); i += 2) {
    bytes.push_back(static_cast<uint8_t>(std::stoul(std::string(hex.substr(i, 2)), nullptr, 16)));
  }
  return bytes;
}

std::string toHex(const std::vector<uint8_t>& bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (uint8_t b : bytes) {
    hex.push_back(kDigits[b >> 4]);
    hex.push_back(kDigits[b & 0x0F]);
  }
  return hex;
}

Uuid sampleUuid() {
  return *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
}

struct Known {
  const char* name;
  Value value;
  const char* hex;
};

// Examples of RFC 8949 appendix A that the value model can carry, plus the model's own forms.
std::vector<Known> knownEncodings() {
  Array twentyFive;
  for (int i = 1; i <= 25; ++i) twentyFive.push_back(i);
  return {
      {"zero", 0, "00"},
      {"one", 1, "01"},
      {"ten", 10, "0a"},
      {"twentyThree", 23, "17"},
      {"twentyFour", 24, "1818"},
      {"hundred", 100, "1864"},
      {"thousand", 1000, "1903e8"},
      {"million", 1000000, "1a000f4240"},
      {"trillion", uint64_t{1000000000000}, "1b000000e8d4a51000"},
      {"maxUnsigned", std::numeric_limits<uint64_t>::max(), "1bffffffffffffffff"},
      {"minusOne", -1, "20"},
      {"minusTen", -10, "29"},
      {"minusHundred", -100, "3863"},
      {"minusThousand", -1000, "3903e7"},
      {"minInt64", std::numeric_limits<int64_t>::min(), "3b7fffffffffffffff"},
      {"zeroDouble", 0.0, "f90000"},
      {"minusZeroDouble", -0.0, "f98000"},
      {"oneDouble", 1.0, "f93c00"},
      {"onePointOne", 1.1, "fb3ff199999999999a"},
      {"onePointFive", 1.5, "f93e00"},
      {"largestHalf", 65504.0, "f97bff"},
      {"hundredThousand", 100000.0, "fa47c35000"},
      {"largestSingle", 3.4028234663852886e+38, "fa7f7fffff"},
      {"tenToThe300", 1.0e+300, "fb7e37e43c8800759c"},
      {"smallestHalfSubnormal", 5.960464477539063e-8, "f90001"},
      {"smallestHalfNormal", 0.00006103515625, "f90400"},
      {"minusFour", -4.0, "f9c400"},
      {"minusFourPointOne", -4.1, "fbc010666666666666"},
      {"infinity", std::numeric_limits<double>::infinity(), "f97c00"},
      {"minusInfinity", -std::numeric_limits<double>::infinity(), "f9fc00"},
      {"false", false, "f4"},
      {"true", true, "f5"},
      {"emptyData", Data{}, "40"},
      {"data", Data{1, 2, 3, 4}, "4401020304"},
      {"emptyText", "", "60"},
      {"a", "a", "6161"},
      {"ietf", "IETF", "6449455446"},
      {"escapes", "\"\\", "62225c"},
      {"uUmlaut", "\u00fc", "62c3bc"},
      {"water", "\u6c34", "63e6b0b4"},
      {"astral", "\U00010151", "64f0908591"},
      {"emptyArray", Array{}, "80"},
      {"array", Array{1, 2, 3}, "83010203"},
      {"nestedArray", Array{1, Array{2, 3}, Array{4, 5}}, "8301820203820405"},
      {"twentyFiveElements", twentyFive,
       "98190102030405060708090a0b0c0d0e0f101112131415161718181819"},
      {"emptyMap", Dictionary{}, "a0"},
      {"map", Dictionary{{"a", 1}, {"b", Array{2, 3}}}, "a26161016162820203"},
      {"arrayWithMap", Array{"a", Dictionary{{"b", "c"}}}, "826161a161626163"},
      {"fiveKeyMap", Dictionary{{"a", "A"}, {"b", "B"}, {"c", "C"}, {"d", "D"}, {"e", "E"}},
       "a56161614161626142616361436164614461656145"},
      {"date", Date{1363896240.5}, "c1fb41d452d9ec200000"},
      {"uuid", sampleUuid(), "d82550e621e1f8c36c495a93fc0c247a3e6e5f"},
  };
}

TEST(Cbor, EncodesKnownItemsExactly) {
  for (const Known& known : knownEncodings()) {
    EXPECT_EQ(toHex(encode(known.value)), known.hex) << known.name;
  }
}

TEST(Cbor, DecodesKnownItemsExactly) {
  for (const Known& known : knownEncodings()) {
    auto decoded = decode(fromHex(known.hex));
    ASSERT_TRUE(decoded.ok()) << known.name << ": " << decoded.error().message;
    EXPECT_EQ(*decoded, known.value) << known.name;
  }
}

TEST(Cbor, RoundTripsEveryType) {
  Value nested(Dictionary{
      {"string", std::string("h\u00e9llo\0x", 8)},
      {"unsigned", uint64_t{1} << 40},
      {"negative", -123456789},
      {"double", 3.141592653589793},
      {"tiny", 1e-310},
      {"bool", true},
      {"data", Data(300, 0xAB)},
      {"uuid", sampleUuid()},
      {"date", Date{-86400.25}},
      {"array", Array{Array{}, Dictionary{}, "x", false}},
      {"dictionary", Dictionary{{"", 0}, {"k", Dictionary{{"deep", Array{1.5}}}}}},
  });
  std::vector<Value> values = {nested, Value("only"), Value(7), Value(Data{}), Value(Array{})};
  for (const Value& value : values) {
    auto decoded = decode(encode(value));
    ASSERT_TRUE(decoded.ok()) << decoded.error().message;
    EXPECT_EQ(*decoded, value) << value.description();
  }
}

TEST(Cbor, DoublesKeepSignAndValueThroughShortestForm) {
  for (double number : {-0.0, 1e-45, 1.401298464324817e-45, 2.5e-8, 6.1e-5, 65505.0, 65536.0, 1e38,
                        1e39, -3.4e38, 0.1, 123456789.0}) {
    auto decoded = decode(encode(Value(number)));
    ASSERT_TRUE(decoded.ok());
    const double* back = decoded->doubleNumber();
    ASSERT_NE(back, nullptr);
    EXPECT_EQ(*back, number);
    EXPECT_EQ(std::signbit(*back), std::signbit(number));
  }
}

TEST(Cbor, NanIsWrittenAsCanonicalHalf) {
  EXPECT_EQ(toHex(encode(Value(std::nan("")))), "f97e00");
  auto decoded = decode(fromHex("fb7ff8000000000000"));
  ASSERT_TRUE(decoded.ok());
  ASSERT_NE(decoded->doubleNumber(), nullptr);
  EXPECT_TRUE(std::isnan(*decoded->doubleNumber()));
}

TEST(Cbor, EncodeAppendsToExistingBuffer) {
  std::vector<uint8_t> out = {0xAA};
  encode(Value(Array{1}), out);
  EXPECT_EQ(toHex(out), "aa8101");
}

TEST(Cbor, PiecesWrittenOneByOneDecodeAsTheWholeValue) {
  const Dictionary big = {{"a", Value("x")}, {"b", Value(Array{1, 2})}};
  std::vector<uint8_t> out;
  encodeArrayHead(30, out);
  for (int i = 0; i < 30; ++i) {
    // Members in an order of their own: a map's keys need not be sorted on the wire.
    encodeMapHead(3, out);
    encodeText("z", out);
    encode(Value(i), out);
    for (const auto& [key, value] : big) {
      encodeText(key, out);
      encode(value, out);
    }
  }
  Array expected;
  for (int i = 0; i < 30; ++i) {
    Dictionary member = big;
    member["z"] = Value(i);
    expected.emplace_back(std::move(member));
  }
  auto decoded = decode(out);
  ASSERT_TRUE(decoded.ok()) << decoded.error().message;
  EXPECT_EQ(*decoded, Value(expected));
  // Shortest heads, as the whole value's encoding writes them: 30 elements take two bytes.
  EXPECT_EQ(toHex(std::vector<uint8_t>(out.begin(), out.begin() + 3)), "981ea3");
  EXPECT_EQ(out.size(), encode(Value(expected)).size());
  EXPECT_GE(encodedSizeBound(Value(expected)), out.size());
}

struct Decodable {
  const char* name;
  const char* hex;
  Value value;
};

TEST(Cbor, DecodesForeignForms) {
  const Decodable cases[] = {
      {"doubleOne", "fb3ff0000000000000", 1.0},
      {"singleHundredThousand", "fa47c35000", 100000.0},
      {"halfSubnormal", "f90001", 5.960464477539063e-8},
      {"nonShortestUnsigned", "1b0000000000000001", 1},
      {"integerDate", "c11a514b67b0", Date{1363896240}},
      {"negativeIntegerDate", "c120", Date{-1}},
      {"halfDate", "c1f93e00", Date{1.5}},
      {"indefiniteBytes", "5f42010243030405ff", Data{1, 2, 3, 4, 5}},
      {"indefiniteBytesEmpty", "5fff", Data{}},
      {"indefiniteText", "7f657374726561646d696e67ff", "streaming"},
      {"indefiniteEmptyArray", "9fff", Array{}},
      {"indefiniteMixed", "9f018202039f0405ffff", Array{1, Array{2, 3}, Array{4, 5}}},
      {"indefiniteMap", "bf61610161629f0203ffff", Dictionary{{"a", 1}, {"b", Array{2, 3}}}},
      {"indefiniteMapNegative", "bf6346756ef563416d7421ff", Dictionary{{"Fun", true}, {"Amt", -2}}},
      {"indefiniteTextKey", "a17f6161ff01", Dictionary{{"a", 1}}},
      {"uuidFromIndefiniteBytes", "d8255f4810e621e1f8c36c49485a593fc0c247a3e6ff",
       Value(*Uuid::parse("10E621E1-F8C3-6C49-5A59-3FC0C247A3E6"))},
  };
  for (const Decodable& c : cases) {
    auto decoded = decode(fromHex(c.hex));
    ASSERT_TRUE(decoded.ok()) << c.name << ": " << decoded.error().message;
    EXPECT_EQ(*decoded, c.value) << c.name;
  }
}

struct Refusal {
  const char* name;
  std::string hex;
  const char* message;  // a fragment of the expected message
};

std::vector<Refusal> refusals() {
  return {
      {"empty", "", "empty"},
      {"null", "f6", "null"},
      {"undefined", "f7", "undefined"},
      {"simpleSixteen", "f0", "malformed"},
      {"simpleOneByte", "f8ff", "malformed"},
      {"reservedAdditionalInfo", "1c", "malformed"},
      {"reservedFloatInfo", "fc", "malformed"},
      {"integerKey", "a10102", "key is not a text string"},
      {"bytesKey", "a1400102", "key is not a text string"},
      {"arrayKey", "a18001", "key is not a text string"},
      {"indefiniteMapIntegerKey", "bf0102ff", "key is not a text string"},
      {"threeBillionEntryMap", "bab2d05e00" + std::string(30, '0'),
       "declares 3000000000 map entries"},
      {"arrayLongerThanInput", "8501020304", "declares 5 array elements"},
      {"innerArrayOverOwedBytes", "8283010203", "declares 3 array elements"},
      {"arrayAfterLongKey", "a36403757f659a6561640379", "declares 1700881411 array elements"},
      {"hugeArrayCount", "9bffffffffffffffff00", "declares 18446744073709551615"},
      {"truncatedInteger", "1a0000", "truncated"},
      {"truncatedText", "6261", "truncated"},
      {"truncatedArrayElement", "82016261", "truncated"},
      {"hugeTextLength", "7bffffffffffffffff61", "truncated"},
      {"unterminatedIndefiniteArray", "9f01", "truncated"},
      {"trailingByte", "0100", "1 trailing byte"},
      {"trailingAfterMap", "a0a0a0", "2 trailing bytes"},
      {"bignumTag", "c24101", "tag 2 is not supported"},
      {"uuidOfFifteenBytes", "d8254f" + std::string(30, '1'), "16-byte byte string"},
      {"uuidOfSeventeenBytes", "d82551" + std::string(34, '1'), "16-byte byte string"},
      {"uuidOfText", "d8256161", "16-byte byte string"},
      {"uuidOfArray", "d82580", "16-byte byte string"},
      {"dateOfText", "c16161", "tag 1 must wrap a number"},
      {"dateOfDate", "c1c101", "tag 1 must wrap a number"},
      {"dateOfArray", "c180", "tag 1 must wrap a number"},
      {"dateOfNull", "c1f6", "tag 1 must wrap a number"},
      {"negativeBelowInt64", "3b8000000000000000", "below the 64-bit range"},
      {"invalidUtf8Byte", "61ff", "not UTF-8"},
      {"overlongUtf8", "62c080", "not UTF-8"},
      {"surrogateUtf8", "63eda080", "not UTF-8"},
      {"aboveUnicodeUtf8", "64f4908080", "not UTF-8"},
      {"truncatedUtf8", "62e6b0", "not UTF-8"},
      {"invalidUtf8Chunk", "7f61ffff", "not UTF-8"},
      {"invalidUtf8Key", "a161ff01", "not UTF-8"},
      {"duplicateKey", "a2616101616102", "repeats the key \"a\""},
      {"duplicateKeyIndefinite", "bf616101616102ff", "repeats the key"},
      {"breakAlone", "ff", "break outside"},
      {"breakInDefiniteArray", "81ff", "break outside"},
      {"breakBetweenKeyAndValue", "bf6161ff", "between a key and its value"},
      {"bytesChunkInText", "7f4100ff", "other than text"},
      {"textChunkInBytes", "5f6161ff", "other than bytes"},
      {"nestedIndefiniteBytes", "5f5fffff", "other than bytes"},
  };
}

TEST(Cbor, RefusesMalformedOrUnsupportedInput) {
  for (const Refusal& refusal : refusals()) {
    auto decoded = decode(fromHex(refusal.hex));
    ASSERT_FALSE(decoded.ok()) << refusal.name << " decoded as " << decoded->description();
    EXPECT_EQ(decoded.error().domain, kFormatErrorDomain) << refusal.name;
    EXPECT_NE(decoded.error().message.find(refusal.message), std::string::npos)
        << refusal.name << ": " << decoded.error().message;
  }
}

TEST(Cbor, TwentyByteFrameDeclaringThreeBillionEntriesIsRefused) {
  std::vector<uint8_t> frame = fromHex("bab2d05e00");
  frame.resize(20, 0x00);
  ASSERT_EQ(frame.size(), 20u);
  auto decoded = decode(frame);
  ASSERT_FALSE(decoded.ok());
  EXPECT_NE(decoded.error().message.find("3000000000"), std::string::npos);
}

std::vector<uint8_t> nestedArrays(size_t depth, bool indefinite) {
  std::vector<uint8_t> bytes(depth, indefinite ? 0x9F : 0x81);
  bytes.back() = indefinite ? 0x9F : 0x80;
  if (indefinite) bytes.insert(bytes.end(), depth, 0xFF);
  return bytes;
}

TEST(Cbor, AcceptsNestingAtTheDepthLimit) {
  for (bool indefinite : {false, true}) {
    auto decoded = decode(nestedArrays(kMaxDepth, indefinite));
    ASSERT_TRUE(decoded.ok()) << decoded.error().message;
    size_t depth = 0;
    const Value* level = &*decoded;
    while (const Array* array = level->array()) {
      ++depth;
      if (array->empty()) break;
      level = &array->front();
    }
    EXPECT_EQ(depth, kMaxDepth);
    EXPECT_EQ(encode(*decoded), nestedArrays(kMaxDepth, false));
  }
}

TEST(Cbor, RefusesNestingBeyondTheDepthLimit) {
  for (bool indefinite : {false, true}) {
    auto decoded = decode(nestedArrays(kMaxDepth + 1, indefinite));
    ASSERT_FALSE(decoded.ok());
    EXPECT_NE(decoded.error().message.find("deeper than 512"), std::string::npos)
        << decoded.error().message;
  }
}

TEST(Cbor, MapsCountTowardTheDepthLimit) {
  // 512 levels of {"k": ...} around an empty map is one level too many.
  std::vector<uint8_t> bytes;
  for (size_t i = 0; i < kMaxDepth; ++i) {
    for (uint8_t b : {0xA1, 0x61, 0x6B}) bytes.push_back(b);
  }
  bytes.push_back(0xA0);
  auto decoded = decode(bytes);
  ASSERT_FALSE(decoded.ok());
  EXPECT_NE(decoded.error().message.find("deeper"), std::string::npos);
}

TEST(Cbor, TaggedLeavesDoNotCountTowardTheDepthLimit) {
  Value leaf(sampleUuid());
  for (size_t i = 0; i < kMaxDepth; ++i) leaf = Value(Array{leaf});
  auto decoded = decode(encode(leaf));
  ASSERT_TRUE(decoded.ok()) << decoded.error().message;
  EXPECT_EQ(*decoded, leaf);
}

// --- decodeEntries: a few members of a message, the rest checked but not built ---

Dictionary only(const Dictionary& all, std::span<const std::string_view> keys) {
  Dictionary kept;
  for (std::string_view key : keys) {
    auto it = all.find(key);
    if (it != all.end()) kept.insert(*it);
  }
  return kept;
}

TEST(CborEntries, AnswersWhatDecodeDecodesUnderTheKeysAlone) {
  // Every form decode knows, each under its own name, the foreign ones as they were written.
  std::vector<std::pair<std::string, std::string>> members;
  for (const Known& known : knownEncodings()) members.emplace_back(known.name, known.hex);
  members.emplace_back("indefiniteMap", "bf61610161629f0203ffff");
  members.emplace_back("indefiniteText", "7f657374726561646d696e67ff");
  members.emplace_back("uuidFromIndefiniteBytes", "d8255f4810e621e1f8c36c49485a593fc0c247a3e6ff");
  members.emplace_back("halfDate", "c1f93e00");
  members.emplace_back("nested", "a2616182a0bf6162f5ff6163c1f93e00");
  std::vector<uint8_t> bytes;
  encodeMapHead(members.size(), bytes);
  for (const auto& [name, hex] : members) {
    encodeText(name, bytes);
    std::vector<uint8_t> item = fromHex(hex);
    bytes.insert(bytes.end(), item.begin(), item.end());
  }
  auto all = decode(bytes);
  ASSERT_TRUE(all.ok()) << all.error().message;
  ASSERT_EQ(all->dictionary()->size(), members.size());

  std::vector<std::string_view> even, odd;
  for (size_t i = 0; i < members.size(); ++i) (i % 2 ? odd : even).push_back(members[i].first);
  const std::string_view absent[] = {"absent", "nested"};
  for (std::span<const std::string_view> keys :
       {std::span<const std::string_view>(even), std::span<const std::string_view>(odd),
        std::span<const std::string_view>(absent), std::span<const std::string_view>()}) {
    auto entries = decodeEntries(bytes, keys);
    ASSERT_TRUE(entries.ok()) << entries.error().message;
    EXPECT_EQ(*entries, only(*all->dictionary(), keys));
  }
}

TEST(CborEntries, RefusesWhatDecodeRefusesInTheMembersItDoesNotBuild) {
  const std::string_view kept[] = {"kept"};
  for (const Refusal& refusal : refusals()) {
    if (refusal.hex.empty()) continue;
    // {"kept": 1, "dropped": refusal} and {"kept": 1, "dropped": [refusal]}
    for (const std::string& wrapped : {refusal.hex, "81" + refusal.hex}) {
      std::vector<uint8_t> bytes = fromHex(
          "a2646b65707401"
          "6764726f70706564" +
          wrapped);
      auto entries = decodeEntries(bytes, kept);
      if (std::string_view(refusal.name).starts_with("duplicateKey")) {
        // Repeated keys are only looked for in what is built.
        ASSERT_TRUE(entries.ok()) << refusal.name << ": " << entries.error().message;
        EXPECT_EQ(*entries, (Dictionary{{"kept", 1}})) << refusal.name;
        continue;
      }
      ASSERT_FALSE(entries.ok()) << refusal.name << " in " << wrapped;
      EXPECT_EQ(entries.error().domain, kFormatErrorDomain) << refusal.name;
      EXPECT_NE(entries.error().message.find(refusal.message), std::string::npos)
          << refusal.name << ": " << entries.error().message;
    }
  }
  // A key repeated among the entries built is refused as decode refuses it.
  const std::string_view a[] = {"a"};
  auto repeated = decodeEntries(fromHex("a2616101616102"), a);
  ASSERT_FALSE(repeated.ok());
  EXPECT_NE(repeated.error().message.find("repeats the key \"a\""), std::string::npos);
  // Nesting is bounded in what is dropped too.
  std::vector<uint8_t> deep = fromHex("a1616b");
  std::vector<uint8_t> arrays = nestedArrays(kMaxDepth, false);
  deep.insert(deep.end(), arrays.begin(), arrays.end());
  auto tooDeep = decodeEntries(deep, a);
  ASSERT_FALSE(tooDeep.ok());
  EXPECT_NE(tooDeep.error().message.find("deeper than 512"), std::string::npos);
}

TEST(CborEntries, AnythingButAMapHasNoEntries) {
  const std::string_view a[] = {"a"};
  for (const char* hex : {"81a1616101", "9fa1616101ff", "01", "6161", "c11a514b67b0"}) {
    auto entries = decodeEntries(fromHex(hex), a);
    ASSERT_TRUE(entries.ok()) << hex << ": " << entries.error().message;
    EXPECT_TRUE(entries->empty()) << hex;
  }
}

}  // namespace
}  // namespace ek::cbor
