// The binary format: a header, objects, a table of the objects' offsets and a trailer of 32 bytes that says where the
// table is and how wide offsets and references are. All numbers are big-endian.
#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <cstring>
#include <limits>
#include <utility>

#include "platform/property_list_internals.h"

namespace appsync {

namespace {

using Internals = PropertyListInternals;
using Bits = Internals::Bits;
using Code = PropertyListErrorCode;

constexpr std::string_view kHeader = "bplist00";
constexpr std::size_t kTrailerSize = 32;
constexpr std::uint64_t kASCIIMask = 0x8080'8080'8080'8080U;

enum Marker : unsigned {
  kFalseMarker = 0x08,
  kTrueMarker = 0x09,
  kIntegerMarker = 0x10,
  kRealMarker = 0x20,
  kReal32Marker = 0x22,
  kReal64Marker = 0x23,
  kDateMarker = 0x33,
  kDataMarker = 0x40,
  kASCIIMarker = 0x50,
  kUTF16Marker = 0x60,
  kUIDMarker = 0x80,
  kArrayMarker = 0xA0,
  kOrderedSetMarker = 0xB0,
  kSetMarker = 0xC0,
  kDictionaryMarker = 0xD0,
};

bool isASCII(const char* text, std::size_t size) {
  std::uint64_t seen = 0;
  std::size_t i = 0;
  for (; i + 8 <= size; i += 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, text + i, 8);
    seen |= word;
  }
  for (; i < size; ++i) seen |= static_cast<unsigned char>(text[i]);
  return (seen & kASCIIMask) == 0;
}

std::string number(std::uint64_t value) {
  return std::to_string(value);
}

std::string hex(unsigned byte) {
  constexpr std::string_view digits = "0123456789abcdef";
  return {'0', 'x', digits[byte >> 4 & 15], digits[byte & 15]};
}

// --- reading --------------------------------------------------------------------------------------------------------

class BinaryReader {
 public:
  BinaryReader(const std::uint8_t* bytes, std::size_t size, const PropertyListLimits& limits)
      : _bytes(bytes), _size(size), _limits(limits) {}

  PropertyList read();

 private:
  // A container whose elements are being read.
  struct Open {
    std::size_t record;
    PropertyList value;
    std::size_t references;  // the byte of the first
    std::size_t count;
    std::size_t next = 0;
  };

  // What is known of a container, for those who refer to it again.
  struct Record {
    Bits bits;
    std::size_t expanded = 1;
    std::size_t height = 1;
    bool finished = false;
  };

  void readTrailer();
  std::uint64_t bigEndian(std::size_t byte, std::size_t width) const;
  void claim(std::size_t object, std::size_t begin, std::size_t size);
  std::size_t offsetOf(std::uint64_t object, std::size_t referenceByte) const;
  std::size_t readCount(std::size_t object, std::size_t& body);

  std::optional<PropertyList> obtain(std::uint64_t object, std::size_t referenceByte);
  PropertyList obtainKey(std::uint64_t object, std::size_t referenceByte);
  void open(std::uint64_t object, std::size_t offset, unsigned kind);
  PropertyList close();
  void give(PropertyList&& child);
  void account(std::size_t expanded, std::size_t height, std::size_t byte);

  PropertyList readLeaf(std::size_t offset);
  PropertyList readSimple(std::size_t offset) const;
  PropertyList readInteger(std::size_t offset, unsigned size);
  PropertyList readReal(std::size_t offset, unsigned marker);
  PropertyList readDate(std::size_t offset, unsigned marker);
  PropertyList readUID(std::size_t offset, unsigned size);
  PropertyList readData(std::size_t offset);
  PropertyList readASCII(std::size_t offset);
  PropertyList readUTF16(std::size_t offset);
  PropertyList makeUTF16(std::size_t begin, std::size_t units) const;

  const std::uint8_t* _bytes;
  std::size_t _size;
  PropertyListLimits _limits;

  std::size_t _offsetSize = 0;
  std::size_t _referenceSize = 0;
  std::uint64_t _objectCount = 0;
  std::uint64_t _top = 0;
  std::size_t _table = 0;
  std::size_t _claimed = 0;

  // For each object: nothing yet, the value of a leaf, or (with the tag of no value) the number of its record. The
  // values are owned by the containers that hold them, or by `_retired` when a duplicate key has put them out of
  // theirs.
  std::vector<Bits> _objects;
  std::vector<Record> _records;
  std::vector<Open> _open;
  std::vector<PropertyList> _retired;
};

std::uint64_t BinaryReader::bigEndian(std::size_t byte, std::size_t width) const {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) value = value << 8 | _bytes[byte + i];
  return value;
}

