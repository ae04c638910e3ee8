#include "host/sample_icon.h"

#include <algorithm>
#include <array>
#include <cmath>

namespace appsync {

namespace {

using Color = std::array<double, 3>;

// A colour of the colour wheel: `turn` from 0 to 1.
Color wheelColor(double turn, double lightness) {
  Color color{};
  for (std::size_t i = 0; i < 3; ++i) {
    const double place = turn * 6 + (i == 0 ? 0.0 : i == 1 ? 4.0 : 2.0);
    const double wave = std::abs(std::fmod(place, 6.0) - 3) - 1;
    color[i] = lightness * (0.25 + 0.75 * std::clamp(wave, 0.0, 1.0));
  }
  return color;
}

// The figure is drawn on 5 × 5 fields, its left half mirrored to the right.
bool isInFigure(std::uint64_t number, double x, double y) {
  constexpr double kMargin = 0.2;
  const double across = (x - kMargin) / (1 - 2 * kMargin) * 5;
  const double down = (y - kMargin) / (1 - 2 * kMargin) * 5;
  if (across < 0 || across >= 5 || down < 0 || down >= 5) return false;
  const auto column = static_cast<unsigned>(across);
  const unsigned mirrored = std::min(column, 4 - column);
  const unsigned field = static_cast<unsigned>(down) * 3 + mirrored;
  constexpr std::uint64_t kSpine = 0b100'000'100'000'100;  // the middle column is never empty
  return (((number >> 16U) | kSpine) >> field & 1U) != 0;
}

// How much of the pixel the figure covers, from 16 points in it.
double coverage(std::uint64_t number, std::uint32_t x, std::uint32_t y, std::uint32_t size) {
  int inside = 0;
  for (int i = 0; i < 16; ++i) {
    const int column = i % 4;
    const int row = i / 4;
    const double px = (x + (column + 0.5) / 4) / size;
    const double py = (y + (row + 0.5) / 4) / size;
    inside += isInFigure(number, px, py) ? 1 : 0;
  }
  return inside / 16.0;
}

}  // namespace

Image sampleIcon(std::uint64_t number, std::uint32_t size) {
  const double turn = static_cast<double>(number % 360) / 360;
  const Color top = wheelColor(turn, 1.0);
  const Color bottom = wheelColor(std::fmod(turn + 0.12, 1.0), 0.6);
  Image image{size, size, Bytes(std::size_t{4} * size * size)};
  for (std::uint32_t y = 0; y < size; ++y) {
    for (std::uint32_t x = 0; x < size; ++x) {
      const double slope = (0.3 * x + 0.7 * y) / size;
      const double white = 0.92 * coverage(number, x, y, size);
      std::uint8_t* pixel = &image.pixels[(std::size_t{y} * size + x) * 4];
      for (std::size_t i = 0; i < 3; ++i) {
        const double ground = top[i] * (1 - slope) + bottom[i] * slope;
        pixel[i] = static_cast<std::uint8_t>(std::lround(255 * (ground * (1 - white) + white)));
      }
      pixel[3] = 255;
    }
  }
  return image;
}

}  // namespace appsync
