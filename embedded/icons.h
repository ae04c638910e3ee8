// Bundles, their home-screen icons, and PNG files on the embedded device.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>

#include "platform/brelm.h"
#include "platform/file_manager.h"

namespace appsync {

inline constexpr std::uint32_t kHomeScreenIconSize = 120;  // pixels, both ways

class EmbeddedIconServices : public IconServices {
 public:
  explicit EmbeddedIconServices(FileManager& files);

  std::optional<Bundle> bundleWithURL(const FileURL& url) override;
  std::optional<Image> GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(const Bundle& bundle) override;
  std::unique_ptr<ImageDestination> makePNGDestination(Bytes& buffer) override;

 private:
  FileManager& _files;
};

// The picture in a PNG file, whatever its colour type; none when it cannot be read whole or is wider or higher than
// 4096 pixels.
std::optional<Image> decodePNG(const Bytes& file);

// The picture in the device's icon size and shape: scaled to fill the square, with rounded corners. The image must have
// at least one pixel.
Image homeScreenIcon(const Image& picture);

}  // namespace appsync
