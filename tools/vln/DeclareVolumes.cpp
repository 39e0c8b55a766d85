#include "Commands.h"
#include "Declare.h"
#include "Interop/VdbMake.h"

#include <CLI/CLI.hpp>

#include <cmath>
#include <memory>

namespace Vln {

using VLN::Interop::FileContent;

CLI::Option* finite(CLI::Option* option) {
  return option->check(CLI::Validator(
      [](std::string& text) {
        double value = 0;
        bool const number = CLI::detail::lexical_cast(text, value);
        return number && !std::isfinite(value) ? text + " is not a finite number" : std::string();
      },
      ""));
}

std::string inputFile(FileContent content) { return "A " + VLN::Interop::suffixesRead(content) + " file"; }
std::string outputFile(FileContent content) {
  return "The " + VLN::Interop::suffixesWritten(content) + " file to write";
}

void addMemoryLimit(CLI::App& self, VLN::Interop::VdbReadLimits& limits) {
  self.add_option_function<std::uint64_t>(
          "--max-memory", [&limits](std::uint64_t const& mb) { limits.memoryBytes = mb * 1000000; },
          "Most memory in MB that reading the file may take (default: three quarters of what is available)")
      ->check(CLI::Range(std::uint64_t(1), std::uint64_t(1) << 40))
      ->type_name("MB");
}

void addChannelFilter(CLI::App& self, VLN::Interop::VdbReadLimits& limits) {
  self.add_option("--channels", limits.channels,
                  "Only channels by these names, such as \"density temp* !temp_old\" (default: all)")
      ->type_name("FILTER");
}

void declareInfo(CLI::App& self) {
  auto const options = std::make_shared<InfoOptions>();
  auto& o = *options;
  self.add_option("FILE", o.files,
                  "Files, " + VLN::Interop::suffixesRead(FileContent::kVolumes | FileContent::kPoints))
      ->required();
  auto* json = self.add_flag("--json", o.json, "One JSON object instead of tables");
  self.add_flag("--memory", o.memory, "Also what accounts for memory: objects, their data, and the pools")
      ->excludes(json);
  addChannelFilter(self, o.limits);
  self.add_flag("--brief", o.brief, "One line for each file")->excludes("--memory")->excludes(json);
  addMemoryLimit(self, o.limits);
  self.callback([options] { info(*options); });
}

void declareSlice(CLI::App& self) {
  auto const options = std::make_shared<SliceOptions>();
  auto& o = *options;
  self.add_option("FILE", o.file, inputFile(FileContent::kVolumes))->required();
  self.add_option("--channel", o.channel, "Name of the channel, as info tells it")
      ->required()
      ->type_name("NAME");
  self.add_option_function<std::string>(
          "--axis", [&o](std::string const& axis) { o.plane.axis = axis[0] - 'x'; },
          "Axis that the plane stands across: x, y or z")
      ->required()
      ->check(CLI::IsMember({"x", "y", "z"}))
      ->type_name("AXIS");
  finite(self.add_option("--at", o.plane.at,
                         "World position on the axis (default: middle of the active voxels)"))
      ->type_name("W");
  self.add_option("--size", o.plane.size, "Pixels along the longer side")
      ->check(CLI::Range(VLN::Interop::kSmallestSlice, VLN::Interop::kLargestSlice))
      ->capture_default_str()
      ->type_name("N");
  self.add_option("--depth", o.plane.depth, "Draw no tile deeper than this (default: the deepest)")
      ->check(CLI::Range(0, 28))
      ->type_name("D");
  self.add_flag("--nearest", o.plane.nearest, "Draw the nearest sample instead of blending linearly");
  self.add_flag("--gradient", o.plane.gradient, "Draw the length of the gradient")->excludes("--nearest");
  self.add_option_function<std::string>(
          "--component", [&o](std::string const& c) { o.plane.component = c == "length" ? -1 : c[0] - 'x'; },
          "Of vectors: x, y, z, or their length (the default)")
      ->check(CLI::IsMember({"x", "y", "z", "length"}))
      ->type_name("C");
  finite(self.add_option_function<std::vector<double>>(
             "--range",
             [&o](std::vector<double> const& r) {
               o.plane.range = {r[0], r[1]};
             },
             "Values of the first and of the last colour"))
      ->expected(2)
      ->type_name("LOW HIGH");
  finite(self.add_option("--percentile", o.plane.percentile,
                         "Colours end at the value that so many per cent of the pixels stay below"))
      ->check(CLI::Range(50.1, 100.0))
      ->capture_default_str()
      ->excludes("--range")
      ->type_name("P");
  self.add_option_function<std::string>(
          "--cmap",
          [&o](std::string const& name) {
            using VLN::Interop::SliceColors;
            o.plane.colors = name == "sequential"  ? SliceColors::kSequential
                             : name == "diverging" ? SliceColors::kDiverging
                             : name == "gray"      ? SliceColors::kGray
                                                   : SliceColors::kAuto;
          },
          "Colours: auto, sequential, diverging (white in the middle) or gray")
      ->check(CLI::IsMember({"auto", "sequential", "diverging", "gray"}))
      ->type_name("NAME");
  self.add_flag("--index-space", o.plane.indexSpace,
                "Draw along the grid's own axes, every voxel a square; --at is an index then");
  self.add_flag("!--no-title", o.title, "Leave the line with file, channel and plane out");
  self.add_option("-o,--output", o.output, outputFile(FileContent::kPictures))
      ->required()
      ->type_name("OUT.png");
  addMemoryLimit(self, o.limits);
  self.callback([options] { slice(*options); });
}

void declareConvert(CLI::App& self) {
  auto const options = std::make_shared<ConvertOptions>();
  auto& o = *options;
  self.add_option("IN", o.file, inputFile(FileContent::kVolumes))->required()->type_name("IN");
  self.add_option("OUT", o.output, outputFile(FileContent::kExports))->required()->type_name("OUT");
  addChannelFilter(self, o.limits);
  finite(
      self.add_option("--voxel-size", o.voxelSize,
                      "World length of a voxel of what a mesh becomes (default: 1/256 of its longest side)"))
      ->check(CLI::PositiveNumber)
      ->type_name("W");
  finite(
      self.add_option("--band", o.band, "How many voxels of a mesh's distances are kept to each side of it"))
      ->check(CLI::Range(1.0, 1000.0))
      ->capture_default_str()
      ->type_name("N");
  finite(self.add_option("--iso", o.iso, "Value on the surface that a .ply file gets"))
      ->capture_default_str()
      ->type_name("V");
  finite(self.add_option("--adaptivity", o.adaptivity,
                         "How much the flat parts of such a surface are made of larger faces"))
      ->check(CLI::Range(0.0, 1.0))
      ->capture_default_str()
      ->type_name("0..1");
  self.add_flag("--sparse", o.sparse, "Of .npz files: the active voxels one by one in place of a dense box");
  self.add_flag("--strict", o.strict, "Write nothing where anything of the file would be left out");
  addMemoryLimit(self, o.limits);
  self.callback([options] { convert(*options); });
}

void declareProbe(CLI::App& self) {
  auto const options = std::make_shared<ProbeOptions>();
  auto& o = *options;
  self.add_option("FILE", o.file, inputFile(FileContent::kVolumes))->required();
  self.add_option("X Y Z", o.positions,
                  "World positions, three numbers each; - reads them from standard input")
      ->type_name("...");
  self.add_option("--channel", o.channel, "Name of the channel, as info tells it")
      ->required()
      ->type_name("NAME");
  self.add_option("--points", o.points, "A file with a line x,y,z for each position, below a header or none")
      ->type_name("FILE.csv");
  self.add_option("-o,--output", o.output, "The file to write (default: standard output)")
      ->type_name("OUT.csv");
  addMemoryLimit(self, o.limits);
  self.callback([options] { probe(*options); });
}

void declareMake(CLI::App& self) {
  auto const options = std::make_shared<MakeOptions>();
  auto& o = *options;
  self.add_option("SHAPE", o.shape, "cloud (fog volume \"density\") or torus (level set \"surface\")")
      ->required()
      ->check(CLI::IsMember({"cloud", "torus"}))
      ->type_name("cloud|torus");
  self.add_option("OUT", o.output, outputFile(FileContent::kGrids))->required()->type_name("OUT.vdb");
  self.add_option("--voxels", o.voxels, "About how many active voxels")
      ->check(CLI::Range(VLN::Interop::kFewestMadeVoxels, VLN::Interop::kMostMadeVoxels))
      ->capture_default_str()
      ->type_name("N");
  self.callback([options] { make(*options); });
}

void declareChurn(CLI::App& self) {
  auto const options = std::make_shared<ChurnOptions>();
  auto& o = *options;
  self.add_option("FILE", o.file, inputFile(FileContent::kGrids))->required();
  self.add_option("--limit", o.limitBytes,
                  "Resident memory that the pools hold the process to, such as 512MB (1 KB is 1024 bytes)")
      ->required()
      ->transform(CLI::AsSizeValue(false))
      ->check(CLI::Range(std::uint64_t(1) << 20, std::uint64_t(1) << 50))
      ->type_name("SIZE");
  self.add_option("--rounds", o.rounds, "How often the volume is loaded, copied, edited and dropped")
      ->check(CLI::Range(1, 1000000))
      ->capture_default_str()
      ->type_name("N");
  self.add_flag("--json", o.json, "One JSON object instead of a table");
  self.add_option("--only", o.only)->check(CLI::IsMember({"with", "without"}))->group("");
  addMemoryLimit(self, o.limits);
  self.footer("The file is read once in each run; each round builds its channels anew from what was read.");
  self.callback([options] { churn(*options); });
}

} // namespace Vln