void BinaryReader::readTrailer() {
  if (_size < kHeader.size() + 1 + kTrailerSize + 1) {
    failAtByte("the binary property list is too short for a header, an object and a trailer", _size);
  }
  if (std::memcmp(_bytes, kHeader.data(), kHeader.size()) != 0) {
    failAtByte("the binary property list is of a version other than 00", 6);
  }
  const std::size_t trailer = _size - kTrailerSize;
  _offsetSize = _bytes[trailer + 6];
  _referenceSize = _bytes[trailer + 7];
  _objectCount = bigEndian(trailer + 8, 8);
  _top = bigEndian(trailer + 16, 8);
  const std::uint64_t table = bigEndian(trailer + 24, 8);
  if (_offsetSize < 1 || _offsetSize > 8) {
    failAtByte("the trailer's offset size is " + number(_offsetSize) + ", not 1 to 8", trailer + 6);
  }
  if (_referenceSize < 1 || _referenceSize > 8) {
    failAtByte("the trailer's reference size is " + number(_referenceSize) + ", not 1 to 8", trailer + 7);
  }
  if (table <= kHeader.size() || table >= trailer) {
    failAtByte("the trailer's offset table at " + number(table) + " is not inside the file", trailer + 24);
  }
  _table = static_cast<std::size_t>(table);
  if (_objectCount == 0 || _objectCount > (trailer - _table) / _offsetSize) {
    failAtByte("the trailer's object count " + number(_objectCount) + " does not fit the offset table", trailer + 8);
  }
  if (_top >= _objectCount) {
    failAtByte("the trailer's top object " + number(_top) + " does not exist", trailer + 16);
  }
}

PropertyList BinaryReader::read() {
  readTrailer();
  _objects.assign(static_cast<std::size_t>(_objectCount), 0);
  std::optional<PropertyList> finished = obtain(_top, _size - kTrailerSize + 16);
  while (!_open.empty()) {
    const Open& container = _open.back();
    if (container.next == container.count) {
      finished = close();
      if (!_open.empty()) give(std::move(*finished));
      continue;
    }
    const bool dictionary = Internals::tag(Internals::bits(container.value)) == Internals::kDictionary;
    const std::size_t index = container.next + (dictionary ? container.count : 0);
    const std::size_t byte = container.references + index * _referenceSize;
    if (std::optional<PropertyList> child = obtain(bigEndian(byte, _referenceSize), byte)) give(std::move(*child));
  }
  return std::move(*finished);
}

// Each object has bytes of its own. Objects that overlap would let a small file grow into any amount of memory.
void BinaryReader::claim(std::size_t object, std::size_t begin, std::size_t size) {
  if (begin > _table || size > _table - begin) failAtByte("an object runs past the end of the objects", object);
  const std::size_t length = begin - object + size;
  if (length > _table - kHeader.size() - _claimed) failAtByte("objects overlap each other", object);
  _claimed += length;
}

std::size_t BinaryReader::offsetOf(std::uint64_t object, std::size_t referenceByte) const {
  if (object >= _objectCount) {
    failAtByte("a reference to object " + number(object) + " of " + number(_objectCount), referenceByte);
  }
  const std::size_t entry = _table + static_cast<std::size_t>(object) * _offsetSize;
  const std::uint64_t offset = bigEndian(entry, _offsetSize);
  if (offset < kHeader.size() || offset >= _table) {
    failAtByte("the offset " + number(offset) + " of object " + number(object) + " is not among the objects", entry);
  }
  return static_cast<std::size_t>(offset);
}

// The count in an object's marker or, when that is too small for it, in the integer behind it; `body` is set to what
// follows.
std::size_t BinaryReader::readCount(std::size_t object, std::size_t& body) {
  body = object + 1;
  const unsigned inMarker = _bytes[object] & 0x0FU;
  if (inMarker != 0x0F) return inMarker;
  if (body >= _table) failAtByte("an object runs past the end of the objects", object);
  const unsigned marker = _bytes[body];
  const std::size_t width = std::size_t{1} << (marker & 3U);
  if ((marker & ~3U) != kIntegerMarker) failAtByte("a count is " + hex(marker) + ", no integer of 1 to 8 bytes", body);
  if (width > _table - body - 1) failAtByte("an object runs past the end of the objects", object);
  const std::uint64_t count = bigEndian(body + 1, width);
  body += 1 + width;
  // Every counted thing takes at least a byte.
  if (count > _table - body) failAtByte("a count of " + number(count) + " where fewer bytes are left", object + 1);
  return static_cast<std::size_t>(count);
}

