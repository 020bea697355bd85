#pragma once

#include <array>
#include <compare>
#include <cstdint>
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
};

}  // namespace ek

template <>
struct std::hash<ek::Uuid> {
  size_t operator()(const ek::Uuid& uuid) const noexcept;
};
