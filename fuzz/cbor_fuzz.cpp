// Decodes arbitrary bytes as a CBOR frame body; whatever decodes must encode to bytes that
// decode to the same value, and encoding must be deterministic. decodeEntries must agree with
// decode: refuse only what decode refuses, and answer decode's entries under its keys.
#include <array>
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string_view>
#include <vector>

#include "fuzz/SameValue.h"
#include "platform/cbor/Cbor.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::span<const uint8_t> input(data, size);
  auto decoded = ek::cbor::decode(input);
  // Short keys, so that the fuzzer meets them; the empty key as well.
  static constexpr std::array<std::string_view, 4> kKeys = {"a", "b", "errorcode", ""};
  auto entries = ek::cbor::decodeEntries(input, kKeys);
  if (!entries.ok() && decoded.ok()) abort();
  if (!decoded.ok()) return 0;
  if (const ek::Dictionary* all = decoded->dictionary()) {
    ek::Dictionary expected;
    for (std::string_view key : kKeys) {
      auto it = all->find(key);
      if (it != all->end()) expected.insert(*it);
    }
    if (!ek::fuzz::sameValue(ek::Value(expected), ek::Value(*entries))) abort();
  } else if (!entries->empty()) {
    abort();
  }
  std::vector<uint8_t> encoded = ek::cbor::encode(*decoded);
  auto again = ek::cbor::decode(encoded);
  if (!again.ok() || !ek::fuzz::sameValue(*decoded, *again)) abort();
  if (ek::cbor::encode(*again) != encoded) abort();
  return 0;
}
