#include "platform/cbor/Cbor.h"

#include <cbor.h>

#include <algorithm>
#include <cassert>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <limits>
#include <string>
#include <utility>

namespace ek::cbor {
namespace {

constexpr uint64_t kTagEpochDate = 1;
constexpr uint64_t kTagUuid = 37;
constexpr size_t kUuidSize = 16;

// ---- Encoding -------------------------------------------------------------------------------

// Every libcbor head encoder writes at most 9 bytes.
constexpr size_t kMaxHead = 9;

template <typename Encode>
void put(std::vector<uint8_t>& out, Encode&& encode) {
  size_t at = out.size();
  out.resize(at + kMaxHead);
  size_t written = encode(out.data() + at, kMaxHead);
  assert(written > 0 && written <= kMaxHead);
  out.resize(at + written);
}

void putBytes(std::vector<uint8_t>& out, const void* bytes, size_t size) {
  auto* begin = static_cast<const uint8_t*>(bytes);
  out.insert(out.end(), begin, begin + size);
}

double halfToDouble(uint16_t half) {
  int exponent = (half >> 10) & 0x1F;
  int mantissa = half & 0x3FF;
  double value;
  if (exponent == 0) {
    value = std::ldexp(mantissa, -24);
  } else if (exponent != 31) {
    value = std::ldexp(mantissa + 1024, exponent - 25);
  } else {
    value = mantissa == 0 ? INFINITY : NAN;
  }
  return (half & 0x8000) ? -value : value;
}

bool sameBits(double a, double b) {
  return std::memcmp(&a, &b, sizeof a) == 0;
}

// Preferred serialization: the shortest of half, single and double that gives the number back
// exactly. libcbor's half encoder is lossy for some inputs, so its output is checked by
// decoding it again. Every NaN is written as the canonical half NaN.
void putFloat(std::vector<uint8_t>& out, double number) {
  if (std::isnan(number)) {
    put(out, [&](uint8_t* at, size_t size) { return cbor_encode_half(NAN, at, size); });
    return;
  }
  if (std::isinf(number) || std::fabs(number) <= FLT_MAX) {
    float single = static_cast<float>(number);
    if (sameBits(static_cast<double>(single), number)) {
      uint8_t half[kMaxHead];
      size_t written = cbor_encode_half(single, half, sizeof half);
      if (written == 3 &&
          sameBits(halfToDouble(static_cast<uint16_t>(half[1] << 8 | half[2])), number)) {
        putBytes(out, half, written);
        return;
      }
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_single(single, at, size); });
      return;
    }
  }
  put(out, [&](uint8_t* at, size_t size) { return cbor_encode_double(number, at, size); });
}

void putText(std::vector<uint8_t>& out, std::string_view text) {
  put(out,
      [&](uint8_t* at, size_t size) { return cbor_encode_string_start(text.size(), at, size); });
  putBytes(out, text.data(), text.size());
}

void encodeInto(const Value& value, std::vector<uint8_t>& out) {
  switch (value.type()) {
    case ValueType::String:
      putText(out, *value.string());
      break;
    case ValueType::Unsigned: {
      uint64_t number = *value.unsignedNumber();
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_uint(number, at, size); });
      break;
    }
    case ValueType::Negative: {
      // Major type 1 carries -1 - n; a negative int64 always fits.
      uint64_t encoded = static_cast<uint64_t>(-(*value.negativeNumber() + 1));
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_negint(encoded, at, size); });
      break;
    }
    case ValueType::Double:
      putFloat(out, *value.doubleNumber());
      break;
    case ValueType::Bool: {
      bool flag = *value.boolean();
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_bool(flag, at, size); });
      break;
    }
    case ValueType::Data: {
      const Data& data = *value.data();
      put(out, [&](uint8_t* at, size_t size) {
        return cbor_encode_bytestring_start(data.size(), at, size);
      });
      putBytes(out, data.data(), data.size());
      break;
    }
    case ValueType::Uuid: {
      const Uuid& uuid = *value.uuid();
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_tag(kTagUuid, at, size); });
      put(out, [&](uint8_t* at, size_t size) {
        return cbor_encode_bytestring_start(kUuidSize, at, size);
      });
      putBytes(out, uuid.bytes.data(), kUuidSize);
      break;
    }
    case ValueType::Date:
      put(out, [&](uint8_t* at, size_t size) { return cbor_encode_tag(kTagEpochDate, at, size); });
      putFloat(out, value.date()->seconds);
      break;
    case ValueType::Array: {
      const Array& array = *value.array();
      put(out, [&](uint8_t* at, size_t size) {
        return cbor_encode_array_start(array.size(), at, size);
      });
      for (const Value& element : array) encodeInto(element, out);
      break;
    }
    case ValueType::Dictionary: {
      const Dictionary& dictionary = *value.dictionary();
      put(out, [&](uint8_t* at, size_t size) {
        return cbor_encode_map_start(dictionary.size(), at, size);
      });
      for (const auto& [key, member] : dictionary) {
        putText(out, key);
        encodeInto(member, out);
      }
      break;
    }
  }
}

