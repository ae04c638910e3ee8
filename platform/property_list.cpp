#include "platform/property_list.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <new>
#include <unordered_set>

#include "platform/property_list_internals.h"

namespace appsync {

using Internals = PropertyListInternals;
using Bits = Internals::Bits;

namespace {

constexpr std::int64_t kMostInlineInteger = (std::int64_t{1} << 59) - 1;
constexpr std::uint64_t kMostInlineUID = (std::uint64_t{1} << 60) - 1;
constexpr unsigned kTagBits = 4;
constexpr std::uint32_t kNowhere = std::numeric_limits<std::uint32_t>::max();

void require(bool condition, const char* what) {
  if (condition) return;
  std::fprintf(stderr, "AppSync: %s\n", what);
  std::abort();
}

// --- nodes ----------------------------------------------------------------------------------------------------------

Bits newScalarNode(std::uint64_t payload, Internals::Tag tag) {
  return Internals::tagged(new ScalarNode{1, payload}, tag);
}

Bits realBits(double value, Internals::Tag inlineTag, Internals::Tag nodeTag) {
  const auto pattern = std::bit_cast<std::uint64_t>(value);
  if ((pattern & ((1U << kTagBits) - 1)) == 0) return pattern | inlineTag;
  return newScalarNode(pattern, nodeTag);
}

double inlineReal(Bits bits) {
  return std::bit_cast<double>(bits >> kTagBits << kTagBits);
}

Bits newArrayNode(std::size_t capacity) {
  constexpr std::size_t most = (std::numeric_limits<std::size_t>::max() / 2 - sizeof(ArrayNode)) / sizeof(PropertyList);
  if (capacity > most) throw std::bad_alloc();
  void* memory = ::operator new(sizeof(ArrayNode) + capacity * sizeof(PropertyList));
  return Internals::tagged(new (memory) ArrayNode{1, 0, capacity}, Internals::kArray);
}

// Makes `array` the only owner of its elements, with room for `wanted` of them.
void ownArray(PropertyList& array, std::size_t wanted) {
  const Bits old = Internals::bits(array);
  const std::size_t size = Internals::childCount(old);
  const bool only = Internals::isNode(old) && Internals::isOnlyReference(old);
  if (only && wanted <= Internals::node<ArrayNode>(old)->capacity) return;

  const bool grows = only && wanted > size;
  PropertyList fresh = Internals::adopt(newArrayNode(grows ? std::max<std::size_t>(4, size * 2) : wanted));
  if (size == 0) {
    array = std::move(fresh);
    return;
  }
  PropertyList* elements = Internals::children(old);
  PropertyList* target = Internals::children(Internals::bits(fresh));
  if (only) {
    std::uninitialized_move_n(elements, size, target);
  } else {
    std::uninitialized_copy_n(elements, size, target);
  }
  Internals::node<ArrayNode>(Internals::bits(fresh))->size = size;
  array = std::move(fresh);
}

// --- the index of a dictionary --------------------------------------------------------------------------------------

constexpr std::uint32_t kMostScanned = 8;
constexpr std::uint32_t kMostByteIndexed = 254;

std::size_t slotCount(std::uint32_t capacity) {
  if (capacity <= kMostScanned) return 0;
  return std::bit_ceil(std::size_t{capacity} + capacity / 3 + 1);
}

std::size_t indexBytes(std::uint32_t capacity) {
  return slotCount(capacity) * (capacity <= kMostByteIndexed ? 1 : sizeof(std::uint64_t));
}

PropertyList* entries(DictionaryNode* node) {
  return reinterpret_cast<PropertyList*>(node + 1);
}

// A slot holds a position and, in wide slots, the hash's upper half, which spares a look at most keys that differ.
template <typename Slot>
Slot* slots(DictionaryNode* node) {
  return reinterpret_cast<Slot*>(entries(node) + std::size_t{2} * node->capacity);
}

template <typename Slot>
constexpr std::uint64_t kHashInSlot = sizeof(Slot) == 1 ? 0 : 0xFFFF'FFFF'0000'0000;

// A key and its hash, which is found out when, and only when, an index asks for it.
class HashedKey {
 public:
  explicit HashedKey(std::string_view text) : _text(text) {}
  std::string_view text() const { return _text; }
  std::uint64_t hash() {
    if (!_hash) _hash = keyedHash(_text);
    return *_hash;
  }

