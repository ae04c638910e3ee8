// A property list: the one value type of every state file, todo list, Info.plist and icon layout.
//
// A `PropertyList` is a value: copies are independent of each other, whatever they share inside. Copying takes constant
// time; the first change of a shared array or dictionary copies that one level. Different threads may use different
// copies at the same time, also while these share parts inside; one copy is used by one thread at a time, or only read.
// No operation recurses on the machine's stack: neither the destruction of, nor a comparison or description of, a
// deeply nested value can exhaust it.
#pragma once

#include <atomic>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <iterator>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "platform/error.h"

namespace appsync {

using Bytes = std::vector<std::uint8_t>;
using BytesView = std::span<const std::uint8_t>;  // valid as long as what it shows

class PropertyList {
 public:
  enum class Type : std::uint8_t { String, Integer, Real, Boolean, Date, Data, UID, Array, Dictionary };

  // One member of a dictionary, as an iteration sees it.
  struct Member;
  // Both views keep what they show: they stay valid, and show the same, whatever happens to the value they came from.
  class Array;       // view: size(), operator[], begin(), end() over `const PropertyList&`
  class Dictionary;  // view: size(), begin(), end() over `Member`, in the dictionary's order

  // --- making values ------------------------------------------------------------------------------------------------
  PropertyList(std::string_view text);    // NOLINT(google-explicit-constructor): UTF-8; not checked here
  PropertyList(const char* text);         // NOLINT(google-explicit-constructor)
  PropertyList(const std::string& text);  // NOLINT(google-explicit-constructor)
  PropertyList(bool value);               // NOLINT(google-explicit-constructor)
  // A number says its type by name (`integer`, `real`, ...), and no pointer or number turns into a boolean by accident.
  template <typename T>
  requires(std::is_arithmetic_v<T> || (std::is_pointer_v<T> && !std::is_convertible_v<T, const char*>)) PropertyList(T)
  = delete;

  PropertyList(const PropertyList& other) noexcept : _bits(other._bits) {
    if (isNode(_bits)) references(_bits).fetch_add(1, std::memory_order_relaxed);
  }
  PropertyList(PropertyList&& other) noexcept
      : _bits(std::exchange(other._bits, kFalse)) {}  // leaves the boolean false
  PropertyList& operator=(PropertyList other) noexcept {
    std::swap(_bits, other._bits);
    return *this;
  }
  ~PropertyList() {
    if (isNode(_bits)) release(_bits);
  }

  static PropertyList integer(std::int64_t value);
  static PropertyList unsignedInteger(std::uint64_t value);  // the same value as `integer` where both can hold it
  static PropertyList real(double value);
  static PropertyList real32(float value);  // keeps its width when written; equal to the `real` of the same value
  static PropertyList date(double secondsSince2001);  // seconds since 2001-01-01T00:00:00Z, may be fractional
  static PropertyList data(BytesView bytes);          // copies them
  static PropertyList uid(std::uint64_t value);
  static PropertyList array(std::vector<PropertyList> elements = {});
  static PropertyList dictionary(std::vector<std::pair<std::string, PropertyList>> members = {});  // a later key wins

  // --- reading values; each answers none, null or false when the value is of another type ---------------------------
  Type type() const;
  bool isString() const;
  bool isArray() const;
  bool isDictionary() const;
  std::optional<std::string> string() const;
  std::optional<std::string_view> stringView() const;    // valid as long as this value (or a copy of it) is unchanged
  std::optional<std::int64_t> integer() const;           // none also when out of range
  std::optional<std::uint64_t> unsignedInteger() const;  // none also when negative
  std::optional<double> real() const;                    // reals only
  bool isReal32() const;
  std::optional<bool> boolean() const;   // booleans only
  std::optional<double> number() const;  // integers and reals
  // What a flag means to a reader who is lenient: a boolean itself, a number that is not zero, a string that begins
  // with a digit 1 to 9 or one of "YyTt" after blanks, signs and zeros; none for every other type.
  std::optional<bool> flag() const;
  std::optional<double> date() const;
  std::optional<BytesView> data() const;  // valid as long as this value (or a copy) is unchanged
  std::optional<std::uint64_t> uid() const;

  // --- arrays and dictionaries --------------------------------------------------------------------------------------
  std::size_t count() const;   // elements or members; 0 for every other type
  Array elements() const;      // an empty view when this is no array
  Dictionary members() const;  // an empty view when this is no dictionary
  // The value under `key`, in constant time; null when there is none or this is no dictionary.
  const PropertyList* find(std::string_view key) const;

  void append(PropertyList element);                      // this must be an array
  void replace(std::size_t index, PropertyList element);  // this must be an array with that element
  void set(std::string_view key, PropertyList value);     // this must be a dictionary; a new key goes to the end
  bool remove(std::string_view key);                      // this must be a dictionary; keeps the others' order

  // Equality by value: integers by number, reals by number (of either width; a NaN equals a NaN, so that a copy equals
  // what it was copied from), dictionaries without regard to order. Values of different types are never equal.
  friend bool operator==(const PropertyList& a, const PropertyList& b);