// An upper bound of what encodeInto writes for value: a large reply is then written into one
// allocation instead of a score of doublings, each copying all of it into fresh pages.
size_t headBound(uint64_t argument) {
  if (argument < 24) return 1;
  if (argument <= 0xFF) return 2;
  if (argument <= 0xFFFF) return 3;
  if (argument <= 0xFFFFFFFF) return 5;
  return kMaxHead;
}

size_t sizeBound(const Value& value) {
  switch (value.type()) {
    case ValueType::String:
      return headBound(value.string()->size()) + value.string()->size();
    case ValueType::Unsigned:
    case ValueType::Negative:
    case ValueType::Double:
      return kMaxHead;
    case ValueType::Bool:
      return 1;
    case ValueType::Data:
      return headBound(value.data()->size()) + value.data()->size();
    case ValueType::Uuid:
      return headBound(kTagUuid) + headBound(kUuidSize) + kUuidSize;
    case ValueType::Date:
      return headBound(kTagEpochDate) + kMaxHead;
    case ValueType::Array: {
      size_t size = headBound(value.array()->size());
      for (const Value& element : *value.array()) size += sizeBound(element);
      return size;
    }
    case ValueType::Dictionary: {
      size_t size = headBound(value.dictionary()->size());
      for (const auto& [key, member] : *value.dictionary()) {
        size += headBound(key.size()) + key.size() + sizeBound(member);
      }
      return size;
    }
  }
  return kMaxHead;
}

// ---- Decoding -------------------------------------------------------------------------------

// RFC 3629: no overlong forms, no surrogates, nothing above U+10FFFF.
bool isValidUtf8(const uint8_t* bytes, size_t size) {
  size_t i = 0;
  while (i < size) {
    uint8_t lead = bytes[i];
    if (lead < 0x80) {
      ++i;
      continue;
    }
    size_t length;
    uint8_t low = 0x80, high = 0xBF;
    if (lead >= 0xC2 && lead <= 0xDF) {
      length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
      length = 3;
      if (lead == 0xE0) low = 0xA0;
      if (lead == 0xED) high = 0x9F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
      length = 4;
      if (lead == 0xF0) low = 0x90;
      if (lead == 0xF4) high = 0x8F;
    } else {
      return false;
    }
    if (size - i < length) return false;
    if (bytes[i + 1] < low || bytes[i + 1] > high) return false;
    for (size_t k = 2; k < length; ++k) {
      if (bytes[i + k] < 0x80 || bytes[i + k] > 0xBF) return false;
    }
    i += length;
  }
  return true;
}

// What one call of cbor_stream_decode reported. The callbacks only record; all decisions are
// taken in plain C++ afterwards, so that an error can stop decoding at once.
enum class Event {
  None,
  Unsigned,
  Negative,
  Bytes,
  Text,
  BytesStart,
  TextStart,
  ArrayStart,
  IndefiniteArrayStart,
  MapStart,
  IndefiniteMapStart,
  Tag,
  Float,
  Bool,
  Null,
  Undefined,
  Break,
};

struct Token {
  Event event = Event::None;
  uint64_t number = 0;  // integer, declared count or tag number
  double real = 0;
  bool flag = false;
  const uint8_t* bytes = nullptr;
  size_t size = 0;
};

Token& token(void* context) {
  return *static_cast<Token*>(context);
}

void onNumber(void* context, Event event, uint64_t number) {
  token(context).event = event;
  token(context).number = number;
}

