// Whatever a package is, reading it ends with a bundle that stays within itself or with an error, in bounded memory.
#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <string>

#include "embedded/package_reader.h"

namespace {

using namespace appsync;

void require(bool condition, const char* what) {
  if (condition) return;
  std::fprintf(stderr, "%s\n", what);
  std::abort();
}

// Accepts everything, and stops the program when the reader breaks a promise.
class CheckingSink : public PackageSink {
 public:
  static constexpr std::uint64_t kLargest = 1 << 20;

  bool bundle(const std::string& name, ErrorOut) override {
    require(_kinds.empty() && name.ends_with(".app") && Path(name).parent_path().empty(), "a bundle's name");
    _kinds[""] = 'd';
    return true;
  }
  bool directory(const std::string& path, ErrorOut) override { return place(path, 'd'); }
  bool beginFile(const std::string& path, bool, ErrorOut) override { return place(path, 'f'); }
  bool bytes(const void*, std::size_t size, ErrorOut) override {
    require((_size += size) <= kLargest, "more bytes than the limit");
    return true;
  }
  bool endFile(ErrorOut) override { return true; }
  bool link(const std::string& path, const std::string& target, ErrorOut) override {
    require(!target.empty() && target[0] != '/', "a link's target");
    _links.emplace(path, target);
    return place(path, 'l');
  }

  // Follows every link through all others; none may leave the bundle.
  void checkLinks() const {
    for (const auto& [path, target] : _links) {
      int steps = 0;
      Path place = path.parent_path();
      follow(target, place, steps);
    }
  }

 private:
  using Path = std::filesystem::path;

  bool place(const Path& path, char kind) {
    for (const Path& component : path) {
      require(!component.empty() && component != "." && component != ".." && component != "/", "a component");
    }
    const auto parent = _kinds.find(path.parent_path());
    require(parent != _kinds.end() && parent->second == 'd', "a parent that is no directory");
    require(_kinds.emplace(path, kind).second, "a path that is there twice");
    return true;
  }

  void follow(const Path& target, Path& place, int& steps) const {
    for (const Path& component : target) {
      if (component.empty() || component == "." || ++steps > 1000) continue;
      const auto link = _links.find(place / component);
      if (component == "..") {
        require(!place.empty(), "a link that leaves the bundle");
        place = place.parent_path();
      } else if (link != _links.end()) {
        follow(link->second, place, steps);
      } else {
        place /= component;
      }
    }
  }

  std::map<Path, char> _kinds;
  std::map<Path, Path> _links;
  std::uint64_t _size = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
  static const int file = ::memfd_create("package", MFD_CLOEXEC);
  require(::ftruncate(file, 0) == 0 && ::pwrite(file, bytes, size, 0) == static_cast<ssize_t>(size), "memory");
  PackageLimits limits;
  limits.unpackedSize = CheckingSink::kLargest;
  limits.entries = 1000;
  CheckingSink sink;
  std::optional<Error> error;
  const bool isRead = readPackage(file, "p.ipa", limits, sink, {}, {}, &error);
  require(isRead != error.has_value(), "neither a bundle nor an error, or both");
  sink.checkLinks();
  return 0;
}
