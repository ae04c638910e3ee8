// The XML format. The reader takes what XML documents in UTF-8 and UTF-16 may bring along (comments, CDATA, processing
// instructions, document types, character references) and nothing of it can make a small document large.
#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstring>
#include <functional>
#include <limits>
#include <utility>

#include "platform/property_list_internals.h"

namespace appsync {

namespace {

using Internals = PropertyListInternals;
using Bits = Internals::Bits;
using Code = PropertyListErrorCode;
using Type = PropertyList::Type;

constexpr std::string_view kUIDKey = "CF$UID";
constexpr std::string_view kBlanks = " \t\r\n";

bool isBlank(char c) {
  return kBlanks.find(c) != std::string_view::npos;
}

std::string_view trimmed(std::string_view text) {
  const std::size_t first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  const auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; };
  return std::ranges::equal(a, b, {}, lower, lower);
}

// A tag in an error's text, whatever stands in its name.
std::string inAngles(std::string_view name, std::string_view begin = "<") {
  std::string shown(name.substr(0, 100));
  std::ranges::replace_if(
      shown, [](char c) { return static_cast<unsigned char>(c) >= 0x7F; }, '?');
  return std::string(begin) + shown + '>';
}

// The first of the bytes in `wanted` from `begin` on; the size when there is none.
std::size_t findAny(std::string_view text, std::size_t begin, const std::array<bool, 256>& wanted) {
  std::size_t i = begin;
  while (i < text.size() && !wanted[static_cast<unsigned char>(text[i])]) ++i;
  return i;
}

constexpr std::array<bool, 256> bytesOf(std::string_view bytes) {
  std::array<bool, 256> table{};
  for (const char byte : bytes) table[static_cast<unsigned char>(byte)] = true;
  return table;
}

constexpr auto kEndsText = bytesOf("<&\r");
constexpr auto kNeedsEscape = bytesOf("<>&\r");
constexpr auto kEndsName = bytesOf(" \t\r\n<>/=?&'\"");

// The first byte that begins a character which XML cannot hold (`text` is UTF-8); the size when there is none.
std::size_t writablePrefix(std::string_view text) {
  for (std::size_t i = 0; i < text.size(); ++i) {
    // Eight printable ASCII characters at once: none has its highest bit, nor gets it when 0x20 is taken away.
    for (std::uint64_t word = 0; i + 8 < text.size(); i += 8) {
      std::memcpy(&word, text.data() + i, 8);
      if (((word - 0x2020'2020'2020'2020U) | word) & 0x8080'8080'8080'8080U) break;
    }
    const auto byte = static_cast<unsigned char>(text[i]);
    if (byte < 0x20 && byte != '\t' && byte != '\n' && byte != '\r') return i;
    if (byte == 0xEF && static_cast<unsigned char>(text[i + 1]) == 0xBF &&
        static_cast<unsigned char>(text[i + 2]) >= 0xBE) {
      return i;
    }
  }
  return text.size();
}

bool isXMLCharacter(std::uint32_t c) {
  if (c < 0x20) return c == '\t' || c == '\n' || c == '\r';
  return c <= 0x10FFFF && (c < 0xD800 || c > 0xDFFF) && c != 0xFFFE && c != 0xFFFF;
}

// --- reading: from bytes to text ------------------------------------------------------------------------------------

// A document's text in UTF-8, and the way back from its bytes to those of the file.
class Document {
 public:
  Document(const std::uint8_t* bytes, std::size_t size);

  std::string_view text() const { return _text; }
  bool isUTF16() const { return _isUTF16; }
  std::size_t byteInFile(std::size_t position) const;

 private:
  void convertUTF16(const std::uint8_t* bytes, std::size_t size, bool bigEndian);

  std::string _converted;
  std::string_view _text;
  std::size_t _mark = 0;  // bytes of a byte order mark
  bool _isUTF16 = false;
};

Document::Document(const std::uint8_t* bytes, std::size_t size) {
  const auto begins = [&](std::initializer_list<int> with) {
    return size >= with.size() && std::equal(with.begin(), with.end(), bytes);
  };
  if (begins({0xFF, 0xFE, 0, 0}) || begins({0, 0, 0xFE, 0xFF})) failAtByte("the document is in UTF-32", 0);
  const bool markedBig = begins({0xFE, 0xFF});
  const bool markedLittle = begins({0xFF, 0xFE});
  const bool unmarkedBig = size >= 2 && bytes[0] == 0 && bytes[1] != 0;
  const bool unmarkedLittle = size >= 2 && bytes[0] != 0 && bytes[1] == 0;
  if (markedBig || markedLittle || unmarkedBig || unmarkedLittle) {
    _mark = markedBig || markedLittle ? 2 : 0;
    convertUTF16(bytes, size, markedBig || unmarkedBig);
  } else {
    _mark = begins({0xEF, 0xBB, 0xBF}) ? 3 : 0;
    if (size != 0) _text = {reinterpret_cast<const char*>(bytes) + _mark, size - _mark};
    const std::size_t valid = validUTF8Prefix(_text);
    if (valid != _text.size()) failAtByte("the document is not valid UTF-8", byteInFile(valid));
  }
  const std::size_t fine = writablePrefix(_text);
  if (fine != _text.size()) failAtByte("a character that XML does not allow", byteInFile(fine));
}

void Document::convertUTF16(const std::uint8_t* bytes, std::size_t size, bool bigEndian) {
  _isUTF16 = true;
  if (size % 2 != 0) failAtByte("the UTF-16 document ends within a character", size);
  const auto unit = [&](std::size_t at) -> char32_t {
    if (at >= size) return 0;
    return bigEndian ? static_cast<char32_t>(bytes[at] << 8 | bytes[at + 1])
                     : static_cast<char32_t>(bytes[at + 1] << 8 | bytes[at]);
  };
  _converted.reserve(size / 2);
  for (std::size_t at = _mark; at < size; at += 2) {
    char32_t character = unit(at);
    if (character >= 0xD800 && character < 0xE000) {
      const char32_t low = unit(at + 2);
      if (character >= 0xDC00 || low < 0xDC00 || low > 0xDFFF) {
        failAtByte("the document is not valid UTF-16: a lone surrogate", at);
      }
      character = 0x10000 + ((character - 0xD800) << 10) + (low - 0xDC00);
      at += 2;
    }
    appendUTF8(_converted, character);
  }
  _text = _converted;
}

std::size_t Document::byteInFile(std::size_t position) const {
  if (!_isUTF16) return _mark + position;
  std::size_t units = 0;
  for (const char c : _text.substr(0, position)) {
    const auto byte = static_cast<unsigned char>(c);
    units += (byte & 0xC0U) == 0x80U ? 0 : byte >= 0xF0 ? 2 : 1;
  }
  return _mark + 2 * units;
}

// --- reading: markup ------------------------------------------------------------------------------------------------

struct Tag {
  std::string_view name;
  std::size_t at;  // of its "<"
  bool isEnd = false;
  bool isEmpty = false;  // <name/>
};

// Walks through a document's text, markup by markup.
class Scanner {
 public:
  explicit Scanner(const Document& document) : _document(document), _text(document.text()) {}

  std::size_t position() const { return _at; }
  bool atEnd() const { return _at == _text.size(); }
  bool sees(std::string_view expected) const { return _text.substr(_at).starts_with(expected); }

  // White space, comments and processing instructions.
  void skipMiscellany();
  void readDeclaration();
  void skipDocumentType();
  Tag readTag();
  // The text up to the end tag of `element`, references resolved. Valid until the next call.
  std::string_view readText(const Tag& element);

  [[noreturn]] void fail(std::string text, std::size_t at, Code code = Code::Malformed) const {
    failAtByte(std::move(text), _document.byteInFile(at), code);
  }

 private:
  bool skip(std::string_view expected) {
    if (!sees(expected)) return false;
    _at += expected.size();
    return true;
  }
  void skipBlanks() { _at = std::min(_text.find_first_not_of(kBlanks, _at), _text.size()); }
  void skipPast(std::string_view end, std::string_view what);
  void skipQuoted();
  void skipInternalSubset(std::size_t doctype);
  std::string_view readName();
  std::string_view readAttribute(std::string_view& name);
  void checkEncoding(std::string_view encoding, std::size_t at) const;
  void appendReference();
  void appendLines(std::string_view text);
  bool appendMarkup(const Tag& element);

  const Document& _document;
  std::string_view _text;
  std::size_t _at = 0;
  std::string _scratch;
};

void Scanner::skipPast(std::string_view end, std::string_view what) {
  const std::size_t found = _text.find(end, _at);
  if (found == std::string_view::npos) fail(std::string(what) + " that does not end", _at);
  _at = found + end.size();
}

void Scanner::skipMiscellany() {
  for (;;) {
    skipBlanks();
    if (sees("<!--")) {
      skipPast("-->", "a comment");
    } else if (sees("<?")) {
      skipPast("?>", "a processing instruction");
    } else {
      return;
    }
  }
}

void Scanner::skipQuoted() {
  const std::string_view quote = _text.substr(_at, 1);
  ++_at;
  skipPast(quote, "a quotation");
}

std::string_view Scanner::readName() {
  const std::size_t begin = _at;
  _at = findAny(_text, _at, kEndsName);
  return _text.substr(begin, _at - begin);
}

// name = "value", the position being at the name.
std::string_view Scanner::readAttribute(std::string_view& name) {
  const std::size_t begin = _at;
  name = readName();
  skipBlanks();
  if (name.empty() || !skip("=")) fail("an attribute that is not name=\"value\"", begin);
  skipBlanks();
  if (!sees("\"") && !sees("'")) fail("an attribute that is not name=\"value\"", begin);
  const std::size_t value = _at + 1;
  skipQuoted();
  return _text.substr(value, _at - 1 - value);
}

void Scanner::readDeclaration() {
  constexpr std::string_view start = "<?xml";
  if (!sees(start) || _at + start.size() >= _text.size() || !isBlank(_text[_at + start.size()])) return;
  const std::size_t begin = _at;
  _at += start.size();
  for (;;) {
    skipBlanks();
    if (skip("?>")) return;
    if (atEnd()) fail("an XML declaration that does not end", begin);
    const std::size_t at = _at;
    std::string_view name;
    const std::string_view value = readAttribute(name);
    if (name == "encoding") checkEncoding(value, at);
  }
}

void Scanner::checkEncoding(std::string_view encoding, std::size_t at) const {
  const auto is = [&](std::string_view name) { return equalsIgnoringCase(encoding, name); };
  const bool is16 = is("UTF-16") || is("UTF-16LE") || is("UTF-16BE");
  if (!is16 && !is("UTF-8") && !is("US-ASCII")) {
    fail("the document's encoding is " + quotedForError(encoding) + "; only UTF-8, UTF-16 and US-ASCII can be read",
         at);
  }
  if (is16 != _document.isUTF16()) {
    fail("the document says that its encoding is " + quotedForError(encoding) + ", but its bytes are not", at);
  }
}

// Document types are neither fetched nor obeyed, only stepped over: quotations may hold any of the other signs.
void Scanner::skipDocumentType() {
  const std::size_t begin = _at;
  if (!skip("<!DOCTYPE")) return;
  while (!atEnd()) {
    const char c = _text[_at];
    if (c == '"' || c == '\'') {
      skipQuoted();
    } else if (c == '[') {
      ++_at;
      skipInternalSubset(begin);
    } else {
      ++_at;
      if (c == '>') return;
    }
  }
  fail("a document type that does not end", begin);
}

void Scanner::skipInternalSubset(std::size_t doctype) {
  bool inDeclaration = false;
  while (!atEnd()) {
    const char c = _text[_at];
    if (sees("<!--")) {
      skipPast("-->", "a comment");
    } else if (sees("<?")) {
      skipPast("?>", "a processing instruction");
    } else if (inDeclaration && (c == '"' || c == '\'')) {
      skipQuoted();
    } else {
      ++_at;
      if (c == '<') inDeclaration = true;
      if (c == '>') inDeclaration = false;
      if (c == ']' && !inDeclaration) return;
    }
  }
  fail("a document type that does not end", doctype);
}

Tag Scanner::readTag() {
  Tag tag{{}, _at};
  ++_at;
  tag.isEnd = skip("/");
  tag.name = readName();
  if (tag.name.empty()) fail("a \"<\" that begins no tag", tag.at);
  for (;;) {
    const std::size_t before = _at;
    skipBlanks();
    if (skip(">")) return tag;
    if (!tag.isEnd && skip("/>")) {
      tag.isEmpty = true;
      return tag;
    }
    if (atEnd() || tag.isEnd || before == _at) fail("a tag " + inAngles(tag.name) + " that does not end", tag.at);
    std::string_view name;
    readAttribute(name);
  }
}

std::string_view Scanner::readText(const Tag& element) {
  if (element.isEmpty) return {};
  const std::size_t begin = _at;
  _at = findAny(_text, _at, kEndsText);
  std::string_view text = _text.substr(begin, _at - begin);
  if (!sees("</")) {
    _scratch = text;
    while (appendMarkup(element)) {
      const std::size_t from = _at;
      _at = findAny(_text, _at, kEndsText);
      _scratch += _text.substr(from, _at - from);
    }
    text = _scratch;
  }
  const Tag end = readTag();
  if (end.name != element.name) {
    fail(inAngles(end.name, "</") + " where " + inAngles(element.name) + " is open", end.at);
  }
  return text;
}

// What interrupts a text. False at the end tag.
bool Scanner::appendMarkup(const Tag& element) {
  if (atEnd()) fail("the document ends within " + inAngles(element.name), _at);
  if (sees("</")) return false;
  if (sees("&")) {
    appendReference();
  } else if (sees("\r")) {
    appendLines(_text.substr(_at, 1));
    _at += _text.substr(_at).starts_with("\r\n") ? 2 : 1;
  } else if (skip("<![CDATA[")) {
    const std::size_t begin = _at;
    skipPast("]]>", "a CDATA section");
    appendLines(_text.substr(begin, _at - 3 - begin));
  } else if (sees("<!--")) {
    skipPast("-->", "a comment");
  } else if (sees("<?")) {
    skipPast("?>", "a processing instruction");
  } else {
    fail("an element within " + inAngles(element.name), _at);
  }
  return true;
}

// Every end of a line becomes a line feed, as XML has it.
void Scanner::appendLines(std::string_view text) {
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\r') {
      _scratch += text[i];
    } else if (i + 1 == text.size() || text[i + 1] != '\n') {
      _scratch += '\n';
    }
  }
}

void Scanner::appendReference() {
  constexpr std::size_t longest = 40;
  constexpr std::array<std::pair<std::string_view, char>, 5> named = {
      {{"lt", '<'}, {"gt", '>'}, {"amp", '&'}, {"quot", '"'}, {"apos", '\''}}};
  const std::size_t end = _text.substr(_at, longest).find(';');
  if (end == std::string_view::npos) fail("a \"&\" that begins no reference", _at);
  std::string_view name = _text.substr(_at + 1, end - 1);
  if (!name.starts_with('#')) {
    const auto* const found = std::ranges::find(named, name, &std::pair<std::string_view, char>::first);
    if (found == named.end()) fail("an entity " + quotedForError(name) + " that is not defined", _at);
    _scratch += found->second;
  } else {
    const int base = name.starts_with("#x") ? 16 : 10;
    name.remove_prefix(base == 16 ? 2 : 1);
    std::uint32_t character = 0;
    const auto [rest, problem] = std::from_chars(name.data(), name.data() + name.size(), character, base);
    if (problem != std::errc() || rest != name.data() + name.size() || !isXMLCharacter(character)) {
      fail("a reference to no character", _at);
    }
    appendUTF8(_scratch, character);
  }
  _at += end + 1;
}

// --- reading: values ------------------------------------------------------------------------------------------------

std::optional<PropertyList> integerFrom(std::string_view text) {
  text = trimmed(text);
  const bool negative = text.starts_with('-');
  if (negative || text.starts_with('+')) text.remove_prefix(1);
  const bool isHex = text.starts_with("0x") || text.starts_with("0X");
  if (isHex) text.remove_prefix(2);
  std::uint64_t magnitude = 0;
  const auto [rest, problem] = std::from_chars(text.data(), text.data() + text.size(), magnitude, isHex ? 16 : 10);
  if (text.empty() || problem != std::errc() || rest != text.data() + text.size()) return std::nullopt;
  if (!negative) return PropertyList::unsignedInteger(magnitude);
  if (magnitude > std::uint64_t{1} << 63) return std::nullopt;
  return PropertyList::integer(static_cast<std::int64_t>(0 - magnitude));
}

std::optional<PropertyList> realFrom(std::string_view text) {
  text = trimmed(text);
  if (text.starts_with('+') && !text.starts_with("+-")) text.remove_prefix(1);
  double value = 0;
  const auto [rest, problem] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || problem != std::errc() || rest != text.data() + text.size()) return std::nullopt;
  return PropertyList::real(value);
}

