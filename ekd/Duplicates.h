#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/value/Value.h"

namespace ek {

// Of the matches of one reply that share an identifier, which the reply keeps: the greatest
// version wins; of equal versions a copy on the system volume, else the one modified last. The
// discovery flags may keep every version, or every copy.
class DuplicateFilter {
 public:
  // A match as the filter weighs it.
  struct Copy {
    std::optional<std::string> identifier;
    // The version of the plug-in's info; null when it has none.
    const Value* version = nullptr;
    bool system = false;
    int32_t modified = 0;
  };
  // What becomes of a match: dropped, or kept at the next position (the number of matches kept
  // before it), in place of the earlier match at replaces, if any.
  struct Verdict {
    bool kept = false;
    std::optional<size_t> replaces;
  };

  // expected: how many matches are likely, so that the index is not rebuilt as it grows.
  explicit DuplicateFilter(uint64_t flags, size_t expected = 0) : flags_(flags) {
    accepted_.reserve(expected);
  }
  // Fed every match in order.
  Verdict admit(const Copy& copy);

  // A kept match as later ones are weighed against it.
  struct Weighed {
    std::string version;
    bool system = false;
    int32_t modified = 0;
  };

 private:
  uint64_t flags_;
  size_t next_ = 0;
  // Per identifier, the positions of its kept matches, earliest first; the index keeps the
  // filter linear in the number of matches.
  std::unordered_map<std::string, std::vector<std::pair<size_t, Weighed>>> accepted_;
};

}  // namespace ek
