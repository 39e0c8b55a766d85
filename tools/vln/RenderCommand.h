// The options of `render`, and how its parts share the work.
#pragma once

#include "Interop/VdbFile.h"
#include "Render/Look.h"
#include "Render/Renderer.h"

#include <optional>
#include <string>
#include <utility>

namespace Vln {

using RenderMode = VLN::Render::LookMode;

struct RenderCommandOptions {
  std::string file;
  std::string output;     ///< empty: the name of the file, with .png, in the working folder
  std::string parameters; ///< a .json file for all parameters; empty for none
  std::string channel;
  int component = -1;
  std::optional<RenderMode> mode;
  std::optional<double> iso;
  std::optional<std::pair<double, double>> range;
  std::string colors; ///< empty: white fogs, else viridis
  std::string background = "neutral";
  int depth = -1; ///< of the deepest tiles that are drawn; -1: the deepest there are
  bool scalarBar = false, axes = false;
  int turntable = 0; ///< frames; 0 for a single picture
  VLN::Render::RenderOptions render;
  VLN::Render::CameraOptions camera;
  VLN::Interop::VdbReadLimits limits;
};
void render(RenderCommandOptions const& options);

/// A picture with what was asked for beside it.
struct RenderedFrame {
  VLN::Render::Picture picture;
  VLN::Render::Camera camera;
  VLN::Render::RenderOptions options; ///< as they were used
  std::string channel;                ///< empty for points
  bool hasColors = false;             ///< whether colours stand for values
};

/// The options that put the camera back where it is.
std::string cameraText(VLN::Render::Camera const& camera);
/// @error std::invalid_argument for what is no background.
void checkBackground(std::string const& background);
/// Writes the picture in the format of the suffix.
/// @error FileError.
void writeFrame(std::string const& path, RenderedFrame const& frame, RenderCommandOptions const& options);
/// Writes all parameters, those that were chosen too, as JSON.
void writeParameters(std::string const& path, std::string const& picture, RenderedFrame const& frame,
                     RenderCommandOptions const& options);

} // namespace Vln
