#include "Render/Camera.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <stdexcept>

namespace VLN::Render {

namespace {

constexpr double kDegree = 3.14159265358979323846 / 180;
// Of the picture that the box fills at most.
constexpr double kFill = 0.94;

// About a unit axis (Rodrigues' formula).
Vec3d turned(Vec3d v, Vec3d axis, double angle) {
  double const c = std::cos(angle), s = std::sin(angle);
  return v * c + cross(axis, v) * s + axis * (dot(axis, v) * (1 - c));
}

// From the right, a little above: the front, one side and the top are seen.
Vec3d threeQuarters(Vec3d up) {
  Vec3d const other = std::abs(up.y) > 0.5   ? Vec3d{0, 0, 1}
                      : std::abs(up.z) > 0.5 ? Vec3d{0, -1, 0}
                                             : Vec3d{0, 0, 1};
  Vec3d const side = normalized(cross(up, other)), front = normalized(cross(side, up));
  return normalized(side * -0.55 + front * -1.0 + up * -0.45);
}

} // namespace

Camera::Camera(CameraOptions const& o, std::vector<Vec3d> const& points, double margin, double aspect) {
  viewUp = normalized(o.viewUp.value_or(Vec3d{0, 1, 0}));
  if (!(length(viewUp) > 0)) throw std::invalid_argument("the camera's up direction has no length");
  viewAngle = o.viewAngle;
  halfHeight = std::tan(0.5 * viewAngle * kDegree), halfWidth = halfHeight * aspect;
  Vec3d low = points.front(), high = low;
  for (Vec3d const& p : points)
    for (int a = 0; a < 3; ++a) low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a]);
  Vec3d const middle = (low + high) * 0.5;
  focalPoint = o.focalPoint.value_or(middle);
  forward = o.direction.value_or(threeQuarters(viewUp));
  double distance = 0;
  if (o.position) {
    position = *o.position;
    if (o.focalPoint || !o.direction) forward = focalPoint - position;
    distance = o.focalPoint || !o.direction ? length(forward) : std::max(length(middle - position), 1e-9);
  }
  if (!(length(forward) > 0)) throw std::invalid_argument("the camera stands where it looks at");
  forward = normalized(forward);
  if (o.position) focalPoint = position + forward * distance;
  auto const makeBasis = [&] {
    right = cross(forward, viewUp);
    if (length(right) < 1e-6)
      throw std::invalid_argument("the camera looks along its up direction; another --camera-view-up helps");
    right = normalized(right), up = cross(right, forward);
  };
  makeBasis();
  // Turned about the focal point.
  if (o.azimuth != 0) forward = turned(forward, viewUp, o.azimuth * kDegree), makeBasis();
  if (o.elevation != 0) forward = turned(forward, right, -o.elevation * kDegree), makeBasis();
  if (!o.position) {
    // Each edge of the picture is a plane that no point may lie beyond: with x, z across and into the picture
    // from the focal point, x - cx <= h (z - cz) on the one side, -(x - cx) <= h (z - cz) on the other.
    double const none = -std::numeric_limits<double>::max();
    double most[4] = {none, none, none, none};
    double const h[2] = {halfWidth * kFill, halfHeight * kFill};
    for (Vec3d const& p : points) {
      Vec3d const d = p - focalPoint;
      double const z = dot(d, forward), across[2] = {dot(d, right), dot(d, up)};
      for (int side = 0; side < 4; ++side)
        most[side] = std::max(most[side], (side & 1 ? -1 : 1) * across[side / 2] - h[side / 2] * z +
                                              margin * std::hypot(1, h[side / 2]));
    }
    double shift[2] = {0, 0}, back = none;
    for (int axis = 0; axis < 2; ++axis) {
      double const a = most[2 * axis], b = most[2 * axis + 1];
      back = std::max(back, (o.focalPoint ? std::max(a, b) : 0.5 * (a + b)) / h[axis]);
      if (!o.focalPoint) shift[axis] = 0.5 * (a - b);
    }
    focalPoint = focalPoint + right * shift[0] + up * shift[1];
    distance = std::max({back, 1e-9 * (1 + length(high - low)), 1e-9 * length(focalPoint)});
  }
  position = focalPoint - forward * distance;
  if (o.zoom != 1) {
    halfHeight /= o.zoom, halfWidth /= o.zoom;
    viewAngle = 2 * std::atan(halfHeight) / kDegree;
  }
}

} // namespace VLN::Render