// YYYY-MM-DDTHH:MM:SSZ
std::optional<PropertyList> dateFrom(std::string_view text) {
  constexpr std::string_view shape = "0000-00-00T00:00:00Z";
  text = trimmed(text);
  if (text.size() != shape.size()) return std::nullopt;
  for (std::size_t i = 0; i < shape.size(); ++i) {
    if (shape[i] == '0' ? text[i] < '0' || text[i] > '9' : text[i] != shape[i]) return std::nullopt;
  }
  const auto digits = [text](std::size_t from, std::size_t count) {
    int value = 0;
    for (const char c : text.substr(from, count)) value = value * 10 + (c - '0');
    return value;
  };
  const std::chrono::year_month_day day{std::chrono::year{digits(0, 4)},
                                        std::chrono::month{static_cast<unsigned>(digits(5, 2))},
                                        std::chrono::day{static_cast<unsigned>(digits(8, 2))}};
  const int hours = digits(11, 2);
  const int minutes = digits(14, 2);
  const int seconds = digits(17, 2);
  if (!day.ok() || hours > 23 || minutes > 59 || seconds > 59) return std::nullopt;
  const std::chrono::seconds time = std::chrono::sys_days{day} -
                                    std::chrono::sys_days{std::chrono::year{2001} / 1 / 1} + std::chrono::hours{hours} +
                                    std::chrono::minutes{minutes};
  const double value = static_cast<double>(time.count() + seconds);
  if (!isWritableDate(value)) return std::nullopt;
  return PropertyList::date(value);
}

