// The way in and out of both formats, and what they have in common: errors, hashes, dates and UTF-8.
#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <new>
#include <random>
#include <utility>

#include "platform/property_list_internals.h"

namespace appsync {

namespace {

using Code = PropertyListErrorCode;

constexpr auto kEpoch = std::chrono::sys_days{std::chrono::year{2001} / 1 / 1};

constexpr double secondsAt(std::chrono::year_month_day day) {
  return static_cast<double>(std::chrono::seconds{std::chrono::sys_days{day} - kEpoch}.count());
}

struct HashKey {
  std::uint64_t first;
  std::uint64_t second;
};

HashKey makeHashKey() {
  try {
    std::random_device device;
    const auto word = [&device] { return std::uint64_t{device()} << 32 | device(); };
    return {word(), word()};
  } catch (const std::exception&) {
    const auto now = static_cast<std::uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count());
    return {now * 0x9E37'79B9'7F4A'7C15U, static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(&makeHashKey))};
  }
}

// SipHash-1-3.
class Sip {
 public:
  explicit Sip(const HashKey& key)
      : _a(key.first ^ 0x736f6d6570736575U),
        _b(key.second ^ 0x646f72616e646f6dU),
        _c(key.first ^ 0x6c7967656e657261U),
        _d(key.second ^ 0x7465646279746573U) {}

  void add(std::uint64_t word) {
    _d ^= word;
    round();
    _a ^= word;
  }

  std::uint64_t finish() {
    _c ^= 0xFF;
    round();
    round();
    round();
    return _a ^ _b ^ _c ^ _d;
  }

 private:
  void round() {
    _a += _b;
    _c += _d;
    _b = std::rotl(_b, 13) ^ _a;
    _d = std::rotl(_d, 16) ^ _c;
    _a = std::rotl(_a, 32);
    _c += _b;
    _a += _d;
    _b = std::rotl(_b, 17) ^ _c;
    _d = std::rotl(_d, 21) ^ _a;
    _c = std::rotl(_c, 32);
  }

  std::uint64_t _a, _b, _c, _d;
};

bool isBinary(const std::uint8_t* bytes, std::size_t size) {
  constexpr std::string_view magic = "bplist";
  return size >= magic.size() && std::memcmp(bytes, magic.data(), magic.size()) == 0;
}

template <typename Work>
auto guarded(ErrorOut error, const Work& work) -> std::optional<decltype(work())> {
  try {
    return work();
  } catch (const PropertyListFailure& failure) {
    setError(error, propertyListError(failure.code, failure.text));
  } catch (const std::bad_alloc&) {
    setError(error, propertyListError(Code::NoMemory, "there is not enough memory for this property list"));
  } catch (const std::length_error&) {
    setError(error, propertyListError(Code::NoMemory, "there is not enough memory for this property list"));
  }
  return std::nullopt;
}

// The length of the well-formed character at `position`, whose first byte is not ASCII; 0 when it is not well formed.
std::size_t characterLength(std::string_view text, std::size_t position) {
  const auto byte = [&](std::size_t i) {
    return position + i < text.size() ? static_cast<unsigned char>(text[position + i]) : 0U;
  };
  const auto follows = [&](std::size_t i) { return (byte(i) & 0xC0U) == 0x80U; };
  const unsigned first = byte(0);
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

}  // namespace

std::optional<PropertyList> parsePropertyList(const std::uint8_t* bytes, std::size_t size, ErrorOut error,
                                              const PropertyListLimits& limits, PropertyListFormat* format) {
  const bool binary = isBinary(bytes, size);
  if (format != nullptr) *format = binary ? PropertyListFormat::Binary : PropertyListFormat::XML;
  return guarded(error, [&] {
    return binary ? parseBinaryPropertyList(bytes, size, limits) : parseXMLPropertyList(bytes, size, limits);
  });
}

std::optional<PropertyList> parsePropertyList(const Bytes& bytes, ErrorOut error) {
  return parsePropertyList(bytes.data(), bytes.size(), error);
}

std::optional<Bytes> serializePropertyList(const PropertyList& value, PropertyListFormat format, ErrorOut error) {
  return guarded(error, [&] {
    return format == PropertyListFormat::Binary ? serializeBinaryPropertyList(value) : serializeXMLPropertyList(value);
  });
}

void failAtByte(std::string text, std::size_t byte, PropertyListErrorCode code) {
  throw PropertyListFailure{code, std::move(text) + ", at byte " + std::to_string(byte)};
}

std::string quotedForError(std::string_view text) {
  constexpr std::size_t longest = 200;
  std::string shown;
  while (!text.empty() && shown.size() < longest) {
    const auto first = static_cast<unsigned char>(text[0]);
    const std::size_t length = first < 0x80 ? 1 : characterLength(text, 0);
    if (length == 0 || first < 0x20) {
      shown += '?';
    } else {
      shown += text.substr(0, length);
    }
    text.remove_prefix(std::max<std::size_t>(1, length));
  }
  return '"' + shown + (text.empty() ? "\"" : "…\"");
}

std::uint64_t keyedHash(std::string_view text) {
  static const HashKey key = makeHashKey();
  Sip sip(key);
  std::size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, text.data() + i, 8);
    sip.add(word);
  }
  std::uint64_t last = 0;
  if (i < text.size()) std::memcpy(&last, text.data() + i, text.size() - i);
  sip.add(last | std::uint64_t{text.size()} << 56);
  return sip.finish();
}

bool isWritableDate(double secondsSince2001) {
  constexpr double first = secondsAt(std::chrono::year{1} / 1 / 1);
  constexpr double end = secondsAt(std::chrono::year{10000} / 1 / 1);
  return secondsSince2001 >= first && secondsSince2001 < end;
}

std::optional<std::string> dateText(double secondsSince2001) {
  if (!isWritableDate(secondsSince2001)) return std::nullopt;
  // Towards the past also before 2001, as a clock does that shows whole seconds.
  auto seconds = static_cast<std::int64_t>(secondsSince2001);
  if (static_cast<double>(seconds) > secondsSince2001) --seconds;
  const auto time = kEpoch + std::chrono::seconds{seconds};
  const auto day = std::chrono::floor<std::chrono::days>(time);
  const std::chrono::year_month_day date{day};
  const std::chrono::hh_mm_ss clock{time - day};
  std::array<char, 64> text{};
  std::snprintf(text.data(), text.size(), "%04d-%02u-%02uT%02d:%02d:%02dZ", static_cast<int>(date.year()),
                static_cast<unsigned>(date.month()), static_cast<unsigned>(date.day()),
                static_cast<int>(clock.hours().count()), static_cast<int>(clock.minutes().count()),
                static_cast<int>(clock.seconds().count()));
  return text.data();
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
    if (static_cast<unsigned char>(text[i]) < 0x80) {
      ++i;
      continue;
    }
    const std::size_t length = characterLength(text, i);
    if (length == 0) return i;
    i += length;
  }
  return i;
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