// The value of an object, or none when it is a container that has been opened now.
std::optional<PropertyList> BinaryReader::obtain(std::uint64_t object, std::size_t referenceByte) {
  if (object < _objectCount) {
    const Bits known = _objects[static_cast<std::size_t>(object)];
    if (Internals::tag(known) != Internals::kHole) {
      account(1, 0, referenceByte);
      return Internals::share(known);
    }
    if (known != 0) {
      const Record& record = _records[static_cast<std::size_t>(known >> 4) - 1];
      if (!record.finished) failAtByte("a container that contains itself", referenceByte);
      account(record.expanded, record.height, referenceByte);
      return Internals::share(record.bits);
    }
  }
  const std::size_t offset = offsetOf(object, referenceByte);
  const unsigned kind = _bytes[offset] & 0xF0U;
  if (kind == kArrayMarker || kind == kDictionaryMarker) {
    open(object, offset, kind);
    return std::nullopt;
  }
  account(1, 0, offset);
  PropertyList leaf = readLeaf(offset);
  _objects[static_cast<std::size_t>(object)] = Internals::bits(leaf);
  return leaf;
}

PropertyList BinaryReader::obtainKey(std::uint64_t object, std::size_t referenceByte) {
  const std::size_t offset = offsetOf(object, referenceByte);
  Bits& known = _objects[static_cast<std::size_t>(object)];
  if (Internals::tag(known) == Internals::kString) return Internals::share(known);
  const unsigned kind = _bytes[offset] & 0xF0U;
  if (kind != kASCIIMarker && kind != kUTF16Marker) failAtByte("a dictionary's key is no string", referenceByte);
  PropertyList key = readLeaf(offset);
  known = Internals::bits(key);
  return key;
}

void BinaryReader::open(std::uint64_t object, std::size_t offset, unsigned kind) {
  if (_open.size() >= _limits.depth) {
    failAtByte("containers within containers beyond " + number(_limits.depth) + " levels", offset, Code::BeyondLimits);
  }
  const bool dictionary = kind == kDictionaryMarker;
  std::size_t body = 0;
  const std::size_t count = readCount(offset, body);
  const std::size_t each = _referenceSize * (dictionary ? 2 : 1);
  if (count > (_table - body) / each) {
    failAtByte("a count of " + number(count) + " where fewer bytes are left", offset);
  }
  claim(offset, body, count * each);
  if (dictionary && count > Internals::kMostMembers) {
    failAtByte("a dictionary of " + number(count) + " members", offset, Code::BeyondLimits);
  }
  PropertyList value = dictionary ? Internals::reservedDictionary(count) : Internals::reservedArray(count);
  _records.push_back({Internals::bits(value)});
  _objects[static_cast<std::size_t>(object)] = Bits{_records.size()} << 4 | Internals::kHole;
  _open.push_back({_records.size() - 1, std::move(value), body, count});
}

PropertyList BinaryReader::close() {
  PropertyList value = std::move(_open.back().value);
  Record& record = _records[_open.back().record];
  const std::size_t byte = _open.back().references;
  _open.pop_back();
  record.finished = true;
  account(record.expanded, record.height, byte);
  return value;
}

// Adds a child to what its container's record says. Sharing makes small files reach very many values and levels, so
// both are counted as a reader of the value will meet them.
void BinaryReader::account(std::size_t expanded, std::size_t height, std::size_t byte) {
  if (_open.empty()) return;
  if (_open.size() + height > _limits.depth) {
    failAtByte("containers within containers beyond " + number(_limits.depth) + " levels", byte, Code::BeyondLimits);
  }
  Record& record = _records[_open.back().record];
  if (expanded > _limits.expandedValues || record.expanded > _limits.expandedValues - expanded) {
    failAtByte("shared references that reach more than " + number(_limits.expandedValues) + " values", byte,
               Code::BeyondLimits);
  }
  record.expanded += expanded;
  record.height = std::max(record.height, height + 1);
}

void BinaryReader::give(PropertyList&& child) {
  Open& container = _open.back();
  const std::size_t keyByte = container.references + container.next++ * _referenceSize;
  if (Internals::tag(Internals::bits(container.value)) == Internals::kArray) {
    return Internals::appendReserved(container.value, std::move(child));
  }
  PropertyList key = obtainKey(bigEndian(keyByte, _referenceSize), keyByte);
  if (std::optional<PropertyList> old = Internals::insert(container.value, key, std::move(child))) {
    _retired.push_back(std::move(*old));
    _retired.push_back(std::move(key));
  }
}

