#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace ek {

// Error domains. The system's own errors travel on the wire as "errorcode" and "error".
inline constexpr std::string_view kEkoraErrorDomain = "Ekora";
// Operating-system failures: the code is the errno value.
inline constexpr std::string_view kPosixErrorDomain = "POSIX";
// Malformed bytes in a file or a message (dmap, CBOR, wire JSON).
inline constexpr std::string_view kFormatErrorDomain = "Format";

// An error value: the outcome of an operation that failed in a way a caller can handle.
struct EkError {
  std::string domain;
  int32_t code = 0;
  std::string message;

  static EkError ekora(int32_t code, std::string message) {
    return {std::string(kEkoraErrorDomain), code, std::move(message)};
  }
  static EkError posix(int errnoValue, std::string message) {
    return {std::string(kPosixErrorDomain), errnoValue, std::move(message)};
  }
  // An errno failure described as "<what>: <strerror>".
  static EkError fromErrno(int errnoValue, std::string_view what);
  static EkError format(std::string message) {
    return {std::string(kFormatErrorDomain), 1, std::move(message)};
  }

  bool isEkora() const { return domain == kEkoraErrorDomain; }
  bool isPosix(int errnoValue) const { return domain == kPosixErrorDomain && code == errnoValue; }
  // The localized description of the platform is the message itself.
  const std::string& description() const { return message; }

  bool operator==(const EkError&) const = default;
};

}  // namespace ek
