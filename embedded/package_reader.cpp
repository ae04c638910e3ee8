#include "embedded/package_reader.h"

#include <archive.h>
#include <archive_entry.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <clocale>
#include <cstring>
#include <memory>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/utf8.h"

namespace appsync {

namespace {

using Buffer = std::vector<std::uint8_t>;

constexpr std::size_t kBlockSize = 256 << 10;
constexpr std::size_t kNameLength = 255;  // of one component, as file systems have it
constexpr std::size_t kLinkTargetLength = 1024;

// --- texts ----------------------------------------------------------------------------------------------------------

// A name out of a package as a message can show it.
std::string quoted(std::string_view text) {
  constexpr std::size_t kShown = 160;
  std::string shown = "\"";
  while (!text.empty() && shown.size() < kShown) {
    const std::size_t length = utf8CharacterLength(text);
    const bool plain = length > 1 || (length == 1 && text[0] >= ' ' && text[0] != 0x7F);
    shown += plain ? text.substr(0, length) : "?";
    text.remove_prefix(std::max<std::size_t>(length, 1));
  }
  return shown + (text.empty() ? "\"" : "…\"");
}

// While it lives, this thread's names are UTF-8, whatever the process's locale: the library would turn the names in an
// archive into the locale's characters, and fail where that has none.
class NamesInUTF8 {
 public:
  NamesInUTF8() : _locale(::newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr)) {
    if (_locale != nullptr) _before = ::uselocale(_locale);
  }
  ~NamesInUTF8() {
    if (_locale == nullptr) return;
    ::uselocale(_before);
    ::freelocale(_locale);
  }
  NamesInUTF8(const NamesInUTF8&) = delete;
  NamesInUTF8& operator=(const NamesInUTF8&) = delete;

 private:
  locale_t _locale;
  locale_t _before = nullptr;
};

class Failure {
 public:
  Failure(const std::string& package, ErrorOut error) : _package(package), _error(error) {}

  // Always false. `what` ends the sentence 'The package "NAME" …'.
  bool operator()(std::int64_t code, const std::string& what) const {
    setError(_error, Error(std::string(kInstallerErrorDomain), code, "The package " + quoted(_package) + " " + what));
    return false;
  }
  ErrorOut out() const { return _error; }

 private:
  const std::string& _package;
  ErrorOut _error;
};

// --- the archive's own directory ------------------------------------------------------------------------------------

// Checks the structure of the archive before anything of it is unpacked: that nothing is cut off or put before or
// behind it, that its directory says how many entries there are and holds that many, that each entry's own header
// agrees with it, and that all sizes are within limits. What the library reads afterwards has exactly these bounds.
class ArchiveCheck {
 public:
  ArchiveCheck(int file, const PackageLimits& limits, const Failure& fail)
      : _file(file), _limits(limits), _fail(fail) {}

  bool run() {
    struct stat status {};
    if (::fstat(_file, &status) != 0 || !S_ISREG(status.st_mode)) {
      return _fail(kInstallerNoPackage, "is no file that can be read");
    }
    _size = static_cast<std::uint64_t>(status.st_size);
    Buffer start;
    if (!read(0, 4, start) || (!hasMark(start, 0, kEntryMark) && !hasMark(start, 0, kEndMark))) {
      return _fail(kInstallerNotAPackage, "is not a ZIP archive");
    }
    return findEnd() && checkEntries();
  }

  std::uint64_t entries() const { return _entries; }
  std::uint64_t unpackedSize() const { return _unpackedSize; }

 private:
  static constexpr std::uint32_t kEntryMark = 0x04034B50;
  static constexpr std::uint32_t kDirectoryMark = 0x02014B50;
  static constexpr std::uint32_t kEndMark = 0x06054B50;
  static constexpr std::uint32_t kLargeEndMark = 0x06064B50;
  static constexpr std::uint32_t kLargeEndLocatorMark = 0x07064B50;
  static constexpr std::size_t kEntryHeader = 30;
  static constexpr std::size_t kDirectoryHeader = 46;
  static constexpr std::size_t kEnd = 22;
  static constexpr std::size_t kLargeEndLocator = 20;
  static constexpr std::size_t kLargeEnd = 56;
  static constexpr std::size_t kSearched = 16 << 10;  // for the end record, from the file's end; as the library does
  static constexpr std::uint32_t kIn64Bits = 0xFFFFFFFF;
  static constexpr unsigned kEncrypted = 0x2041;  // by any of the format's means

