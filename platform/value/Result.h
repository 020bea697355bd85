#pragma once

#include <cassert>
#include <utility>
#include <variant>

#include "platform/value/EkError.h"

namespace ek {

// Value-or-error. Accessing the value of a failed result is a broken invariant.
template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : storage_(std::in_place_index<0>, std::move(value)) {}
  Result(EkError error) : storage_(std::in_place_index<1>, std::move(error)) {}

  bool ok() const { return storage_.index() == 0; }
  explicit operator bool() const { return ok(); }

  T& value() & {
    assert(ok());
    return std::get<0>(storage_);
  }
  const T& value() const& {
    assert(ok());
    return std::get<0>(storage_);
  }
  T&& value() && {
    assert(ok());
    return std::get<0>(std::move(storage_));
  }
  const EkError& error() const& {
    assert(!ok());
    return std::get<1>(storage_);
  }
  EkError&& error() && {
    assert(!ok());
    return std::get<1>(std::move(storage_));
  }

  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }
  T& operator*() & { return value(); }
  const T& operator*() const& { return value(); }

 private:
  std::variant<T, EkError> storage_;
};

template <>
class [[nodiscard]] Result<void> {
 public:
  Result() = default;
  Result(EkError error) : error_(std::move(error)), failed_(true) {}

  bool ok() const { return !failed_; }
  explicit operator bool() const { return ok(); }
  const EkError& error() const& {
    assert(failed_);
    return error_;
  }
  EkError&& error() && {
    assert(failed_);
    return std::move(error_);
  }

 private:
  EkError error_;
  bool failed_ = false;
};

}  // namespace ek

// EK_TRY(expr): evaluates a Result; on failure returns its error from the enclosing function,
// otherwise yields the value (for Result<void>, nothing).
#define EK_TRY(expr)                                 \
  ({                                                 \
    auto ek_try_result_ = (expr);                    \
    if (!ek_try_result_.ok()) {                      \
      return std::move(ek_try_result_).error();      \
    }                                                \
    ::ek::detail::unwrap(std::move(ek_try_result_)); \
  })

namespace ek::detail {
template <typename T>
T unwrap(Result<T>&& result) {
  return std::move(result).value();
}
inline void unwrap(Result<void>&&) {}
}  // namespace ek::detail
