// Decodes arbitrary bytes as a CBOR frame body; whatever decodes must encode to bytes that
// decode to the same value, and encoding must be deterministic.
#include <cstdint>
#include <cstdlib>
#include <span>
#include <vector>

#include "fuzz/SameValue.h"
#include "platform/cbor/Cbor.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  auto decoded = ek::cbor::decode(std::span<const uint8_t>(data, size));
  if (!decoded.ok()) return 0;
  std::vector<uint8_t> encoded = ek::cbor::encode(*decoded);
  auto again = ek::cbor::decode(encoded);
  if (!again.ok() || !ek::fuzz::sameValue(*decoded, *again)) abort();
  if (ek::cbor::encode(*again) != encoded) abort();
  return 0;
}