void onString(void* context, Event event, cbor_data bytes, size_t size) {
  token(context).event = event;
  token(context).bytes = bytes;
  token(context).size = size;
}

void onFloat(void* context, double real) {
  token(context).event = Event::Float;
  token(context).real = real;
}

cbor_callbacks makeCallbacks() {
  cbor_callbacks callbacks{};
  callbacks.uint8 = [](void* c, uint8_t n) { onNumber(c, Event::Unsigned, n); };
  callbacks.uint16 = [](void* c, uint16_t n) { onNumber(c, Event::Unsigned, n); };
  callbacks.uint32 = [](void* c, uint32_t n) { onNumber(c, Event::Unsigned, n); };
  callbacks.uint64 = [](void* c, uint64_t n) { onNumber(c, Event::Unsigned, n); };
  callbacks.negint8 = [](void* c, uint8_t n) { onNumber(c, Event::Negative, n); };
  callbacks.negint16 = [](void* c, uint16_t n) { onNumber(c, Event::Negative, n); };
  callbacks.negint32 = [](void* c, uint32_t n) { onNumber(c, Event::Negative, n); };
  callbacks.negint64 = [](void* c, uint64_t n) { onNumber(c, Event::Negative, n); };
  // libcbor's naming is inverted here: byte_string/string are the definite forms,
  // *_start the indefinite ones.
  callbacks.byte_string = [](void* c, cbor_data b, size_t n) { onString(c, Event::Bytes, b, n); };
  callbacks.byte_string_start = [](void* c) { token(c).event = Event::BytesStart; };
  callbacks.string = [](void* c, cbor_data b, size_t n) { onString(c, Event::Text, b, n); };
  callbacks.string_start = [](void* c) { token(c).event = Event::TextStart; };
  callbacks.array_start = [](void* c, size_t n) { onNumber(c, Event::ArrayStart, n); };
  callbacks.indef_array_start = [](void* c) { token(c).event = Event::IndefiniteArrayStart; };
  callbacks.map_start = [](void* c, size_t n) { onNumber(c, Event::MapStart, n); };
  callbacks.indef_map_start = [](void* c) { token(c).event = Event::IndefiniteMapStart; };
  callbacks.tag = [](void* c, uint64_t n) { onNumber(c, Event::Tag, n); };
  callbacks.float2 = [](void* c, float f) { onFloat(c, f); };
  callbacks.float4 = [](void* c, float f) { onFloat(c, f); };
  callbacks.float8 = [](void* c, double d) { onFloat(c, d); };
  callbacks.undefined = [](void* c) { token(c).event = Event::Undefined; };
  callbacks.null = [](void* c) { token(c).event = Event::Null; };
  callbacks.boolean = [](void* c, bool b) {
    token(c).event = Event::Bool;
    token(c).flag = b;
  };
  callbacks.indef_break = [](void* c) { token(c).event = Event::Break; };
  return callbacks;
}

const cbor_callbacks kCallbacks = makeCallbacks();

// One open item on the explicit stack.
struct Frame {
  enum class Kind { Array, Map, Bytes, Text, Tag } kind;
  bool indefinite = false;
  // Definite containers: data items not yet begun (a map counts keys and values).
  uint64_t remaining = 0;
  uint64_t tag = 0;
  Array array;
  Dictionary dictionary;
  std::string text;  // indefinite text string, or the pending key of a map
  bool haveKey = false;
  Data bytes;
  // Checked like any other item but not built (decodeEntries).
  bool discard = false;
};

class Decoder {
 public:
  explicit Decoder(std::span<const uint8_t> input) : input_(input) {}
  // Builds of the top-level map only the entries under keys; everything else is checked and
  // dropped.
  Decoder(std::span<const uint8_t> input, std::span<const std::string_view> keys)
      : input_(input), skim_(true), keys_(keys) {}

