#include "platform/value/Value.h"

#include <gtest/gtest.h>

#include <set>
#include <unordered_set>

#include "platform/value/Result.h"

namespace ek {
namespace {

TEST(Uuid, ParsesEitherCaseAndWritesUpperCase) {
  auto lower = Uuid::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f");
  auto upper = Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  ASSERT_TRUE(lower && upper);
  EXPECT_EQ(*lower, *upper);
  EXPECT_EQ(lower->string(), "E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
}

TEST(Uuid, RefusesMalformedText) {
  for (const char* text :
       {"", "E621E1F8C36C495A93FC0C247A3E6E5F", "E621E1F8-C36C-495A-93FC-0C247A3E6E5",
        "E621E1F8-C36C-495A-93FC-0C247A3E6E5FF", "G621E1F8-C36C-495A-93FC-0C247A3E6E5F",
        "E621E1F8+C36C-495A-93FC-0C247A3E6E5F"}) {
    EXPECT_FALSE(Uuid::parse(text).has_value()) << text;
  }
}

TEST(Uuid, RandomIsVersionFourAndDistinct) {
  std::set<Uuid> seen;
  for (int i = 0; i < 100; ++i) {
    Uuid u = Uuid::random();
    EXPECT_EQ(u.bytes[6] >> 4, 4);
    EXPECT_EQ(u.bytes[8] >> 6, 2);
    seen.insert(u);
  }
  EXPECT_EQ(seen.size(), 100u);
}

TEST(Uuid, EveryByteCountsForEqualityAndOrder) {
  const Uuid base = *Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  for (size_t i = 0; i < base.bytes.size(); ++i) {
    Uuid other = base;
    other.bytes[i] ^= 0x01;
    EXPECT_NE(other, base) << "byte " << i;
    EXPECT_EQ(other < base, other.bytes[i] < base.bytes[i]) << "byte " << i;
    Uuid same = other;
    EXPECT_EQ(same, other);
    EXPECT_EQ(std::hash<Uuid>()(same), std::hash<Uuid>()(other));
  }
  std::unordered_set<Uuid> set;
  for (int i = 0; i < 1000; ++i) set.insert(Uuid::random());
  EXPECT_EQ(set.size(), 1000u);
  for (const Uuid& uuid : set) EXPECT_EQ(set.count(uuid), 1u);
}

TEST(Value, IntegersNormaliseToUnsignedUnlessNegative) {
  EXPECT_EQ(Value(5).type(), ValueType::Unsigned);
  EXPECT_EQ(Value(int64_t{5}), Value(uint64_t{5}));
  EXPECT_EQ(Value(-3).type(), ValueType::Negative);
  EXPECT_EQ(Value(true).type(), ValueType::Bool);
  EXPECT_EQ(Value("x").type(), ValueType::String);
  EXPECT_NE(Value(1), Value(true));
}

TEST(Value, TypedLookupsAnswerNullForOtherTypes) {
  Value v(Dictionary{{"name", "A"}, {"count", 3}, {"list", Array{1, 2}}});
  ASSERT_NE(v.getString("name"), nullptr);
  EXPECT_EQ(*v.getString("name"), "A");
  EXPECT_EQ(v.getString("count"), nullptr);
  EXPECT_EQ(v.getArray("name"), nullptr);
  EXPECT_EQ(v.getArray("list")->size(), 2u);
  EXPECT_EQ(v.get("missing"), nullptr);
  EXPECT_EQ(Value("text").get("name"), nullptr);
}

TEST(Value, DescriptionIsReadable) {
  Value v(Dictionary{{"b", Array{1, -2, "x"}}, {"a", true}});
  EXPECT_EQ(v.description(), R"({"a": true, "b": [1, -2, "x"]})");
}

Result<int> half(int n) {
  if (n % 2) return EkError::ekora(4, "odd");
  return n / 2;
}

Result<int> quarter(int n) {
  int h = EK_TRY(half(n));
  return EK_TRY(half(h));
}

TEST(Result, TryPropagatesTheFirstError) {
  EXPECT_EQ(quarter(8).value(), 2);
  auto failed = quarter(6);
  ASSERT_FALSE(failed.ok());
  EXPECT_EQ(failed.error().code, 4);
  EXPECT_EQ(failed.error().message, "odd");
}

}  // namespace
}  // namespace ek
