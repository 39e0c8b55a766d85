#include "Commands.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbImport.h"
#include "vln/Commands.h"
#include "vln/Content.h"
#include "vln/ProgressBar.h"

#include <iostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

void slice(SliceOptions const& options) {
  checkOutput(options.output);
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
  std::cout << summary;
}

} // namespace Vln