  Result<Value> run() {
    while (!root_) {
      if (position_ == input_.size()) return EkError::format("CBOR item is truncated");
      Token current;
      cbor_decoder_result result = cbor_stream_decode(
          input_.data() + position_, input_.size() - position_, &kCallbacks, &current);
      if (result.status == CBOR_DECODER_NEDATA) return EkError::format("CBOR item is truncated");
      if (result.status != CBOR_DECODER_FINISHED || current.event == Event::None) {
        return EkError::format("CBOR item is malformed at byte " + std::to_string(position_));
      }
      position_ += result.read;
      EK_TRY(handle(current));
    }
    if (position_ != input_.size()) {
      size_t trailing = input_.size() - position_;
      return EkError::format("CBOR item is followed by " + std::to_string(trailing) +
                             (trailing == 1 ? " trailing byte" : " trailing bytes"));
    }
    return std::move(*root_);
  }

 private:
  size_t bytesLeft() const { return input_.size() - position_; }
  Frame* top() { return stack_.empty() ? nullptr : &stack_.back(); }

  bool expectingKey() {
    Frame* frame = top();
    return frame && frame->kind == Frame::Kind::Map && !frame->haveKey;
  }

  // Claims the parent's slot for an item that starts now.
  void beginItem() {
    Frame* frame = top();
    if (frame && !frame->indefinite &&
        (frame->kind == Frame::Kind::Array || frame->kind == Frame::Kind::Map)) {
      --frame->remaining;
      --pending_;
    }
  }

  // Whether the item that starts next is dropped rather than built.
  bool discardingNext() const {
    if (!skim_ || stack_.empty()) return false;
    const Frame& frame = stack_.back();
    // A tag's content is built: checking it needs its value, and it is small.
    if (frame.kind == Frame::Kind::Tag) return false;
    if (frame.discard) return true;
    if (stack_.size() > 1) return false;  // inside a kept entry
    if (frame.kind == Frame::Kind::Map) {
      return frame.haveKey &&
             std::find(keys_.begin(), keys_.end(), std::string_view(frame.text)) == keys_.end();
    }
    return frame.kind == Frame::Kind::Array;
  }

  Result<void> handle(const Token& t) {
    Frame* frame = top();
    // Inside an indefinite string only definite chunks of the same major type and break.
    if (frame && (frame->kind == Frame::Kind::Bytes || frame->kind == Frame::Kind::Text)) {
      return handleChunk(*frame, t);
    }
    if (t.event == Event::Break) return handleBreak();
    if (expectingKey() && t.event != Event::Text && t.event != Event::TextStart) {
      return EkError::format("CBOR map key is not a text string");
    }
    if (frame && frame->kind == Frame::Kind::Tag) EK_TRY(checkTagContent(*frame, t));
    const bool discard = discardingNext();

    switch (t.event) {
      case Event::Unsigned:
        beginItem();
        return discard ? deliverNothing() : deliver(Value(t.number));
      case Event::Negative:
        if (t.number > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
          return EkError::format("CBOR negative integer is below the 64-bit range");
        }
        beginItem();
        return discard ? deliverNothing() : deliver(Value(-1 - static_cast<int64_t>(t.number)));
      case Event::Float:
        beginItem();
        return discard ? deliverNothing() : deliver(Value(t.real));
      case Event::Bool:
        beginItem();
        return discard ? deliverNothing() : deliver(Value(t.flag));
      case Event::Bytes:
        beginItem();
        return discard ? deliverNothing() : deliver(Value(Data(t.bytes, t.bytes + t.size)));
      case Event::Text:
        if (!isValidUtf8(t.bytes, t.size)) return EkError::format("CBOR text string is not UTF-8");
        beginItem();
        return discard
                   ? deliverNothing()
                   : deliver(Value(std::string(reinterpret_cast<const char*>(t.bytes), t.size)));
      case Event::BytesStart:
      case Event::TextStart:
        beginItem();
        stack_.push_back(
            Frame{t.event == Event::TextStart ? Frame::Kind::Text : Frame::Kind::Bytes});
        stack_.back().indefinite = true;
        stack_.back().discard = discard;
        return {};
      case Event::ArrayStart:
      case Event::MapStart:
      case Event::IndefiniteArrayStart:
      case Event::IndefiniteMapStart:
        return openContainer(t, discard);
      case Event::Tag:
        if (t.number != kTagUuid && t.number != kTagEpochDate) {
          return EkError::format("CBOR tag " + std::to_string(t.number) + " is not supported");
        }
        beginItem();
        stack_.push_back(Frame{Frame::Kind::Tag});
        stack_.back().tag = t.number;
        stack_.back().discard = discard;
        return {};
      case Event::Null:
        return EkError::format("CBOR null has no counterpart in the value model");
      case Event::Undefined:
        return EkError::format("CBOR undefined has no counterpart in the value model");
      case Event::None:
      case Event::Break:
        break;
    }
    return EkError::format("CBOR item is malformed");
  }

