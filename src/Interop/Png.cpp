#include "Interop/PngImpl.h"

#include <stdexcept>
#include <string>

#include <png.h>

namespace VLN::Interop {

std::vector<unsigned char> codePng(void const* pixels, int width, int height, PixelBytes bytes) {
  png_image image = {};
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(width);
  image.height = static_cast<png_uint_32>(height);
  image.format = bytes == PixelBytes::kRgb ? PNG_FORMAT_RGB : PNG_FORMAT_RGBA;
  png_alloc_size_t size = PNG_IMAGE_PNG_SIZE_MAX(image);
  std::vector<unsigned char> file(size);
  if (!png_image_write_to_memory(&image, file.data(), &size, 0, pixels, 0, nullptr))
    throw std::runtime_error(std::string("the picture cannot be coded: ") + image.message);
  file.resize(size);
  return file;
}

} // namespace VLN::Interop