 private:
  std::string_view _text;
  std::optional<std::uint64_t> _hash;
};

bool keyIs(const PropertyList& key, std::string_view text) {
  return Internals::bits(key) != Internals::kHole && Internals::text(Internals::bits(key)) == text;
}

template <typename Slot>
std::uint32_t probe(DictionaryNode* node, HashedKey& key) {
  const std::size_t mask = slotCount(node->capacity) - 1;
  const std::uint64_t hash = key.hash();
  for (std::size_t i = hash & mask;; i = (i + 1) & mask) {
    const std::uint64_t slot = slots<Slot>(node)[i];
    if (slot == 0) return kNowhere;
    if ((slot ^ hash) & kHashInSlot<Slot>) continue;
    const auto position = static_cast<std::uint32_t>((slot & ~kHashInSlot<Slot>)-1);
    if (keyIs(entries(node)[std::size_t{2} * position], key.text())) return position;
  }
}

template <typename Slot>
void addSlot(DictionaryNode* node, std::uint32_t position, HashedKey& key) {
  const std::size_t mask = slotCount(node->capacity) - 1;
  const std::uint64_t hash = key.hash();
  std::size_t i = hash & mask;
  while (slots<Slot>(node)[i] != 0) i = (i + 1) & mask;
  slots<Slot>(node)[i] = static_cast<Slot>((hash & kHashInSlot<Slot>) | (std::uint64_t{position} + 1));
}

std::uint32_t locate(Bits dictionary, HashedKey& key) {
  if (!Internals::isNode(dictionary)) return kNowhere;
  auto* node = Internals::node<DictionaryNode>(dictionary);
  if (node->capacity > kMostByteIndexed) return probe<std::uint64_t>(node, key);
  if (node->capacity > kMostScanned) return probe<std::uint8_t>(node, key);
  for (std::uint32_t i = 0; i < node->used; ++i) {
    if (keyIs(entries(node)[std::size_t{2} * i], key.text())) return i;
  }
  return kNowhere;
}

std::uint32_t locate(Bits dictionary, std::string_view key) {
  HashedKey hashed(key);
  return locate(dictionary, hashed);
}

// --- the members of a dictionary ------------------------------------------------------------------------------------

Bits newDictionaryNode(std::size_t wanted) {
  if (wanted > Internals::kMostMembers) throw std::bad_alloc();
  const auto capacity = static_cast<std::uint32_t>(wanted);
  const std::size_t size = sizeof(DictionaryNode) + std::size_t{2} * capacity * sizeof(PropertyList);
  void* memory = ::operator new(size + indexBytes(capacity));
  std::memset(static_cast<char*>(memory) + size, 0, indexBytes(capacity));
  return Internals::tagged(new (memory) DictionaryNode{1, 0, 0, capacity}, Internals::kDictionary);
}

// The dictionary has room, one owner, and no such key.
void addMember(Bits dictionary, HashedKey& hashed, PropertyList key, PropertyList value) {
  auto* node = Internals::node<DictionaryNode>(dictionary);
  PropertyList* entry = entries(node) + std::size_t{2} * node->used;
  std::construct_at(entry, std::move(key));
  std::construct_at(entry + 1, std::move(value));
  if (node->capacity > kMostByteIndexed) {
    addSlot<std::uint64_t>(node, node->used, hashed);
  } else if (node->capacity > kMostScanned) {
    addSlot<std::uint8_t>(node, node->used, hashed);
  }
  ++node->used;
  ++node->live;
}

// Makes `dictionary` the only owner of its members, with room for one more if asked. Positions may change.
void ownDictionary(PropertyList& dictionary, bool room) {
  const Bits old = Internals::bits(dictionary);
  if (!Internals::isNode(old)) {
    if (room) dictionary = Internals::adopt(newDictionaryNode(4));
    return;
  }
  auto* node = Internals::node<DictionaryNode>(old);
  const bool only = Internals::isOnlyReference(old);
  if (only && (!room || node->used < node->capacity)) return;

  const std::size_t live = node->live;
  const std::size_t spare = !room ? 0 : only ? std::max<std::size_t>(4, live) : live / 8 + 1;
  const std::size_t most = std::max(live, std::size_t{Internals::kMostMembers});
  PropertyList fresh = Internals::adopt(newDictionaryNode(std::min(live + spare, most)));
  for (std::uint32_t i = 0; i < node->used; ++i) {
    PropertyList* entry = entries(node) + std::size_t{2} * i;
    if (Internals::bits(entry[0]) == Internals::kHole) continue;
    HashedKey hashed(Internals::text(Internals::bits(entry[0])));
    if (only) {
      addMember(Internals::bits(fresh), hashed, std::move(entry[0]), std::move(entry[1]));
    } else {
      addMember(Internals::bits(fresh), hashed, entry[0], entry[1]);
    }
  }
  dictionary = std::move(fresh);
}

// --- destruction ----------------------------------------------------------------------------------------------------

// Whether this was the last reference. Who sees one reference, his own, needs no atomic write.
bool dropReference(Bits node) noexcept {
  auto& references = Internals::node<ScalarNode>(node)->references;
  return references.load(std::memory_order_acquire) == 1 || references.fetch_sub(1, std::memory_order_acq_rel) == 1;
}

void freeNode(Bits node) noexcept {
  ::operator delete(Internals::node<void>(node));
}

// --- description ----------------------------------------------------------------------------------------------------

constexpr std::string_view kCutOff = "…";
constexpr std::size_t kLongestText = 15'000;        // of a string that stands alone
constexpr std::size_t kLongestInnerText = 2'000;    // of a string in a collection
constexpr std::size_t kLongestCollection = 11'000;  // where no further element is begun
constexpr std::size_t kDeepestDescribed = 100;

void appendCutOff(std::string& text, std::string_view added, std::size_t most) {
  if (added.size() <= most) {
    text += added;
    return;
  }
  while (most > 0 && (static_cast<unsigned char>(added[most]) & 0xC0) == 0x80) --most;
  text += added.substr(0, most);
  text += kCutOff;
}

std::string numberText(auto value) {
  std::array<char, 40> buffer{};
  return {buffer.data(), std::to_chars(buffer.data(), buffer.data() + buffer.size(), value).ptr};
}

void appendDate(std::string& text, double date) {
  if (const std::optional<std::string> named = dateText(date)) {
    text += *named;
  } else {
    text.append("<date ").append(numberText(date)).append(">");
  }
}

void appendLeaf(std::string& text, const PropertyList& value, std::size_t longestText) {
  switch (value.type()) {
    case PropertyList::Type::String:
      return appendCutOff(text, *value.stringView(), longestText);
    case PropertyList::Type::Integer:
      text += value.integer() ? numberText(*value.integer()) : numberText(*value.unsignedInteger());
      return;
    case PropertyList::Type::Real:
      text += numberText(*value.real());
      return;
    case PropertyList::Type::Boolean:
      text += *value.boolean() ? "true" : "false";
      return;
    case PropertyList::Type::Date:
      appendDate(text, *value.date());
      return;
    case PropertyList::Type::Data:
      text.append("<").append(numberText(value.data()->size())).append(" bytes>");
      return;
    case PropertyList::Type::UID:
      text.append("<UID ").append(numberText(*value.uid())).append(">");
      return;
    case PropertyList::Type::Array:
    case PropertyList::Type::Dictionary:
      return;
  }
}

struct Cursor {
  Bits container;
  std::size_t next = 0;  // into the container's children
  bool begun = false;

