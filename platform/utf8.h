// Text in UTF-8: what is well formed, and making it. No overlong forms, surrogates, or characters beyond the last.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace appsync {

// The bytes of the well-formed character that the text begins with; 0 when it begins with none.
std::size_t utf8CharacterLength(std::string_view text);

// The first byte that is not part of well-formed UTF-8; the size when all are.
std::size_t validUTF8Prefix(std::string_view text);
inline bool isUTF8(std::string_view text) {
  return validUTF8Prefix(text) == text.size();
}

// The character in the first `length` bytes, as `utf8CharacterLength` has measured them.
char32_t utf8Character(std::string_view text, std::size_t length);

void appendUTF8(std::string& text, char32_t character);

}  // namespace appsync