PropertyList BinaryReader::readLeaf(std::size_t offset) {
  const unsigned marker = _bytes[offset];
  switch (marker & 0xF0U) {
    case 0x00:
      claim(offset, offset + 1, 0);
      return readSimple(offset);
    case kIntegerMarker:
      return readInteger(offset, marker & 0x0FU);
    case kRealMarker:
      return readReal(offset, marker);
    case kDateMarker & 0xF0U:
      return readDate(offset, marker);
    case kDataMarker:
      return readData(offset);
    case kASCIIMarker:
      return readASCII(offset);
    case kUTF16Marker:
      return readUTF16(offset);
    case kUIDMarker:
      return readUID(offset, (marker & 0x0FU) + 1);
    case kOrderedSetMarker:
    case kSetMarker:
      failAtByte("a set object, which a property list here cannot hold", offset);
    default:
      failAtByte("an unknown kind of object " + hex(marker), offset);
  }
}

PropertyList BinaryReader::readSimple(std::size_t offset) const {
  switch (_bytes[offset]) {
    case kFalseMarker:
      return false;
    case kTrueMarker:
      return true;
    case 0x00:
      failAtByte("a null object, which a property list here cannot hold", offset);
    case 0x0F:
      failAtByte("a fill byte in the place of an object", offset);
    default:
      failAtByte("an unknown kind of object " + hex(_bytes[offset]), offset);
  }
}

// Integers of one, two and four bytes are unsigned, those of eight are signed; unsigned ones that eight cannot hold
// take sixteen.
PropertyList BinaryReader::readInteger(std::size_t offset, unsigned size) {
  if (size > 4) failAtByte("an unknown kind of object " + hex(_bytes[offset]), offset);
  const std::size_t width = std::size_t{1} << size;
  claim(offset, offset + 1, width);
  if (width < 8) return PropertyList::integer(static_cast<std::int64_t>(bigEndian(offset + 1, width)));
  const std::uint64_t low = bigEndian(offset + 1 + width - 8, 8);
  const auto asSigned = static_cast<std::int64_t>(low);
  if (width == 8) return PropertyList::integer(asSigned);
  const std::uint64_t high = bigEndian(offset + 1, 8);
  if (high == 0) return PropertyList::unsignedInteger(low);
  if (high == ~std::uint64_t{0} && asSigned < 0) return PropertyList::integer(asSigned);
  failAtByte("an integer beyond 64 bits", offset);
}

PropertyList BinaryReader::readReal(std::size_t offset, unsigned marker) {
  if (marker == kReal32Marker) {
    claim(offset, offset + 1, 4);
    return PropertyList::real32(std::bit_cast<float>(static_cast<std::uint32_t>(bigEndian(offset + 1, 4))));
  }
  if (marker != kReal64Marker) failAtByte("a real of a width other than 4 and 8 bytes", offset);
  claim(offset, offset + 1, 8);
  return PropertyList::real(std::bit_cast<double>(bigEndian(offset + 1, 8)));
}

PropertyList BinaryReader::readDate(std::size_t offset, unsigned marker) {
  if (marker != kDateMarker) failAtByte("an unknown kind of object " + hex(marker), offset);
  claim(offset, offset + 1, 8);
  const auto seconds = std::bit_cast<double>(bigEndian(offset + 1, 8));
  if (!isWritableDate(seconds)) failAtByte("a date outside the years 1 to 9999", offset);
  return PropertyList::date(seconds);
}

PropertyList BinaryReader::readUID(std::size_t offset, unsigned size) {
  claim(offset, offset + 1, size);
  const std::size_t excess = size > 8 ? size - 8 : 0;
  if (bigEndian(offset + 1, excess) != 0) failAtByte("a UID beyond 64 bits", offset);
  return PropertyList::uid(bigEndian(offset + 1 + excess, size - excess));
}

PropertyList BinaryReader::readData(std::size_t offset) {
  std::size_t body = 0;
  const std::size_t size = readCount(offset, body);
  claim(offset, body, size);
  return PropertyList::data({_bytes + body, size});
}

PropertyList BinaryReader::readASCII(std::size_t offset) {
  std::size_t body = 0;
  const std::size_t size = readCount(offset, body);
  claim(offset, body, size);
  const char* text = reinterpret_cast<const char*>(_bytes + body);
  if (!isASCII(text, size)) failAtByte("a byte beyond ASCII in an ASCII string", offset);
  return PropertyList(std::string_view(text, size));
}

PropertyList BinaryReader::readUTF16(std::size_t offset) {
  std::size_t body = 0;
  const std::size_t units = readCount(offset, body);
  if (units > (_table - body) / 2) failAtByte("a count of " + number(units) + " where fewer bytes are left", offset);
  claim(offset, body, units * 2);
  return makeUTF16(body, units);
}

