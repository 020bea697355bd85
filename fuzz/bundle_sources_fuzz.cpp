// Checks arbitrary bytes as a bundle's record of sources, as the start-up scan does with what
// it reads back from the registry: never a crash, and a record of another context never holds.
#include <cstdint>
#include <cstdlib>
#include <span>

#include "platform/vantor/BundleSources.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::span<const uint8_t> record(data, size);
  bool holds = ek::vantor::BundleSources::Checker("ctx").unchanged(record);
  bool holdsElsewhere = ek::vantor::BundleSources::Checker("another context").unchanged(record);
  if (holds && holdsElsewhere) abort();
  return 0;
}
