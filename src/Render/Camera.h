// Camera: a pinhole in world space, and how it is put before what it shows.
#pragma once

#include "Render/Export.h"
#include "Render/Vec.h"

#include <optional>
#include <vector>

namespace VLN::Render {

/// What was asked for; what was not follows from what is shown.
struct CameraOptions {
  std::optional<Vec3d> direction; ///< into the picture
  std::optional<Vec3d> position, focalPoint, viewUp;
  double viewAngle = 30; ///< degrees, from the lower to the upper edge of the picture
  double zoom = 1;       ///< the picture shows that much less
  double azimuth = 0;    ///< degrees, to the right about the up direction
  double elevation = 0;  ///< degrees, upward
};

class VLN_RENDER_API Camera {
public:
  Camera() = default;
  /// Without a position it stands as near as lets all points be seen, in the middle of the picture unless a
  /// focal point is given; without a direction it looks from three quarters and above.
  /// @space World.
  /// @param margin World length by which the points are widened.
  /// @pre There is a point.
  /// @error std::invalid_argument when position and focal point are one, or the up direction is that of view.
  Camera(CameraOptions const& options, std::vector<Vec3d> const& points, double margin, double aspect);

  Vec3d position, focalPoint, viewUp;
  double viewAngle = 30;

  /// Unit vectors of the picture: to the right, up, and into it.
  Vec3d right, up, forward;
  /// Half the height of the picture at distance 1, and half its width.
  double halfHeight = 0, halfWidth = 0;

  /// @param u, v 0 to 1 from the left and from the top. @return A unit vector.
  Vec3d ray(double u, double v) const {
    return normalized(forward + right * ((2 * u - 1) * halfWidth) + up * ((1 - 2 * v) * halfHeight));
  }
  /// Where a point is seen, as ray() counts, and its distance along `forward`.
  Vec3d project(Vec3d p) const {
    Vec3d const d = p - position;
    double const z = dot(d, forward);
    return {0.5 + 0.5 * dot(d, right) / (z * halfWidth), 0.5 - 0.5 * dot(d, up) / (z * halfHeight), z};
  }
};

} // namespace VLN::Render
