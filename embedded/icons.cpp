#include "embedded/icons.h"

#include <png.h>

#include <algorithm>
#include <cmath>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace appsync {

namespace {

constexpr std::uint32_t kLargestPicture = 4096;      // pixels, either way
constexpr std::uint64_t kLargestFile = 64ULL << 20;  // bytes of a PNG file
constexpr std::size_t kMostIconFiles = 64;           // looked at in one bundle
constexpr double kCornerRadius = 0.225;              // of the icon's side
constexpr std::size_t kChannels = 4;

// --- PNG files ------------------------------------------------------------------------------------------------------

// The library's reader and writer of whole images, which reports its errors by results.
class PNGImage {
 public:
  PNGImage() { _image.version = PNG_IMAGE_VERSION; }
  ~PNGImage() { ::png_image_free(&_image); }
  PNGImage(const PNGImage&) = delete;
  PNGImage& operator=(const PNGImage&) = delete;

  png_image* operator->() { return &_image; }
  png_image* get() { return &_image; }
  bool hasFailed() const { return (_image.warning_or_error & PNG_IMAGE_ERROR) != 0; }

 private:
  png_image _image{};
};

bool beginReading(PNGImage& image, const Bytes& file) {
  return ::png_image_begin_read_from_memory(image.get(), file.data(), file.size()) != 0 && image->width > 0 &&
         image->height > 0 && image->width <= kLargestPicture && image->height <= kLargestPicture;
}

class PNGDestination : public ImageDestination {
 public:
  explicit PNGDestination(Bytes& buffer) : _buffer(buffer) {}

  void addImage(const Image& image) override {
    _image = image;
    ++_images;
  }

  bool finalize() override {
    if (_images != 1 || _image.width == 0 || _image.height == 0 ||
        _image.pixels.size() != std::uint64_t{_image.width} * _image.height * kChannels) {
      return false;
    }
    PNGImage png;
    png->width = _image.width;
    png->height = _image.height;
    png->format = PNG_FORMAT_RGBA;
    png_alloc_size_t size = 0;
    const void* pixels = _image.pixels.data();
    if (::png_image_write_to_memory(png.get(), nullptr, &size, 0, pixels, 0, nullptr) == 0) return false;
    Bytes file(size);
    if (::png_image_write_to_memory(png.get(), file.data(), &size, 0, pixels, 0, nullptr) == 0) return false;
    file.resize(size);
    _buffer = std::move(file);
    return true;
  }

 private:
  Bytes& _buffer;
  Image _image;
  std::size_t _images = 0;
};

// --- scaling --------------------------------------------------------------------------------------------------------

// Pixels with colours multiplied by their opacity, so that what is transparent lends no colour to its neighbours.
struct Surface {
  std::size_t width = 0;
  std::size_t height = 0;
  std::vector<float> values;  // four for each pixel

  Surface(std::size_t columns, std::size_t rows) : width(columns), height(rows), values(columns * rows * kChannels) {}
};

// One row of a picture as a surface has it: a whole picture would take four times its size.
void premultiplyRow(const Image& image, std::size_t row, std::vector<float>& values) {
  const std::uint8_t* from = &image.pixels[row * image.width * kChannels];
  values.resize(image.width * kChannels);
  for (std::size_t at = 0; at < values.size(); at += kChannels) {
    const auto alpha = static_cast<float>(from[at + 3]);
    for (std::size_t channel = 0; channel < 3; ++channel) {
      values[at + channel] = static_cast<float>(from[at + channel]) * alpha / 255.0F;
    }
    values[at + 3] = alpha;
  }
}

// What one pixel of the result takes from the source, along one axis.
struct Taps {
  std::size_t first = 0;
  std::vector<float> weights;
};

// Each of the icon's pixels covers `length / kHomeScreenIconSize` pixels of the source from `start` on: it takes their
// mean by area or, when it covers less than one, a mixture of the two nearest.
std::vector<Taps> tapsAlong(double start, double length, std::size_t available) {
  const double scale = length / kHomeScreenIconSize;
  std::vector<Taps> all(kHomeScreenIconSize);
  for (std::size_t index = 0; index < all.size(); ++index) {
    const double center = start + (static_cast<double>(index) + 0.5) * scale;
    const double reach = std::max(scale, 1.0) / 2;
    const double last = static_cast<double>(available);
    const double from = std::clamp(center - reach, 0.0, last - 1);
    const double to = std::clamp(center + reach, from + 1e-6, last);
    all[index].first = static_cast<std::size_t>(from);
    for (auto pixel = static_cast<double>(all[index].first); pixel < to; ++pixel) {
      all[index].weights.push_back(static_cast<float>((std::min(pixel + 1, to) - std::max(pixel, from)) / (to - from)));
    }
  }
  return all;
}

// Scales one row of pixels into column `row` of the result: rows become columns, so that doing it twice, across and
// down, scales both ways and leaves the picture upright.
void scaleRow(const float* source, const std::vector<Taps>& taps, std::size_t row, Surface& result) {
  for (std::size_t column = 0; column < taps.size(); ++column) {
    float* to = &result.values[(column * result.width + row) * kChannels];
    const float* from = &source[taps[column].first * kChannels];
    for (const float weight : taps[column].weights) {
      for (std::size_t channel = 0; channel < kChannels; ++channel) to[channel] += weight * *from++;
    }
  }
}

// The middle square of the picture in the icon's size.
Surface scaled(const Image& picture) {
  const double side = std::min(picture.width, picture.height);
  const std::vector<Taps> across = tapsAlong((picture.width - side) / 2, side, picture.width);
  const std::vector<Taps> down = tapsAlong((picture.height - side) / 2, side, picture.height);
  Surface turned(picture.height, kHomeScreenIconSize);
  std::vector<float> values;
  for (std::size_t row = 0; row < picture.height; ++row) {
    premultiplyRow(picture, row, values);
    scaleRow(values.data(), across, row, turned);
  }
  Surface result(kHomeScreenIconSize, kHomeScreenIconSize);
  for (std::size_t row = 0; row < turned.height; ++row) {
    scaleRow(&turned.values[row * turned.width * kChannels], down, row, result);
  }
  return result;
}

// How much of a pixel of the icon is inside the rounded square, 0 to 1.
float cornerMask(std::size_t column, std::size_t row) {
  constexpr double kHalf = kHomeScreenIconSize / 2.0;
  constexpr double kRadius = kHomeScreenIconSize * kCornerRadius;
  const double x = std::max(std::abs(static_cast<double>(column) + 0.5 - kHalf) - (kHalf - kRadius), 0.0);
  const double y = std::max(std::abs(static_cast<double>(row) + 0.5 - kHalf) - (kHalf - kRadius), 0.0);
  return static_cast<float>(std::clamp(kRadius - std::hypot(x, y) + 0.5, 0.0, 1.0));
}

std::uint8_t byteOf(float value) {
  return static_cast<std::uint8_t>(std::clamp(std::lround(value), 0L, 255L));
}

}  // namespace

