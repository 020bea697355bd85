#include "platform/dmap/Dmap.h"

#include <dirent.h>
#include <expat.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <locale.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <optional>
#include <utility>
#include <vector>

#include <fmt/format.h>

#include "platform/io/UniqueFd.h"

namespace ek::dmap {
namespace {

// ---------------------------------------------------------------------------------------------
// Shared helpers

bool isXmlSpace(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

std::string_view trimXmlSpace(std::string_view text) {
  while (!text.empty() && isXmlSpace(text.front())) text.remove_prefix(1);
  while (!text.empty() && isXmlSpace(text.back())) text.remove_suffix(1);
  return text;
}

bool isAllXmlSpace(std::string_view text) {
  for (char c : text) {
    if (!isXmlSpace(c)) return false;
  }
  return true;
}

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// Days since 1970-01-01 of a proleptic Gregorian date, and back (H. Hinnant's algorithms).
int64_t daysFromCivil(int64_t year, unsigned month, unsigned day) {
  year -= month <= 2;
  const int64_t era = (year >= 0 ? year : year - 399) / 400;
  const auto yearOfEra = static_cast<unsigned>(year - era * 400);
  const unsigned dayOfYear = (153 * (month > 2 ? month - 3 : month + 9) + 2) / 5 + day - 1;
  const unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
  return era * 146097 + static_cast<int64_t>(dayOfEra) - 719468;
}

struct Civil {
  int64_t year;
  unsigned month;
  unsigned day;
};

Civil civilFromDays(int64_t days) {
  days += 719468;
  const int64_t era = (days >= 0 ? days : days - 146096) / 146097;
  const auto dayOfEra = static_cast<unsigned>(days - era * 146097);
  const unsigned yearOfEra =
      (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
  const int64_t year = static_cast<int64_t>(yearOfEra) + era * 400;
  const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
  const unsigned mp = (5 * dayOfYear + 2) / 153;
  const unsigned day = dayOfYear - (153 * mp + 2) / 5 + 1;
  const unsigned month = mp < 10 ? mp + 3 : mp - 9;
  return {year + (month <= 2), month, day};
}

bool isLeapYear(int64_t year) {
  return (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
}

unsigned daysInMonth(int64_t year, unsigned month) {
  static constexpr unsigned kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return month == 2 && isLeapYear(year) ? 29 : kDays[month - 1];
}

// The dates a document can hold: years 0001 to 9999. Year 0000 is not a year of the calendar
// every reader of the text agrees on.
const int64_t kFirstSecond = daysFromCivil(1, 1, 1) * 86400;
const int64_t kLastSecond = daysFromCivil(10000, 1, 1) * 86400 - 1;

// Keys and strings quoted in error messages are cut short: they come from untrusted files.
std::string quoted(std::string_view text) {
  constexpr size_t kMaxQuoted = 80;
  if (text.size() <= kMaxQuoted) return fmt::format("\"{}\"", text);
  return fmt::format("\"{}...\"", text.substr(0, kMaxQuoted));
}

// ---------------------------------------------------------------------------------------------
// Scalar conversions (reader)

Result<Value> parseInteger(std::string_view raw) {
  std::string_view text = trimXmlSpace(raw);
  const bool negative = !text.empty() && text.front() == '-';
  std::string_view digits = negative ? text.substr(1) : text;
  if (digits.empty()) return EkError::format(fmt::format("malformed integer {}", quoted(raw)));
  for (char c : digits) {
    if (!isDigit(c)) return EkError::format(fmt::format("malformed integer {}", quoted(raw)));
  }
  uint64_t magnitude = 0;
  auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), magnitude);
  if (ec == std::errc::result_out_of_range) {
    return EkError::format(fmt::format("integer {} out of range", quoted(text)));
  }
  if (ec != std::errc() || end != digits.data() + digits.size()) {
    return EkError::format(fmt::format("malformed integer {}", quoted(raw)));
  }
  if (!negative || magnitude == 0) return Value(magnitude);
  constexpr uint64_t kMinMagnitude = uint64_t{1} << 63;
  if (magnitude > kMinMagnitude) {
    return EkError::format(fmt::format("integer {} out of range", quoted(text)));
  }
  const int64_t number = magnitude == kMinMagnitude ? std::numeric_limits<int64_t>::min()
                                                    : -static_cast<int64_t>(magnitude);
  return Value(number);
}

// Decimal only: strtod alone would also take hexadecimal, "inf" and "nan".
bool isDecimalReal(std::string_view text) {
  size_t i = 0;
  if (i < text.size() && (text[i] == '-' || text[i] == '+')) ++i;
  size_t mantissaDigits = 0;
  while (i < text.size() && isDigit(text[i])) ++i, ++mantissaDigits;
  if (i < text.size() && text[i] == '.') {
    ++i;
    while (i < text.size() && isDigit(text[i])) ++i, ++mantissaDigits;
  }
  if (mantissaDigits == 0) return false;
  if (i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
    ++i;
    if (i < text.size() && (text[i] == '-' || text[i] == '+')) ++i;
    size_t exponentDigits = 0;
    while (i < text.size() && isDigit(text[i])) ++i, ++exponentDigits;
    if (exponentDigits == 0) return false;
  }
  return i == text.size();
}

locale_t cLocale() {
  static const locale_t locale = newlocale(LC_ALL_MASK, "C", static_cast<locale_t>(nullptr));
  return locale;
}

Result<Value> parseReal(std::string_view raw) {
  const std::string text(trimXmlSpace(raw));
  if (!isDecimalReal(text)) return EkError::format(fmt::format("malformed real {}", quoted(raw)));
  if (cLocale() == static_cast<locale_t>(nullptr)) {
    return EkError::format("cannot read reals: no C locale");
  }
  // Underflow rounds towards zero and is accepted; only overflow is out of range.
  const double number = strtod_l(text.c_str(), nullptr, cLocale());
  if (!std::isfinite(number)) {
    return EkError::format(fmt::format("real {} out of range", quoted(text)));
  }
  return Value(number);
}

Result<Value> parseDate(std::string_view raw) {
  std::string_view text = trimXmlSpace(raw);
  const auto malformed = [&] {
    return EkError::format(
        fmt::format("malformed date {} (expected YYYY-MM-DDTHH:MM:SSZ)", quoted(raw)));
  };
  static constexpr std::string_view kPattern = "dddd-dd-ddTdd:dd:ddZ";
  if (text.size() != kPattern.size()) return malformed();
  for (size_t i = 0; i < kPattern.size(); ++i) {
    if (kPattern[i] == 'd' ? !isDigit(text[i]) : text[i] != kPattern[i]) return malformed();
  }
  const auto field = [&](size_t at, size_t length) {
    unsigned number = 0;
    for (size_t i = at; i < at + length; ++i) number = number * 10 + (text[i] - '0');
    return number;
  };
  const int64_t year = field(0, 4);
  const unsigned month = field(5, 2), day = field(8, 2);
  const unsigned hour = field(11, 2), minute = field(14, 2), second = field(17, 2);
  if (year < 1 || month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month) ||
      hour > 23 || minute > 59 || second > 59) {
    return EkError::format(fmt::format("invalid date {}", quoted(text)));
  }
  const int64_t seconds =
      daysFromCivil(year, month, day) * 86400 + hour * 3600 + minute * 60 + second;
  return Value(Date{static_cast<double>(seconds)});
}

int base64Digit(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (isDigit(c)) return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

Result<Value> parseData(std::string_view raw) {
  std::string compact;
  compact.reserve(raw.size());
  for (char c : raw) {
    if (!isXmlSpace(c)) compact.push_back(c);
  }
  const auto malformed = [] { return EkError::format("malformed base64 in data"); };
  if (compact.size() % 4 != 0) return malformed();
  size_t padding = 0;
  while (padding < 2 && padding < compact.size() && compact[compact.size() - 1 - padding] == '=')
    ++padding;
  for (size_t i = 0; i < compact.size() - padding; ++i) {
    if (base64Digit(compact[i]) < 0) return malformed();
  }
  Data data(compact.size() / 4 * 3);
  if (compact.empty()) return Value(std::move(data));
  // The size is bounded by kMaxFileSize, far below INT_MAX.
  const int decoded = EVP_DecodeBlock(data.data(), reinterpret_cast<const uint8_t*>(compact.data()),
                                      static_cast<int>(compact.size()));
  if (decoded < 0 || static_cast<size_t>(decoded) != data.size()) return malformed();
  data.resize(data.size() - padding);
  return Value(std::move(data));
}

// ---------------------------------------------------------------------------------------------
// Reader

enum class Kind { Dmap, Dict, Array, Key, String, Integer, Real, True, False, Date, Data };

std::optional<Kind> kindOf(std::string_view name) {
  static constexpr std::pair<std::string_view, Kind> kKinds[] = {
      {"dict", Kind::Dict},     {"array", Kind::Array},     {"key", Kind::Key},
      {"string", Kind::String}, {"integer", Kind::Integer}, {"real", Kind::Real},
      {"true", Kind::True},     {"false", Kind::False},     {"date", Kind::Date},
      {"data", Kind::Data},
  };
  for (const auto& [kindName, kind] : kKinds) {
    if (kindName == name) return kind;
  }
  return std::nullopt;
}

bool holdsText(Kind kind) {
  switch (kind) {
    case Kind::Key:
    case Kind::String:
    case Kind::Integer:
    case Kind::Real:
    case Kind::Date:
    case Kind::Data:
      return true;
    default:
      return false;
  }
}

bool isContainer(Kind kind) {
  return kind == Kind::Dict || kind == Kind::Array;
}

// One open element. Containers collect their children in `value`; scalars and keys collect
// their character data in `text`. Finished children are moved into their parent, so building
// the tree copies nothing.
struct Frame {
  Kind kind;
  unsigned long line;
  std::string name;
  std::string text;
  Value value;
  std::optional<std::string> pendingKey;  // dict: a key still waiting for its value
  bool hasValue = false;                  // dmap: the root value has been seen
};

class Parser {
 public:
  Parser() : parser_(XML_ParserCreate("UTF-8")) {}
  ~Parser() {
    if (parser_ != nullptr) XML_ParserFree(parser_);
  }
  Parser(const Parser&) = delete;
  Parser& operator=(const Parser&) = delete;

  Result<Value> run(std::string_view bytes) {
    if (parser_ == nullptr) return EkError::format("cannot create an XML parser");
    if (bytes.size() > kMaxFileSize) {
      return EkError::format(
          fmt::format("document of {} bytes exceeds the limit of {}", bytes.size(), kMaxFileSize));
    }
    if (isAllXmlSpace(bytes)) return EkError::format("line 1: empty document");

    XML_SetUserData(parser_, this);
    XML_SetParamEntityParsing(parser_, XML_PARAM_ENTITY_PARSING_NEVER);
    XML_SetXmlDeclHandler(parser_, &Parser::onXmlDecl);
    XML_SetStartDoctypeDeclHandler(parser_, &Parser::onStartDoctype);
    XML_SetEntityDeclHandler(parser_, &Parser::onEntityDecl);
    XML_SetSkippedEntityHandler(parser_, &Parser::onSkippedEntity);
    XML_SetExternalEntityRefHandler(parser_, &Parser::onExternalEntityRef);
    XML_SetElementHandler(parser_, &Parser::onStart, &Parser::onEnd);
    XML_SetCharacterDataHandler(parser_, &Parser::onText);
    stack_.reserve(kMaxDepth + 3);

    const XML_Status status =
        XML_Parse(parser_, bytes.data(), static_cast<int>(bytes.size()), XML_TRUE);
    if (error_) return std::move(*error_);
    if (status != XML_STATUS_OK) {
      return EkError::format(fmt::format("line {}: {}", XML_GetCurrentLineNumber(parser_),
                                         XML_ErrorString(XML_GetErrorCode(parser_))));
    }
    if (!root_) return EkError::format("line 1: empty document");
    return std::move(*root_);
  }

 private:
  static Parser& self(void* userData) { return *static_cast<Parser*>(userData); }

  void fail(unsigned long line, std::string message) {
    if (error_) return;
    error_ = EkError::format(fmt::format("line {}: {}", line, message));
    XML_StopParser(parser_, XML_FALSE);
  }
  void fail(std::string message) { fail(XML_GetCurrentLineNumber(parser_), std::move(message)); }

  static void onXmlDecl(void* userData, const XML_Char* version, const XML_Char* encoding,
                        int /*standalone*/) {
    Parser& p = self(userData);
    if (version != nullptr && std::string_view(version) != "1.0") {
      p.fail(fmt::format("unsupported XML version {}", quoted(version)));
    } else if (encoding != nullptr && strcasecmp(encoding, "UTF-8") != 0) {
      p.fail(fmt::format("unsupported encoding {} (dmap is UTF-8)", quoted(encoding)));
    }
  }

  // Only the bare form is accepted: an external identifier or an internal subset would let
  // the document declare entities or point outside itself.
  static void onStartDoctype(void* userData, const XML_Char* name, const XML_Char* systemId,
                             const XML_Char* publicId, int hasInternalSubset) {
    Parser& p = self(userData);
    if (hasInternalSubset) {
      p.fail("DOCTYPE with an internal subset is not allowed");
    } else if (systemId != nullptr || publicId != nullptr) {
      p.fail("DOCTYPE with an external identifier is not allowed");
    } else if (std::string_view(name) != "dmap") {
      p.fail(fmt::format("DOCTYPE names {} instead of dmap", quoted(name)));
    }
  }

  static void onEntityDecl(void* userData, const XML_Char* name, int /*isParameterEntity*/,
                           const XML_Char* /*value*/, int /*valueLength*/, const XML_Char* /*base*/,
                           const XML_Char* /*systemId*/, const XML_Char* /*publicId*/,
                           const XML_Char* /*notationName*/) {
    self(userData).fail(fmt::format("entity declaration {} is not allowed", quoted(name)));
  }

  static void onSkippedEntity(void* userData, const XML_Char* name, int /*isParameterEntity*/) {
    self(userData).fail(fmt::format("undefined entity {}", quoted(name)));
  }

  static int XMLCALL onExternalEntityRef(XML_Parser parser, const XML_Char* /*context*/,
                                         const XML_Char* /*base*/, const XML_Char* /*systemId*/,
                                         const XML_Char* /*publicId*/) {
    // Never fetched. The user data is reachable through the parser.
    self(XML_GetUserData(parser)).fail("external entities are not allowed");
    return XML_STATUS_ERROR;
  }

  static void onStart(void* userData, const XML_Char* name, const XML_Char** attributes) {
    Parser& p = self(userData);
    if (!p.error_) p.start(name, attributes);
  }
  static void onEnd(void* userData, const XML_Char* /*name*/) {
    Parser& p = self(userData);
    if (!p.error_) p.end();
  }
  static void onText(void* userData, const XML_Char* text, int length) {
    Parser& p = self(userData);
    if (!p.error_) p.text(std::string_view(text, static_cast<size_t>(length)));
  }

  void start(std::string_view name, const XML_Char** attributes) {
    const unsigned long line = XML_GetCurrentLineNumber(parser_);
    if (stack_.empty()) {
      if (name != "dmap") return fail(line, fmt::format("root element <{}> is not <dmap>", name));
      bool hasVersion = false;
      for (size_t i = 0; attributes[i] != nullptr; i += 2) {
        const std::string_view attribute = attributes[i], value = attributes[i + 1];
        if (attribute != "version") {
          return fail(line, fmt::format("unknown attribute {} on <dmap>", quoted(attribute)));
        }
        if (value != "1.0") {
          return fail(line, fmt::format("unsupported dmap version {}", quoted(value)));
        }
        hasVersion = true;
      }
      if (!hasVersion) return fail(line, "<dmap> has no version attribute");
      stack_.push_back(Frame{Kind::Dmap, line, std::string(name)});
      return;
    }

    const std::optional<Kind> kind = kindOf(name);
    if (!kind) return fail(line, fmt::format("unknown element <{}>", name));
    if (attributes[0] != nullptr) {
      return fail(line, fmt::format("unknown attribute {} on <{}>", quoted(attributes[0]), name));
    }

    Frame& parent = stack_.back();
    switch (parent.kind) {
      case Kind::Dmap:
        if (*kind == Kind::Key) return fail(line, "<key> outside a dictionary");
        if (parent.hasValue) return fail(line, "more than one value in <dmap>");
        break;
      case Kind::Dict:
        if (*kind == Kind::Key && parent.pendingKey) {
          return fail(line, fmt::format("key {} has no value", quoted(*parent.pendingKey)));
        }
        if (*kind != Kind::Key && !parent.pendingKey) {
          return fail(line, fmt::format("<{}> in a dictionary without a key", name));
        }
        break;
      case Kind::Array:
        if (*kind == Kind::Key) return fail(line, "<key> outside a dictionary");
        break;
      default:
        return fail(line, fmt::format("<{}> inside <{}>", name, parent.name));
    }

    if (isContainer(*kind)) {
      if (containerDepth_ == kMaxDepth) {
        return fail(line, fmt::format("nesting deeper than {} levels", kMaxDepth));
      }
      ++containerDepth_;
    }
    Frame frame{*kind, line, std::string(name)};
    if (*kind == Kind::Array) frame.value = Value(Array{});
    stack_.push_back(std::move(frame));
  }

  void text(std::string_view chunk) {
    Frame& frame = stack_.back();
    if (holdsText(frame.kind)) {
      frame.text.append(chunk);
    } else if (!isAllXmlSpace(chunk)) {
      if (frame.kind == Kind::True || frame.kind == Kind::False) {
        fail(fmt::format("text inside <{}/>", frame.name));
      } else {
        fail("text outside a value");
      }
    }
  }

  void end() {
    Frame frame = std::move(stack_.back());
    stack_.pop_back();

    Value value;
    switch (frame.kind) {
      case Kind::Dmap:
        if (!frame.hasValue) return fail(frame.line, "<dmap> holds no value");
        return;
      case Kind::Key: {
        Frame& dict = stack_.back();
        if (dict.value.dictionary()->contains(frame.text)) {
          return fail(frame.line, fmt::format("duplicate key {}", quoted(frame.text)));
        }
        dict.pendingKey = std::move(frame.text);
        return;
      }
      case Kind::Dict:
        if (frame.pendingKey) {
          return fail(frame.line, fmt::format("key {} has no value", quoted(*frame.pendingKey)));
        }
        --containerDepth_;
        value = std::move(frame.value);
        break;
      case Kind::Array:
        --containerDepth_;
        value = std::move(frame.value);
        break;
      case Kind::String:
        value = Value(std::move(frame.text));
        break;
      case Kind::True:
        value = Value(true);
        break;
      case Kind::False:
        value = Value(false);
        break;
      case Kind::Integer:
      case Kind::Real:
      case Kind::Date:
      case Kind::Data: {
        Result<Value> scalar = frame.kind == Kind::Integer ? parseInteger(frame.text)
                               : frame.kind == Kind::Real  ? parseReal(frame.text)
                               : frame.kind == Kind::Date  ? parseDate(frame.text)
                                                           : parseData(frame.text);
        if (!scalar) return fail(frame.line, std::move(scalar).error().message);
        value = std::move(scalar).value();
        break;
      }
    }

    Frame& parent = stack_.back();
    switch (parent.kind) {
      case Kind::Dmap:
        parent.hasValue = true;
        root_ = std::move(value);
        break;
      case Kind::Array:
        parent.value.array()->push_back(std::move(value));
        break;
      case Kind::Dict:
        parent.value.dictionary()->emplace(std::move(*parent.pendingKey), std::move(value));
        parent.pendingKey.reset();
        break;
      default:
        std::abort();  // start() admits values only inside dmap, dict and array
    }
  }

  XML_Parser parser_;
  std::vector<Frame> stack_;
  size_t containerDepth_ = 0;
  std::optional<Value> root_;
  std::optional<EkError> error_;
};

// ---------------------------------------------------------------------------------------------
// Writer

// What the writer can carry, shared by write() and checkWritable() so that they cannot disagree.

// Whether text is UTF-8 made of characters XML 1.0 can carry.
Result<void> checkText(std::string_view text) {
  const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
  const size_t size = text.size();
  size_t i = 0;
  while (i < size) {
    const unsigned char c = bytes[i];
    if (c < 0x80) {
      if (c < 0x20 && c != '\t' && c != '\n' && c != '\r') {
        return EkError::format(fmt::format("cannot write control character U+{:04X} in dmap", c));
      }
      ++i;
      continue;
    }
    size_t length;
    uint32_t codePoint;
    if (c >= 0xC2 && c <= 0xDF) {
      length = 2, codePoint = c & 0x1F;
    } else if (c >= 0xE0 && c <= 0xEF) {
      length = 3, codePoint = c & 0x0F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      length = 4, codePoint = c & 0x07;
    } else {
      return EkError::format("cannot write invalid UTF-8 in dmap");
    }
    if (i + length > size) return EkError::format("cannot write invalid UTF-8 in dmap");
    for (size_t k = 1; k < length; ++k) {
      if ((bytes[i + k] & 0xC0) != 0x80) {
        return EkError::format("cannot write invalid UTF-8 in dmap");
      }
      codePoint = (codePoint << 6) | (bytes[i + k] & 0x3F);
    }
    const bool overlong =
        (length == 3 && codePoint < 0x800) || (length == 4 && codePoint < 0x10000);
    if (overlong || codePoint > 0x10FFFF || (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
      return EkError::format("cannot write invalid UTF-8 in dmap");
    }
    if (codePoint == 0xFFFE || codePoint == 0xFFFF) {
      return EkError::format(fmt::format("cannot write character U+{:04X} in dmap", codePoint));
    }
    i += length;
  }
  return {};
}

EkError tooDeep() {
  return EkError::format(
      fmt::format("cannot write dmap: nesting deeper than {} levels", kMaxDepth));
}

// The value itself, not its members: its text, number or date, and for a container whether
// one more level fits. depth is the value's own (the root value is at 0).
Result<void> checkOne(const Value& value, size_t depth) {
  switch (value.type()) {
    case ValueType::String:
      return checkText(*value.string());
    case ValueType::Double:
      if (!std::isfinite(*value.doubleNumber())) {
        return EkError::format(fmt::format("cannot write real {} in dmap", *value.doubleNumber()));
      }
      return {};
    case ValueType::Date: {
      const double seconds = value.date()->seconds;
      if (!std::isfinite(seconds)) return EkError::format("cannot write a non-finite date in dmap");
      const double whole = std::floor(seconds);
      if (whole < static_cast<double>(kFirstSecond) || whole > static_cast<double>(kLastSecond)) {
        return EkError::format(
            fmt::format("cannot write date {} in dmap: outside the years 0001-9999", seconds));
      }
      return {};
    }
    case ValueType::Array:
    case ValueType::Dictionary:
      if (depth >= kMaxDepth) return tooDeep();
      return {};
    default:
      return {};
  }
}

// Escapes text that checkText accepted.
void appendEscaped(std::string& out, std::string_view text) {
  size_t plain = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    std::string_view entity;
    switch (text[i]) {
      case '&':
        entity = "&amp;";
        break;
      case '<':
        entity = "&lt;";
        break;
      case '>':
        entity = "&gt;";
        break;
      // A literal carriage return would be turned into a line feed by any XML reader.
      case '\r':
        entity = "&#13;";
        break;
      default:
        continue;
    }
    out.append(text.substr(plain, i - plain));
    out += entity;
    plain = i + 1;
  }
  out.append(text.substr(plain));
}

void appendBase64(std::string& out, const Data& data) {
  // Whole groups of three bytes per call, so the chunks join into one base64 text.
  constexpr size_t kChunk = 3 * 16 * 1024;
  std::vector<uint8_t> encoded(kChunk / 3 * 4 + 1);
  for (size_t at = 0; at < data.size(); at += kChunk) {
    const size_t length = std::min(kChunk, data.size() - at);
    const int written = EVP_EncodeBlock(encoded.data(), data.data() + at, static_cast<int>(length));
    out.append(reinterpret_cast<const char*>(encoded.data()), static_cast<size_t>(written));
  }
}

// A date that checkOne accepted.
std::string formatDate(double seconds) {
  const double whole = std::floor(seconds);
  const auto total = static_cast<int64_t>(whole);
  int64_t days = total / 86400, rest = total % 86400;
  if (rest < 0) rest += 86400, --days;
  const Civil civil = civilFromDays(days);
  return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}Z", civil.year, civil.month, civil.day,
                     rest / 3600, rest / 60 % 60, rest % 60);
}

class Writer {
 public:
  Result<std::string> run(const Value& value) {
    out_ = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<dmap version=\"1.0\">\n";
    EK_TRY(writeValue(value, 0, 0));
    out_ += "</dmap>\n";
    if (out_.size() > kMaxFileSize) return tooLarge();
    return std::move(out_);
  }

