#pragma once

#include <cmath>
#include <cstring>

#include "platform/value/Value.h"

namespace ek::fuzz {

// Value equality for round-trip checks: doubles must keep their exact bits (sign of zero
// included), and NaN counts as equal to NaN, which operator== would not allow.
inline bool sameNumber(double a, double b) {
  if (std::isnan(a) || std::isnan(b)) return std::isnan(a) && std::isnan(b);
  return std::memcmp(&a, &b, sizeof a) == 0;
}

inline bool sameValue(const Value& a, const Value& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case ValueType::Double:
      return sameNumber(*a.doubleNumber(), *b.doubleNumber());
    case ValueType::Date:
      return sameNumber(a.date()->seconds, b.date()->seconds);
    case ValueType::Array: {
      const Array& x = *a.array();
      const Array& y = *b.array();
      if (x.size() != y.size()) return false;
      for (size_t i = 0; i < x.size(); ++i) {
        if (!sameValue(x[i], y[i])) return false;
      }
      return true;
    }
    case ValueType::Dictionary: {
      const Dictionary& x = *a.dictionary();
      const Dictionary& y = *b.dictionary();
      if (x.size() != y.size()) return false;
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
        if (i->first != j->first || !sameValue(i->second, j->second)) return false;
      }
      return true;
    }
    default:
      return a == b;
  }
}

}  // namespace ek::fuzz
