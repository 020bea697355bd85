#include "platform/json/WireJson.h"

#include <openssl/evp.h>

#include <fmt/format.h>

#include <algorithm>
#include <cmath>
#include <ctime>
#include <limits>
#include <nlohmann/json.hpp>
#include <optional>
#include <utility>
#include <vector>

namespace ek::wirejson {
namespace {

using Json = nlohmann::json;

constexpr std::string_view kUuidMember = "$uuid";
constexpr std::string_view kDataMember = "$data";
constexpr std::string_view kDateMember = "$date";
constexpr std::string_view kRealMember = "$real";

// JSON has no literal for these; typed numbers carry them as text.
constexpr std::string_view kNaN = "NaN";
constexpr std::string_view kInfinity = "Infinity";
constexpr std::string_view kMinusInfinity = "-Infinity";

// ---- Base64 ---------------------------------------------------------------------------------

// Whole groups, so that every chunk but the last encodes without padding.
constexpr size_t kEncodeChunk = 3 * 4096;
constexpr size_t kDecodeChunk = 4 * 4096;

std::string encodeBase64(const Data& data) {
  std::string text;
  text.resize((data.size() + 2) / 3 * 4);
  size_t written = 0;
  std::vector<unsigned char> buffer(kEncodeChunk / 3 * 4 + 1);
  for (size_t at = 0; at < data.size(); at += kEncodeChunk) {
    size_t length = std::min(kEncodeChunk, data.size() - at);
    int n = EVP_EncodeBlock(buffer.data(), data.data() + at, static_cast<int>(length));
    std::copy_n(buffer.data(), n, text.data() + written);
    written += static_cast<size_t>(n);
  }
  text.resize(written);
  return text;
}

bool isBase64Digit(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '+' ||
         c == '/';
}

// OpenSSL's decoder skips surrounding white space and takes '=' anywhere as zero bits, so the
// text is checked here first: padded groups of four, '=' only as the last one or two characters.
std::optional<Data> decodeBase64(std::string_view text) {
  if (text.size() % 4 != 0) return std::nullopt;
  size_t padding = 0;
  if (!text.empty() && text.back() == '=') padding = text[text.size() - 2] == '=' ? 2 : 1;
  for (size_t i = 0; i < text.size() - padding; ++i) {
    if (!isBase64Digit(text[i])) return std::nullopt;
  }
  Data data(text.size() / 4 * 3);
  size_t written = 0;
  for (size_t at = 0; at < text.size(); at += kDecodeChunk) {
    size_t length = std::min(kDecodeChunk, text.size() - at);
    int n = EVP_DecodeBlock(data.data() + written,
                            reinterpret_cast<const unsigned char*>(text.data() + at),
                            static_cast<int>(length));
    if (n < 0) return std::nullopt;
    written += static_cast<size_t>(n);
  }
  data.resize(written - padding);
  return data;
}

// ---- Parsing --------------------------------------------------------------------------------

std::optional<double> typedNumber(const Value& value) {
  if (auto number = value.numericValue()) return number;
  if (const std::string* text = value.string()) {
    if (*text == kNaN) return std::numeric_limits<double>::quiet_NaN();
    if (*text == kInfinity) return std::numeric_limits<double>::infinity();
    if (*text == kMinusInfinity) return -std::numeric_limits<double>::infinity();
  }
  return std::nullopt;
}

struct Frame {
  bool isObject = false;
  // Opened one level beyond the depth limit: acceptable only as a typed value, which is a
  // leaf of the value model.
  bool mustBeTyped = false;
  Array array;
  Dictionary dictionary;
  std::string key;
  // A member was itself a typed value: {"$real": {"$real": 1}} is not a number.
  bool holdsTypedMember = false;
};

// Builds the value directly from nlohmann's SAX events. Returning false stops the parser;
// error_ then says why.
class Builder {
 public:
  using number_integer_t = Json::number_integer_t;
  using number_unsigned_t = Json::number_unsigned_t;
  using number_float_t = Json::number_float_t;
  using string_t = Json::string_t;
  using binary_t = Json::binary_t;