  static std::uint64_t number(const Buffer& bytes, std::size_t at, std::size_t width) {
    std::uint64_t value = 0;
    for (std::size_t index = width; index > 0; --index) value = value << 8 | bytes[at + index - 1];
    return value;
  }
  static bool hasMark(const Buffer& bytes, std::size_t at, std::uint32_t mark) { return number(bytes, at, 4) == mark; }

  bool read(std::uint64_t offset, std::uint64_t size, Buffer& bytes) const {
    if (offset > _size || size > _size - offset) return false;
    bytes.resize(size);
    for (std::size_t done = 0; done < size;) {
      const ssize_t got = ::pread(_file, bytes.data() + done, size - done, static_cast<off_t>(offset + done));
      if (got == 0 || (got < 0 && errno != EINTR)) return false;
      if (got > 0) done += static_cast<std::size_t>(got);
    }
    return true;
  }

  bool cutOff() const {
    return _fail(kInstallerDamaged,
                 "is cut off or damaged at its end: its directory of entries is not there. Fetch it "
                 "again");
  }
  bool contradicts(const std::string& where) const {
    return _fail(kInstallerDamaged, "is damaged: " + where + " contradicts the rest. Fetch or make it again");
  }

  bool findEnd() {
    const std::uint64_t searched = std::min<std::uint64_t>(_size, kSearched);
    Buffer tail;
    if (searched < kEnd || !read(_size - searched, searched, tail)) return cutOff();
    std::size_t at = tail.size() - kEnd;
    while (at > 0 && !hasMark(tail, at, kEndMark)) --at;
    if (!hasMark(tail, at, kEndMark) || at + kEnd + number(tail, at + 20, 2) != tail.size()) return cutOff();

    _directoryEnd = _size - searched + at;
    _entries = number(tail, at + 10, 2);
    _directorySize = number(tail, at + 12, 4);
    _directoryStart = number(tail, at + 16, 4);
    const bool oneDisk = number(tail, at + 4, 4) == 0 && number(tail, at + 8, 2) == _entries;
    Buffer locator;
    if (_directoryEnd >= kLargeEndLocator && read(_directoryEnd - kLargeEndLocator, kLargeEndLocator, locator) &&
        hasMark(locator, 0, kLargeEndLocatorMark)) {
      Buffer end;
      _directoryEnd = number(locator, 8, 8);
      if (number(locator, 4, 4) != 0 || number(locator, 16, 4) != 1 || !read(_directoryEnd, kLargeEnd, end) ||
          !hasMark(end, 0, kLargeEndMark) || number(end, 16, 8) != 0 || number(end, 24, 8) != number(end, 32, 8)) {
        return contradicts("its end");
      }
      _entries = number(end, 32, 8);
      _directorySize = number(end, 40, 8);
      _directoryStart = number(end, 48, 8);
    } else if (!oneDisk) {
      return contradicts("its end");
    }
    if (_directoryStart > _directoryEnd || _directorySize != _directoryEnd - _directoryStart) {
      return contradicts("its end");
    }
    if (_entries > _limits.entries || _directorySize > _limits.directorySize) {
      return _fail(kInstallerTooLarge, "has " + std::to_string(_entries) + " entries; a package may have " +
                                           std::to_string(_limits.entries) + " in a directory of " +
                                           std::to_string(_limits.directorySize) + " bytes");
    }
    return true;
  }

  bool checkEntries() {
    Buffer directory;
    if (!read(_directoryStart, _directorySize, directory)) return cutOff();
    std::size_t at = 0;
    for (std::uint64_t index = 0; index < _entries; ++index) {
      if (directory.size() - at < kDirectoryHeader || !hasMark(directory, at, kDirectoryMark)) {
        return contradicts("the number of its entries");
      }
      const std::size_t length = kDirectoryHeader + number(directory, at + 28, 2) + number(directory, at + 30, 2) +
                                 number(directory, at + 32, 2);
      if (directory.size() - at < length) return contradicts("the size of its directory");
      if (!checkEntry(directory, at)) return false;
      at += length;
    }
    if (at != directory.size()) return contradicts("the number of its entries");
    if (_unpackedSize > _limits.ratioFrom && _unpackedSize / _limits.ratio > _size) {
      return _fail(kInstallerTooLarge, "unpacks to " + std::to_string(_unpackedSize) +
                                           " bytes, suspiciously many for its size of " + std::to_string(_size));
    }
    return true;
  }