  Result<std::string> runEntry(std::string_view key, const Value& value, size_t level) {
    if (level == 0 || level > kMaxDepth) return tooDeep();
    EK_TRY(writeKey(key, level));
    EK_TRY(writeValue(value, level, level));
    if (out_.size() > kMaxFileSize) return tooLarge();
    return std::move(out_);
  }

  // The root dictionary's member under key is written from the given entry texts.
  Result<std::string> runAssembled(const Dictionary& root, std::string_view key,
                                   const std::vector<const std::string*>& entries) {
    size_t size = 0;
    for (const std::string* entry : entries) size += entry->size();
    if (size > kMaxFileSize) return tooLarge();
    out_.reserve(size + 4096);
    splice_ = key;
    entries_ = &entries;
    return run(Value(root));
  }

 private:
  Result<void> writeKey(std::string_view key, size_t level) {
    indent(level);
    EK_TRY(checkText(key));
    out_ += "<key>";
    appendEscaped(out_, key);
    out_ += "</key>\n";
    return {};
  }

  void writeSplice(size_t level) {
    indent(level);
    if (entries_->empty()) {
      out_ += "<dict/>\n";
      return;
    }
    out_ += "<dict>\n";
    for (const std::string* entry : *entries_) out_ += *entry;
    indent(level);
    out_ += "</dict>\n";
  }

