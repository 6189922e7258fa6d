// Result<T, E>: the value a parsing or set-up step produced, or why it failed, in the manner of
// std::expected. The failure is a text by default, written to follow the name of the thing parsed
// ("it has no \"uid\""); operations that fail with a platform::Error use Result<T, Error>.
#pragma once

#include <concepts>
#include <optional>
#include <string>
#include <utility>
#include <variant>

namespace platform {

// Failure carries the text of a failed step into a Result<T>.
struct Failure {
  std::string message;
};

// Done is the outcome of a step that makes nothing: empty when it succeeded, else why it failed;
// `if (Done failed = step()) return *failed;` passes the failure on into a Result.
using Done = std::optional<Failure>;

template <class T, class E = std::string>
class Result {
 public:
  // A Result converts from the value on success.
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  // A Result with a text for its failure converts from a Failure...
  Result(Failure failure) requires std::same_as<E, std::string>
      : v_(std::in_place_index<1>, std::move(failure.message)) {}
  // ...and one with any other failure type from the failure itself.
  Result(E error) requires(!std::same_as<E, std::string>) : v_(std::in_place_index<1>, std::move(error)) {}

  // ok, and the conversion to bool, are true when the step succeeded.
  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // The value, borrowed or moved out of an rvalue Result; calling these on a failure throws
  // std::bad_variant_access, a programming error.
  const T& value() const& { return std::get<0>(v_); }
  T& value() & { return std::get<0>(v_); }
  T&& value() && { return std::get<0>(std::move(v_)); }
  const T& operator*() const& { return value(); }
  T& operator*() & { return value(); }
  T&& operator*() && { return std::move(*this).value(); }
  const T* operator->() const { return &value(); }
  T* operator->() { return &value(); }
  // value_or is a copy of the value on success, else `fallback`.
  T value_or(T fallback) const& { return ok() ? value() : std::move(fallback); }
  // error is why it failed, borrowed; calling it on a success throws std::bad_variant_access.
  const E& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, E> v_;
};

}  // namespace platform
