#include "Render/Camera.h"

#include <algorithm>
#include <cmath>
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
  Vec3d const other = std::abs(up.y) > 0.5 ? Vec3d{0, 0, 1} : std::abs(up.z) > 0.5 ? Vec3d{0, -1, 0} : Vec3d{0, 0, 1};
  Vec3d const side = normalized(cross(up, other)), front = normalized(cross(side, up));
  return normalized(side * -0.55 + front * -1.0 + up * -0.45);
}

} // namespace

Camera::Camera(CameraOptions const& o, Vec3d low, Vec3d high, double aspect) {
  viewUp = normalized(o.viewUp.value_or(Vec3d{0, 1, 0}));
  if (!(length(viewUp) > 0)) throw std::invalid_argument("the camera's up direction has no length");
  viewAngle = o.viewAngle;
  halfHeight = std::tan(0.5 * viewAngle * kDegree), halfWidth = halfHeight * aspect;
  focalPoint = o.focalPoint.value_or((low + high) * 0.5);
  if (o.position) {
    position = *o.position;
    forward = o.direction && !o.focalPoint ? *o.direction : focalPoint - position;
  } else {
    forward = o.direction.value_or(threeQuarters(viewUp));
  }
  double const away = length(forward);
  if (!(away > 0)) throw std::invalid_argument("the camera stands where it looks at");
  forward = normalized(forward);
  // Turned about the focal point.
  auto const basis = [&] {
    right = cross(forward, viewUp);
    if (length(right) < 1e-6)
      throw std::invalid_argument("the camera looks along its up direction; choose another --camera-view-up");
    right = normalized(right), up = cross(right, forward);
  };
  basis();
  if (o.position && o.direction && !o.focalPoint)
    focalPoint = position + forward * std::max(dot(focalPoint - position, forward), 1e-9);
  double distance = o.position ? length(focalPoint - position) : 0;
  if (o.azimuth != 0) forward = turned(forward, viewUp, o.azimuth * kDegree), basis();
  if (o.elevation != 0) forward = turned(forward, right, -o.elevation * kDegree), basis();
  if (!o.position) {
    // As near as lets every corner of the box be seen.
    for (int corner = 0; corner < 8; ++corner) {
      Vec3d const p{corner & 1 ? high.x : low.x, corner & 2 ? high.y : low.y, corner & 4 ? high.z : low.z};
      Vec3d const d = p - focalPoint;
      double const back = -dot(d, forward);
      distance = std::max({distance, back + std::abs(dot(d, right)) / (halfWidth * kFill),
                           back + std::abs(dot(d, up)) / (halfHeight * kFill)});
    }
    if (!(distance > 0)) distance = 1;
  }
  position = focalPoint - forward * distance;
  if (o.zoom != 1) {
    halfHeight /= o.zoom, halfWidth /= o.zoom;
    viewAngle = 2 * std::atan(halfHeight) / kDegree;
  }
}

} // namespace VLN::Render
