#include "platform/cbor/Cbor.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cmath>
#include <limits>

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
  return fmt::format("{:02x}", fmt::join(bytes, ""));
}

std::string repeat(std::string_view hex, size_t times) {
  std::string all;
  for (size_t i = 0; i < times; ++i) all += hex;
  return all;
}

// Bytes decode refuses, with a fragment of its message.
std::vector<std::pair<std::string, std::string>> refusals() {
  return {
      {"f6", "null"},
      {"a10102", "key is not a text string"},
      {"bab2d05e00" + std::string(30, '0'), "declares 3000000000 map entries"},
      {"8501020304", "declares 5 array elements"},
      {"7bffffffffffffffff61", "truncated"},
      {"0100", "1 trailing byte"},
      {"c24101", "tag 2 is not supported"},
      {"d8254f" + std::string(30, '1'), "16-byte byte string"},
      {"3b8000000000000000", "below the 64-bit range"},
      {"62c080", "not UTF-8"},
      {"a161ff01", "not UTF-8"},  // in a key
      {"63eda080", "not UTF-8"},  // a UTF-16 surrogate
      {"a2616101616102", "repeats the key \"a\""},
      {repeat("81", kMaxDepth) + "80", "deeper than 512"},
      {repeat("a1616b", kMaxDepth) + "a0", "deeper than 512"},
  };
}

TEST(Cbor, EncodesShortestAndDecodesEveryForm) {
  // Each value with its bytes: encode writes them (the shortest form) and decode reads them.
  const std::pair<Value, std::string> known[] = {
      {23, "17"},
      {24, "1818"},
      {std::numeric_limits<uint64_t>::max(), "1bffffffffffffffff"},
      {std::numeric_limits<int64_t>::min(), "3b7fffffffffffffff"},
      {-0.0, "f98000"},
      {1.5, "f93e00"},
      {100000.0, "fa47c35000"},
      {1.1, "fb3ff199999999999a"},
      {true, "f5"},
      {"\U00010151", "64f0908591"},
      {Array{1, Array{2, 3}}, "8201820203"},
      {Dictionary{{"a", 1}, {"b", Array{2, 3}}}, "a26161016162820203"},
      {Date{1363896240.5}, "c1fb41d452d9ec200000"},
      {*Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"),
       "d82550e621e1f8c36c495a93fc0c247a3e6e5f"},
  };
  for (const auto& [value, hex] : known) {
    EXPECT_EQ(toHex(encode(value)), hex);
    auto decoded = decode(fromHex(hex));
    ASSERT_TRUE(decoded.ok()) << hex << ": " << decoded.error().message;
    EXPECT_EQ(*decoded, value) << hex;
  }
  // Forms other writers use.
  EXPECT_EQ(decode(fromHex("5f42010243030405ff")).value(), Value(Data{1, 2, 3, 4, 5}));
  EXPECT_EQ(decode(fromHex("bf61619f0203ffff")).value(), Value(Dictionary{{"a", Array{2, 3}}}));
  EXPECT_EQ(toHex(encode(Value(std::nan("")))), "f97e00");
  // At the depth limit, also with a tagged leaf (which is no level of its own).
  Value deep(*Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"));
  for (size_t i = 0; i < kMaxDepth; ++i) deep = Value(Array{deep});
  EXPECT_EQ(decode(encode(deep)).value(), deep);
}

TEST(Cbor, RefusesWhatTheValueModelCannotHold) {
  for (const auto& [hex, message] : refusals()) {
    auto decoded = decode(fromHex(hex));
    ASSERT_FALSE(decoded.ok()) << hex.substr(0, 40);
    EXPECT_EQ(decoded.error().domain, kFormatErrorDomain);
    EXPECT_NE(decoded.error().message.find(message), std::string::npos) << decoded.error().message;
  }
}

}  // namespace
}  // namespace ek::cbor