std::optional<PropertyList> dataFrom(std::string_view text) {
  static constexpr std::string_view alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  static constexpr std::uint8_t kNoDigit = 0xFF;
  static constexpr auto values = [] {
    std::array<std::uint8_t, 256> table{};
    table.fill(kNoDigit);
    for (std::size_t i = 0; i < alphabet.size(); ++i) {
      table[static_cast<unsigned char>(alphabet[i])] = static_cast<std::uint8_t>(i);
    }
    return table;
  }();
  Bytes bytes;
  bytes.reserve(text.size() / 4 * 3);
  std::uint32_t group = 0;
  std::size_t digits = 0;
  std::size_t padding = 0;
  for (const char c : text) {
    if (isBlank(c)) continue;
    if (c == '=') {
      ++padding;
      continue;
    }
    const std::uint32_t value = values[static_cast<unsigned char>(c)];
    if (value == kNoDigit || padding != 0) return std::nullopt;
    group = group << 6 | value;
    if (++digits % 4 == 0) {
      for (const int shift : {16, 8, 0}) bytes.push_back(static_cast<std::uint8_t>(group >> shift));
    }
  }
  if (padding > 2 || (digits + padding) % 4 != 0) return std::nullopt;
  if (padding == 1) {
    for (const int shift : {10, 2}) bytes.push_back(static_cast<std::uint8_t>(group >> shift));
  }
  if (padding == 2) bytes.push_back(static_cast<std::uint8_t>(group >> 4));
  return PropertyList::data(bytes);
}