PropertyList BinaryReader::makeUTF16(std::size_t begin, std::size_t units) const {
  std::string text;
  text.reserve(units);
  for (std::size_t i = 0; i < units; ++i) {
    const std::size_t byte = begin + 2 * i;
    auto character = static_cast<char32_t>(bigEndian(byte, 2));
    if (character >= 0xD800 && character < 0xE000) {
      const auto low = i + 1 < units ? static_cast<char32_t>(bigEndian(byte + 2, 2)) : 0;
      if (character >= 0xDC00 || low < 0xDC00 || low > 0xDFFF) failAtByte("a lone surrogate in a string", byte);
      character = 0x10000 + ((character - 0xD800) << 10) + (low - 0xDC00);
      ++i;
    }
    appendUTF8(text, character);
  }
  return text;
}

// --- writing --------------------------------------------------------------------------------------------------------

// Open hash table of 64-bit keys (values' words) and object numbers.
class ObjectsByWord {
 public:
  // The number for `word`, and whether it was there already.
  std::pair<std::uint32_t, bool> findOrAdd(Bits word, std::uint32_t number) {
    if ((_count + 1) * 3 > _slots.size() * 2) grow();
    Slot& slot = slotOf(word);
    if (slot.word == word) return {slot.number, true};
    slot = {word, number};
    ++_count;
    return {number, false};
  }
  const std::uint32_t* find(Bits word) {
    if (_slots.empty()) return nullptr;
    const Slot& slot = slotOf(word);
    return slot.word == word ? &slot.number : nullptr;
  }

 private:
  struct Slot {
    Bits word = 0;
    std::uint32_t number = 0;
  };

  Slot& slotOf(Bits word) {
    std::uint64_t hash = (word ^ _secret) * 0xFF51'AFD7'ED55'8CCDU;
    hash = (hash ^ hash >> 32) * 0xC4CE'B9FE'1A85'EC53U;
    std::size_t i = (hash >> 32) & (_slots.size() - 1);
    while (_slots[i].word != 0 && _slots[i].word != word) i = (i + 1) & (_slots.size() - 1);
    return _slots[i];
  }

  void grow() {
    std::vector<Slot> old(std::max<std::size_t>(64, _slots.size() * 2));
    old.swap(_slots);
    for (const Slot& slot : old) {
      if (slot.word != 0) slotOf(slot.word) = slot;
    }
  }

  std::vector<Slot> _slots;
  std::size_t _count = 0;
  std::uint64_t _secret = keyedHash("property list");
};

// Open hash table of strings, by their text. A slot holds half of the text's hash and the object's number.
class ObjectsByText {
 public:
  explicit ObjectsByText(std::size_t expected)
      : _slots(std::bit_ceil(std::max<std::size_t>(64, expected * 3 / 2 + 1))) {}

  std::pair<std::uint32_t, bool> findOrAdd(std::string_view text, std::uint32_t number,
                                           const std::vector<Bits>& objects) {
    if ((_count + 1) * 3 > _slots.size() * 2) grow();
    const std::uint64_t half = keyedHash(text) & kHalf;
    for (std::size_t i = half >> 32 & mask();; i = (i + 1) & mask()) {
      const std::uint64_t slot = _slots[i];
      if (slot == 0) {
        _slots[i] = half | (std::uint64_t{number} + 1);
        ++_count;
        return {number, false};
      }
      const auto found = static_cast<std::uint32_t>((slot & ~kHalf) - 1);
      if ((slot & kHalf) == half && Internals::text(objects[found]) == text) return {found, true};
    }
  }

 private:
  static constexpr std::uint64_t kHalf = 0xFFFF'FFFF'0000'0000;

  std::size_t mask() const { return _slots.size() - 1; }

  void grow() {
    std::vector<std::uint64_t> old(_slots.size() * 2);
    old.swap(_slots);
    for (const std::uint64_t slot : old) {
      if (slot == 0) continue;
      std::size_t i = slot >> 32 & mask();
      while (_slots[i] != 0) i = (i + 1) & mask();
      _slots[i] = slot;
    }
  }

  std::vector<std::uint64_t> _slots;
  std::size_t _count = 0;
};

std::size_t widthOf(std::uint64_t value) {
  return std::max<std::size_t>(1, (static_cast<std::size_t>(std::bit_width(value)) + 7) / 8);
}

// What integers and counts are written with.
std::size_t powerOfTwoWidthOf(std::uint64_t value) {
  return std::bit_ceil(widthOf(value));
}

