// parseTokenArray on arbitrary bytes: it must never read outside the input, and what it returns
// must be the input cut into pieces, in order, with at most the one trailing byte left over.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "network/token_array.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::optional<platform::Data> input;
  if (size > 0) input = platform::Data(data, size - 1);  // the last byte chooses nil input
  if (size > 0 && data[size - 1] == 0xFF) input.reset();
  auto tokens = parseTokenArray(input);
  if (!input) {
    if (tokens) std::abort();
    return 0;
  }
  if (!tokens) return 0;
  if (input->empty()) std::abort();  // zero-length data never parses
  size_t offset = 0;
  for (const platform::Data& t : *tokens) {
    if (t.length() < 2 || offset + t.length() > input->length()) std::abort();
    if (std::memcmp(t.bytes(), input->bytes() + offset, t.length()) != 0) std::abort();
    offset += t.length();
  }
  size_t left = input->length() - offset;
  if (left > 1) std::abort();
  return 0;
}
