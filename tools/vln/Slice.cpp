#include "Commands.h"
#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/VdbImport.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <ostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

void slice(SliceOptions const& options) {
  checkOutputAs(options.output, "pictures", {FileFormat::kPng});
  std::string summary;
  {
    ProgressBar bar;
    auto const content = importVdb(options.file, options.limits, bar.progress());
    auto const& volume = volumeWith(content, options.channel);
    try {
      auto const result = drawSlice(volume, options.channel, options.plane);
      result.image.writePng(options.output);
      summary = fmt::format("{}{} at {} = {:.6g}: values {:.6g} .. {:.6g}, {} x {} pixels\n",
                            options.plane.gradient ? "gradient of " : "", options.channel,
                            "xyz"[options.plane.axis], result.at, result.low, result.high,
                            result.image.width(), result.image.height());
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
  }
  remarks(options.output) << summary;
}

} // namespace Vln
