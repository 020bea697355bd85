#include "Ekora/EkCollections.h"

#include <gtest/gtest.h>

#include <string>

namespace ek {
namespace {

const char* name(std::strong_ordering order) {
  return order < 0 ? "less" : order > 0 ? "greater" : "equal";
}

TEST(CompareVersionString, OrdersByNumericRunsAndExactCharacters) {
  const struct {
    std::string receiver, other;
    std::strong_ordering expected;
  } cases[] = {
      {"2.0", "10.0", std::strong_ordering::less},
      {"1.10", "1.9", std::strong_ordering::greater},
      {"1.9", "1.8", std::strong_ordering::greater},
      {"1", "1.0", std::strong_ordering::less},
      {"1.0.1", "1.0", std::strong_ordering::greater},
      {"1.9z", "1.10", std::strong_ordering::less},
      // Letters and separators compare exactly, bytes beyond ASCII as unsigned values.
      {"1.0B", "1.0a", std::strong_ordering::less},
      {"1\xc3\xa9", "1e", std::strong_ordering::greater},
      // Equal values of different lengths only break a tie: more leading zeros is lower.
      {"01", "1", std::strong_ordering::less},
      {"0", "00", std::strong_ordering::greater},
      {"1.01.5", "1.1.4", std::strong_ordering::greater},
      // Runs far beyond 64 bits.
      {"1." + std::string(5000, '9'), "1." + std::string(4999, '9'), std::strong_ordering::greater},
      {std::string(3000, '0') + "5", "6", std::strong_ordering::less},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.receiver.substr(0, 20) + " vs " + c.other.substr(0, 20));
    EXPECT_STREQ(name(compareVersionString(c.receiver, c.other)), name(c.expected));
    EXPECT_STREQ(name(compareVersionString(c.other, c.receiver)), name(0 <=> c.expected));
  }
  const std::string present = "2.0";
  EXPECT_EQ(compareVersionString(&present, "10.0"), std::strong_ordering::less);
  EXPECT_EQ(compareVersionString(nullptr, "2.0"), std::strong_ordering::equal);
}

}  // namespace
}  // namespace ek