  void indent(size_t level) { out_.append(level, '\t'); }

  Result<void> writeValue(const Value& value, size_t level, size_t depth) {
    // Stop early rather than build a document that could not be read back.
    if (out_.size() > kMaxFileSize) return tooLarge();
    EK_TRY(checkOne(value, depth));
    indent(level);
    switch (value.type()) {
      case ValueType::String:
        out_ += "<string>";
        appendEscaped(out_, *value.string());
        out_ += "</string>\n";
        break;
      case ValueType::Unsigned:
        out_ += fmt::format("<integer>{}</integer>\n", *value.unsignedNumber());
        break;
      case ValueType::Negative:
        out_ += fmt::format("<integer>{}</integer>\n", *value.negativeNumber());
        break;
      case ValueType::Double:
        out_ += fmt::format("<real>{}</real>\n", *value.doubleNumber());
        break;
      case ValueType::Bool:
        out_ += *value.boolean() ? "<true/>\n" : "<false/>\n";
        break;
      case ValueType::Data:
        out_ += "<data>";
        appendBase64(out_, *value.data());
        out_ += "</data>\n";
        break;
      case ValueType::Uuid:
        out_ += fmt::format("<string>{}</string>\n", value.uuid()->string());
        break;
      case ValueType::Date:
        out_ += fmt::format("<date>{}</date>\n", formatDate(value.date()->seconds));
        break;
      case ValueType::Array: {
        const Array& array = *value.array();
        if (array.empty()) {
          out_ += "<array/>\n";
          break;
        }
        out_ += "<array>\n";
        for (const Value& item : array) EK_TRY(writeValue(item, level + 1, depth + 1));
        indent(level);
        out_ += "</array>\n";
        break;
      }
      case ValueType::Dictionary: {
        const Dictionary& dictionary = *value.dictionary();
        if (dictionary.empty()) {
          out_ += "<dict/>\n";
          break;
        }
        out_ += "<dict>\n";
        for (const auto& [key, item] : dictionary) {
          EK_TRY(writeKey(key, level + 1));
          if (entries_ != nullptr && depth == 0 && key == splice_) {
            writeSplice(level + 1);
            continue;
          }
          EK_TRY(writeValue(item, level + 1, depth + 1));
        }
        indent(level);
        out_ += "</dict>\n";
        break;
      }
    }
    return {};
  }

