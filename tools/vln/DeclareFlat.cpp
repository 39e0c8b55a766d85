#include "Commands.h"
#include "Declare.h"

#include <CLI/CLI.hpp>

#include <map>
#include <memory>

namespace Vln {

using VLN::Interop::FileContent;

void declareFlatten(CLI::App& self) {
  using VLN::Interop::Quantisation;
  auto const options = std::make_shared<FlattenOptions>();
  auto& o = *options;
  auto& f = o.flat;
  self.add_option("IN", o.file, inputFile(FileContent::kVolumes))->required()->type_name("IN");
  self.add_option("OUT", o.output, outputFile(FileContent::kFlatBuffers))->required()->type_name("OUT.nvtt");
  self.add_option("--channels", f.channels, "Channels by name, such as \"density temp* !temp_old\"")
      ->capture_default_str()
      ->type_name("FILTER");
  static std::map<std::string, Quantisation> const builds{{"none", Quantisation::kNone},
                                                          {"fp4", Quantisation::kFp4},
                                                          {"fp8", Quantisation::kFp8},
                                                          {"fp16", Quantisation::kFp16},
                                                          {"fpn", Quantisation::kFpN}};
  self.add_option(
          "--quantise", f.quantisation,
          "Store float channels as codes of 4, 8 or 16 bits, or (fpn) of as few as the tolerance allows")
      ->transform(CLI::CheckedTransformer(builds, CLI::ignore_case))
      ->default_str("none")
      ->type_name("none|fp4|fp8|fp16|fpn");
  finite(
      self.add_option("--tolerance", f.tolerance,
                      "Largest error for fpn, in units of the values (default: by the name of the channel)"))
      ->type_name("ERROR");
  self.add_flag("--dither", f.dither, "Dither codes");
  finite(self.add_option("--halo", f.haloFraction,
                         "Share of tiles that may be stored with the samples beyond their high sides"))
      ->check(CLI::Range(0.0f, 1.0f))
      ->capture_default_str()
      ->type_name("FRACTION");
  self.add_flag("--morton", f.morton, "Number the tiles of each depth along a Morton curve");
  auto* coalesce = self.add_flag("--coalesce", f.coalesce, "Merge complete subtrees into dense blocks");
  self.add_flag("--textures", f.textures, "Lay tiles out as bricks of a 3D texture; needs --halo 1")
      ->excludes(coalesce);
  static std::map<std::string, int> const sums{{"none", 0}, {"partial", 1}, {"full", 2}};
  self.add_option("--checksum", f.checksum, "Checksum of the headers, or of all bytes")
      ->transform(CLI::CheckedTransformer(sums, CLI::ignore_case))
      ->default_str("partial")
      ->type_name("none|partial|full");
  self.add_option("--finest-level", f.finestLevel, "Levels above the deepest at which the buffer ends")
      ->check(CLI::Range(0, 28))
      ->capture_default_str()
      ->type_name("N");
  auto* coarser = self.add_flag("--coarser-levels", f.coarserLevels,
                                "Let coarse samples take the values of their children where they differ");
  finite(self.add_option("--coarser-tolerance", f.coarserTolerance, "By more than this"))
      ->needs(coarser)
      ->capture_default_str()
      ->type_name("D");
  self.add_flag("--traversal", f.traversal, "Also where each tile lies")->excludes(coalesce);
  self.add_flag("--neighbours", f.neighbors, "Also the 27 neighbours of each tile")->excludes(coalesce);
  static std::map<std::string, int> const bounds{{"none", 0}, {"8", 8}, {"16", 16}};
  self.add_option("--bounds", o.boundsBits,
                  "Also bounds and means of each tile, in codes of so many bits, which render and view use")
      ->transform(CLI::CheckedTransformer(bounds, CLI::ignore_case))
      ->default_str("16")
      ->type_name("none|8|16");
  auto* cubic = self.add_flag("--cubic", f.cubic, "Make the buffer a cube of whole elements");
  self.add_option("--element-bytes", f.elementBytes, "Bytes of such an element")
      ->needs(cubic)
      ->check(CLI::Range(1, 4096))
      ->capture_default_str()
      ->type_name("N");
  addMemoryLimit(self, o.limits);
  self.callback([options] { flatten(*options); });
}

void declareValidate(CLI::App& self) {
  auto const options = std::make_shared<ValidateOptions>();
  self.add_option("FILE", options->file, inputFile(FileContent::kFlatBuffers))->required();
  self.callback([options] { validate(*options); });
}

} // namespace Vln
