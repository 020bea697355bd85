#pragma once

#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek::cbor {

inline constexpr size_t kMaxDepth = 512;

// Appends the CBOR encoding of value (definite lengths, shortest forms) to out. A double or a
// date's seconds take the shortest of half, single and double float that holds the number
// exactly; every NaN becomes the half-precision NaN f97e00. Strings are written as they are:
// one that is not UTF-8 will not decode.
void encode(const Value& value, std::vector<uint8_t>& out);
std::vector<uint8_t> encode(const Value& value);

// Pieces for writing an array or a map whose members are encoded separately, e.g. members kept
// encoded from an earlier message. The caller appends exactly count elements (count key and
// value pairs for a map, each key written with encodeText).
void encodeArrayHead(uint64_t count, std::vector<uint8_t>& out);
void encodeMapHead(uint64_t count, std::vector<uint8_t>& out);
void encodeText(std::string_view text, std::vector<uint8_t>& out);
// At least as many bytes as encode appends for value.
size_t encodedSizeBound(const Value& value);

// Decodes exactly one CBOR data item spanning all of bytes into the value model. Refuses,
// with a Format error, anything the value model cannot carry, a map key that is not text,
// nesting deeper than kMaxDepth, a declared length larger than the bytes that remain, and
// trailing bytes. Never allocates more than a small multiple of the input's size.
// Indefinite-length strings, arrays and maps are accepted under the same bounds; half and
// single floats become doubles; tag 1 may wrap an integer or a float. Null, undefined, other
// simple values, other tags, duplicate map keys and text that is not UTF-8 are refused.
Result<Value> decode(std::span<const uint8_t> bytes);

// Checks bytes as decode does but builds only the entries of the top-level map whose keys are
// among keys, and answers those (none when the item is not a map). For a reader that needs a
// few members of a large message, such as the error of a reply. Repeated map keys are looked
// for only among the entries answered: where decode refuses nothing else, this answers
// decode's entries under keys.
Result<Dictionary> decodeEntries(std::span<const uint8_t> bytes,
                                 std::span<const std::string_view> keys);

}  // namespace ek::cbor