  static EkError tooLarge() {
    return EkError::format(
        fmt::format("cannot write dmap: the document exceeds the limit of {} bytes", kMaxFileSize));
  }

  std::string out_;
  std::string_view splice_;
  const std::vector<const std::string*>* entries_ = nullptr;
};

// ---------------------------------------------------------------------------------------------
// Files

Result<std::string> readRegularFile(const std::string& path) {
  // O_NONBLOCK keeps a FIFO planted at the path from blocking the open.
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (fd.get() < 0) return EkError::fromErrno(errno, path);
  struct stat status;
  if (::fstat(fd.get(), &status) != 0) return EkError::fromErrno(errno, path);
  if (!S_ISREG(status.st_mode)) return EkError::format(fmt::format("{}: not a regular file", path));
  if (static_cast<uint64_t>(status.st_size) > kMaxFileSize) {
    return EkError::posix(EFBIG, fmt::format("{}: file of {} bytes exceeds the limit of {}", path,
                                             status.st_size, kMaxFileSize));
  }
  std::string bytes;
  bytes.resize(static_cast<size_t>(status.st_size) + 1);
  size_t filled = 0;
  for (;;) {
    // A file that grows while it is read is still held to the limit.
    if (filled == bytes.size()) {
      if (bytes.size() > kMaxFileSize) {
        return EkError::posix(
            EFBIG, fmt::format("{}: file exceeds the limit of {} bytes", path, kMaxFileSize));
      }
      bytes.resize(std::min(bytes.size() * 2, kMaxFileSize + 1));
    }
    const ssize_t got = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
    if (got < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, path);
    }
    if (got == 0) break;
    filled += static_cast<size_t>(got);
  }
  bytes.resize(filled);
  return bytes;
}