  bool checkEntry(const Buffer& directory, std::size_t at) {
    const auto* nameStart = reinterpret_cast<const char*>(directory.data()) + at + kDirectoryHeader;
    const std::string_view name(nameStart, number(directory, at + 28, 2));
    std::uint64_t unpacked = number(directory, at + 24, 4);
    std::uint64_t offset = number(directory, at + 42, 4);
    if (!readLargeNumbers(directory, at, unpacked, offset)) return contradicts("its entry " + quoted(name));
    if (name.find('\0') != std::string_view::npos || !isUTF8(name)) {
      return _fail(kInstallerRefused, "has an entry whose name is no text in UTF-8, " + quoted(name));
    }

    Buffer header;
    Buffer ownName;
    if (!read(offset, kEntryHeader, header) || !hasMark(header, 0, kEntryMark) || offset >= _directoryStart ||
        !read(offset + kEntryHeader, number(header, 26, 2), ownName) ||
        !std::equal(ownName.begin(), ownName.end(), name.begin(), name.end(),
                    [](std::uint8_t a, char b) { return a == static_cast<std::uint8_t>(b); })) {
      return contradicts("its entry " + quoted(name));
    }
    if (((number(directory, at + 8, 2) | number(header, 6, 2)) & kEncrypted) != 0) {
      return _fail(kInstallerEncrypted, "has an encrypted entry, " + quoted(name) + "; make it without encryption");
    }
    for (const std::uint64_t method : {number(directory, at + 10, 2), number(header, 8, 2)}) {
      if (method != 0 && method != 8) {
        return _fail(kInstallerRefused, "has an entry packed by the unknown method " + std::to_string(method) + ", " +
                                            quoted(name) + "; make it with \"deflate\"");
      }
    }
    if (unpacked > _limits.unpackedSize || _unpackedSize + unpacked > _limits.unpackedSize) {
      return _fail(kInstallerTooLarge, "unpacks to more than " + std::to_string(_limits.unpackedSize) + " bytes");
    }
    _unpackedSize += unpacked;
    return true;
  }

  // Sizes and places beyond 32 bits stand in an extra field, each only when it is needed.
  static bool readLargeNumbers(const Buffer& directory, std::size_t at, std::uint64_t& unpacked,
                               std::uint64_t& offset) {
    const bool largeUnpacked = unpacked == kIn64Bits;
    const bool largePacked = number(directory, at + 20, 4) == kIn64Bits;
    const bool largeOffset = offset == kIn64Bits;
    std::size_t field = at + kDirectoryHeader + number(directory, at + 28, 2);
    const std::size_t end = field + number(directory, at + 30, 2);
    while (end - field >= 4) {
      const std::uint64_t kind = number(directory, field, 2);
      const std::uint64_t length = number(directory, field + 2, 2);
      field += 4;
      if (length > end - field) return false;
      if (kind == 1) {
        const std::size_t sizes = std::size_t{8} * (largeUnpacked + largePacked);
        if (length < sizes + (largeOffset ? 8 : 0)) return false;
        if (largeUnpacked) unpacked = number(directory, field, 8);
        if (largeOffset) offset = number(directory, field + sizes, 8);
        return true;
      }
      field += length;
    }
    return !largeUnpacked && !largePacked && !largeOffset;
  }

