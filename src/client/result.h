// Result<T>: either the value of a successful call or the platform::Error it failed with.
#pragma once

#include <utility>
#include <variant>

#include "platform/values/error.h"

namespace zlka_client {

template <class T>
class Result {
 public:
  // A Result converts from the value on success and from the error on failure.
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(platform::Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  // ok, and the conversion to bool, are true on success.
  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // value borrows (or moves out of an rvalue Result) the value: only on success (ok()); std::bad_variant_access
  // otherwise.
  const T& value() const& { return std::get<0>(v_); }
  T& value() & { return std::get<0>(v_); }
  T&& value() && { return std::get<0>(std::move(v_)); }
  // error borrows the error: only on failure (!ok()); std::bad_variant_access otherwise.
  const platform::Error& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, platform::Error> v_;
};

}  // namespace zlka_client