struct Target {
  std::string directory;
  std::string name;
};

Result<Target> splitTarget(const std::string& path) {
  const size_t slash = path.rfind('/');
  Target target{slash == std::string::npos ? "."
                : slash == 0               ? "/"
                                           : path.substr(0, slash),
                slash == std::string::npos ? path : path.substr(slash + 1)};
  if (target.name.empty() || target.name == "." || target.name == "..") {
    return EkError::posix(EINVAL, fmt::format("{}: not a file name", path));
  }
  return target;
}

// The temporary files of a target are this prefix followed by mkstemp's six characters.
std::string temporaryPrefix(std::string_view name) {
  return fmt::format(".{}.", name);
}
constexpr size_t kTemporarySuffixLength = 6;

bool isTemporaryName(std::string_view candidate, std::string_view prefix) {
  if (candidate.size() != prefix.size() + kTemporarySuffixLength) return false;
  if (!candidate.starts_with(prefix)) return false;
  for (char c : candidate.substr(prefix.size())) {
    if (!std::isalnum(static_cast<unsigned char>(c))) return false;
  }
  return true;
}

bool writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    bytes.remove_prefix(static_cast<size_t>(written));
  }
  return true;
}

}  // namespace

Result<Value> parse(std::string_view bytes) {
  return Parser().run(bytes);
}