  const int _file;
  const PackageLimits& _limits;
  const Failure& _fail;
  std::uint64_t _size = 0;
  std::uint64_t _directoryStart = 0;
  std::uint64_t _directorySize = 0;
  std::uint64_t _directoryEnd = 0;
  std::uint64_t _entries = 0;
  std::uint64_t _unpackedSize = 0;
};

// --- names ----------------------------------------------------------------------------------------------------------

bool isPlainComponent(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.size() <= kNameLength;
}

// The components of an entry's name; empty when it is not such a name.
std::vector<std::string> componentsOf(std::string_view path, const PackageLimits& limits) {
  std::vector<std::string> components;
  if (path.size() > limits.pathLength || !isUTF8(path)) return {};
  if (path.ends_with('/')) path.remove_suffix(1);
  while (true) {
    const std::size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    if (!isPlainComponent(component) || components.size() == limits.depth) return {};
    components.emplace_back(component);
    if (slash == std::string_view::npos) return components;
    path.remove_prefix(slash + 1);
  }
}

// Whether a link `depth` directories below the bundle stays in the bundle: it may climb before it descends, no higher
// than the bundle, and never climb out of what it has descended into, which may be another link.
bool linkStaysInside(std::string_view target, std::size_t depth) {
  if (target.empty() || target.size() > kLinkTargetLength || target.front() == '/' || !isUTF8(target)) return false;
  bool descending = false;
  while (!target.empty()) {
    const std::size_t slash = std::min(target.find('/'), target.size());
    const std::string_view component = target.substr(0, slash);
    target.remove_prefix(std::min(slash + 1, target.size()));
    if (component == "..") {
      if (descending || depth == 0) return false;
      --depth;
    } else if (component.size() > kNameLength) {
      return false;
    } else if (!component.empty() && component != ".") {
      descending = true;
    }
  }
  return true;
}

// --- the entries ----------------------------------------------------------------------------------------------------

struct ArchiveDeleter {
  void operator()(archive* handle) const { ::archive_read_free(handle); }
};
using Archive = std::unique_ptr<archive, ArchiveDeleter>;

class PackageReading {
 public:
  PackageReading(const PackageLimits& limits, PackageSink& sink, const std::function<void(double)>& progress,
                 const std::function<bool()>& cancelled, const Failure& fail, const ArchiveCheck& announced)
      : _limits(limits),
        _sink(sink),
        _progress(progress),
        _cancelled(cancelled),
        _fail(fail),
        _announced(announced),
        _archive(::archive_read_new()) {}

  bool run(int file) {
    if (_announced.entries() == 0) return holdsNoBundle();
    archive* const handle = _archive.get();
    if (handle == nullptr || ::lseek(file, 0, SEEK_SET) != 0 ||
        ::archive_read_support_format_zip_seekable(handle) != ARCHIVE_OK ||
        ::archive_read_set_format_option(handle, "zip", "mac-ext", nullptr) != ARCHIVE_OK ||
        ::archive_read_open_fd(handle, file, kBlockSize) != ARCHIVE_OK) {
      return damaged("");
    }
    std::uint64_t entries = 0;
    archive_entry* entry = nullptr;
    int result = ::archive_read_next_header(handle, &entry);
    for (; result == ARCHIVE_OK; result = ::archive_read_next_header(handle, &entry)) {
      ++entries;
      if (!goOn() || !read(entry)) return false;
    }
    if (result != ARCHIVE_EOF) return damaged(_bundle.empty() ? "" : "after " + quoted(_lastName));
    if (entries != _announced.entries()) return damaged("because not all of its entries can be reached");
    return !_bundle.empty() || holdsNoBundle();
  }

 private:
  enum class Kind : std::uint8_t { ImplicitDirectory, Directory, Other };

  bool damaged(const std::string& where) const {
    const char* reported = ::archive_error_string(_archive.get());
    std::string reason = reported == nullptr ? "it cannot be read" : reported;
    while (reason.ends_with('.')) reason.pop_back();
    return _fail(kInstallerDamaged,
                 "is damaged" + (where.empty() ? "" : " " + where) + ": " + reason + ". Fetch or make it again");
  }
  bool holdsNoBundle() const {
    return _fail(kInstallerNotAPackage, "holds no application: there is no Payload/<name>.app/");
  }
  bool refused(const std::string& why) const {
    return _fail(kInstallerRefused, "has an entry " + quoted(_lastName) + " that " + why);
  }

  bool goOn() const {
    if (!_cancelled || !_cancelled()) return true;
    return _fail(kInstallerCancelled, "is not installed: the install was cancelled");
  }

  bool read(archive_entry* entry) {
    const char* path = ::archive_entry_pathname(entry);
    _lastName = path == nullptr ? "" : path;
    const std::vector<std::string> components = componentsOf(_lastName, _limits);
    if (components.empty()) {
      return refused("is no name inside of the package, or too long or too deep");
    }
    const auto type = ::archive_entry_filetype(entry);
    if (type != AE_IFREG && type != AE_IFDIR && type != AE_IFLNK) return refused("is neither file, directory nor link");
    if (components[0] != "Payload") return true;
    if (components.size() == 1) return type == AE_IFDIR || refused("must be a directory");
    if (!components[1].ends_with(".app") || components[1].size() == 4) return true;
    if (components.size() == 2 && type != AE_IFDIR) return refused("must be a directory");
    return enterBundle(components[1]) && place(entry, components);
  }