std::optional<Image> decodePNG(const Bytes& file) {
  PNGImage png;
  if (!beginReading(png, file)) return std::nullopt;
  png->format = PNG_FORMAT_RGBA;
  Image image;
  image.width = png->width;
  image.height = png->height;
  image.pixels.resize(std::size_t{image.width} * image.height * kChannels);
  if (::png_image_finish_read(png.get(), nullptr, image.pixels.data(), 0, nullptr) == 0 || png.hasFailed()) {
    return std::nullopt;
  }
  return image;
}

Image homeScreenIcon(const Image& picture) {
  const Surface surface = scaled(picture);
  Image icon{kHomeScreenIconSize, kHomeScreenIconSize, Bytes(surface.values.size())};
  for (std::size_t pixel = 0; pixel < icon.pixels.size() / kChannels; ++pixel) {
    const float* from = &surface.values[pixel * kChannels];
    std::uint8_t* to = &icon.pixels[pixel * kChannels];
    const float alpha = from[3];
    for (std::size_t channel = 0; channel < 3 && alpha > 0; ++channel)
      to[channel] = byteOf(from[channel] * 255 / alpha);
    to[3] = byteOf(alpha * cornerMask(pixel % kHomeScreenIconSize, pixel / kHomeScreenIconSize));
  }
  return icon;
}

EmbeddedIconServices::EmbeddedIconServices(FileManager& files) : _files(files) {}

std::optional<Bundle> EmbeddedIconServices::bundleWithURL(const FileURL& url) {
  const std::optional<FileInformation> information = _files.attributesOfItem(url.path(), nullptr);
  if (!information || !information->isDirectory) return std::nullopt;
  Bundle bundle{url, PropertyList::dictionary()};
  const std::optional<Bytes> bytes = _files.readFile(url.path() + "/Info.plist", nullptr);
  const std::optional<PropertyList> info = bytes ? parsePropertyList(*bytes, nullptr) : std::nullopt;
  if (info && info->isDictionary()) bundle.infoDictionary = *info;
  return bundle;
}

std::optional<Image> EmbeddedIconServices::GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(
    const Bundle& bundle) {
  struct Candidate {
    std::uint64_t pixels;
    std::string path;
  };
  std::vector<Candidate> candidates;
  const PropertyList* names = bundle.infoDictionary.find("TefBundleIconFiles");
  if (names == nullptr) return std::nullopt;
  for (const PropertyList& name : names->elements()) {
    if (candidates.size() == kMostIconFiles) break;
    if (!name.isString() || name.string()->empty()) continue;
    const std::string path = bundle.url.path() + "/" + *name.string();  // the file manager refuses one that climbs
    const std::optional<FileInformation> information = _files.attributesOfItem(path, nullptr);
    if (!information || information->isDirectory || information->size > kLargestFile) continue;
    const std::optional<Bytes> file = _files.readFile(path, nullptr);
    PNGImage png;
    if (file && beginReading(png, *file)) candidates.push_back({std::uint64_t{png->width} * png->height, path});
  }
  std::stable_sort(candidates.begin(), candidates.end(),
                   [](const Candidate& a, const Candidate& b) { return a.pixels > b.pixels; });
  for (const Candidate& candidate : candidates) {
    const std::optional<Bytes> file = _files.readFile(candidate.path, nullptr);
    if (const std::optional<Image> picture = file ? decodePNG(*file) : std::nullopt) return homeScreenIcon(*picture);
  }
  return std::nullopt;
}

std::unique_ptr<ImageDestination> EmbeddedIconServices::makePNGDestination(Bytes& buffer) {
  return std::make_unique<PNGDestination>(buffer);
}

}  // namespace appsync
