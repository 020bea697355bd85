#pragma once

#include <string>
#include <string_view>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace ek::wirejson {

inline constexpr size_t kMaxDepth = 512;

// Parses wire JSON into the value model; a Format error names what is wrong. null, duplicate
// keys, integers outside the 64-bit range and malformed typed values are refused. A plain
// JSON number with a fraction or an exponent is a double. "$real" and "$date" also take the
// strings "NaN", "Infinity" and "-Infinity", which JSON has no number for.
Result<Value> parse(std::string_view text);

// Writes wire JSON: object members in sorted key order, doubles as {"$real": x}, UUIDs in
// upper case. Pretty output indents by two spaces; compact output is one line. Data is base64
// with padding. parse(write(v)) == v for every value except a dictionary whose only key is
// "$uuid", "$data", "$date" or "$real", which the notation cannot tell from a typed value.
std::string write(const Value& value, bool pretty = false);

// Writes plain JSON for tools such as jq, which cannot be parsed back into the same values:
// UUIDs as upper-case text, dates as RFC 3339 text in UTC ("2026-11-25T10:04:05Z"), data as
// base64 text, doubles as numbers (null when not finite). Key order and pretty printing as in
// write.
std::string writePlain(const Value& value, bool pretty = false);

}  // namespace ek::wirejson