  Result<void> openContainer(const Token& t, bool discard) {
    if (containerDepth_ >= kMaxDepth) {
      return EkError::format("CBOR item is nested deeper than " + std::to_string(kMaxDepth) +
                             " levels");
    }
    bool isMap = t.event == Event::MapStart || t.event == Event::IndefiniteMapStart;
    bool indefinite =
        t.event == Event::IndefiniteArrayStart || t.event == Event::IndefiniteMapStart;
    beginItem();
    Frame frame{isMap ? Frame::Kind::Map : Frame::Kind::Array};
    frame.indefinite = indefinite;
    frame.discard = discard;
    if (!indefinite) {
      // Each item takes at least one byte, and so does every item still owed to the enclosing
      // containers: a count beyond that cannot be honest, and is refused before anything is
      // allocated for it.
      uint64_t budget = bytesLeft() > pending_ ? bytesLeft() - pending_ : 0;
      uint64_t items = t.number;
      if (isMap) {
        if (items > budget / 2) return tooLong(items, "map entries");
        items *= 2;
      } else if (items > budget) {
        return tooLong(items, "array elements");
      }
      frame.remaining = items;
      pending_ += items;
      if (!isMap && !discard) frame.array.reserve(items);
    }
    ++containerDepth_;
    stack_.push_back(std::move(frame));
    if (!indefinite && stack_.back().remaining == 0) return closeTop();
    return {};
  }

  EkError tooLong(uint64_t count, const char* what) const {
    return EkError::format("CBOR container declares " + std::to_string(count) + " " + what +
                           " but only " + std::to_string(bytesLeft()) + " bytes remain");
  }

  Result<void> checkTagContent(const Frame& tagFrame, const Token& t) {
    if (tagFrame.tag == kTagUuid) {
      if (t.event == Event::Bytes || t.event == Event::BytesStart) return {};
      return EkError::format("CBOR tag 37 must wrap a 16-byte byte string");
    }
    if (t.event == Event::Float || t.event == Event::Unsigned || t.event == Event::Negative) {
      return {};
    }
    return EkError::format("CBOR tag 1 must wrap a number");
  }

  Result<void> handleChunk(Frame& frame, const Token& t) {
    if (t.event == Event::Break) {
      if (frame.discard) {
        stack_.pop_back();
        return deliverNothing();
      }
      Value value = frame.kind == Frame::Kind::Text ? Value(std::move(frame.text))
                                                    : Value(std::move(frame.bytes));
      stack_.pop_back();
      return deliver(std::move(value));
    }
    if (frame.kind == Frame::Kind::Text) {
      if (t.event != Event::Text) {
        return EkError::format("CBOR indefinite text string holds something other than text");
      }
      if (!isValidUtf8(t.bytes, t.size)) return EkError::format("CBOR text string is not UTF-8");
      if (!frame.discard) frame.text.append(reinterpret_cast<const char*>(t.bytes), t.size);
      return {};
    }
    if (t.event != Event::Bytes) {
      return EkError::format("CBOR indefinite byte string holds something other than bytes");
    }
    if (!frame.discard) frame.bytes.insert(frame.bytes.end(), t.bytes, t.bytes + t.size);
    return {};
  }

  Result<void> handleBreak() {
    Frame* frame = top();
    if (!frame || !frame->indefinite)
      return EkError::format("CBOR break outside an indefinite item");
    if (frame->kind == Frame::Kind::Map && frame->haveKey) {
      return EkError::format("CBOR map ends between a key and its value");
    }
    return closeTop();
  }

  Result<void> closeTop() {
    Frame& frame = stack_.back();
    if (frame.discard) {
      stack_.pop_back();
      --containerDepth_;
      return deliverNothing();
    }
    Value value = frame.kind == Frame::Kind::Map ? Value(std::move(frame.dictionary))
                                                 : Value(std::move(frame.array));
    stack_.pop_back();
    --containerDepth_;
    return deliver(std::move(value));
  }

