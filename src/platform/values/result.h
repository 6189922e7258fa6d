// Result<T>: what a parsing or set-up step produced, or the text that says why it failed. The
// failure text is written to follow the name of the thing parsed ("it has no \"uid\"").
#pragma once

#include <string>
#include <utility>
#include <variant>

namespace platform {

struct Failure {
  std::string message;
};

template <class T>
class Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Failure failure) : v_(std::in_place_index<1>, std::move(failure.message)) {}

  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // The value; only on success.
  const T& operator*() const& { return std::get<0>(v_); }
  T&& operator*() && { return std::get<0>(std::move(v_)); }
  const T* operator->() const { return &std::get<0>(v_); }
  // Why it failed; only on failure.
  const std::string& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, std::string> v_;
};

}  // namespace platform
