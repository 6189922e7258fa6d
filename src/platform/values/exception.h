// The one exception the service raises: a programming error such as calling a forbidden
// initializer. Errors that can happen at run time are values, never exceptions.
#pragma once

#include <stdexcept>

namespace platform {

class InternalInconsistencyException : public std::logic_error {
 public:
  using std::logic_error::logic_error;
};

}  // namespace platform
