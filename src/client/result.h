// Result<T>: either the value of a successful call or the platform::Error it failed with.
#pragma once

#include <utility>
#include <variant>

#include "platform/error.h"

namespace zlka_client {

template <class T>
class Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(platform::Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // Only on success (ok()); std::bad_variant_access otherwise.
  const T& value() const& { return std::get<0>(v_); }
  T& value() & { return std::get<0>(v_); }
  T&& value() && { return std::get<0>(std::move(v_)); }
  // Only on failure (!ok()); std::bad_variant_access otherwise.
  const platform::Error& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, platform::Error> v_;
};

}  // namespace zlka_client
