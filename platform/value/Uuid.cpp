#include "platform/value/Uuid.h"

#include <sys/random.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

namespace ek {
namespace {

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

std::optional<Uuid> Uuid::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  Uuid uuid;
  size_t byte = 0;
  for (size_t i = 0; i < text.size();) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    int high = hexDigit(text[i]);
    int low = hexDigit(text[i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    uuid.bytes[byte++] = static_cast<uint8_t>(high << 4 | low);
    i += 2;
  }
  return uuid;
}

Uuid Uuid::fromBytes(const uint8_t* sixteen) {
  Uuid uuid;
  std::memcpy(uuid.bytes.data(), sixteen, 16);
  return uuid;
}

Uuid Uuid::random() {
  Uuid uuid;
  size_t filled = 0;
  while (filled < uuid.bytes.size()) {
    ssize_t n = getrandom(uuid.bytes.data() + filled, uuid.bytes.size() - filled, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      throw std::runtime_error("getrandom failed: the kernel's random source is unavailable");
    }
    filled += static_cast<size_t>(n);
  }
  uuid.bytes[6] = (uuid.bytes[6] & 0x0F) | 0x40;
  uuid.bytes[8] = (uuid.bytes[8] & 0x3F) | 0x80;
  return uuid;
}

std::string Uuid::string() const {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string text;
  text.reserve(36);
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text.push_back('-');
    text.push_back(kDigits[bytes[i] >> 4]);
    text.push_back(kDigits[bytes[i] & 0x0F]);
  }
  return text;
}

bool Uuid::isNull() const {
  for (uint8_t b : bytes) {
    if (b != 0) return false;
  }
  return true;
}

}  // namespace ek
