// Values as clients send them (CBOR), held to what the dmap writer can carry: the check and
// the writer agree on every value, and whatever they accept reads back and writes again to the
// same bytes.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>
#include <string>

#include "platform/cbor/Cbor.h"
#include "platform/dmap/Dmap.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  ek::Result<ek::Value> decoded = ek::cbor::decode(std::span<const uint8_t>(data, size));
  if (!decoded.ok()) return 0;
  // At the root, and where an annotation's entries sit in the annotation file.
  for (size_t depth : {size_t{0}, size_t{3}}) {
    ek::Result<void> checked = ek::dmap::checkWritable(*decoded, depth);
    ek::Result<std::string> written =
        depth == 0 ? ek::dmap::write(*decoded) : ek::dmap::writeEntry("k", *decoded, depth);
    if (!checked.ok()) {
      if (written.ok() || written.error() != checked.error()) {
        std::fprintf(stderr, "the writer does not refuse what the check refuses: %s\n",
                     checked.error().message.c_str());
        abort();
      }
      continue;
    }
    // Accepted, the value can fail only the size limit.
    if (!written.ok() || depth != 0) continue;
    ek::Result<ek::Value> reparsed = ek::dmap::parse(*written);
    if (!reparsed.ok()) {
      std::fprintf(stderr, "cannot read back what was written: %s\n",
                   reparsed.error().message.c_str());
      abort();
    }
    ek::Result<std::string> rewritten = ek::dmap::write(*reparsed);
    if (!rewritten.ok() || *rewritten != *written) abort();
  }
  return 0;
}
