// Pictures of fields.
//
//   Field + Affine ──> weigh by mode ──> for each pixel and sample a ray ──> light, opacity, depth, normal
//                                                                     ──> Picture ──> bytes
#pragma once

#include "Render/Camera.h"
#include "Render/Export.h"
#include "Render/Field.h"
#include "Render/Transfer.h"

#include <functional>
#include <string>
#include <vector>

namespace VLN::Render {

enum class Mode { kFog, kSurface, kMaximum, kMean };
enum class Quality { kPreview, kFinal };

struct RenderOptions {
  int width = 1024, height = 1024;
  Mode mode = Mode::kFog;
  Quality quality = Quality::kPreview;
  float iso = 0;   ///< of kSurface
  int samples = 0; ///< for each pixel; 0: as the quality asks, of a fog's preview maybe fewer than pixels
  double timeLimit = 0;     ///< seconds, after which no further sample of the pixels is begun; 0: none
  TransferOptions transfer; ///< of fogs and projections
  bool colored = false;     ///< fogs take their colours from the map; else they are white
  double opacityUnit = 0;   ///< world length over which opacity 1 lets 1/e pass; 0: chosen from the field
  Vec3d light{0, 0, 0};     ///< world direction to the light; zero: beside the camera
  double anisotropy = 0.3;  ///< g of the phase function
  double albedo = 0.97;
  int bounces = 12;              ///< of final fogs
  int occlusionRays = -1;        ///< of surfaces, for each sample; -1: as the quality asks
  bool rangeFromPicture = false; ///< of projections: colours span the values drawn
  int depth = -1;                ///< of the deepest tiles drawn; -1: where samples are as wide as pixels
  int threads = 0;
};

/// @shape width x height, row by row from the top.
struct Picture {
  int width = 0, height = 0;
  std::vector<Vec3> color;    ///< linear light, multiplied by opacity
  std::vector<float> opacity; ///< 0 to 1
  std::vector<float> depth;   ///< world distance from the camera; infinite where nothing was met
  std::vector<Vec3> normal;   ///< of surfaces, in the world; zero elsewhere
  std::vector<float> value;   ///< of projections

  int samples = 0;         ///< of each pixel
  double opacityUnit = 0;  ///< that was used
  int deepest = 0;         ///< depth of the deepest tiles drawn
  Vec3d light;             ///< world direction to the light that was used
  float low = 0, high = 0; ///< range of the colours that was used
  double seconds = 0;      ///< of the rays alone
  std::int64_t rays = 0;   ///< from the camera; fewer than pixels where some follow from those about them
};

/// @param tileToWorld The place in the world of a sample, from its tile-space position.
/// @param watch Told now and then the share that is done, by the calling thread.
/// @error std::invalid_argument for options that are none, and a transform without an inverse.
/// @numeric The same bytes for any number of threads, unless a time limit ends it.
VLN_RENDER_API Picture render(Field& field, Affine const& tileToWorld, Camera const& camera,
                              RenderOptions const& options, std::function<void(double)> const& watch = {});

/// The unit of opacity that render() would choose for a fog.
/// @error As render().
VLN_RENDER_API double opacityUnit(Field& field, Affine const& tileToWorld, Camera const& camera,
                                  RenderOptions const& options);

/// Light over a background, as sRGB bytes.
/// @param background Linear light. @param opaque Alpha is 255 everywhere; else it is kept, the background is
/// not drawn, and colours are not multiplied by it.
/// @return Four bytes for each pixel.
VLN_RENDER_API std::vector<std::uint8_t> toBytes(Picture const& picture, Vec3 background, bool opaque);

} // namespace VLN::Render
