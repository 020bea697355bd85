#include "Ekora/EkCollections.h"

#include <gtest/gtest.h>

#include <string>

namespace ek {
namespace {

TEST(DictionaryChanging, ReplacesValueAndLeavesReceiverUntouched) {
  const Dictionary receiver{{"election", 1}, {"name", "A"}};
  std::optional<Dictionary> changed = dictionaryChanging(&receiver, "election", Value(2));
  ASSERT_TRUE(changed.has_value());
  EXPECT_EQ(*changed, (Dictionary{{"election", 2}, {"name", "A"}}));
  EXPECT_EQ(receiver, (Dictionary{{"election", 1}, {"name", "A"}}));
}

TEST(DictionaryChanging, AbsentValueRemovesKey) {
  const Dictionary receiver{{"election", 1}, {"name", "A"}};
  std::optional<Dictionary> changed = dictionaryChanging(&receiver, "election", std::nullopt);
  ASSERT_TRUE(changed.has_value());
  EXPECT_EQ(*changed, (Dictionary{{"name", "A"}}));
  EXPECT_EQ(receiver.size(), 2u);
}

TEST(DictionaryChanging, AddsMissingKey) {
  const Dictionary receiver{{"name", "A"}};
  std::optional<Dictionary> changed =
      dictionaryChanging(&receiver, "extension", Value(Dictionary{{"k", "v"}}));
  ASSERT_TRUE(changed.has_value());
  EXPECT_EQ(*changed, (Dictionary{{"extension", Dictionary{{"k", "v"}}}, {"name", "A"}}));
}

TEST(DictionaryChanging, RemovingMissingKeyGivesEqualCopy) {
  const Dictionary receiver{{"name", "A"}};
  EXPECT_EQ(dictionaryChanging(&receiver, "election", std::nullopt), receiver);
}

TEST(DictionaryChanging, NoReceiverGivesNoDictionary) {
  EXPECT_FALSE(dictionaryChanging(nullptr, "election", Value(1)).has_value());
  EXPECT_FALSE(dictionaryChanging(nullptr, "election", std::nullopt).has_value());
}

struct VersionCase {
  std::string receiver;
  std::string other;
  std::strong_ordering expected;
};

const char* name(std::strong_ordering order) {
  if (order < 0) return "ascending";
  if (order > 0) return "descending";
  return "same";
}

TEST(CompareVersionString, OrdersByNumericRunsAndExactCharacters) {
  const VersionCase cases[] = {
      {"2.0", "10.0", std::strong_ordering::less},
      {"1.10", "1.9", std::strong_ordering::greater},
      {"3.1", "3.1", std::strong_ordering::equal},
      {"1", "1.0", std::strong_ordering::less},
      {"10", "9", std::strong_ordering::greater},
      {"v2", "v10", std::strong_ordering::less},
      {"1.9z", "1.10", std::strong_ordering::less},
      {"1.2", "1.2b", std::strong_ordering::less},
      {"1.2", "1.2.", std::strong_ordering::less},
      {"", "", std::strong_ordering::equal},
      {"", "1", std::strong_ordering::less},
      // Letters compare exactly: upper case sorts before lower case.
      {"1.0b", "1.0a", std::strong_ordering::greater},
      {"1.0B", "1.0a", std::strong_ordering::less},
      {"a", "A", std::strong_ordering::greater},
      {"beta", "beta", std::strong_ordering::equal},
      // No meaning for separators: they compare as characters.
      {"1-beta", "1.beta", std::strong_ordering::less},
      {"1_2", "1.2", std::strong_ordering::greater},
      // Bytes beyond ASCII compare as unsigned values.
      {"1\xc3\xa9", "1e", std::strong_ordering::greater},
      // Equal values, different lengths: only a tie-break, more leading zeros is lower.
      {"1.01", "1.1", std::strong_ordering::less},
      {"007", "7", std::strong_ordering::less},
      {"0", "00", std::strong_ordering::greater},
      {"a1b", "a01c", std::strong_ordering::less},
      {"1.01.5", "1.1.4", std::strong_ordering::greater},
      {"01", "1.0", std::strong_ordering::less},
      // Runs far beyond 64 bits.
      {"12345678901234567890123456789", "12345678901234567890123456788",
       std::strong_ordering::greater},
      {"99999999999999999999999", "100000000000000000000000", std::strong_ordering::less},
      {"1.000000000000000000000000000000002", "1.3", std::strong_ordering::less},
      {"000000000000000000000000000001", "1", std::strong_ordering::less},
      {"1.99999999999999999999999999999999999999", "1.99999999999999999999999999999999999999",
       std::strong_ordering::equal},
  };
  for (const VersionCase& c : cases) {
    EXPECT_EQ(name(compareVersionString(c.receiver, c.other)), std::string(name(c.expected)))
        << c.receiver << " vs " << c.other;
    // The order is antisymmetric.
    EXPECT_EQ(name(compareVersionString(c.other, c.receiver)), std::string(name(0 <=> c.expected)))
        << c.other << " vs " << c.receiver;
  }
}

TEST(CompareVersionString, SameOnlyForIdenticalStrings) {
  const std::string versions[] = {"1", "01", "1.0", "1.00", "1.0.0", "1a", "1A", "10", "010"};
  for (const std::string& a : versions) {
    for (const std::string& b : versions) {
      EXPECT_EQ(compareVersionString(a, b) == 0, a == b) << a << " vs " << b;
    }
  }
}

TEST(CompareVersionString, AbsentReceiverIsSame) {
  EXPECT_EQ(compareVersionString(nullptr, "2.0"), std::strong_ordering::equal);
  EXPECT_EQ(compareVersionString(nullptr, ""), std::strong_ordering::equal);
  const std::string present = "2.0";
  EXPECT_EQ(compareVersionString(&present, "10.0"), std::strong_ordering::less);
}

TEST(CompareVersionString, HugeRunsDoNotOverflow) {
  const std::string longer = "1." + std::string(5000, '9');
  const std::string shorter = "1." + std::string(4999, '9');
  EXPECT_EQ(compareVersionString(longer, shorter), std::strong_ordering::greater);
  EXPECT_EQ(compareVersionString(std::string(3000, '0') + "5", "6"), std::strong_ordering::less);
}

}  // namespace
}  // namespace ek
