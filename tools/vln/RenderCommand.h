// The options of `render`.
#pragma once

#include "Interop/VdbFile.h"
#include "Render/Renderer.h"

#include <optional>
#include <string>
#include <utility>

namespace Vln {

struct RenderCommandOptions {
  std::string file;
  std::string output; ///< empty: the name of the file with .png
  std::string channel;
  int component = -1;
  std::optional<VLN::Render::Mode> mode;
  std::optional<std::pair<double, double>> range;
  VLN::Render::RenderOptions render;
  VLN::Render::CameraOptions camera;
  int threads = 0;
  VLN::Interop::VdbReadLimits limits;
};
void render(RenderCommandOptions const& options);

} // namespace Vln