  // One line for a log: a string as it is, numbers and booleans plainly, [a, b], {key = value, …}, data as <N bytes>,
  // long texts, data and collections cut off with "…" so that a log line stays bounded (at most about 16 KiB).
  std::string description() const;

 private:
  friend struct PropertyListInternals;

  // One word: the low four bits are a tag that says the type and whether the rest is the value itself or the address of
  // a node with a reference count (platform/property_list_internals.h).
  using Bits = std::uint64_t;
  struct Raw {
    Bits bits;
  };
  static constexpr Bits kTagMask = 15;
  static constexpr Bits kFirstNodeTag = 7;
  static constexpr Bits kFalse = 1;

  explicit PropertyList(Raw raw) noexcept : _bits(raw.bits) {}

  static bool isNode(Bits bits) { return (bits & kTagMask) >= kFirstNodeTag && bits > kTagMask; }
  static std::atomic<std::uint64_t>& references(Bits node) {
    return *reinterpret_cast<std::atomic<std::uint64_t>*>(static_cast<std::uintptr_t>(node & ~kTagMask));
  }
  static void release(Bits node) noexcept;

  Bits _bits;
};

class PropertyList::Array {
 public:
  using Iterator = const PropertyList*;

  std::size_t size() const { return _size; }
  bool empty() const { return _size == 0; }
  const PropertyList& operator[](std::size_t index) const { return _first[index]; }
  Iterator begin() const { return _first; }
  Iterator end() const { return _first + _size; }

 private:
  friend class PropertyList;
  explicit Array(const PropertyList& owner);

  PropertyList _owner;
  const PropertyList* _first = nullptr;
  std::size_t _size = 0;
};

struct PropertyList::Member {
  std::string_view key;
  const PropertyList& value;
};

class PropertyList::Dictionary {
 public:
  class Iterator {
   public:
    using value_type = Member;
    using difference_type = std::ptrdiff_t;
    using iterator_category = std::input_iterator_tag;
    using reference = Member;

    Iterator() = default;
    Member operator*() const;
    Iterator& operator++();
    Iterator operator++(int) {
      Iterator before = *this;
      ++*this;
      return before;
    }
    friend bool operator==(const Iterator& a, const Iterator& b) { return a._entry == b._entry; }

   private:
    friend class Dictionary;
    Iterator(const PropertyList* entry, const PropertyList* end);
    void skipHoles();

    const PropertyList* _entry = nullptr;  // keys and values alternate
    const PropertyList* _end = nullptr;
  };

  std::size_t size() const { return _size; }
  bool empty() const { return _size == 0; }
  Iterator begin() const { return {_first, _end}; }
  Iterator end() const { return {_end, _end}; }

 private:
  friend class PropertyList;
  explicit Dictionary(const PropertyList& owner);

  PropertyList _owner;
  const PropertyList* _first = nullptr;
  const PropertyList* _end = nullptr;
  std::size_t _size = 0;
};

// The domain of every error that reading or writing a property list gives.
inline constexpr std::string_view kPropertyListErrorDomain = "PropertyListError";

// The codes of that domain.
enum class PropertyListErrorCode : std::int64_t {
  Malformed = 1,        // the bytes are no property list
  BeyondLimits = 2,     // they would be one, but a reader's or writer's limit forbids it
  CannotBeWritten = 3,  // the format has no place for the value
  NoMemory = 4,
  UnexpectedRoot = 5,  // the outermost value is of another type than was asked for
};

enum class PropertyListFormat : std::uint8_t { XML, Binary };

// What a reader of foreign bytes puts up with. Whatever goes beyond is an error, found before memory is spent on it.
struct PropertyListLimits {
  std::size_t depth = 512;                  // containers within containers
  std::size_t expandedValues = 20'000'000;  // values counted as often as they are reached through shared references
};

// Reads a property list of either format: XML in UTF-8 or UTF-16 (with or without byte order mark; comments, CDATA,
// the five named entities and character references; any document type or none, which is never fetched and whose
// entities are never expanded) or binary version 00. None, with an error that says what is wrong and at which byte,
// when the bytes are not a property list or go beyond the limits; never anything else, whatever the bytes are.
std::optional<PropertyList> parsePropertyList(const std::uint8_t* bytes, std::size_t size, ErrorOut error,
                                              const PropertyListLimits& limits = {},
                                              PropertyListFormat* format = nullptr);
std::optional<PropertyList> parsePropertyList(BytesView bytes, ErrorOut error);
// The same for a list whose outermost value has to be a dictionary: any other is an error too.
std::optional<PropertyList> parseDictionary(BytesView bytes, ErrorOut error);

// Writes a property list. Binary output holds each distinct string once. None, with an error, when the value cannot be
// written: deeper than 512 levels, a string that is not UTF-8 or that XML cannot hold, a date outside the format's
// years, a UID in a place where the format has none.
std::optional<Bytes> serializePropertyList(const PropertyList& value, PropertyListFormat format, ErrorOut error);

}  // namespace appsync
