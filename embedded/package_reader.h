// Reads packages: ZIP archives that hold one application bundle, "Payload/<anything>.app/".
//
// A package comes from outside and is not trusted: it is read once from its directory to its last byte, within limits,
// and whatever is not in order is an error. What lies beside the bundle is left out.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/error.h"

namespace appsync {

// The domain of the errors of packages and of their installation; a failure of the disk is the underlying error.
inline constexpr std::string_view kInstallerErrorDomain = "InstallerError";
inline constexpr std::int64_t kInstallerBadIdentifier = 1;  // no single path component
inline constexpr std::int64_t kInstallerNoPackage = 2;      // missing, or cannot be opened
inline constexpr std::int64_t kInstallerNotAPackage = 3;    // no ZIP archive, or none with one bundle in it
inline constexpr std::int64_t kInstallerDamaged = 4;        // cut off, wrong checksums, contradicts itself
inline constexpr std::int64_t kInstallerRefused = 5;        // names, links or kinds of entries that no package may have
inline constexpr std::int64_t kInstallerTooLarge = 6;       // beyond a limit
inline constexpr std::int64_t kInstallerEncrypted = 7;
inline constexpr std::int64_t kInstallerWrongApplication = 8;  // not the application that was asked for
inline constexpr std::int64_t kInstallerCancelled = 9;
inline constexpr std::int64_t kInstallerDisk = 10;  // could not be written

struct PackageLimits {
  std::uint64_t entries = 200'000;
  std::uint64_t directorySize = 64ULL << 20;  // bytes of the archive's own directory, which is held in memory
  std::uint64_t unpackedSize = 16ULL << 30;   // bytes of all entries
  std::uint64_t ratio = 1000;                 // unpacked bytes for each byte of the package ...
  std::uint64_t ratioFrom = 64ULL << 20;      // ... in packages that unpack to more than this
  std::size_t depth = 64;                     // directories within directories
  std::size_t pathLength = 1024;              // bytes of an entry's name
};

// Where the bundle goes. Paths are relative to the bundle, of plain components only, each given once; a parent is given
// before what is in it. An operation that answers false ends the reading, with the error that it has set.
class PackageSink {
 public:
  virtual ~PackageSink() = default;

  // First of all: the bundle's own directory, "<anything>.app".
  virtual bool bundle(const std::string& name, ErrorOut error) = 0;
  virtual bool directory(const std::string& path, ErrorOut error) = 0;
  virtual bool beginFile(const std::string& path, bool executable, ErrorOut error) = 0;
  virtual bool bytes(const void* data, std::size_t size, ErrorOut error) = 0;  // of the file begun last
  virtual bool endFile(ErrorOut error) = 0;
  // `target` is relative and leads to a place inside the bundle, whatever other links there are.
  virtual bool link(const std::string& path, const std::string& target, ErrorOut error) = 0;
};

// Reads the package in `file` (a descriptor open for reading, seekable; its position changes, it stays open) into the
// sink, in memory that does not grow with its size. `name` is what errors call the package. `progress` hears the
// fraction that is done and `cancelled` is asked whether to give up, both between blocks, both may be empty. False,
// with an error of the installer's domain or the sink's own.
bool readPackage(int file, const std::string& name, const PackageLimits& limits, PackageSink& sink,
                 const std::function<void(double fraction)>& progress, const std::function<bool()>& cancelled,
                 ErrorOut error);

}  // namespace appsync