Result<Value> readFile(const std::string& path) {
  const std::string bytes = EK_TRY(readRegularFile(path));
  Result<Value> value = parse(bytes);
  if (!value) {
    EkError error = std::move(value).error();
    error.message = fmt::format("{}: {}", path, error.message);
    return error;
  }
  return value;
}

Result<void> checkWritable(const Value& value, size_t depth) {
  EK_TRY(checkOne(value, depth));
  if (const Array* array = value.array()) {
    for (const Value& item : *array) EK_TRY(checkWritable(item, depth + 1));
  } else if (const Dictionary* dictionary = value.dictionary()) {
    for (const auto& [key, item] : *dictionary) {
      EK_TRY(checkText(key));
      EK_TRY(checkWritable(item, depth + 1));
    }
  }
  return {};
}

Result<std::string> write(const Value& value) {
  return Writer().run(value);
}

Result<std::string> writeEntry(std::string_view key, const Value& value, size_t level) {
  return Writer().runEntry(key, value, level);
}

Result<std::string> writeAssembled(const Dictionary& root, std::string_view key,
                                   const std::vector<const std::string*>& entries) {
  return Writer().runAssembled(root, key, entries);
}

Result<void> writeFileAtomically(const std::string& path, const Value& value, mode_t mode,
                                 Durability durability) {
  const std::string bytes = EK_TRY(write(value));
  return writeBytesAtomically(path, bytes, mode, durability);
}

