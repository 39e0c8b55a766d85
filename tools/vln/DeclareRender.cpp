#include "Declare.h"
#include "RenderCommand.h"

#include <CLI/CLI.hpp>

#include <map>
#include <memory>

namespace Vln {

void declareRender(CLI::App& self) {
  using VLN::Render::Mode;
  using VLN::Render::Quality;
  auto const options = std::make_shared<RenderCommandOptions>();
  auto& o = *options;
  self.add_option("FILE", o.file, "A .vdb or .nvtt file")->required();
  self.add_option("-o,--output", o.output, "The file to write (default: the name of FILE with .png)")
      ->type_name("OUT.png");
  self.add_option("--channel", o.channel, "Name of the channel, as info tells it")->type_name("NAME");
  static std::map<std::string, Mode> const modes{{"fog", Mode::kFog},
                                                 {"surface", Mode::kSurface},
                                                 {"mip", Mode::kMaximum},
                                                 {"mean", Mode::kMean}};
  self.add_option("--mode", o.mode, "What is drawn")
      ->transform(CLI::CheckedTransformer(modes, CLI::ignore_case))
      ->type_name("fog|surface|mip|mean");
  static std::map<std::string, Quality> const qualities{{"preview", Quality::kPreview},
                                                        {"final", Quality::kFinal}};
  self.add_option("--quality", o.render.quality, "preview or final")
      ->transform(CLI::CheckedTransformer(qualities, CLI::ignore_case))
      ->type_name("preview|final");
  self.add_option("--spp", o.render.samples, "Samples for each pixel")->check(CLI::Range(1, 65536));
  self.add_option("--threads", o.threads, "Threads (default: one for each processor)")->check(CLI::Range(0, 1024));
  addMemoryLimit(self, o.limits);
  self.callback([options] { render(*options); });
}

} // namespace Vln
