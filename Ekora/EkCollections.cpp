#include "Ekora/EkCollections.h"

namespace ek {

std::optional<Dictionary> dictionaryChanging(const Dictionary* receiver, std::string_view key,
                                             std::optional<Value> value) {
  if (receiver == nullptr) return std::nullopt;
  Dictionary changed = *receiver;
  if (value) {
    auto it = changed.find(key);
    if (it != changed.end()) {
      it->second = std::move(*value);
    } else {
      changed.emplace(std::string(key), std::move(*value));
    }
  } else if (auto it = changed.find(key); it != changed.end()) {
    changed.erase(it);
  }
  return changed;
}

namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// The run of digits starting at position, advancing position past it.
std::string_view digitRun(std::string_view text, size_t& position) {
  size_t start = position;
  while (position < text.size() && isDigit(text[position])) ++position;
  return text.substr(start, position - start);
}

std::string_view withoutLeadingZeros(std::string_view run) {
  size_t zeros = 0;
  while (zeros < run.size() && run[zeros] == '0') ++zeros;
  return run.substr(zeros);
}

// Digit runs of any length compare by value without converting them to a machine integer:
// with leading zeros gone, the longer run is the larger, and equal lengths compare digit by
// digit.
std::strong_ordering compareRunValues(std::string_view a, std::string_view b) {
  a = withoutLeadingZeros(a);
  b = withoutLeadingZeros(b);
  if (a.size() != b.size()) return a.size() <=> b.size();
  int byBytes = a.compare(b);
  return byBytes <=> 0;
}

}  // namespace

std::strong_ordering compareVersionString(std::string_view a, std::string_view b) {
  // The common case of a rule that names its value exactly (an extension point, a type): equal
  // bytes are equal in every run below, so one memcmp answers it.
  if (a == b) return std::strong_ordering::equal;
  size_t i = 0;
  size_t j = 0;
  std::strong_ordering tieBreak = std::strong_ordering::equal;
  while (i < a.size() && j < b.size()) {
    if (isDigit(a[i]) && isDigit(b[j])) {
      std::string_view runA = digitRun(a, i);
      std::string_view runB = digitRun(b, j);
      std::strong_ordering byValue = compareRunValues(runA, runB);
      if (byValue != 0) return byValue;
      if (tieBreak == 0 && runA.size() != runB.size()) {
        tieBreak =
            runA.size() > runB.size() ? std::strong_ordering::less : std::strong_ordering::greater;
      }
      continue;
    }
    auto byteA = static_cast<unsigned char>(a[i]);
    auto byteB = static_cast<unsigned char>(b[j]);
    if (byteA != byteB) return byteA <=> byteB;
    ++i;
    ++j;
  }
  if (i < a.size()) return std::strong_ordering::greater;
  if (j < b.size()) return std::strong_ordering::less;
  return tieBreak;
}

std::strong_ordering compareVersionString(const std::string* receiver, std::string_view other) {
  if (receiver == nullptr) return std::strong_ordering::equal;
  return compareVersionString(std::string_view(*receiver), other);
}

}  // namespace ek