// The strings that were read last, so that the same keys and values over and over are one node. A string that pushes
// another one out costs nothing but that.
class RecentStrings {
 public:
  PropertyList string(std::string_view text) {
    if (text.size() > kLongest) return text;
    PropertyList& place = _strings[std::hash<std::string_view>()(text) % _strings.size()];
    if (place.stringView() != text) place = text;
    return place;
  }

 private:
  static constexpr std::size_t kLongest = 64;
  std::vector<PropertyList> _strings = std::vector<PropertyList>(1024, PropertyList(false));
};

class XMLReader {
 public:
  XMLReader(const Document& document, const PropertyListLimits& limits) : _scanner(document), _limits(limits) {}

  PropertyList read();

 private:
  enum class Kind : std::uint8_t { Document, Array, Dictionary };

  struct Open {
    Tag tag;
    Kind kind;
    std::size_t firstChild;  // among `_children`, where keys and values alternate
    bool hasKey = false;
  };

  void readProlog();
  void begin(const Tag& tag);
  void beginContainer(const Tag& tag, Kind kind);
  void readKey(const Tag& tag);
  void end(const Tag& tag);
  PropertyList readLeaf(const Tag& tag);
  PropertyList readParsed(const Tag& tag, std::optional<PropertyList> (*parse)(std::string_view));
  PropertyList closeContainer();
  void checkPlace(const Tag& tag);
  void add(PropertyList value);

