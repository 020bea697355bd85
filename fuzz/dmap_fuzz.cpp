// Parses arbitrary bytes as a dmap document; whatever parses must write, read back to the same
// value (doubles bit for bit) and write again to the same bytes.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "fuzz/SameValue.h"
#include "platform/dmap/Dmap.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  ek::Result<ek::Value> parsed = ek::dmap::parse(bytes);
  if (!parsed.ok()) {
    if (parsed.error().domain != ek::kFormatErrorDomain) abort();
    return 0;
  }
  ek::Result<std::string> written = ek::dmap::write(*parsed);
  if (!written.ok()) {
    std::fprintf(stderr, "write refused a parsed value: %s\n", written.error().message.c_str());
    abort();
  }
  ek::Result<ek::Value> reparsed = ek::dmap::parse(*written);
  if (!reparsed.ok()) {
    std::fprintf(stderr, "cannot read back what was written: %s\n%s\n",
                 reparsed.error().message.c_str(), written->c_str());
    abort();
  }
  if (!ek::fuzz::sameValue(*parsed, *reparsed)) {
    std::fprintf(stderr, "round trip changed the value:\n%s\n", written->c_str());
    abort();
  }
  ek::Result<std::string> rewritten = ek::dmap::write(*reparsed);
  if (!rewritten.ok() || *rewritten != *written) abort();
  return 0;
}