  bool isDictionary() const { return Internals::tag(container) == Internals::kDictionary; }

  // The next element, or the next member's key (its value follows it); null at the end.
  const PropertyList* advance() {
    const std::size_t count = Internals::childCount(container);
    while (next < count) {
      const PropertyList* child = Internals::children(container) + next;
      next += isDictionary() ? 2 : 1;
      if (Internals::bits(*child) != Internals::kHole) return child;
    }
    return nullptr;
  }
};

std::string describeCollection(const PropertyList& collection) {
  std::string text;
  std::vector<Cursor> open{{Internals::bits(collection)}};
  text += collection.isDictionary() ? '{' : '[';
  while (!open.empty()) {
    Cursor& cursor = open.back();
    const PropertyList* child = cursor.advance();
    if (child == nullptr) {
      text += cursor.isDictionary() ? '}' : ']';
      open.pop_back();
      continue;
    }
    if (cursor.begun) text += ", ";
    cursor.begun = true;
    if (text.size() > kLongestCollection) {
      text += kCutOff;
      for (; !open.empty(); open.pop_back()) text += open.back().isDictionary() ? '}' : ']';
      break;
    }
    if (cursor.isDictionary()) {
      appendCutOff(text, *child->stringView(), kLongestInnerText);
      text += " = ";
      ++child;
    }
    if (!Internals::isContainer(Internals::bits(*child))) {
      appendLeaf(text, *child, kLongestInnerText);
    } else if (open.size() == kDeepestDescribed) {
      text += kCutOff;
    } else {
      text += child->isDictionary() ? '{' : '[';
      open.push_back({Internals::bits(*child)});
    }
  }
  return text;
}

// --- equality -------------------------------------------------------------------------------------------------------

bool leavesAreEqual(const PropertyList& a, const PropertyList& b) {
  switch (a.type()) {
    case PropertyList::Type::String:
      return a.stringView() == b.stringView();
    case PropertyList::Type::Integer:
      return a.integer() == b.integer() && a.unsignedInteger() == b.unsignedInteger();
    case PropertyList::Type::Real:
      return *a.real() == *b.real() || (std::isnan(*a.real()) && std::isnan(*b.real()));
    case PropertyList::Type::Boolean:
      return a.boolean() == b.boolean();
    case PropertyList::Type::Date:
      return *a.date() == *b.date() || (std::isnan(*a.date()) && std::isnan(*b.date()));
    case PropertyList::Type::Data:
      return std::ranges::equal(*a.data(), *b.data());
    case PropertyList::Type::UID:
      return a.uid() == b.uid();
    case PropertyList::Type::Array:
    case PropertyList::Type::Dictionary:
      return false;
  }
  return false;
}

class Comparison {
 public:
  bool areEqual(const PropertyList& a, const PropertyList& b) {
    if (!compare(a, b)) return false;
    while (!_open.empty()) {
      Pair& pair = _open.back();
      const PropertyList* left = pair.left.advance();
      if (left == nullptr) {
        _open.pop_back();
        continue;
      }
      const PropertyList* right = counterpart(pair, left);
      if (right == nullptr) return false;
      if (!compare(pair.left.isDictionary() ? left[1] : left[0], *right)) return false;
    }
    return true;
  }

