// The inside of a `PropertyList`, shared by the value type and its readers and writers; nobody else includes this.
//
// A value is one word whose low four bits are its tag. Small scalars (booleans, integers of 60 bits, reals and dates
// whose mantissa ends in four zero bits, which whole numbers and whole seconds do, 32-bit reals) and empty collections
// live in the word. Everything else lives in a node that begins with an atomic reference count. So a value costs eight
// bytes beside its node, and a file whose objects are referred to by one byte each still takes less than ten times its
// size.
//
// A node is changed only by an owner that is its only one.
#pragma once

#include <atomic>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/property_list.h"
#include "platform/utf8.h"

namespace appsync {

struct StringNode {
  std::atomic<std::uint64_t> references;
  std::size_t size;  // the text follows the node
};

struct ScalarNode {
  std::atomic<std::uint64_t> references;
  std::uint64_t payload;
};

struct DataNode {
  std::atomic<std::uint64_t> references;
  std::size_t size;  // the bytes follow the node
};

struct ArrayNode {
  std::atomic<std::uint64_t> references;
  std::size_t size;
  std::size_t capacity;  // the elements follow the node
};

// Keys and values alternate behind the node; behind them comes, when there are more than a few, an index: an open
// hash table of positions. A removed member stays as a hole until the members are moved anyway.
struct DictionaryNode {
  std::atomic<std::uint64_t> references;
  std::uint32_t used;  // members, holes included
  std::uint32_t live;
  std::uint32_t capacity;
};

struct PropertyListInternals {
  using Bits = PropertyList::Bits;

  enum Tag : Bits {
    kHole,  // no value: in the place of a removed member's key
    kBoolean,
    kInteger,
    kUID,
    kReal,
    kReal32,
    kDate,
    kString,  // the first that is a node
    kIntegerNode,
    kUnsignedNode,  // only above the signed range
    kRealNode,
    kDateNode,
    kUIDNode,
    kData,
    kArray,       // no address: empty
    kDictionary,  // no address: empty
  };

  static Bits bits(const PropertyList& value) { return value._bits; }
  static Tag tag(Bits bits) { return static_cast<Tag>(bits & PropertyList::kTagMask); }
  static bool isNode(Bits bits) { return PropertyList::isNode(bits); }
  static bool isContainer(Bits bits) { return tag(bits) == kArray || tag(bits) == kDictionary; }

  // Takes over a reference that the caller owns, or adds one of its own.
  static PropertyList adopt(Bits bits) { return PropertyList(PropertyList::Raw{bits}); }
  static PropertyList share(Bits bits) {
    if (isNode(bits)) PropertyList::references(bits).fetch_add(1, std::memory_order_relaxed);
    return adopt(bits);
  }
  static bool isOnlyReference(Bits node) { return PropertyList::references(node).load(std::memory_order_acquire) == 1; }

  template <typename Node>
  static Node* node(Bits bits) {
    return reinterpret_cast<Node*>(static_cast<std::uintptr_t>(bits & ~PropertyList::kTagMask));
  }
  static Bits tagged(const void* node, Tag tag) {
    return static_cast<Bits>(reinterpret_cast<std::uintptr_t>(node)) | tag;
  }

  static char* text(StringNode* node) { return reinterpret_cast<char*>(node + 1); }
  static std::string_view text(Bits string) {
    auto* found = node<StringNode>(string);
    return {text(found), found->size};
  }
  static std::uint8_t* bytes(DataNode* node) { return reinterpret_cast<std::uint8_t*>(node + 1); }
  static double payloadAsReal(Bits bits) { return std::bit_cast<double>(node<ScalarNode>(bits)->payload); }

  // The values inside an array, or the keys and values of a dictionary in turn (where a key may be a hole).
  static PropertyList* children(Bits container) {
    if (!isNode(container)) return nullptr;
    if (tag(container) == kArray) return reinterpret_cast<PropertyList*>(node<ArrayNode>(container) + 1);
    return reinterpret_cast<PropertyList*>(node<DictionaryNode>(container) + 1);
  }
  static std::size_t childCount(Bits container) {
    if (!isNode(container)) return 0;
    if (tag(container) == kArray) return node<ArrayNode>(container)->size;
    return std::size_t{2} * node<DictionaryNode>(container)->used;
  }

  // A string of `size` bytes, for the caller to fill through `text` before anybody else sees it.
  static PropertyList uninitializedString(std::size_t size);
  // Empty collections with room for a known number of elements; appending and inserting up to it moves nothing.
  static PropertyList reservedArray(std::size_t capacity);
  static PropertyList reservedDictionary(std::size_t capacity);
  // Adds to an array that has room and one owner.
  static void appendReserved(const PropertyList& array, PropertyList&& element);
  // Puts `value` under `key`, a string value. Moves the key away if it is new; otherwise leaves it alone and answers
  // the value that was there before.
  static std::optional<PropertyList> insert(PropertyList& dictionary, PropertyList& key, PropertyList&& value);

  static constexpr std::size_t kMostMembers = 0xFFFF'FFF0;
};

// A hash that nobody who writes a file can foresee, so that no file makes a table slow.
std::uint64_t keyedHash(std::string_view text);

// Whether a date lies in the years 1 to 9999; the formats, or their other readers, know no others.
bool isWritableDate(double secondsSince2001);
// "2024-05-01T10:00:00Z", fractions of a second cut off; none when the date is not writable.
std::optional<std::string> dateText(double secondsSince2001);

// The largest number of values, each counted as often as it is reached, that a writer puts down: what a reader with
// the usual limits reads again.
inline constexpr std::size_t kMostWrittenValues = PropertyListLimits{}.expandedValues;
inline constexpr std::size_t kDeepestWritten = PropertyListLimits{}.depth;

inline Error propertyListError(PropertyListErrorCode code, std::string text) {
  return Error(std::string(kPropertyListErrorDomain), static_cast<std::int64_t>(code), std::move(text));
}

// What the readers and writers throw among themselves; it never leaves them.
struct PropertyListFailure {
  PropertyListErrorCode code;
  std::string text;
};

[[noreturn]] void failAtByte(std::string text, std::size_t byte,
                             PropertyListErrorCode code = PropertyListErrorCode::Malformed);

// A string as an error's text shows it: cut off when long, on one line, UTF-8 whatever the string is.
std::string quotedForError(std::string_view text);

PropertyList parseBinaryPropertyList(const std::uint8_t* bytes, std::size_t size, const PropertyListLimits& limits);
PropertyList parseXMLPropertyList(const std::uint8_t* bytes, std::size_t size, const PropertyListLimits& limits);
Bytes serializeBinaryPropertyList(const PropertyList& value);
Bytes serializeXMLPropertyList(const PropertyList& value);

}  // namespace appsync
