// Drawing: a grid or points of a file ready to be drawn, with what was not asked for chosen from the field.
#pragma once

#include "RenderCommand.h"
#include "RenderSource.h"

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace Vln {

class Drawing {
public:
  /// @param channel In place of that of the options, which must live as long as this.
  /// @error FileError; std::invalid_argument when nothing would be seen.
  Drawing(RenderCommandOptions const& options, std::string const& channel,
          VLN::Interop::Progress const& progress);

  RenderSource const& source() const { return m_source; }
  /// What was asked for, and what was chosen.
  VLN::Render::RenderOptions const& options() const { return m_render; }
  /// @pre The source is a grid.
  VLN::Render::Field& field() { return *m_field; }
  /// @param azimuth Degrees, beside those asked for. @param aspect Width over height.
  VLN::Render::Camera camera(double azimuth, double aspect) const;
  RenderedFrame frame(double azimuth, std::function<void(double)> const& watch);

private:
  RenderCommandOptions const& m_options;
  RenderSource m_source;
  std::optional<VLN::Render::Field> m_field;
  VLN::Render::RenderOptions m_render;
  std::vector<VLN::Render::Vec3d> m_outline;
  double m_margin = 0;
};

} // namespace Vln
