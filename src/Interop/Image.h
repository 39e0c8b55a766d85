// Image: an RGB picture in memory, and its way into a PNG file.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace VLN::Interop {

struct Rgb {
  std::uint8_t r = 0, g = 0, b = 0;
  bool operator==(Rgb const&) const = default;
};

/// @shape width() x height() pixels, row by row from the top, three bytes each (sRGB).
class VLN_API Image {
public:
  Image(int width, int height, Rgb fill = {255, 255, 255});

  int width() const { return m_width; }
  int height() const { return m_height; }
  Rgb& operator()(int x, int y) { return m_pixels[offset(x, y)]; }
  Rgb const& operator()(int x, int y) const { return m_pixels[offset(x, y)]; }

  /// Fills the half-open box [x0, x1) x [y0, y1), cut to the picture.
  void fill(int x0, int y0, int x1, int y1, Rgb color);
  /// Copies another picture in, its corner at (x, y), cut to this one.
  void paste(Image const& other, int x, int y);
  /// Writes characters of the built-in 5 x 7 font, each pixel of it `scale` wide. (x, y) is the upper left
  /// corner. Characters that the font lacks leave a blank.
  void text(int x, int y, std::string_view characters, Rgb color, int scale = 1);
  static int textWidth(std::string_view characters, int scale = 1);
  static int textHeight(int scale = 1) { return 7 * scale; }

  /// The picture as the bytes of a PNG file.
  std::vector<unsigned char> png() const;
  /// Writes a PNG file, beside its name first.
  /// @error FileError.
  void writePng(std::string const& path) const;

private:
  std::size_t offset(int x, int y) const {
    return static_cast<std::size_t>(y) * static_cast<std::size_t>(m_width) + static_cast<std::size_t>(x);
  }

  int m_width;
  int m_height;
  std::vector<Rgb> m_pixels;
};

} // namespace VLN::Interop
