#include "support/unicode.h"

namespace {
// U+202A..U+202D encode as E2 80 AA..AD.
bool isTrimmedControl(std::string_view s, size_t at) {
  return at + 3 <= s.size() && static_cast<unsigned char>(s[at]) == 0xE2 &&
         static_cast<unsigned char>(s[at + 1]) == 0x80 && static_cast<unsigned char>(s[at + 2]) >= 0xAA &&
         static_cast<unsigned char>(s[at + 2]) <= 0xAD;
}
}  // namespace

std::string trimBidirectionalUnicodeCharacters(std::string_view text) {
  size_t begin = 0, end = text.size();
  while (isTrimmedControl(text, begin)) begin += 3;
  while (end >= begin + 3 && isTrimmedControl(text, end - 3)) end -= 3;
  return std::string(text.substr(begin, end - begin));
}