std::size_t counted(std::size_t count) {
  return 1 + (count < 0x0F ? 0 : 1 + powerOfTwoWidthOf(count));
}

// Numbers the objects (a container before what it holds), notes each container's references and adds up the size, then
// writes the objects in the order of their numbers.
class BinaryWriter {
 public:
  explicit BinaryWriter(const PropertyList& value) : _texts(value.count()) { number(Internals::bits(value)); }
  Bytes write();

 private:
  struct Open {
    Bits container;
    std::uint32_t object;
    std::size_t firstReference;
    std::size_t members;    // 0 in an array
    std::size_t next = 0;   // into the container's children
    std::size_t place = 0;  // among the references; in a dictionary all keys come first
    bool values = false;
  };

  // How deep an object reaches and how many values it stands for; needed again where it is shared.
  struct Shape {
    std::uint32_t expanded = 1;
    std::uint32_t height = 0;
  };

  void number(Bits top);
  std::pair<std::uint32_t, bool> numberOf(Bits value);
  void addObject(Bits value);
  const PropertyList* nextChild(Open& open);
  void account(const Open& parent, std::uint32_t child);
  static std::size_t leafSize(Bits leaf);

  void writeObject(Bits object);
  void writeContainer(Bits container);
  void writeInteger(const PropertyList& value);
  void writeString(std::string_view text);
  void writeMarker(unsigned kind, std::size_t count);
  void writeBytes(const void* bytes, std::size_t size);
  void writeBigEndian(std::uint64_t value, std::size_t width);

  std::vector<Bits> _objects;
  std::vector<Shape> _shapes;
  std::vector<std::uint32_t> _references;
  std::vector<Open> _open;
  ObjectsByWord _words;
  ObjectsByText _texts;
  std::size_t _size = kHeader.size();

  std::size_t _referenceSize = 0;
  std::size_t _nextReference = 0;
  std::uint8_t* _end = nullptr;
};

void BinaryWriter::number(Bits top) {
  numberOf(top);
  while (!_open.empty()) {
    Open& open = _open.back();
    const PropertyList* child = nextChild(open);
    if (child == nullptr) {
      const std::uint32_t finished = open.object;
      _open.pop_back();
      if (!_open.empty()) account(_open.back(), finished);
      continue;
    }
    const std::size_t reference = open.firstReference + open.place++;
    const std::size_t depth = _open.size();
    const std::uint32_t object = numberOf(Internals::bits(*child)).first;
    _references[reference] = object;
    const bool isKey = _open[depth - 1].members != 0 && !_open[depth - 1].values;
    if (_open.size() == depth && !isKey) account(_open.back(), object);
  }
}

const PropertyList* BinaryWriter::nextChild(Open& open) {
  const std::size_t count = Internals::childCount(open.container);
  const PropertyList* children = Internals::children(open.container);
  if (open.members == 0) return open.next < count ? children + open.next++ : nullptr;
  if (open.place == open.members && !open.values) {
    open.values = true;
    open.next = 0;
  }
  while (open.next < count && Internals::bits(children[open.next]) == Internals::kHole) open.next += 2;
  if (open.next >= count) return nullptr;
  const PropertyList* child = children + open.next + (open.values ? 1 : 0);
  open.next += 2;
  return child;
}

// The number of a value that may have one already: because it is the same word or node, or a string of the same text.
std::pair<std::uint32_t, bool> BinaryWriter::numberOf(Bits value) {
  const auto fresh = static_cast<std::uint32_t>(_objects.size());
  const bool findable = !Internals::isNode(value) || !Internals::isOnlyReference(value);
  if (Internals::tag(value) == Internals::kString) {
    if (findable) {
      if (const std::uint32_t* found = _words.find(value)) return {*found, true};
    }
    const auto numbered = _texts.findOrAdd(Internals::text(value), fresh, _objects);
    if (findable) _words.findOrAdd(value, numbered.first);
    if (numbered.second) return numbered;
  } else if (findable) {
    const auto numbered = _words.findOrAdd(value, fresh);
    if (numbered.second) return numbered;
  }
  addObject(value);
  return {fresh, false};
}