  Scanner _scanner;
  PropertyListLimits _limits;
  RecentStrings _recent;
  std::vector<Open> _open;
  std::vector<PropertyList> _children;
  std::size_t _containers = 0;  // of those that are open
  std::size_t _values = 0;
};

PropertyList XMLReader::read() {
  readProlog();
  do {
    _scanner.skipMiscellany();
    if (_scanner.atEnd()) {
      if (_open.empty()) _scanner.fail("the document is empty", _scanner.position());
      _scanner.fail("the document ends within " + inAngles(_open.back().tag.name), _scanner.position());
    }
    if (!_scanner.sees("<")) {
      _scanner.fail(
          _open.empty() ? "the document is neither XML nor a binary property list" : "text outside of a value",
          _scanner.position());
    }
    const Tag tag = _scanner.readTag();
    if (tag.isEnd) {
      end(tag);
    } else {
      begin(tag);
    }
  } while (!_open.empty());
  _scanner.skipMiscellany();
  if (!_scanner.atEnd()) _scanner.fail("something follows the property list", _scanner.position());
  return std::move(_children.front());
}

void XMLReader::readProlog() {
  _scanner.readDeclaration();
  _scanner.skipMiscellany();
  _scanner.skipDocumentType();
}

void XMLReader::begin(const Tag& tag) {
  if (tag.name == "plist") {
    if (!_open.empty()) _scanner.fail("<plist> within " + inAngles(_open.back().tag.name), tag.at);
    if (tag.isEmpty) _scanner.fail("<plist> holds no value", tag.at);
    _open.push_back({tag, Kind::Document, 0});
  } else if (tag.name == "key") {
    readKey(tag);
  } else {
    checkPlace(tag);
    if (tag.name == "dict") {
      beginContainer(tag, Kind::Dictionary);
    } else if (tag.name == "array") {
      beginContainer(tag, Kind::Array);
    } else {
      add(readLeaf(tag));
    }
  }
}

