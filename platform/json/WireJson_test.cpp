#include "platform/json/WireJson.h"

#include <gtest/gtest.h>

#include <limits>

namespace ek::wirejson {
namespace {

const Uuid kUuid = *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");

// Each value as write gives it; parse gives the value back, for every row.
TEST(WireJson, TypedValuesRoundTripThroughTheirReservedNames) {
  const struct {
    Value value;
    std::string text;
  } rows[] = {
      {"a\"b\\\n\x01\u00e9", R"("a\"b\\\n\u0001)"
                             "\u00e9\""},
      {std::numeric_limits<uint64_t>::max(), "18446744073709551615"},
      {std::numeric_limits<int64_t>::min(), "-9223372036854775808"},
      {0.1, R"({"$real":0.1})"},
      {kUuid, R"({"$uuid":"E621E1F8-C36C-495A-93FC-0C247A3E6E5F"})"},
      {Data{'A', 'B'}, R"({"$data":"QUI="})"},
      {Date{1700000000.25}, R"({"$date":1700000000.25})"},
      {Dictionary{{"b", Array{true, Dictionary{}}}, {"a", Array{}}}, R"({"a":[],"b":[true,{}]})"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(write(row.value), row.text);
    auto parsed = parse(write(row.value, true));
    ASSERT_TRUE(parsed.ok()) << row.text << ": " << parsed.error().message;
    EXPECT_EQ(*parsed, row.value) << row.text;
  }
  EXPECT_EQ(writePlain(Value(Array{kUuid, Data{'A'}, Date{1700000000}, 0.5})),
            R"(["E621E1F8-C36C-495A-93FC-0C247A3E6E5F","QQ==","2023-11-14T22:13:20Z",0.5])");
}

TEST(WireJson, RefusesWhatTheValueModelCannotHold) {
  const struct {
    std::string text;
    const char* message;  // a fragment of the expected message
  } rows[] = {
      {"[1, null]", "null"},
      {R"("\ud800")", "malformed"},
      {R"({"a": 1, "a": 2})", "repeats the key \"a\""},
      {"18446744073709551616", "outside the 64-bit range"},
      {R"({"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5"})", "$uuid"},
      {std::string(kMaxDepth + 1, '[') + std::string(kMaxDepth + 1, ']'), "deeper than 512"},
  };
  for (const auto& row : rows) {
    auto parsed = parse(row.text);
    ASSERT_FALSE(parsed.ok()) << row.text;
    EXPECT_NE(parsed.error().message.find(row.message), std::string::npos)
        << parsed.error().message;
  }
  EXPECT_TRUE(
      parse(std::string(kMaxDepth, '[') + R"({"$real": 1})" + std::string(kMaxDepth, ']')).ok());
}

}  // namespace
}  // namespace ek::wirejson
