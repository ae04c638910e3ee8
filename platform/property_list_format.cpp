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

}  // namespace

std::optional<PropertyList> parsePropertyList(const std::uint8_t* bytes, std::size_t size, ErrorOut error,
                                              const PropertyListLimits& limits, PropertyListFormat* format) {
  const bool binary = isBinary(bytes, size);
  if (format != nullptr) *format = binary ? PropertyListFormat::Binary : PropertyListFormat::XML;
  return guarded(error, [&] {
    return binary ? parseBinaryPropertyList(bytes, size, limits) : parseXMLPropertyList(bytes, size, limits);
  });
}

std::optional<PropertyList> parsePropertyList(BytesView bytes, ErrorOut error) {
  return parsePropertyList(bytes.data(), bytes.size(), error);
}

std::optional<PropertyList> parseDictionary(BytesView bytes, ErrorOut error) {
  std::optional<PropertyList> value = parsePropertyList(bytes, error);
  if (!value || value->isDictionary()) return value;
  setError(error, Error(std::string(kPropertyListErrorDomain),
                        static_cast<std::int64_t>(PropertyListErrorCode::UnexpectedRoot),
                        "The outermost value of the property list must be a dictionary"));
  return std::nullopt;
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
    const std::size_t length = utf8CharacterLength(text);
    if (length == 0 || (length == 1 && static_cast<unsigned char>(text[0]) < 0x20)) {
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

}  // namespace appsync
