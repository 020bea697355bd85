#pragma once

#include <compare>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace ek {

// A copy of receiver in which key maps to value, or from which key is removed when value is
// absent. The receiver is never changed. No receiver gives no dictionary: changing one entry of
// a dictionary that does not exist does not create it.
std::optional<Dictionary> dictionaryChanging(const Dictionary* receiver, std::string_view key,
                                             std::optional<Value> value);

// Orders receiver relative to other: less when receiver is the lower version, greater when it
// is the higher one. Runs of decimal digits found at the same place in both strings compare by
// numeric value, of any length; every other byte compares exactly (case-sensitive, no locale,
// no meaning for dots). When one string is a prefix of the other, the shorter is lower.
// Two runs of equal value but different length ("01" and "1") only matter when nothing else
// differs; then the first such pair decides and the run with more leading zeros is the lower,
// as a byte-wise comparison would also say. So two present strings compare equal exactly when
// they are identical. An absent receiver compares equal to anything.
std::strong_ordering compareVersionString(const std::string* receiver, std::string_view other);
std::strong_ordering compareVersionString(std::string_view receiver, std::string_view other);

}  // namespace ek