void XMLReader::checkPlace(const Tag& tag) {
  if (_open.empty()) return;
  const Open& parent = _open.back();
  if (parent.kind == Kind::Dictionary && !parent.hasKey) {
    _scanner.fail(inAngles(tag.name) + " where <dict> needs a <key>", tag.at);
  }
  if (parent.kind == Kind::Document && !_children.empty()) _scanner.fail("<plist> holds a second value", tag.at);
}

void XMLReader::beginContainer(const Tag& tag, Kind kind) {
  if (_containers >= _limits.depth) {
    _scanner.fail("containers within containers beyond " + std::to_string(_limits.depth) + " levels", tag.at,
                  Code::BeyondLimits);
  }
  if (tag.isEmpty) return add(kind == Kind::Array ? PropertyList::array() : PropertyList::dictionary());
  ++_containers;
  _open.push_back({tag, kind, _children.size()});
}

void XMLReader::readKey(const Tag& tag) {
  if (_open.empty() || _open.back().kind != Kind::Dictionary) _scanner.fail("a <key> outside of a <dict>", tag.at);
  if (_open.back().hasKey) _scanner.fail("a <key> after a <key>", tag.at);
  _open.back().hasKey = true;
  _children.push_back(_recent.string(_scanner.readText(tag)));
}

void XMLReader::end(const Tag& tag) {
  if (_open.empty()) _scanner.fail(inAngles(tag.name, "</") + " where nothing is open", tag.at);
  const Open& open = _open.back();
  if (tag.name != open.tag.name) {
    _scanner.fail(inAngles(tag.name, "</") + " where " + inAngles(open.tag.name) + " is open", tag.at);
  }
  if (open.hasKey) _scanner.fail("a <key> without a value", tag.at);
  if (open.kind != Kind::Document) return add(closeContainer());
  if (_children.empty()) _scanner.fail("<plist> holds no value", tag.at);
  _open.pop_back();
}

PropertyList XMLReader::closeContainer() {
  const Open open = _open.back();
  _open.pop_back();
  --_containers;
  const std::size_t count = _children.size() - open.firstChild;
  PropertyList* first = _children.data() + open.firstChild;
  PropertyList value = PropertyList::array();
  if (open.kind == Kind::Array) {
    value = Internals::reservedArray(count);
    for (std::size_t i = 0; i < count; ++i) Internals::appendReserved(value, std::move(first[i]));
  } else {
    value = Internals::reservedDictionary(count / 2);
    for (std::size_t i = 0; i < count; i += 2) Internals::insert(value, first[i], std::move(first[i + 1]));
    const PropertyList* uid = value.count() == 1 ? value.find(kUIDKey) : nullptr;
    if (uid != nullptr && uid->unsignedInteger()) value = PropertyList::uid(*uid->unsignedInteger());
  }
  _children.erase(_children.begin() + static_cast<std::ptrdiff_t>(open.firstChild), _children.end());
  return value;
}