  bool enterBundle(const std::string& name) {
    if (_bundle == name) return true;
    if (!_bundle.empty()) {
      return _fail(kInstallerNotAPackage,
                   "holds two applications, " + quoted(_bundle) + " and " + quoted(name) + "; a package has one");
    }
    _bundle = name;
    _kinds.emplace("", Kind::ImplicitDirectory);
    return _sink.bundle(name, _fail.out());
  }

  bool place(archive_entry* entry, const std::vector<std::string>& components) {
    std::string path;
    for (std::size_t index = 2; index < components.size(); ++index) {
      if (index > 2) {
        const auto [parent, isNew] = _kinds.emplace(path, Kind::ImplicitDirectory);
        if (isNew && !_sink.directory(path, _fail.out())) return false;
        if (parent->second == Kind::Other) return refused("lies in something that is no directory");
        path += '/';
      }
      path += components[index];
    }
    const bool isDirectory = ::archive_entry_filetype(entry) == AE_IFDIR;
    const auto [known, isNew] = _kinds.emplace(path, isDirectory ? Kind::Directory : Kind::Other);
    if (!isNew) {
      if (!isDirectory || known->second != Kind::ImplicitDirectory) return refused("is there twice");
      known->second = Kind::Directory;
      return true;
    }
    if (isDirectory) return _sink.directory(path, _fail.out());
    return ::archive_entry_filetype(entry) == AE_IFLNK ? link(entry, path, components.size() - 3) : file(entry, path);
  }

  bool link(archive_entry* entry, const std::string& path, std::size_t depth) {
    const char* target = ::archive_entry_symlink(entry);
    if (target == nullptr || !linkStaysInside(target, depth)) {
      return refused("is a link to " + quoted(target == nullptr ? "" : target) + ", outside of the application");
    }
    return _sink.link(path, target, _fail.out());
  }

  bool file(archive_entry* entry, const std::string& path) {
    if (!_sink.beginFile(path, (::archive_entry_perm(entry) & 0100) != 0, _fail.out())) return false;
    const auto announced = static_cast<std::uint64_t>(std::max<std::int64_t>(::archive_entry_size(entry), 0));
    std::uint64_t written = 0;
    while (true) {
      const void* block = nullptr;
      std::size_t size = 0;
      la_int64_t offset = 0;
      const int result = ::archive_read_data_block(_archive.get(), &block, &size, &offset);
      if (result == ARCHIVE_EOF) break;
      if (result != ARCHIVE_OK) return damaged("in " + quoted(_lastName));
      if (static_cast<std::uint64_t>(offset) != written || size > announced - written) {
        return damaged("in " + quoted(_lastName) + ", which is larger than announced");
      }
      written += size;
      if (!_sink.bytes(block, size, _fail.out()) || !advance(size)) return false;
    }
    if (written != announced) return damaged("in " + quoted(_lastName) + ", which is smaller than announced");
    return _sink.endFile(_fail.out());
  }

  bool advance(std::size_t size) {
    _done += size;
    if (_progress) {
      const auto total = static_cast<double>(std::max<std::uint64_t>(_announced.unpackedSize(), 1));
      _progress(std::min(static_cast<double>(_done) / total, 1.0));
    }
    return goOn();
  }

  const PackageLimits& _limits;
  PackageSink& _sink;
  const std::function<void(double)>& _progress;
  const std::function<bool()>& _cancelled;
  const Failure& _fail;
  const ArchiveCheck& _announced;
  const Archive _archive;

  std::string _bundle;                           // empty until it has been met
  std::string _lastName;                         // of the entry that is being read
  std::unordered_map<std::string, Kind> _kinds;  // of everything in the bundle so far, by path
  std::uint64_t _done = 0;
};

}  // namespace

bool readPackage(int file, const std::string& name, const PackageLimits& limits, PackageSink& sink,
                 const std::function<void(double fraction)>& progress, const std::function<bool()>& cancelled,
                 ErrorOut error) {
  const Failure fail(name, error);
  ArchiveCheck check(file, limits, fail);
  if (!check.run()) return false;
  const NamesInUTF8 names;
  return PackageReading(limits, sink, progress, cancelled, fail, check).run(file);
}

}  // namespace appsync
