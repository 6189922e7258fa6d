// TarvexSAPResult<T>: what a set-up step of the SAP library (a server, a certificate, a key)
// produced, or the text that says why it failed. The library sits below every other project
// library and links none of them, so it keeps this small result type of its own; callers above
// the platform turn a failure into theirs with its error() text.
#pragma once

#include <string>
#include <utility>
#include <variant>

// TarvexSAPFailure carries the text of a failed step into a TarvexSAPResult<T>.
struct TarvexSAPFailure {
  std::string message;
};

template <class T>
class TarvexSAPResult {
 public:
  // A result converts from the value on success and from a TarvexSAPFailure on failure.
  TarvexSAPResult(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  TarvexSAPResult(TarvexSAPFailure failure) : v_(std::in_place_index<1>, std::move(failure.message)) {}

  // ok, and the conversion to bool, are true when the step succeeded.
  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // The value (borrowed, or moved out of an rvalue result); calling them on a failure throws
  // std::bad_variant_access, a programming error.
  const T& operator*() const& { return std::get<0>(v_); }
  T& operator*() & { return std::get<0>(v_); }
  T&& operator*() && { return std::get<0>(std::move(v_)); }
  const T* operator->() const { return &std::get<0>(v_); }
  T* operator->() { return &std::get<0>(v_); }
  // error is why it failed; calling it on a success throws std::bad_variant_access.
  const std::string& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, std::string> v_;
};