void XMLReader::add(PropertyList value) {
  if (++_values > _limits.expandedValues) {
    _scanner.fail("more than " + std::to_string(_limits.expandedValues) + " values", _scanner.position(),
                  Code::BeyondLimits);
  }
  _children.push_back(std::move(value));
  if (!_open.empty()) _open.back().hasKey = false;
}

PropertyList XMLReader::readLeaf(const Tag& tag) {
  if (tag.name == "string") return _recent.string(_scanner.readText(tag));
  if (tag.name == "integer") return readParsed(tag, integerFrom);
  if (tag.name == "real") return readParsed(tag, realFrom);
  if (tag.name == "date") return readParsed(tag, dateFrom);
  if (tag.name == "data") return readParsed(tag, dataFrom);
  if (tag.name != "true" && tag.name != "false") {
    _scanner.fail("an unknown element " + inAngles(tag.name), tag.at);
  }
  if (!trimmed(_scanner.readText(tag)).empty()) _scanner.fail("text within " + inAngles(tag.name), tag.at);
  return tag.name == "true";
}

PropertyList XMLReader::readParsed(const Tag& tag, std::optional<PropertyList> (*parse)(std::string_view)) {
  const std::string_view text = _scanner.readText(tag);
  std::optional<PropertyList> value = parse(text);
  if (!value) _scanner.fail(inAngles(tag.name) + " holds " + quotedForError(text) + ", which is none", tag.at);
  return std::move(*value);
}

// --- writing --------------------------------------------------------------------------------------------------------

[[noreturn]] void cannotWrite(std::string why, Code code = Code::CannotBeWritten) {
  throw PropertyListFailure{code, std::move(why)};
}

class XMLWriter {
 public:
  Bytes write(const PropertyList& value);

 private:
  struct Open {
    const PropertyList* container;
    std::size_t next = 0;  // into the container's children
  };

  void add(const PropertyList& value);
  void advance();
  void writeLeaf(const PropertyList& value);
  void writeText(std::string_view element, std::string_view text);
  void writeEscaped(std::string_view text);
  void writeReal(double value);
  void writeDate(double value);
  void writeData(BytesView bytes);
  void writeUID(std::uint64_t value);

  void checkDepth() const {
    if (_open.size() < kDeepestWritten) return;
    cannotWrite("containers within containers beyond " + std::to_string(kDeepestWritten) + " levels cannot be written",
                Code::BeyondLimits);
  }
  void put(std::string_view text) { _out += text; }
  void indent(std::size_t more = 0) { _out.append(_open.size() + more, '\t'); }

  // Shared parts are written as often as they are reached, so that a small value can be a very large document.
  static constexpr std::size_t kMostBytes = std::size_t{1} << 30;

  std::string _out;
  std::vector<Open> _open;
  std::size_t _values = 0;
};

Bytes XMLWriter::write(const PropertyList& value) {
  put("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n");
  add(value);
  while (!_open.empty()) advance();
  put("</plist>\n");
  return {_out.begin(), _out.end()};
}

void XMLWriter::add(const PropertyList& value) {
  if (++_values > kMostWrittenValues) {
    cannotWrite("more than " + std::to_string(kMostWrittenValues) + " values cannot be written", Code::BeyondLimits);
  }
  if (_out.size() > kMostBytes) cannotWrite("a document of more than 1 GiB cannot be written", Code::BeyondLimits);
  indent();
  if (!Internals::isContainer(Internals::bits(value))) return writeLeaf(value);
  checkDepth();
  if (value.count() == 0) return put(value.isArray() ? "<array/>\n" : "<dict/>\n");
  put(value.isArray() ? "<array>\n" : "<dict>\n");
  _open.push_back({&value});
}

