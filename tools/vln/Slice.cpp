#include "Commands.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbImport.h"
#include "ProgressBar.h"

#include <iostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

namespace {

using namespace VLN::Interop;

// Distinct channels of all objects in the file's order.
std::string names(VdbImport const& content) {
  std::string list;
  for (auto const& volume : content.volumes)
    for (auto const& channel : volume.channels) list += (list.empty() ? "" : ", ") + channel.name;
  return list.empty() ? "it has none" : "it has " + list;
}

VdbVolume const& volumeWith(VdbImport const& content, std::string const& channel) {
  for (auto const& volume : content.volumes)
    if (volume.channel(channel)) return volume;
  for (auto const& skipped : content.skipped)
    if (skipped.grid == channel) throw FileError(content.file, "'" + channel + "': " + skipped.reason);
  throw FileError(content.file, "has no channel '" + channel + "'; " + names(content));
}

} // namespace

void slice(SliceOptions const& options) {
  checkOutput(options.output);
  std::string summary, note;
  {
    ProgressBar bar;
    auto const content = importVdb(options.file, options.limits, bar.progress());
    auto const& volume = volumeWith(content, options.channel);
    try {
      auto const result = drawSlice(volume, options.channel, options.plane);
      result.image.writePng(options.output);
      summary = fmt::format("{} at {} = {:.6g}: values {:.6g} .. {:.6g}, {} x {} pixels\n", options.channel,
                            "xyz"[options.plane.axis], result.at, result.low, result.high,
                            result.image.width(), result.image.height());
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
    if (!volume.transform.empty())
      note = fmt::format("vln: {}: note: its transform is {}; positions are voxel size times index only\n",
                         options.file, volume.transform);
  }
  std::cout << summary;
  std::cerr << note;
}

} // namespace Vln
