// Parses arbitrary text as wire JSON; whatever parses must write, compact and pretty, to text
// that parses to the same value, and writing must be deterministic.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "fuzz/SameValue.h"
#include "platform/json/WireJson.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  auto parsed = ek::wirejson::parse(text);
  if (!parsed.ok()) return 0;
  for (bool pretty : {false, true}) {
    std::string written = ek::wirejson::write(*parsed, pretty);
    auto again = ek::wirejson::parse(written);
    if (!again.ok() || !ek::fuzz::sameValue(*parsed, *again)) abort();
    if (ek::wirejson::write(*again, pretty) != written) abort();
  }
  return 0;
}