// Writes the next child of the innermost container, or its end.
void XMLWriter::advance() {
  Open& open = _open.back();
  const Bits container = Internals::bits(*open.container);
  const bool dictionary = open.container->isDictionary();
  const PropertyList* children = Internals::children(container);
  const std::size_t count = Internals::childCount(container);
  while (open.next < count && Internals::bits(children[open.next]) == Internals::kHole) open.next += 2;
  if (open.next >= count) {
    _open.pop_back();
    indent();
    return put(dictionary ? "</dict>\n" : "</array>\n");
  }
  const PropertyList* child = children + open.next;
  open.next += dictionary ? 2 : 1;
  if (dictionary) {
    indent();
    writeText("key", Internals::text(Internals::bits(*child)));
    ++child;
  }
  add(*child);
}

void XMLWriter::writeLeaf(const PropertyList& value) {
  switch (value.type()) {
    case Type::String:
      return writeText("string", *value.stringView());
    case Type::Integer:
      put("<integer>");
      put(value.integer() ? std::to_string(*value.integer()) : std::to_string(*value.unsignedInteger()));
      return put("</integer>\n");
    case Type::Real:
      return writeReal(*value.real());
    case Type::Boolean:
      return put(*value.boolean() ? "<true/>\n" : "<false/>\n");
    case Type::Date:
      return writeDate(*value.date());
    case Type::Data:
      return writeData(*value.data());
    case Type::UID:
      return writeUID(*value.uid());
    case Type::Array:
    case Type::Dictionary:
      return;
  }
}

void XMLWriter::writeText(std::string_view element, std::string_view text) {
  put("<");
  put(element);
  put(">");
  writeEscaped(text);
  put("</");
  put(element);
  put(">\n");
}

void XMLWriter::writeEscaped(std::string_view text) {
  if (validUTF8Prefix(text) != text.size()) cannotWrite("the string " + quotedForError(text) + " is not UTF-8");
  const std::size_t fine = writablePrefix(text);
  if (fine != text.size()) {
    cannotWrite("the string " + quotedForError(text) + " has at its byte " + std::to_string(fine) +
                " a control character that XML cannot hold");
  }
  for (std::size_t begin = 0;;) {
    const std::size_t end = findAny(text, begin, kNeedsEscape);
    put(text.substr(begin, end - begin));
    if (end == text.size()) return;
    // A bare carriage return would be read as a line feed.
    put(text[end] == '<' ? "&lt;" : text[end] == '>' ? "&gt;" : text[end] == '&' ? "&amp;" : "&#13;");
    begin = end + 1;
  }
}

void XMLWriter::writeReal(double value) {
  put("<real>");
  if (std::isnan(value)) {
    put("nan");
  } else if (std::isinf(value)) {
    put(value < 0 ? "-infinity" : "+infinity");
  } else {
    std::array<char, 40> text{};
    const char* end = std::to_chars(text.data(), text.data() + text.size(), value).ptr;
    put({text.data(), static_cast<std::size_t>(end - text.data())});
  }
  put("</real>\n");
}

void XMLWriter::writeDate(double value) {
  const std::optional<std::string> text = dateText(value);
  if (!text) cannotWrite("a date outside the years 1 to 9999 cannot be written");
  writeText("date", *text);
}

void XMLWriter::writeData(BytesView bytes) {
  static constexpr std::string_view alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  constexpr std::size_t bytesPerLine = 57;
  put("<data>\n");
  for (std::size_t line = 0; line < bytes.size(); line += bytesPerLine) {
    const std::size_t end = std::min(line + bytesPerLine, bytes.size());
    indent();
    for (std::size_t i = line; i < end; i += 3) {
      const auto at = [&](std::size_t n) { return n < end ? std::uint32_t{bytes[n]} : 0U; };
      const std::uint32_t group = at(i) << 16 | at(i + 1) << 8 | at(i + 2);
      for (std::size_t digit = 0; digit < 4; ++digit) {
        const bool padding = i + digit > end;
        _out += padding ? '=' : alphabet[group >> (18 - 6 * digit) & 63];
      }
    }
    put("\n");
  }
  indent();
  put("</data>\n");
}

void XMLWriter::writeUID(std::uint64_t value) {
  checkDepth();
  put("<dict>\n");
  indent(1);
  writeText("key", kUIDKey);
  indent(1);
  writeText("integer", std::to_string(value));
  indent();
  put("</dict>\n");
}

}  // namespace

PropertyList parseXMLPropertyList(const std::uint8_t* bytes, std::size_t size, const PropertyListLimits& limits) {
  const Document document(bytes, size);
  return XMLReader(document, limits).read();
}

Bytes serializeXMLPropertyList(const PropertyList& value) {
  return XMLWriter().write(value);
}

}  // namespace appsync