  bool null() { return fail("null has no counterpart in the value model"); }
  bool boolean(bool flag) { return deliver(Value(flag)); }
  bool number_integer(number_integer_t number) { return deliver(Value(number)); }
  bool number_unsigned(number_unsigned_t number) { return deliver(Value(number)); }
  bool number_float(number_float_t number, const string_t& literal) {
    if (literal.find_first_of(".eE") == std::string::npos) {
      return fail("integer " + literal + " is outside the 64-bit range");
    }
    if (!std::isfinite(number)) return fail("number " + literal + " is out of range");
    return deliver(Value(number));
  }
  bool string(string_t& text) { return deliver(Value(std::move(text))); }
  bool binary(binary_t&) { return fail("binary values are not JSON"); }

  bool start_object(std::size_t) { return open(true); }
  bool key(string_t& name) {
    Frame& frame = stack_.back();
    if (frame.dictionary.contains(name)) return fail("object repeats the key \"" + name + "\"");
    frame.key = std::move(name);
    return true;
  }
  bool end_object() {
    Frame& frame = stack_.back();
    Dictionary dictionary = std::move(frame.dictionary);
    bool mustBeTyped = frame.mustBeTyped;
    bool holdsTypedMember = frame.holdsTypedMember;
    stack_.pop_back();
    if (dictionary.size() == 1) {
      auto& [name, member] = *dictionary.begin();
      if (name == kUuidMember || name == kDataMember || name == kDateMember ||
          name == kRealMember) {
        if (holdsTypedMember) return fail(name + " holds a typed value");
        return typed(name, member);
      }
    }
    if (mustBeTyped) return tooDeep();
    return deliver(Value(std::move(dictionary)));
  }

  bool start_array(std::size_t) { return open(false); }
  bool end_array() {
    Array array = std::move(stack_.back().array);
    stack_.pop_back();
    return deliver(Value(std::move(array)));
  }

  bool parse_error(std::size_t position, const std::string&, const nlohmann::detail::exception& e) {
    if (error_.empty()) {
      // nlohmann's text starts with "[json.exception.parse_error.101] parse error at ...".
      std::string_view what = e.what();
      if (auto bracket = what.find("] "); bracket != std::string_view::npos) {
        what.remove_prefix(bracket + 2);
      }
      error_ =
          "wire JSON is malformed at byte " + std::to_string(position) + ": " + std::string(what);
    }
    return false;
  }

  Result<Value> result() {
    if (!error_.empty()) return EkError::format(error_);
    if (!root_) return EkError::format("wire JSON holds no value");
    return std::move(*root_);
  }

 private:
  bool fail(std::string message) {
    if (message.rfind("wire JSON", 0) != 0) message = "wire JSON " + message;
    error_ = std::move(message);
    return false;
  }

  bool tooDeep() { return fail("is nested deeper than " + std::to_string(kMaxDepth) + " levels"); }

  bool open(bool isObject) {
    if (stack_.size() > kMaxDepth || (stack_.size() == kMaxDepth && !isObject)) return tooDeep();
    Frame frame;
    frame.isObject = isObject;
    frame.mustBeTyped = stack_.size() == kMaxDepth;
    stack_.push_back(std::move(frame));
    return true;
  }

  bool typed(std::string_view name, const Value& member) {
    if (name == kUuidMember) {
      const std::string* text = member.string();
      std::optional<Uuid> uuid = text ? Uuid::parse(*text) : std::nullopt;
      if (!uuid) return fail("$uuid is not a UUID in canonical text");
      return deliver(Value(*uuid), true);
    }
    if (name == kDataMember) {
      const std::string* text = member.string();
      std::optional<Data> data = text ? decodeBase64(*text) : std::nullopt;
      if (!data) return fail("$data is not base64 text");
      return deliver(Value(std::move(*data)), true);
    }
    std::optional<double> number = typedNumber(member);
    if (!number) return fail(std::string(name) + " is not a number");
    if (name == kDateMember) return deliver(Value(Date{*number}), true);
    return deliver(Value(*number), true);
  }

