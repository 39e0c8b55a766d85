#include "Commands.h"
#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/VolumeFile.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <filesystem>
#include <ostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

void slice(SliceOptions const& options) {
  checkOutputFor(FileContent::kPictures, options.output);
  std::string summary;
  {
    ProgressBar bar;
    auto content = importVolumes(options.file, options.limits, bar.progress());
    auto const& volume = volumeWith(content, options.channel);
    try {
      auto plane = options.plane;
      std::string what = oneLine(options.channel, 60);
      if (plane.component >= 0) what += std::string("_") + "xyz"[plane.component];
      if (plane.gradient) what = "gradient of " + what;
      char const axis = (plane.indexSpace ? "ijk" : "xyz")[plane.axis];
      if (options.title) plane.title = std::filesystem::path(options.file).filename().string() + ": " + what;
      auto const result = drawSlice(volume, options.channel, plane);
      result.image.writePng(options.output);
      summary = fmt::format("{} at {} = {:.9g}: values {:.6g} .. {:.6g}, {} x {} pixels\n", what, axis,
                            result.at, result.low, result.high, result.image.width(), result.image.height());
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
    leaveToSystem(std::move(content));
  }
  remarks(options.output) << summary;
}

} // namespace Vln
