#include "Interop/Picture.h"

#include "Interop/OutputFile.h"

#include <stdexcept>

#include <png.h>

namespace VLN::Interop {

void writeRgbaPng(std::string const& path, int width, int height, std::vector<std::uint8_t> const& pixels) {
  OutputFile file(path);
  bool opaque = true;
  for (std::size_t n = 3; n < pixels.size(); n += 4) opaque = opaque && pixels[n] == 255;
  std::vector<std::uint8_t> rgb;
  if (opaque) {
    rgb.resize(pixels.size() / 4 * 3);
    for (std::size_t n = 0; n < pixels.size() / 4; ++n)
      for (std::size_t c = 0; c < 3; ++c) rgb[3 * n + c] = pixels[4 * n + c];
  }
  png_image image = {};
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(width);
  image.height = static_cast<png_uint_32>(height);
  image.format = opaque ? PNG_FORMAT_RGB : PNG_FORMAT_RGBA;
  png_alloc_size_t size = PNG_IMAGE_PNG_SIZE_MAX(image);
  std::vector<unsigned char> bytes(size);
  if (!png_image_write_to_memory(&image, bytes.data(), &size, 0, opaque ? rgb.data() : pixels.data(), 0,
                                 nullptr))
    throw std::runtime_error(std::string("the picture cannot be coded: ") + image.message);
  file.write(bytes.data(), size);
  file.commit();
}

} // namespace VLN::Interop
