// What a picture of a field shows where nobody said it.
#pragma once

#include "Render/Field.h"
#include "Render/Renderer.h"

#include <optional>
#include <string>
#include <utility>

namespace VLN::Render {

enum class LookMode { kFog, kSurface, kMaximum, kMean, kIsosurface };

/// What is known of a field, and what was asked for.
struct LookHints {
  std::string channel{};   ///< its name
  std::string gridClass{}; ///< "fog volume", "level set", or another or none
  std::optional<LookMode> mode{};
  std::optional<double> iso{};
  std::optional<std::pair<double, double>> range{};
  std::string colors{}; ///< empty: white fogs, else viridis
  int depth = -1;       ///< of the deepest tiles that are drawn; -1: the deepest there are
};

/// Fills in mode, colours and ranges of the options.
/// @error std::invalid_argument when nothing would be seen.
VLN_RENDER_API void chooseLook(Field const& field, LookHints const& hints, RenderOptions& options);

/// The corners between which all that such a picture shows lies, in the world.
VLN_RENDER_API std::vector<Vec3d> outlineOf(Field const& field, Affine const& tileToWorld,
                                            RenderOptions const& options);

} // namespace VLN::Render