  // Hands a complete item to whatever encloses it.
  Result<void> deliver(Value value) {
    Frame* frame = top();
    if (!frame) {
      root_ = std::move(value);
      return {};
    }
    switch (frame->kind) {
      case Frame::Kind::Array:
        frame->array.push_back(std::move(value));
        break;
      case Frame::Kind::Map:
        if (!frame->haveKey) {
          frame->text = std::move(*value.getIf<std::string>());
          frame->haveKey = true;
        } else {
          auto [where, inserted] =
              frame->dictionary.try_emplace(std::move(frame->text), std::move(value));
          if (!inserted)
            return EkError::format("CBOR map repeats the key \"" + where->first + "\"");
          frame->text.clear();
          frame->haveKey = false;
        }
        break;
      case Frame::Kind::Tag:
        return deliverTagged(std::move(value));
      case Frame::Kind::Bytes:
      case Frame::Kind::Text:
        assert(false && "chunks are handled before delivery");
        break;
    }
    if (!frame->indefinite && frame->remaining == 0) return closeTop();
    return {};
  }

  // Accounts in the enclosing container for an item that was checked but not built.
  Result<void> deliverNothing() {
    Frame& frame = stack_.back();  // the root is never dropped
    assert((frame.kind == Frame::Kind::Array || frame.kind == Frame::Kind::Map) &&
           "only container members are dropped");
    if (frame.kind == Frame::Kind::Map) {
      // A dropped key belongs to a dropped map; a dropped value ends its entry.
      frame.haveKey = !frame.haveKey;
      if (!frame.haveKey) frame.text.clear();
    }
    if (!frame.indefinite && frame.remaining == 0) return closeTop();
    return {};
  }

  Result<void> deliverTagged(Value value) {
    const uint64_t tag = stack_.back().tag;
    const bool discard = stack_.back().discard;
    stack_.pop_back();
    if (tag == kTagUuid) {
      const Data* bytes = value.data();
      if (!bytes || bytes->size() != kUuidSize) {
        return EkError::format("CBOR tag 37 must wrap a 16-byte byte string");
      }
      return discard ? deliverNothing() : deliver(Value(Uuid::fromBytes(bytes->data())));
    }
    std::optional<double> seconds = value.numericValue();
    assert(seconds && "checkTagContent admits only numbers");
    return discard ? deliverNothing() : deliver(Value(Date{*seconds}));
  }

  std::span<const uint8_t> input_;
  const bool skim_ = false;
  const std::span<const std::string_view> keys_;
  size_t position_ = 0;
  std::vector<Frame> stack_;
  size_t containerDepth_ = 0;
  // Items owed to open definite containers, each needing at least one more byte.
  uint64_t pending_ = 0;
  std::optional<Value> root_;
};

}  // namespace

void encode(const Value& value, std::vector<uint8_t>& out) {
  out.reserve(out.size() + sizeBound(value));
  encodeInto(value, out);
}

std::vector<uint8_t> encode(const Value& value) {
  std::vector<uint8_t> out;
  out.reserve(sizeBound(value));
  encodeInto(value, out);
  return out;
}

void encodeArrayHead(uint64_t count, std::vector<uint8_t>& out) {
  put(out, [&](uint8_t* at, size_t size) { return cbor_encode_array_start(count, at, size); });
}

void encodeMapHead(uint64_t count, std::vector<uint8_t>& out) {
  put(out, [&](uint8_t* at, size_t size) { return cbor_encode_map_start(count, at, size); });
}

void encodeText(std::string_view text, std::vector<uint8_t>& out) {
  putText(out, text);
}

size_t encodedSizeBound(const Value& value) {
  return sizeBound(value);
}

Result<Value> decode(std::span<const uint8_t> bytes) {
  if (bytes.empty()) return EkError::format("CBOR item is empty");
  return Decoder(bytes).run();
}

Result<Dictionary> decodeEntries(std::span<const uint8_t> bytes,
                                 std::span<const std::string_view> keys) {
  if (bytes.empty()) return EkError::format("CBOR item is empty");
  Result<Value> root = Decoder(bytes, keys).run();
  if (!root) return root.error();
  Dictionary* entries = root->getIf<Dictionary>();
  return entries ? std::move(*entries) : Dictionary{};
}

}  // namespace ek::cbor