Result<void> writeBytesAtomically(const std::string& path, std::string_view bytes, mode_t mode,
                                  Durability durability) {
  const bool durable = durability == Durability::Durable;
  const Target target = EK_TRY(splitTarget(path));
  const std::string& directory = target.directory;

  // Hidden, and named after the target so a leftover from a crash says where it came from.
  std::string temporary = fmt::format("{}/{}XXXXXX", directory, temporaryPrefix(target.name));
  const int rawFd = ::mkostemp(temporary.data(), O_CLOEXEC);
  if (rawFd < 0)
    return EkError::fromErrno(errno, fmt::format("create a temporary file for {}", path));
  UniqueFd fd(rawFd);

  const auto failAndRemove = [&](std::string_view step) {
    const int saved = errno;
    if (fd.get() >= 0) fd.close();
    ::unlink(temporary.c_str());
    return EkError::fromErrno(saved, fmt::format("{} {}", step, path));
  };
  if (!writeAll(fd.get(), bytes)) return failAndRemove("write");
  if (::fchmod(fd.get(), mode) != 0) return failAndRemove("chmod");
  if (durable && ::fsync(fd.get()) != 0) return failAndRemove("fsync");
  if (fd.close() != 0) return failAndRemove("close");
  if (::rename(temporary.c_str(), path.c_str()) != 0) return failAndRemove("rename over");
  if (!durable) return {};

  // The rename is durable only once the directory is.
  UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directoryFd.get() < 0) return EkError::fromErrno(errno, fmt::format("open {}", directory));
  if (::fsync(directoryFd.get()) != 0) {
    return EkError::fromErrno(errno, fmt::format("fsync {}", directory));
  }
  return {};
}