 private:
  struct Pair {
    Cursor left;
    Bits right;
  };
  struct PairHash {
    std::size_t operator()(const std::pair<Bits, Bits>& pair) const {
      return static_cast<std::size_t>((pair.first ^ std::rotl(pair.second, 31)) * 0x9E37'79B9'7F4A'7C15U >> 7);
    }
  };

  static const PropertyList* counterpart(const Pair& pair, const PropertyList* left) {
    PropertyList* others = Internals::children(pair.right);
    if (!pair.left.isDictionary()) return others + (pair.left.next - 1);
    const std::string_view key = Internals::text(Internals::bits(*left));
    const std::size_t same = pair.left.next - 2;
    if (same < Internals::childCount(pair.right) && keyIs(others[same], key)) return others + same + 1;
    const std::uint32_t position = locate(pair.right, key);
    return position == kNowhere ? nullptr : others + std::size_t{2} * position + 1;
  }

  // False when the two differ at once; collections are put on the stack for their elements' sake.
  bool compare(const PropertyList& a, const PropertyList& b) {
    const Bits left = Internals::bits(a);
    const Bits right = Internals::bits(b);
    if (left == right) return true;
    if (a.type() != b.type()) return false;
    if (!Internals::isContainer(left)) return leavesAreEqual(a, b);
    if (a.count() != b.count()) return false;
    if (a.count() == 0) return true;
    // Two trees whose parts are shared over and over must not be walked once for every way that leads to a part.
    const bool shared = !Internals::isOnlyReference(left) && !Internals::isOnlyReference(right);
    if (shared && !_seen.emplace(left, right).second) return true;
    _open.push_back({{left}, right});
    return true;
  }

