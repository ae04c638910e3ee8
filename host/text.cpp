#include "host/text.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <iterator>

#include "platform/utf8.h"

namespace appsync {

namespace {

constexpr std::string_view kReplacement = "\xEF\xBF\xBD";

struct Range {
  char32_t first;
  char32_t last;
};

// Characters that add nothing to the width of a line.
constexpr std::array kZeroWidth{
    Range{0x0300, 0x036F},  Range{0x0483, 0x0489}, Range{0x0591, 0x05BD}, Range{0x05BF, 0x05BF},
    Range{0x05C1, 0x05C2},  Range{0x05C4, 0x05C5}, Range{0x05C7, 0x05C7}, Range{0x0610, 0x061A},
    Range{0x064B, 0x065F},  Range{0x0670, 0x0670}, Range{0x06D6, 0x06DC}, Range{0x06DF, 0x06E4},
    Range{0x06E7, 0x06E8},  Range{0x06EA, 0x06ED}, Range{0x0900, 0x0902}, Range{0x093A, 0x093A},
    Range{0x093C, 0x093C},  Range{0x0941, 0x0948}, Range{0x094D, 0x094D}, Range{0x0E31, 0x0E31},
    Range{0x0E34, 0x0E3A},  Range{0x0E47, 0x0E4E}, Range{0x1AB0, 0x1AFF}, Range{0x1DC0, 0x1DFF},
    Range{0x200B, 0x200D},  Range{0x20D0, 0x20FF}, Range{0x302A, 0x302D}, Range{0x3099, 0x309A},
    Range{0xFE00, 0xFE0F},  Range{0xFE20, 0xFE2F}, Range{0xFEFF, 0xFEFF}, Range{0x1F3FB, 0x1F3FF},
    Range{0xE0100, 0xE01EF}};

constexpr std::array kWide{
    Range{0x1100, 0x115F},   Range{0x231A, 0x231B},   Range{0x23E9, 0x23EC},   Range{0x23F0, 0x23F0},
    Range{0x23F3, 0x23F3},   Range{0x25FD, 0x25FE},   Range{0x2614, 0x2615},   Range{0x2648, 0x2653},
    Range{0x267F, 0x267F},   Range{0x2693, 0x2693},   Range{0x26A1, 0x26A1},   Range{0x26AA, 0x26AB},
    Range{0x26BD, 0x26BE},   Range{0x26C4, 0x26C5},   Range{0x26CE, 0x26CE},   Range{0x26D4, 0x26D4},
    Range{0x26EA, 0x26EA},   Range{0x26F2, 0x26F3},   Range{0x26F5, 0x26F5},   Range{0x26FA, 0x26FA},
    Range{0x26FD, 0x26FD},   Range{0x2705, 0x2705},   Range{0x270A, 0x270B},   Range{0x2728, 0x2728},
    Range{0x274C, 0x274C},   Range{0x274E, 0x274E},   Range{0x2753, 0x2755},   Range{0x2757, 0x2757},
    Range{0x2795, 0x2797},   Range{0x27B0, 0x27B0},   Range{0x27BF, 0x27BF},   Range{0x2B1B, 0x2B1C},
    Range{0x2B50, 0x2B50},   Range{0x2B55, 0x2B55},   Range{0x2E80, 0x303E},   Range{0x3041, 0x33FF},
    Range{0x3400, 0x4DBF},   Range{0x4E00, 0x9FFF},   Range{0xA000, 0xA4CF},   Range{0xA960, 0xA97C},
    Range{0xAC00, 0xD7A3},   Range{0xF900, 0xFAFF},   Range{0xFE10, 0xFE19},   Range{0xFE30, 0xFE6F},
    Range{0xFF00, 0xFF60},   Range{0xFFE0, 0xFFE6},   Range{0x17000, 0x18CFF}, Range{0x1B000, 0x1B2FF},
    Range{0x1F004, 0x1F004}, Range{0x1F0CF, 0x1F0CF}, Range{0x1F18E, 0x1F18E}, Range{0x1F191, 0x1F19A},
    Range{0x1F200, 0x1F320}, Range{0x1F32D, 0x1F335}, Range{0x1F337, 0x1F37C}, Range{0x1F37E, 0x1F393},
    Range{0x1F3A0, 0x1F3CA}, Range{0x1F3CF, 0x1F3D3}, Range{0x1F3E0, 0x1F3F0}, Range{0x1F3F4, 0x1F3F4},
    Range{0x1F3F8, 0x1F43E}, Range{0x1F440, 0x1F440}, Range{0x1F442, 0x1F4FC}, Range{0x1F4FF, 0x1F53D},
    Range{0x1F54B, 0x1F567}, Range{0x1F57A, 0x1F57A}, Range{0x1F595, 0x1F596}, Range{0x1F5A4, 0x1F5A4},
    Range{0x1F5FB, 0x1F64F}, Range{0x1F680, 0x1F6C5}, Range{0x1F6CC, 0x1F6CC}, Range{0x1F6D0, 0x1F6D2},
    Range{0x1F6D5, 0x1F6DF}, Range{0x1F6EB, 0x1F6EC}, Range{0x1F6F4, 0x1F6FC}, Range{0x1F7E0, 0x1F7EB},
    Range{0x1F90C, 0x1F93A}, Range{0x1F93C, 0x1F945}, Range{0x1F947, 0x1F9FF}, Range{0x1FA70, 0x1FAFF},
    Range{0x20000, 0x3FFFD}};

template <class Ranges>
bool isAmong(char32_t character, const Ranges& ranges) {
  const auto after = std::upper_bound(ranges.begin(), ranges.end(), character,
                                      [](char32_t value, const Range& range) { return value < range.first; });
  return after != ranges.begin() && character <= std::prev(after)->last;
}

bool isObeyed(char32_t character) {
  if (character < 0x20 || (character >= 0x7F && character < 0xA0)) return true;
  return (character >= 0x200E && character <= 0x200F) || (character >= 0x2028 && character <= 0x202E) ||
         (character >= 0x2060 && character <= 0x206F) || (character >= 0xFFF9 && character <= 0xFFFB);
}

// Takes one character off the front of `rest`; false, with one byte taken, when it is no UTF-8.
bool takeCharacter(std::string_view& rest, char32_t& character) {
  const std::size_t length = utf8CharacterLength(rest);
  if (length > 0) character = utf8Character(rest, length);
  rest.remove_prefix(length > 0 ? length : 1);
  return length > 0;
}

std::size_t widthOf(char32_t character) {
  if (isAmong(character, kZeroWidth)) return 0;
  return isAmong(character, kWide) ? 2 : 1;
}

}  // namespace

std::string printable(std::string_view text) {
  std::string made;
  made.reserve(text.size());
  while (!text.empty()) {
    const std::string_view before = text;
    char32_t character = 0;
    const bool valid = takeCharacter(text, character);
    made += valid && !isObeyed(character) ? before.substr(0, before.size() - text.size()) : kReplacement;
  }
  return made;
}

std::size_t displayWidth(std::string_view text) {
  std::size_t width = 0;
  while (!text.empty()) {
    char32_t character = 0;
    width += takeCharacter(text, character) ? widthOf(character) : 1;
  }
  return width;
}

std::string fitted(std::string_view text, std::size_t columns) {
  const std::size_t all = displayWidth(text);
  if (all <= columns) return std::string(text) + std::string(columns - all, ' ');
  if (columns == 0) return {};
  std::string made;
  std::size_t width = 0;
  while (!text.empty()) {
    const std::string_view before = text;
    char32_t character = 0;
    const std::size_t more = takeCharacter(text, character) ? widthOf(character) : 1;
    if (width + more > columns - 1) break;
    width += more;
    made += before.substr(0, before.size() - text.size());
  }
  return made + "…" + std::string(columns - 1 - width, ' ');
}

std::string counted(std::size_t number, std::string_view one, std::string_view many) {
  return std::to_string(number) + " " + std::string(number == 1 ? one : many);
}

std::string byteText(double bytes) {
  constexpr std::array<const char*, 5> kUnits{"B", "KiB", "MiB", "GiB", "TiB"};
  std::size_t unit = 0;
  while (bytes >= 1024 && unit + 1 < kUnits.size()) {
    bytes /= 1024;
    ++unit;
  }
  std::array<char, 32> text{};
  std::snprintf(text.data(), text.size(), unit == 0 ? "%.0f %s" : "%.1f %s", bytes, kUnits[unit]);
  return text.data();
}

std::string installTypeText(std::uint64_t type) {
  constexpr std::array<const char*, 9> kNames{
      "none",      "store download",       "restore", "automatic download", "sync", "automatic update", "migration",
      "downgrade", "intentional downgrade"};
  const std::string number = std::to_string(type);
  return type < kNames.size() ? std::string(kNames[type]) + " (" + number + ")" : number;
}

}  // namespace appsync