Result<size_t> removeStaleTemporaries(const std::string& path) {
  const Target target = EK_TRY(splitTarget(path));
  const std::string prefix = temporaryPrefix(target.name);
  UniqueFd directoryFd(::open(target.directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directoryFd.get() < 0)
    return EkError::fromErrno(errno, fmt::format("open {}", target.directory));
  // The listing gets its own descriptor: closedir closes what it was given.
  const int listingFd = ::fcntl(directoryFd.get(), F_DUPFD_CLOEXEC, 0);
  DIR* listing = listingFd < 0 ? nullptr : ::fdopendir(listingFd);
  if (listing == nullptr) {
    const int error = errno;
    if (listingFd >= 0) ::close(listingFd);
    return EkError::fromErrno(error, fmt::format("list {}", target.directory));
  }
  std::vector<std::string> stale;
  while (const dirent* entry = ::readdir(listing)) {
    if (isTemporaryName(entry->d_name, prefix)) stale.emplace_back(entry->d_name);
  }
  ::closedir(listing);
  size_t removed = 0;
  for (const std::string& name : stale) {
    struct stat status;
    // Only what a writer leaves: a regular file, never what a link points at.
    if (::fstatat(directoryFd.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISREG(status.st_mode)) {
      continue;
    }
    if (::unlinkat(directoryFd.get(), name.c_str(), 0) == 0) ++removed;
  }
  return removed;
}

// ---------------------------------------------------------------------------------------------
// Files beneath a directory

namespace {

std::string beneathName(const std::string& directory, std::string_view relative) {
  if (directory.empty() || directory.back() == '/') return fmt::format("{}{}", directory, relative);
  return fmt::format("{}/{}", directory, relative);
}

// Without openat2 (older kernels, or a seccomp filter that hides it): one component at a time,
// never following a link at all, which is stricter than needed and still what bundles use.
int openBeneathByWalk(int directoryFd, std::string_view relative, int flags) {
  UniqueFd current;
  int at = directoryFd;
  size_t position = 0;
  for (;;) {
    const size_t slash = relative.find('/', position);
    const bool last = slash == std::string_view::npos;
    const std::string component(
        relative.substr(position, last ? std::string_view::npos : slash - position));
    position = last ? relative.size() : slash + 1;
    if (component.empty() || component == ".") {
      if (last) {
        errno = EISDIR;
        return -1;
      }
      continue;
    }
    if (component == "..") {
      errno = EXDEV;
      return -1;
    }
    const int next =
        ::openat(at, component.c_str(),
                 last ? flags | O_NOFOLLOW : O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (next < 0) {
      if (errno == ELOOP) errno = EXDEV;
      return -1;
    }
    if (last) return next;
    current.reset(next);
    at = current.get();
  }
}

int openBeneath(int directoryFd, std::string_view relative, int flags) {
  const std::string name(relative);
  open_how how{};
  how.flags = static_cast<uint64_t>(flags);
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
  const long fd = ::syscall(SYS_openat2, directoryFd, name.c_str(), &how, sizeof how);
  if (fd >= 0) return static_cast<int>(fd);
  if (errno != ENOSYS) return -1;
  return openBeneathByWalk(directoryFd, relative, flags);
}

}  // namespace

Result<Value> readFileBeneath(int directoryFd, const std::string& directoryPath,
                              std::string_view relative, size_t maxSize) {
  const std::string shown = beneathName(directoryPath, relative);
  if (relative.empty() || relative.front() == '/' ||
      relative.find('\0') != std::string_view::npos) {
    return EkError::posix(EXDEV, fmt::format("{}: not a path beneath {}", shown, directoryPath));
  }
  // O_NONBLOCK keeps a FIFO planted at the path from blocking the open.
  UniqueFd fd(openBeneath(directoryFd, relative, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!fd.valid()) {
    if (errno == EXDEV || errno == ELOOP) {
      return EkError::posix(EXDEV, fmt::format("{}: a symbolic link or \"..\" leads out of {}",
                                               shown, directoryPath));
    }
    return EkError::fromErrno(errno, shown);
  }
  struct stat status;
  if (::fstat(fd.get(), &status) != 0) return EkError::fromErrno(errno, shown);
  if (!S_ISREG(status.st_mode))
    return EkError::format(fmt::format("{}: not a regular file", shown));
  if (static_cast<uint64_t>(status.st_size) > maxSize) {
    return EkError::posix(EFBIG, fmt::format("{}: file of {} bytes exceeds the limit of {}", shown,
                                             status.st_size, maxSize));
  }
  // One byte more than allowed tells a file that grew while it was read.
  std::string bytes(static_cast<size_t>(status.st_size) + 1, '\0');
  size_t filled = 0;
  while (filled < bytes.size()) {
    const ssize_t got = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
    if (got < 0) {
      if (errno == EINTR) continue;
      return EkError::fromErrno(errno, shown);
    }
    if (got == 0) break;
    filled += static_cast<size_t>(got);
    if (filled == bytes.size() && filled <= maxSize)
      bytes.resize(std::min(filled * 2, maxSize + 1));
  }
  if (filled > maxSize) {
    return EkError::posix(EFBIG,
                          fmt::format("{}: file exceeds the limit of {} bytes", shown, maxSize));
  }
  bytes.resize(filled);
  Result<Value> value = parse(bytes);
  if (!value) {
    EkError error = std::move(value).error();
    error.message = fmt::format("{}: {}", shown, error.message);
    return error;
  }
  return value;
}

Result<Value> readFileBeneath(const std::string& directory, std::string_view relative,
                              size_t maxSize) {
  UniqueFd fd(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return EkError::fromErrno(errno, directory);
  return readFileBeneath(fd.get(), directory, relative, maxSize);
}

}  // namespace ek::dmap