void BinaryWriter::addObject(Bits value) {
  const auto object = static_cast<std::uint32_t>(_objects.size());
  _objects.push_back(value);
  const bool container = Internals::isContainer(value);
  _shapes.push_back({1, container ? 1U : 0U});
  if (!container) {
    _size += leafSize(value);
    return;
  }
  if (_open.size() >= kDeepestWritten) {
    throw PropertyListFailure{Code::BeyondLimits, "containers within containers beyond " +
                                                      std::to_string(kDeepestWritten) + " levels cannot be written"};
  }
  const bool dictionary = Internals::tag(value) == Internals::kDictionary;
  const std::size_t children = !Internals::isNode(value) ? 0
                               : dictionary              ? Internals::node<DictionaryNode>(value)->live
                                                         : Internals::childCount(value);
  _size += counted(children);
  const std::size_t references = children * (dictionary ? 2 : 1);
  if (references > 2 * kMostWrittenValues) {
    throw PropertyListFailure{Code::BeyondLimits,
                              "more than " + std::to_string(kMostWrittenValues) + " values cannot be written"};
  }
  _open.push_back({value, object, _references.size(), dictionary ? children : 0});
  _references.resize(_references.size() + references);
}

void BinaryWriter::account(const Open& parent, std::uint32_t child) {
  Shape& shape = _shapes[parent.object];
  const Shape& added = _shapes[child];
  if (_open.size() + added.height > kDeepestWritten) {
    throw PropertyListFailure{Code::BeyondLimits, "containers within containers beyond " +
                                                      std::to_string(kDeepestWritten) + " levels cannot be written"};
  }
  if (std::size_t{shape.expanded} + added.expanded > kMostWrittenValues) {
    throw PropertyListFailure{Code::BeyondLimits,
                              "more than " + std::to_string(kMostWrittenValues) + " values cannot be written"};
  }
  shape.expanded += added.expanded;
  shape.height = std::max(shape.height, added.height + 1);
}

std::size_t utf16Units(std::string_view text) {
  if (validUTF8Prefix(text) != text.size()) {
    throw PropertyListFailure{Code::CannotBeWritten, "the string " + quotedForError(text) + " is not UTF-8"};
  }
  std::size_t units = 0;
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    units += (byte & 0xC0U) == 0x80U ? 0 : byte >= 0xF0 ? 2 : 1;
  }
  return units;
}

std::size_t BinaryWriter::leafSize(Bits leaf) {
  if (Internals::tag(leaf) == Internals::kString) {
    const std::string_view text = Internals::text(leaf);
    if (isASCII(text.data(), text.size())) return counted(text.size()) + text.size();
    const std::size_t units = utf16Units(text);
    return counted(units) + 2 * units;
  }
  const PropertyList value = Internals::share(leaf);
  switch (value.type()) {
    case PropertyList::Type::Integer:
      if (!value.integer()) return 17;
      return 1 + (*value.integer() < 0 ? 8 : powerOfTwoWidthOf(*value.unsignedInteger()));
    case PropertyList::Type::Real:
      return value.isReal32() ? 5 : 9;
    case PropertyList::Type::Date:
      if (isWritableDate(*value.date())) return 9;
      throw PropertyListFailure{Code::CannotBeWritten, "a date outside the years 1 to 9999 cannot be written"};
    case PropertyList::Type::Data:
      return counted(value.data()->size()) + value.data()->size();
    case PropertyList::Type::UID:
      return 1 + powerOfTwoWidthOf(*value.uid());
    default:
      return 1;
  }
}

Bytes BinaryWriter::write() {
  _referenceSize = widthOf(_objects.size() - 1);
  const std::size_t table = _size + _references.size() * _referenceSize;
  const std::size_t offsetSize = widthOf(table);
  Bytes bytes(table + _objects.size() * offsetSize + kTrailerSize);
  _end = bytes.data();
  writeBytes(kHeader.data(), kHeader.size());
  std::uint8_t* offsets = bytes.data() + table;
  for (const Bits object : _objects) {
    const auto offset = static_cast<std::uint64_t>(_end - bytes.data());
    for (std::size_t i = 0; i < offsetSize; ++i) {
      *offsets++ = static_cast<std::uint8_t>(offset >> 8 * (offsetSize - 1 - i));
    }
    writeObject(object);
  }
  _end = bytes.data() + bytes.size() - kTrailerSize;
  writeBigEndian(0, 6);
  writeBigEndian(offsetSize, 1);
  writeBigEndian(_referenceSize, 1);
  writeBigEndian(_objects.size(), 8);
  writeBigEndian(0, 8);
  writeBigEndian(table, 8);
  return bytes;
}

