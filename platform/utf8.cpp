#include "platform/utf8.h"

#include <cstdint>
#include <cstring>

namespace appsync {

std::size_t utf8CharacterLength(std::string_view text) {
  const auto byte = [&](std::size_t i) { return i < text.size() ? static_cast<unsigned char>(text[i]) : 0U; };
  const auto follows = [&](std::size_t i) { return (byte(i) & 0xC0U) == 0x80U; };
  if (text.empty()) return 0;
  const unsigned first = byte(0);
  if (first < 0x80) return 1;
  if (first >= 0xC2 && first <= 0xDF) return follows(1) ? 2 : 0;
  if (first >= 0xE0 && first <= 0xEF) {
    const bool overlong = first == 0xE0 && byte(1) < 0xA0;
    const bool surrogate = first == 0xED && byte(1) > 0x9F;
    return !overlong && !surrogate && follows(1) && follows(2) ? 3 : 0;
  }
  if (first >= 0xF0 && first <= 0xF4) {
    const bool overlong = first == 0xF0 && byte(1) < 0x90;
    const bool beyond = first == 0xF4 && byte(1) > 0x8F;
    return !overlong && !beyond && follows(1) && follows(2) && follows(3) ? 4 : 0;
  }
  return 0;
}

std::size_t validUTF8Prefix(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size()) {
    std::uint64_t word = 0;
    if (i + 8 <= text.size()) {
      std::memcpy(&word, text.data() + i, 8);
      if ((word & 0x8080'8080'8080'8080U) == 0) {
        i += 8;
        continue;
      }
    }
    const std::size_t length = utf8CharacterLength(text.substr(i));
    if (length == 0) return i;
    i += length;
  }
  return i;
}

char32_t utf8Character(std::string_view text, std::size_t length) {
  const auto byte = [&](std::size_t i) { return static_cast<char32_t>(static_cast<unsigned char>(text[i])); };
  if (length == 1) return byte(0);
  char32_t character = byte(0) & (0x7FU >> length);
  for (std::size_t i = 1; i < length; ++i) character = character << 6U | (byte(i) & 0x3FU);
  return character;
}

void appendUTF8(std::string& text, char32_t character) {
  const auto add = [&text](char32_t byte) { text += static_cast<char>(static_cast<unsigned char>(byte)); };
  if (character < 0x80) return add(character);
  if (character < 0x800) {
    add(0xC0 | character >> 6);
  } else {
    if (character < 0x10000) {
      add(0xE0 | character >> 12);
    } else {
      add(0xF0 | character >> 18);
      add(0x80 | (character >> 12 & 0x3F));
    }
    add(0x80 | (character >> 6 & 0x3F));
  }
  add(0x80 | (character & 0x3F));
}

}  // namespace appsync