  bool deliver(Value value, bool isTyped = false) {
    if (stack_.empty()) {
      root_ = std::move(value);
      return true;
    }
    Frame& frame = stack_.back();
    if (frame.isObject) {
      frame.dictionary.emplace(std::move(frame.key), std::move(value));
      frame.key.clear();
      frame.holdsTypedMember |= isTyped;
    } else {
      frame.array.push_back(std::move(value));
    }
    return true;
  }

  std::vector<Frame> stack_;
  std::optional<Value> root_;
  std::string error_;
};

// ---- Writing --------------------------------------------------------------------------------

Json typedNumberJson(double number) {
  if (std::isnan(number)) return Json(kNaN);
  if (std::isinf(number)) return Json(number > 0 ? kInfinity : kMinusInfinity);
  return Json(number);
}

// RFC 3339 in UTC, with the fraction of a second only when there is one.
Json plainDate(double seconds) {
  if (!std::isfinite(seconds)) return Json();
  double whole = std::floor(seconds);
  if (whole < -62135596800.0 || whole > 253402300799.0) return Json(seconds);
  time_t time = static_cast<time_t>(whole);
  struct tm utc {};
  gmtime_r(&time, &utc);
  std::string text = fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}", utc.tm_year + 1900,
                                 utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec);
  if (int millis = static_cast<int>(std::lround((seconds - whole) * 1000)); millis > 0) {
    text += fmt::format(".{:03}", std::min(millis, 999));
  }
  return Json(text + "Z");
}

Json toJson(const Value& value, bool plain) {
  if (plain) {
    switch (value.type()) {
      case ValueType::Double: {
        double number = *value.doubleNumber();
        return std::isfinite(number) ? Json(number) : Json();
      }
      case ValueType::Data:
        return Json(encodeBase64(*value.data()));
      case ValueType::Uuid:
        return Json(value.uuid()->string());
      case ValueType::Date:
        return plainDate(value.date()->seconds);
      default:
        break;
    }
  }
  switch (value.type()) {
    case ValueType::String:
      return Json(*value.string());
    case ValueType::Unsigned:
      return Json(*value.unsignedNumber());
    case ValueType::Negative:
      return Json(*value.negativeNumber());
    case ValueType::Double:
      return Json::object({{kRealMember, typedNumberJson(*value.doubleNumber())}});
    case ValueType::Bool:
      return Json(*value.boolean());
    case ValueType::Data:
      return Json::object({{kDataMember, encodeBase64(*value.data())}});
    case ValueType::Uuid:
      return Json::object({{kUuidMember, value.uuid()->string()}});
    case ValueType::Date:
      return Json::object({{kDateMember, typedNumberJson(value.date()->seconds)}});
    case ValueType::Array: {
      Json array = Json::array();
      for (const Value& element : *value.array()) array.push_back(toJson(element, plain));
      return array;
    }
    case ValueType::Dictionary: {
      Json object = Json::object();
      for (const auto& [key, member] : *value.dictionary()) object[key] = toJson(member, plain);
      return object;
    }
  }
  return Json();
}

}  // namespace

Result<Value> parse(std::string_view text) {
  Builder builder;
  Json::sax_parse(text.begin(), text.end(), &builder);
  return builder.result();
}

std::string write(const Value& value, bool pretty) {
  // Invalid UTF-8 in a string built in-process becomes U+FFFD rather than an exception.
  return toJson(value, false).dump(pretty ? 2 : -1, ' ', false, Json::error_handler_t::replace);
}

std::string writePlain(const Value& value, bool pretty) {
  return toJson(value, true).dump(pretty ? 2 : -1, ' ', false, Json::error_handler_t::replace);
}

}  // namespace ek::wirejson
