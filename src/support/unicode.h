// Unicode clean-up of display strings.
#pragma once

#include <string>
#include <string_view>

// Removes runs of U+202A, U+202B, U+202C and U+202D (the embedding, pop and left-to-right override
// controls) from both ends of UTF-8 text. U+202E and the isolates U+2066..U+2069 are kept on
// purpose, as is anything inside the text.
std::string trimBidirectionalUnicodeCharacters(std::string_view text);
