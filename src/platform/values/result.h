// Result<T>: what a parsing or set-up step produced, or the text that says why it failed. The
// failure text is written to follow the name of the thing parsed ("it has no \"uid\"").
#pragma once

#include <string>
#include <utility>
#include <variant>

namespace platform {

// Failure carries the text of a failed step into a Result<T>.
struct Failure {
  std::string message;
};

template <class T>
class Result {
 public:
  // A Result converts from the value on success and from a Failure on failure.
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Failure failure) : v_(std::in_place_index<1>, std::move(failure.message)) {}

  // ok, and the conversion to bool, are true when the step succeeded.
  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // The value (borrowed, or moved out of an rvalue Result); calling them on a failure throws
  // std::bad_variant_access, a programming error.
  const T& operator*() const& { return std::get<0>(v_); }
  T&& operator*() && { return std::get<0>(std::move(v_)); }
  const T* operator->() const { return &std::get<0>(v_); }
  // error is why it failed; calling it on a success throws std::bad_variant_access.
  const std::string& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, std::string> v_;
};

}  // namespace platform