void BinaryWriter::writeObject(Bits object) {
  if (Internals::isContainer(object)) return writeContainer(object);
  if (Internals::tag(object) == Internals::kString) return writeString(Internals::text(object));
  const PropertyList value = Internals::share(object);
  switch (value.type()) {
    case PropertyList::Type::Integer:
      return writeInteger(value);
    case PropertyList::Type::Real:
      if (value.isReal32()) {
        writeBigEndian(kReal32Marker, 1);
        return writeBigEndian(std::bit_cast<std::uint32_t>(static_cast<float>(*value.real())), 4);
      }
      writeBigEndian(kReal64Marker, 1);
      return writeBigEndian(std::bit_cast<std::uint64_t>(*value.real()), 8);
    case PropertyList::Type::Date:
      writeBigEndian(kDateMarker, 1);
      return writeBigEndian(std::bit_cast<std::uint64_t>(*value.date()), 8);
    case PropertyList::Type::Data:
      writeMarker(kDataMarker, value.data()->size());
      return writeBytes(value.data()->data(), value.data()->size());
    case PropertyList::Type::UID: {
      const std::size_t width = powerOfTwoWidthOf(*value.uid());
      writeBigEndian(kUIDMarker | (width - 1), 1);
      return writeBigEndian(*value.uid(), width);
    }
    default:
      return writeBigEndian(*value.boolean() ? kTrueMarker : kFalseMarker, 1);
  }
}

void BinaryWriter::writeContainer(Bits container) {
  const bool dictionary = Internals::tag(container) == Internals::kDictionary;
  const std::size_t count = Internals::share(container).count();
  writeMarker(dictionary ? kDictionaryMarker : kArrayMarker, count);
  for (std::size_t i = 0; i < count * (dictionary ? 2 : 1); ++i) {
    writeBigEndian(_references[_nextReference++], _referenceSize);
  }
}

void BinaryWriter::writeInteger(const PropertyList& value) {
  const std::optional<std::int64_t> fits = value.integer();
  if (!fits) {
    writeBigEndian(kIntegerMarker | 4U, 1);
    writeBigEndian(0, 8);
    return writeBigEndian(*value.unsignedInteger(), 8);
  }
  const std::size_t width = *fits < 0 ? 8 : powerOfTwoWidthOf(*value.unsignedInteger());
  writeBigEndian(kIntegerMarker | static_cast<unsigned>(std::countr_zero(width)), 1);
  writeBigEndian(static_cast<std::uint64_t>(*fits), width);
}

void BinaryWriter::writeString(std::string_view text) {
  if (isASCII(text.data(), text.size())) {
    writeMarker(kASCIIMarker, text.size());
    return writeBytes(text.data(), text.size());
  }
  writeMarker(kUTF16Marker, utf16Units(text));
  for (std::size_t i = 0; i < text.size();) {
    const auto byte = [&](std::size_t n) {
      return static_cast<std::uint32_t>(static_cast<unsigned char>(text[i + n]));
    };
    const auto low = [&](std::size_t n) { return byte(n) & 0x3FU; };
    const std::uint32_t first = byte(0);
    if (first < 0x80) {
      writeBigEndian(first, 2);
      i += 1;
    } else if (first < 0xE0) {
      writeBigEndian((first & 0x1FU) << 6 | low(1), 2);
      i += 2;
    } else if (first < 0xF0) {
      writeBigEndian((first & 0x0FU) << 12 | low(1) << 6 | low(2), 2);
      i += 3;
    } else {
      const std::uint32_t beyond = ((first & 0x07U) << 18 | low(1) << 12 | low(2) << 6 | low(3)) - 0x10000U;
      writeBigEndian(0xD800U + (beyond >> 10), 2);
      writeBigEndian(0xDC00U + (beyond & 0x3FFU), 2);
      i += 4;
    }
  }
}

void BinaryWriter::writeMarker(unsigned kind, std::size_t count) {
  if (count < 0x0F) return writeBigEndian(kind | count, 1);
  writeBigEndian(kind | 0x0FU, 1);
  const std::size_t width = powerOfTwoWidthOf(count);
  writeBigEndian(kIntegerMarker | static_cast<unsigned>(std::countr_zero(width)), 1);
  writeBigEndian(count, width);
}

void BinaryWriter::writeBytes(const void* bytes, std::size_t size) {
  if (size != 0) std::memcpy(_end, bytes, size);
  _end += size;
}

void BinaryWriter::writeBigEndian(std::uint64_t value, std::size_t width) {
  for (std::size_t i = 0; i < width; ++i) *_end++ = static_cast<std::uint8_t>(value >> 8 * (width - 1 - i));
}

}  // namespace

PropertyList parseBinaryPropertyList(const std::uint8_t* bytes, std::size_t size, const PropertyListLimits& limits) {
  return BinaryReader(bytes, size, limits).read();
}

Bytes serializeBinaryPropertyList(const PropertyList& value) {
  return BinaryWriter(value).write();
}

}  // namespace appsync
