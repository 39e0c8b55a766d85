#include "Drawing.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "ProgressBar.h"
#include "RenderCommand.h"
#include "StandardOutput.h"

#include <algorithm>
#include <filesystem>
#include <iostream>
#include <ostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;

namespace {

// name.png, frame 3: name_0003.png
std::string frameName(std::string const& path, int frame, int frames) {
  if (frames == 0) return path;
  std::filesystem::path const p(path);
  return (p.parent_path() / fmt::format("{}_{:04}{}", p.stem().string(), frame, p.extension().string()))
      .string();
}

} // namespace

void render(RenderCommandOptions const& options) {
  std::string const output =
      options.output.empty() ? std::filesystem::path(options.file).stem().string() + ".png" : options.output;
  checkOutputFor(FileContent::kRenderings, output);
  if (options.turntable > 0 && formatOf(output) == FileFormat::kUnknown)
    throw FileError(output, "several pictures are written as .exr or .png files");
  if (!options.parameters.empty()) checkOutputFor(FileContent::kParameters, options.parameters);
  checkBackground(options.background);
  TransferOptions early; // what is wrong with the opacity is told before the file is read
  early.opacity = options.render.transfer.opacity;
  Transfer const unused(early);
  std::string summary, note;
  {
    ProgressBar bar;
    try {
      Drawing drawing(options, options.channel, bar.progress(0, 0.5));
      Progress const progress = bar.progress(0.5, 1);
      note = drawing.source().note;
      int const frames = std::max(1, options.turntable);
      for (int n = 0; n < frames; ++n) {
        auto const frame = drawing.frame(360.0 * n / frames, [&](double done) {
          if (progress) progress("drawing", (n + done) / frames);
        });
        std::string const path = frameName(output, n + 1, options.turntable);
        writeFrame(path, frame, options);
        if (n > 0) continue;
        if (!options.parameters.empty()) writeParameters(options.parameters, path, frame, options);
        summary = fmt::format("{}: {}, {} x {} pixels, {:.2f} s\n", path,
                              frame.channel.empty() ? "points" : oneLine(frame.channel, 60),
                              frame.picture.width, frame.picture.height, frame.picture.seconds);
        if (frame.options.mode == Mode::kFog && !frame.channel.empty())
          summary +=
              fmt::format("fog: --clim {:.6g},{:.6g} --opacity-unit {:.6g}\n", frame.options.transfer.low,
                          frame.options.transfer.high, frame.picture.opacityUnit);
        else if (frame.hasColors)
          summary += fmt::format("colours: --clim {:.6g},{:.6g}\n", frame.picture.low, frame.picture.high);
        else if (frame.options.mode == Mode::kSurface && frame.options.iso != 0)
          summary += fmt::format("surface: --iso {}\n", frame.options.iso);
        summary += "camera: " + cameraText(frame.camera) + "\n";
      }
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
  }
  // Beside neither the picture nor the parameters where one of them is standard output.
  bool const beside = &remarks(options.parameters.empty() ? output : options.parameters) == &std::cerr;
  (beside ? std::cerr : remarks(output)) << summary;
  if (!note.empty()) std::cerr << fmt::format("vln: {}: note: {}\n", options.file, note);
}

} // namespace Vln
