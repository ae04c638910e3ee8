// The home-screen shell: the layout of icons, and the look of one icon.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/error.h"
#include "platform/file_url.h"
#include "platform/property_list.h"

namespace appsync {

// A right to talk to the shell.
struct BrelmPort {
  std::uint32_t name = 0;
};

// Forms in which the shell gives its layout away.
inline constexpr std::uint32_t kBrelmIconStateFlattened = 1;

// Any thread; never calls back, but may take long: not to be called under a lock.
class BrelmShell {
 public:
  virtual ~BrelmShell() = default;

  virtual BrelmPort BrelmBlockableServerPort() = 0;

  // Replaces the layout by the one in these bytes: a property list, an array of pages, each an array of bundle
  // identifiers or of folders ({"displayName", "iconLists"}), or simply a flat array of identifiers. Identifiers of
  // applications that are not on the device are kept, so that a layout sent ahead orders what comes; what is on the
  // device and not in the layout follows it. 0 on success; another number, and the old layout stays, when the bytes
  // cannot be used.
  virtual int BrelmSetIconState(BrelmPort port, const std::uint8_t* bytes, std::size_t length) = 0;

  // The layout as the bytes of a property list: an array of bundle identifiers in home-screen order, folders flattened.
  // None when the shell cannot be asked.
  virtual std::optional<Bytes> BrelmGetFlattenedIconState(BrelmPort port, std::uint32_t format) = 0;
};

// A bundle's directory and what its Info.plist says.
struct Bundle {
  FileURL url;
  PropertyList infoDictionary;  // a dictionary; empty when there is none that can be read
};

// Pixels, row after row from the top, four bytes each: red, green, blue, alpha (not premultiplied).
struct Image {
  std::uint32_t width = 0;
  std::uint32_t height = 0;
  Bytes pixels;  // 4 * width * height bytes
};

// Encodes one image.
class ImageDestination {
 public:
  virtual ~ImageDestination() = default;
  virtual void addImage(const Image& image) = 0;
  // Finishes the encoding; only after it has answered true the buffer holds the file. False without an image, or when
  // it cannot be encoded.
  virtual bool finalize() = 0;
};

// Bundles, their icons, and image files. Any thread; never calls back; not to be called under a lock.
class IconServices {
 public:
  virtual ~IconServices() = default;

  // The bundle in this directory; none when there is no directory.
  virtual std::optional<Bundle> bundleWithURL(const FileURL& url) = 0;

  // The bundle's icon in the size and shape of the device's home screen: the largest of the PNG files named by its
  // "TefBundleIconFiles" that can be read. None when there is none.
  virtual std::optional<Image> GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(const Bundle& bundle) = 0;

  // An encoder of one PNG image into `buffer`, which must outlive it; null when there can be none.
  virtual std::unique_ptr<ImageDestination> makePNGDestination(Bytes& buffer) = 0;
};

}  // namespace appsync