  std::vector<Pair> _open;
  std::unordered_set<std::pair<Bits, Bits>, PairHash> _seen;
};

}  // namespace

// --- what the readers build with ------------------------------------------------------------------------------------

PropertyList Internals::uninitializedString(std::size_t size) {
  if (size > std::numeric_limits<std::size_t>::max() / 2) throw std::bad_alloc();
  void* memory = ::operator new(sizeof(StringNode) + size);
  return adopt(tagged(new (memory) StringNode{1, size}, kString));
}

PropertyList Internals::reservedArray(std::size_t capacity) {
  return adopt(capacity == 0 ? Bits{kArray} : newArrayNode(capacity));
}

PropertyList Internals::reservedDictionary(std::size_t capacity) {
  return adopt(capacity == 0 ? Bits{kDictionary} : newDictionaryNode(capacity));
}

void Internals::appendReserved(const PropertyList& array, PropertyList&& element) {
  auto* found = node<ArrayNode>(array._bits);
  std::construct_at(children(array._bits) + found->size, std::move(element));
  ++found->size;
}

std::optional<PropertyList> Internals::insert(PropertyList& dictionary, PropertyList& key, PropertyList&& value) {
  HashedKey hashed(text(key._bits));
  std::uint32_t position = locate(dictionary._bits, hashed);
  if (position == kNowhere) {
    ownDictionary(dictionary, true);
    addMember(dictionary._bits, hashed, std::move(key), std::move(value));
    return std::nullopt;
  }
  if (!isOnlyReference(dictionary._bits)) {
    ownDictionary(dictionary, false);
    position = locate(dictionary._bits, hashed);
  }
  return std::exchange(children(dictionary._bits)[std::size_t{2} * position + 1], std::move(value));
}

// The nodes that wait to be freed are chained through their reference counts, which nobody needs any more; so freeing a
// value takes neither the machine's stack nor memory.
void PropertyList::release(Bits node) noexcept {
  if (!dropReference(node)) return;
  if (!Internals::isContainer(node)) return freeNode(node);
  Bits pending = node;
  references(pending).store(0, std::memory_order_relaxed);
  while (pending != 0) {
    const Bits current = pending;
    pending = references(current).load(std::memory_order_relaxed);
    const PropertyList* children = Internals::children(current);
    for (std::size_t i = 0, count = Internals::childCount(current); i < count; ++i) {
      const Bits child = children[i]._bits;
      if (!isNode(child) || !dropReference(child)) continue;
      if (Internals::isContainer(child)) {
        references(child).store(pending, std::memory_order_relaxed);
        pending = child;
      } else {
        freeNode(child);
      }
    }
    freeNode(current);
  }
}

// --- making values --------------------------------------------------------------------------------------------------

PropertyList::PropertyList(std::string_view text) : _bits(kFalse) {
  PropertyList made = Internals::uninitializedString(text.size());
  if (!text.empty()) std::memcpy(Internals::text(Internals::node<StringNode>(made._bits)), text.data(), text.size());
  std::swap(_bits, made._bits);
}

PropertyList::PropertyList(const char* text) : PropertyList(std::string_view(text)) {}
PropertyList::PropertyList(const std::string& text) : PropertyList(std::string_view(text)) {}
PropertyList::PropertyList(bool value) : _bits(Bits{value} << kTagBits | Internals::kBoolean) {}

PropertyList PropertyList::integer(std::int64_t value) {
  if (value > kMostInlineInteger || value < -kMostInlineInteger - 1) {
    return Internals::adopt(newScalarNode(static_cast<std::uint64_t>(value), Internals::kIntegerNode));
  }
  return Internals::adopt(static_cast<std::uint64_t>(value) << kTagBits | Internals::kInteger);
}

PropertyList PropertyList::unsignedInteger(std::uint64_t value) {
  if (std::in_range<std::int64_t>(value)) return integer(static_cast<std::int64_t>(value));
  return Internals::adopt(newScalarNode(value, Internals::kUnsignedNode));
}

PropertyList PropertyList::real(double value) {
  return Internals::adopt(realBits(value, Internals::kReal, Internals::kRealNode));
}

PropertyList PropertyList::real32(float value) {
  return Internals::adopt(std::uint64_t{std::bit_cast<std::uint32_t>(value)} << 32 | Internals::kReal32);
}

PropertyList PropertyList::date(double secondsSince2001) {
  return Internals::adopt(realBits(secondsSince2001, Internals::kDate, Internals::kDateNode));
}

PropertyList PropertyList::data(BytesView bytes) {
  void* memory = ::operator new(sizeof(DataNode) + bytes.size());
  auto* node = ::new (memory) DataNode{1, bytes.size()};
  if (!bytes.empty()) std::memcpy(Internals::bytes(node), bytes.data(), bytes.size());
  return Internals::adopt(Internals::tagged(node, Internals::kData));
}

PropertyList PropertyList::uid(std::uint64_t value) {
  if (value > kMostInlineUID) return Internals::adopt(newScalarNode(value, Internals::kUIDNode));
  return Internals::adopt(value << kTagBits | Internals::kUID);
}

PropertyList PropertyList::array(std::vector<PropertyList> elements) {
  PropertyList made = Internals::reservedArray(elements.size());
  for (PropertyList& element : elements) Internals::appendReserved(made, std::move(element));
  return made;
}

PropertyList PropertyList::dictionary(std::vector<std::pair<std::string, PropertyList>> members) {
  PropertyList made = Internals::reservedDictionary(members.size());
  for (auto& member : members) {
    PropertyList key = member.first;
    Internals::insert(made, key, std::move(member.second));
  }
  return made;
}

// --- reading values -------------------------------------------------------------------------------------------------

PropertyList::Type PropertyList::type() const {
  static constexpr std::array<Type, 16> kTypes = {
      Type::Boolean, Type::Boolean, Type::Integer, Type::UID,  Type::Real, Type::Real, Type::Date,  Type::String,
      Type::Integer, Type::Integer, Type::Real,    Type::Date, Type::UID,  Type::Data, Type::Array, Type::Dictionary};
  return kTypes[_bits & kTagMask];
}

bool PropertyList::isString() const {
  return type() == Type::String;
}
bool PropertyList::isArray() const {
  return type() == Type::Array;
}
bool PropertyList::isDictionary() const {
  return type() == Type::Dictionary;
}

std::optional<std::string_view> PropertyList::stringView() const {
  if (!isString()) return std::nullopt;
  return Internals::text(_bits);
}

std::optional<std::string> PropertyList::string() const {
  if (!isString()) return std::nullopt;
  return std::string(Internals::text(_bits));
}

std::optional<std::int64_t> PropertyList::integer() const {
  switch (Internals::tag(_bits)) {
    case Internals::kInteger:
      return static_cast<std::int64_t>(_bits) >> kTagBits;
    case Internals::kIntegerNode:
      return static_cast<std::int64_t>(Internals::node<ScalarNode>(_bits)->payload);
    default:
      return std::nullopt;
  }
}

std::optional<std::uint64_t> PropertyList::unsignedInteger() const {
  if (Internals::tag(_bits) == Internals::kUnsignedNode) return Internals::node<ScalarNode>(_bits)->payload;
  const std::optional<std::int64_t> value = integer();
  if (!value || *value < 0) return std::nullopt;
  return static_cast<std::uint64_t>(*value);
}

bool PropertyList::isReal32() const {
  return Internals::tag(_bits) == Internals::kReal32;
}

std::optional<double> PropertyList::real() const {
  switch (Internals::tag(_bits)) {
    case Internals::kReal:
      return inlineReal(_bits);
    case Internals::kReal32:
      return std::bit_cast<float>(static_cast<std::uint32_t>(_bits >> 32));
    case Internals::kRealNode:
      return Internals::payloadAsReal(_bits);
    default:
      return std::nullopt;
  }
}

std::optional<bool> PropertyList::boolean() const {
  if (type() != Type::Boolean) return std::nullopt;
  return _bits >> kTagBits != 0;
}

std::optional<double> PropertyList::number() const {
  if (const auto value = integer()) return static_cast<double>(*value);
  if (const auto value = unsignedInteger()) return static_cast<double>(*value);
  return real();
}

std::optional<bool> PropertyList::flag() const {
  if (const auto value = boolean()) return value;
  if (const auto value = number()) return *value != 0;
  if (!isString()) return std::nullopt;
  std::string_view text = Internals::text(_bits);
  for (const std::string_view skipped : {" \t\n\v\f\r", "+-", "0"}) {
    text.remove_prefix(std::min(text.find_first_not_of(skipped), text.size()));
  }
  return !text.empty() && std::string_view("123456789YyTt").find(text.front()) != std::string_view::npos;
}

std::optional<double> PropertyList::date() const {
  switch (Internals::tag(_bits)) {
    case Internals::kDate:
      return inlineReal(_bits);
    case Internals::kDateNode:
      return Internals::payloadAsReal(_bits);
    default:
      return std::nullopt;
  }
}

std::optional<BytesView> PropertyList::data() const {
  if (Internals::tag(_bits) != Internals::kData) return std::nullopt;
  auto* node = Internals::node<DataNode>(_bits);
  return BytesView(Internals::bytes(node), node->size);
}

std::optional<std::uint64_t> PropertyList::uid() const {
  switch (Internals::tag(_bits)) {
    case Internals::kUID:
      return _bits >> kTagBits;
    case Internals::kUIDNode:
      return Internals::node<ScalarNode>(_bits)->payload;
    default:
      return std::nullopt;
  }
}

// --- arrays and dictionaries ----------------------------------------------------------------------------------------

std::size_t PropertyList::count() const {
  if (!Internals::isContainer(_bits) || !isNode(_bits)) return 0;
  return isArray() ? Internals::node<ArrayNode>(_bits)->size : Internals::node<DictionaryNode>(_bits)->live;
}

PropertyList::Array::Array(const PropertyList& owner) : _owner(owner), _size(owner.count()) {
  if (_size != 0) _first = Internals::children(owner._bits);
}

PropertyList::Dictionary::Dictionary(const PropertyList& owner) : _owner(owner), _size(owner.count()) {
  if (_size == 0) return;
  _first = Internals::children(owner._bits);
  _end = _first + Internals::childCount(owner._bits);
}

PropertyList::Dictionary::Iterator::Iterator(const PropertyList* entry, const PropertyList* end)
    : _entry(entry), _end(end) {
  skipHoles();
}

void PropertyList::Dictionary::Iterator::skipHoles() {
  while (_entry != _end && Internals::bits(*_entry) == Internals::kHole) _entry += 2;
}

PropertyList::Member PropertyList::Dictionary::Iterator::operator*() const {
  return {Internals::text(Internals::bits(_entry[0])), _entry[1]};
}

PropertyList::Dictionary::Iterator& PropertyList::Dictionary::Iterator::operator++() {
  _entry += 2;
  skipHoles();
  return *this;
}

PropertyList::Array PropertyList::elements() const {
  return Array(isArray() ? *this : PropertyList(false));
}
PropertyList::Dictionary PropertyList::members() const {
  return Dictionary(isDictionary() ? *this : PropertyList(false));
}

const PropertyList* PropertyList::find(std::string_view key) const {
  if (!isDictionary()) return nullptr;
  const std::uint32_t position = locate(_bits, key);
  return position == kNowhere ? nullptr : Internals::children(_bits) + std::size_t{2} * position + 1;
}

void PropertyList::append(PropertyList element) {
  require(isArray(), "append to a property list that is no array");
  ownArray(*this, count() + 1);
  Internals::appendReserved(*this, std::move(element));
}

void PropertyList::replace(std::size_t index, PropertyList element) {
  require(isArray() && index < count(), "replace of an element that a property list does not have");
  ownArray(*this, count());
  Internals::children(_bits)[index] = std::move(element);
}

void PropertyList::set(std::string_view key, PropertyList value) {
  require(isDictionary(), "set in a property list that is no dictionary");
  PropertyList text = key;
  Internals::insert(*this, text, std::move(value));
}

bool PropertyList::remove(std::string_view key) {
  require(isDictionary(), "remove from a property list that is no dictionary");
  if (locate(_bits, key) == kNowhere) return false;
  ownDictionary(*this, false);
  PropertyList* entry = Internals::children(_bits) + std::size_t{2} * locate(_bits, key);
  // `key` may be the text of the entry itself, which goes last.
  const PropertyList removed = std::exchange(entry[0], Internals::adopt(Internals::kHole));
  entry[1] = false;
  if (--Internals::node<DictionaryNode>(_bits)->live == 0) *this = Internals::adopt(Internals::kDictionary);
  return true;
}

bool operator==(const PropertyList& a, const PropertyList& b) {
  return Comparison().areEqual(a, b);
}

std::string PropertyList::description() const {
  if (Internals::isContainer(_bits)) return describeCollection(*this);
  std::string text;
  appendLeaf(text, *this, kLongestText);
  return text;
}

}  // namespace appsync
