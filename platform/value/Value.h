#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "platform/value/Uuid.h"

namespace ek {

class Value;

using Array = std::vector<Value>;
// Keys are kept sorted, which also gives wire JSON and dmap output their stable key order.
using Dictionary = std::map<std::string, Value, std::less<>>;
using Data = std::vector<uint8_t>;

// Seconds since 1970 UTC.
struct Date {
  double seconds = 0;
  auto operator<=>(const Date&) const = default;
};

enum class ValueType {
  String,
  Unsigned,  // unsigned 64-bit integer
  Negative,  // signed integer, negative values only
  Double,
  Bool,
  Data,
  Uuid,
  Date,
  Array,
  Dictionary,
};

std::string_view valueTypeName(ValueType type);

// One value of the system's value model: what messages, files and forms are made of.
// An integer that is not negative is always held as Unsigned, so that two equal numbers
// compare equal whatever they were built from.
class Value {
 public:
  using Storage = std::variant<std::string, uint64_t, int64_t, double, bool, Data, Uuid, Date,
                               Array, Dictionary>;

  Value() : storage_(Dictionary{}) {}
  Value(std::string text) : storage_(std::move(text)) {}
  Value(std::string_view text) : storage_(std::string(text)) {}
  Value(const char* text) : storage_(std::string(text)) {}
  template <typename T>
  requires(std::is_integral_v<T> && !std::is_same_v<T, bool>) Value(T number) {
    if constexpr (std::is_signed_v<T>) {
      if (number < 0) {
        storage_ = static_cast<int64_t>(number);
        return;
      }
    }
    storage_ = static_cast<uint64_t>(number);
  }
  template <typename T>
  requires std::is_same_v<T, bool> Value(T flag) : storage_(flag) {}
  Value(double number) : storage_(number) {}
  Value(Data data) : storage_(std::move(data)) {}
  Value(Uuid uuid) : storage_(uuid) {}
  Value(Date date) : storage_(date) {}
  Value(Array array) : storage_(std::move(array)) {}
  Value(Dictionary dictionary) : storage_(std::move(dictionary)) {}

  ValueType type() const { return static_cast<ValueType>(storage_.index()); }
  bool is(ValueType t) const { return type() == t; }

  template <typename T>
  const T* getIf() const {
    return std::get_if<T>(&storage_);
  }
  template <typename T>
  T* getIf() {
    return std::get_if<T>(&storage_);
  }

  const std::string* string() const { return getIf<std::string>(); }
  const uint64_t* unsignedNumber() const { return getIf<uint64_t>(); }
  const int64_t* negativeNumber() const { return getIf<int64_t>(); }
  const double* doubleNumber() const { return getIf<double>(); }
  const bool* boolean() const { return getIf<bool>(); }
  const Data* data() const { return getIf<Data>(); }
  const Uuid* uuid() const { return getIf<Uuid>(); }
  const Date* date() const { return getIf<Date>(); }
  const Array* array() const { return getIf<Array>(); }
  Array* array() { return getIf<Array>(); }
  const Dictionary* dictionary() const { return getIf<Dictionary>(); }
  Dictionary* dictionary() { return getIf<Dictionary>(); }

  // The member under key when this is a dictionary holding it; nullptr otherwise.
  const Value* get(std::string_view key) const;
  // Typed member lookups; nullptr when missing or of another type.
  const std::string* getString(std::string_view key) const;
  const Array* getArray(std::string_view key) const;
  const Dictionary* getDictionary(std::string_view key) const;
  const uint64_t* getUnsigned(std::string_view key) const;

  // Any number as a double (for comparisons by value); absent for other types.
  std::optional<double> numericValue() const;

  // A readable one-line rendering for logs and probes.
  std::string description() const;

  const Storage& storage() const { return storage_; }

  bool operator==(const Value& other) const { return storage_ == other.storage_; }

 private:
  Storage storage_;
};

}  // namespace ek
