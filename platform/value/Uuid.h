#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <cstring>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace ek {

// A 16-byte UUID. Parsed in upper or lower case; always written in upper case.
struct Uuid {
  std::array<uint8_t, 16> bytes{};

  // Canonical 8-4-4-4-12 text, either case; anything else is absent.
  static std::optional<Uuid> parse(std::string_view text);
  static Uuid fromBytes(const uint8_t* sixteen);
  // A random (version 4) UUID from the kernel's random source.
  static Uuid random();

  std::string string() const;
  bool isNull() const;

  auto operator<=>(const Uuid&) const = default;
  // Records and forms are found by UUID many times per request: two word compares instead
  // of a call to memcmp.
  bool operator==(const Uuid& other) const {
    return word(0) == other.word(0) && word(1) == other.word(1);
  }

  uint64_t word(size_t index) const {
    uint64_t value;
    std::memcpy(&value, bytes.data() + 8 * index, 8);
    return value;
  }
};

}  // namespace ek

template <>
struct std::hash<ek::Uuid> {
  size_t operator()(const ek::Uuid& uuid) const noexcept {
    return static_cast<size_t>(uuid.word(0) ^ (uuid.word(1) * 0x9E3779B97F4A7C15ULL));
  }
};
