// Reads PNG files with the library that wrote them, for tests.
#pragma once

#include "Interop/Image.h"

#include <stdexcept>
#include <string>

#include <png.h>

namespace VLN::Test {

inline Interop::Image readPng(std::string const& path) {
  png_image image = {};
  image.version = PNG_IMAGE_VERSION;
  if (!png_image_begin_read_from_file(&image, path.c_str())) throw std::runtime_error(image.message);
  image.format = PNG_FORMAT_RGB;
  Interop::Image result(static_cast<int>(image.width), static_cast<int>(image.height));
  if (!png_image_finish_read(&image, nullptr, &result(0, 0), 0, nullptr))
    throw std::runtime_error(image.message);
  return result;
}

} // namespace VLN::Test
