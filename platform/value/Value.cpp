#include "platform/value/Value.h"

#include <fmt/format.h>

#include <cstring>

#include "platform/value/EkError.h"

namespace ek {

EkError EkError::fromErrno(int errnoValue, std::string_view what) {
  return posix(errnoValue, fmt::format("{}: {}", what, std::strerror(errnoValue)));
}

std::string_view valueTypeName(ValueType type) {
  switch (type) {
    case ValueType::String:
      return "string";
    case ValueType::Unsigned:
      return "unsigned integer";
    case ValueType::Negative:
      return "signed integer";
    case ValueType::Double:
      return "double";
    case ValueType::Bool:
      return "boolean";
    case ValueType::Data:
      return "data";
    case ValueType::Uuid:
      return "uuid";
    case ValueType::Date:
      return "date";
    case ValueType::Array:
      return "array";
    case ValueType::Dictionary:
      return "dictionary";
  }
  return "unknown";
}

const Value* Value::get(std::string_view key) const {
  const Dictionary* dict = dictionary();
  if (dict == nullptr) return nullptr;
  auto it = dict->find(key);
  return it == dict->end() ? nullptr : &it->second;
}

const std::string* Value::getString(std::string_view key) const {
  const Value* v = get(key);
  return v ? v->string() : nullptr;
}

const Array* Value::getArray(std::string_view key) const {
  const Value* v = get(key);
  return v ? v->array() : nullptr;
}

const Dictionary* Value::getDictionary(std::string_view key) const {
  const Value* v = get(key);
  return v ? v->dictionary() : nullptr;
}

const uint64_t* Value::getUnsigned(std::string_view key) const {
  const Value* v = get(key);
  return v ? v->unsignedNumber() : nullptr;
}

std::optional<double> Value::numericValue() const {
  if (auto* u = unsignedNumber()) return static_cast<double>(*u);
  if (auto* n = negativeNumber()) return static_cast<double>(*n);
  if (auto* d = doubleNumber()) return *d;
  return std::nullopt;
}

namespace {

void quote(std::string& out, std::string_view text) {
  out.push_back('"');
  for (char c : text) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          out += fmt::format("\\u{:04x}", static_cast<unsigned char>(c));
        } else {
          out.push_back(c);
        }
    }
  }
  out.push_back('"');
}

void describe(std::string& out, const Value& value, int depth) {
  if (depth > 64) {
    out += "...";
    return;
  }
  std::visit(
      [&](const auto& v) {
        using T = std::decay_t<decltype(v)>;
        if constexpr (std::is_same_v<T, std::string>) {
          quote(out, v);
        } else if constexpr (std::is_same_v<T, uint64_t> || std::is_same_v<T, int64_t>) {
          out += fmt::format("{}", v);
        } else if constexpr (std::is_same_v<T, double>) {
          out += fmt::format("{}", v);
        } else if constexpr (std::is_same_v<T, bool>) {
          out += v ? "true" : "false";
        } else if constexpr (std::is_same_v<T, Data>) {
          out += fmt::format("<{} bytes>", v.size());
        } else if constexpr (std::is_same_v<T, Uuid>) {
          out += v.string();
        } else if constexpr (std::is_same_v<T, Date>) {
          out += fmt::format("@{}", v.seconds);
        } else if constexpr (std::is_same_v<T, Array>) {
          out.push_back('[');
          for (size_t i = 0; i < v.size(); ++i) {
            if (i) out += ", ";
            describe(out, v[i], depth + 1);
          }
          out.push_back(']');
        } else {
          out.push_back('{');
          bool first = true;
          for (const auto& [key, member] : v) {
            if (!first) out += ", ";
            first = false;
            quote(out, key);
            out += ": ";
            describe(out, member, depth + 1);
          }
          out.push_back('}');
        }
      },
      value.storage());
}

}  // namespace

std::string Value::description() const {
  std::string out;
  describe(out, *this, 0);
  return out;
}

}  // namespace ek
