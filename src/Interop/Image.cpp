#include "Interop/Image.h"

#include "Interop/OutputFile.h"

#include <algorithm>
#include <stdexcept>

#include <png.h>

namespace VLN::Interop {

static_assert(sizeof(Rgb) == 3, "rows of pixels are handed to libpng as they are");

namespace {

// Seven rows of five bits for each character, the highest bit on the left.
struct Glyph {
  char character;
  std::uint8_t rows[7];
};
constexpr Glyph kFont[] = {
    {'0', {0x0e, 0x11, 0x13, 0x15, 0x19, 0x11, 0x0e}}, {'1', {0x04, 0x0c, 0x04, 0x04, 0x04, 0x04, 0x0e}},
    {'2', {0x0e, 0x11, 0x01, 0x06, 0x08, 0x10, 0x1f}}, {'3', {0x1f, 0x02, 0x04, 0x02, 0x01, 0x11, 0x0e}},
    {'4', {0x02, 0x06, 0x0a, 0x12, 0x1f, 0x02, 0x02}}, {'5', {0x1f, 0x10, 0x1e, 0x01, 0x01, 0x11, 0x0e}},
    {'6', {0x06, 0x08, 0x10, 0x1e, 0x11, 0x11, 0x0e}}, {'7', {0x1f, 0x01, 0x02, 0x04, 0x08, 0x08, 0x08}},
    {'8', {0x0e, 0x11, 0x11, 0x0e, 0x11, 0x11, 0x0e}}, {'9', {0x0e, 0x11, 0x11, 0x0f, 0x01, 0x02, 0x0c}},
    {'.', {0x00, 0x00, 0x00, 0x00, 0x00, 0x0c, 0x0c}}, {'-', {0x00, 0x00, 0x00, 0x1f, 0x00, 0x00, 0x00}},
    {'+', {0x00, 0x04, 0x04, 0x1f, 0x04, 0x04, 0x00}}, {'e', {0x00, 0x00, 0x0e, 0x11, 0x1f, 0x10, 0x0e}},
    {'i', {0x04, 0x00, 0x0c, 0x04, 0x04, 0x04, 0x0e}}, {'n', {0x00, 0x00, 0x16, 0x19, 0x11, 0x11, 0x11}},
    {'>', {0x10, 0x08, 0x04, 0x02, 0x04, 0x08, 0x10}}, {'f', {0x06, 0x09, 0x08, 0x1c, 0x08, 0x08, 0x08}},
    {'a', {0x00, 0x00, 0x0e, 0x01, 0x0f, 0x11, 0x0f}},
};

Glyph const* glyph(char c) {
  for (Glyph const& g : kFont)
    if (g.character == c) return &g;
  return nullptr;
}

} // namespace

Image::Image(int width, int height, Rgb fill)
    : m_width(width)
    , m_height(height) {
  if (width < 1 || height < 1) throw std::invalid_argument("a picture needs at least one pixel");
  m_pixels.assign(static_cast<std::size_t>(width) * static_cast<std::size_t>(height), fill);
}

void Image::fill(int x0, int y0, int x1, int y1, Rgb color) {
  for (int y = std::max(y0, 0); y < std::min(y1, m_height); ++y)
    for (int x = std::max(x0, 0); x < std::min(x1, m_width); ++x) (*this)(x, y) = color;
}

void Image::paste(Image const& other, int x, int y) {
  for (int v = std::max(0, -y); v < std::min(other.height(), m_height - y); ++v)
    for (int u = std::max(0, -x); u < std::min(other.width(), m_width - x); ++u)
      (*this)(x + u, y + v) = other(u, v);
}

void Image::text(int x, int y, std::string_view characters, Rgb color, int scale) {
  for (char c : characters) {
    if (Glyph const* g = glyph(c))
      for (int row = 0; row < 7; ++row)
        for (int column = 0; column < 5; ++column)
          if (g->rows[row] >> (4 - column) & 1)
            fill(x + column * scale, y + row * scale, x + (column + 1) * scale, y + (row + 1) * scale, color);
    x += 6 * scale;
  }
}

int Image::textWidth(std::string_view characters, int scale) {
  return characters.empty() ? 0 : (6 * static_cast<int>(characters.size()) - 1) * scale;
}

std::vector<unsigned char> Image::png() const {
  png_image image = {};
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(m_width);
  image.height = static_cast<png_uint_32>(m_height);
  image.format = PNG_FORMAT_RGB;
  png_alloc_size_t size = PNG_IMAGE_PNG_SIZE_MAX(image);
  std::vector<unsigned char> bytes(size);
  if (!png_image_write_to_memory(&image, bytes.data(), &size, 0, m_pixels.data(), 0, nullptr))
    throw std::runtime_error(std::string("the picture cannot be coded: ") + image.message);
  bytes.resize(size);
  return bytes;
}

void Image::writePng(std::string const& path) const {
  OutputFile file(path);
  auto const bytes = png();
  file.write(bytes.data(), bytes.size());
  file.commit();
}

} // namespace VLN::Interop
