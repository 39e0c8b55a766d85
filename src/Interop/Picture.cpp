#include "Interop/Picture.h"

#include "Interop/OutputFile.h"
#include "Interop/PngImpl.h"

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
  auto const bytes = opaque ? codePng(rgb.data(), width, height, PixelBytes::kRgb)
                            : codePng(pixels.data(), width, height, PixelBytes::kRgba);
  file.write(bytes.data(), bytes.size());
  file.commit();
}

} // namespace VLN::Interop
