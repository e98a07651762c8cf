// Result values: std::expected where the standard library has it, and a
// compact stand-in with the same surface where it does not (clang 14 on
// libstdc++ 12, used for the fuzz build and clang-tidy).
#pragma once

#include <version>
#if __has_include(<expected>)
#include <expected>
#endif

#if defined(__cpp_lib_expected)

namespace platform {
using std::expected;
using std::unexpected;
}  // namespace platform

#else

#include <cstdlib>
#include <optional>
#include <type_traits>
#include <utility>
#include <variant>

#include "platform/Misuse.h"

namespace platform {

template <class E>
class unexpected {
 public:
  explicit unexpected(E error) : error_(std::move(error)) {}
  const E& error() const& { return error_; }
  E& error() & { return error_; }
  E&& error() && { return std::move(error_); }

 private:
  E error_;
};

template <class E>
unexpected(E) -> unexpected<E>;

template <class T, class E>
class expected {
 public:
  using value_type = T;
  using error_type = E;

  expected() requires std::is_default_constructible_v<T> : storage_(std::in_place_index<0>) {}
  template <class U = T>
  requires std::is_constructible_v<T, U&&> &&
      (!std::is_same_v<std::remove_cvref_t<U>, expected>)expected(U&& value)
      : storage_(std::in_place_index<0>, std::forward<U>(value)) {}
  template <class G>
  expected(unexpected<G> error) : storage_(std::in_place_index<1>, std::move(error).error()) {}

  bool has_value() const { return storage_.index() == 0; }
  explicit operator bool() const { return has_value(); }

  T& value() & { return checked(), std::get<0>(storage_); }
  const T& value() const& { return checked(), std::get<0>(storage_); }
  T&& value() && { return checked(), std::move(std::get<0>(storage_)); }
  T& operator*() & { return value(); }
  const T& operator*() const& { return value(); }
  T&& operator*() && { return std::move(*this).value(); }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }
  template <class U>
  T value_or(U&& other) const& {
    return has_value() ? std::get<0>(storage_) : static_cast<T>(std::forward<U>(other));
  }

  const E& error() const& { return std::get<1>(storage_); }
  E& error() & { return std::get<1>(storage_); }
  E&& error() && { return std::move(std::get<1>(storage_)); }

 private:
  void checked() const { QV_MISUSE(!has_value(), "value() of a result that holds an error"); }
  std::variant<T, E> storage_;
};

template <class E>
class expected<void, E> {
 public:
  using value_type = void;
  using error_type = E;

  expected() = default;
  template <class G>
  expected(unexpected<G> error) : error_(std::move(error).error()) {}

  bool has_value() const { return !error_.has_value(); }
  explicit operator bool() const { return has_value(); }
  void value() const { QV_MISUSE(error_.has_value(), "value() of a status that holds an error"); }
  const E& error() const& { return *error_; }
  E& error() & { return *error_; }
  E&& error() && { return std::move(*error_); }

 private:
  // Optional so that E needs no default constructor (platform::Error has none).
  std::optional<E> error_;
};

}  // namespace platform

#endif
