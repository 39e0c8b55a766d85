// Light through fog: march for previews, tracking of free flights for finals.
//
//   extinction(value) = opacity(value) / unit       along a ray, unit in world length
#pragma once

#include "Render/Random.h"
#include "Render/Transfer.h"
#include "Render/Walk.h"

namespace VLN::Render {

/// Shares of light that arrive at the points of a coarse lattice over the field's box: from the light, and
/// from above.
struct LightView {
  struct Shares {
    float direct, above;
  };
  Shares const* values = nullptr; ///< 0 to 1, x fastest
  int size[3] = {1, 1, 1};
  Vec3 low, scale; ///< lattice = (local - low) * scale

  /// @param u In points of the lattice. @edges The nearest side's for what lies outside.
  /// @pre There are two points or more along each axis.
  NANOVTT_HD Shares at(Lanes u) const {
    Lanes const last(static_cast<float>(size[0] - 1), static_cast<float>(size[1] - 1),
                     static_cast<float>(size[2] - 1), 0);
    Lanes const c = lesser(larger(u, Lanes(0.0f)), last);
    std::int32_t n[4];
    Lanes const f = c - lesser(c, last - Lanes(0.5f)).whole(n);
    std::int64_t const dy = size[0], dz = dy * size[1];
    float const* const v = &values[n[2] * dz + n[1] * dy + n[0]].direct;
    // Both shares of a point, and of the next one along x.
    float const fy = f.second();
    Lanes const z0 = lerp(Lanes::load(v), Lanes::load(v + 2 * dy), fy),
                z1 = lerp(Lanes::load(v + 2 * dz), Lanes::load(v + 2 * (dz + dy)), fy);
    Lanes const z = lerp(z0, z1, f.third()), x = lerp(z, z.upper(), f.first());
    return {x.first(), x.second()};
  }
};

/// What a fog is made of and lit by.
struct FogView {
  FieldView field;
  TransferView const* transfer = nullptr;
  float perUnit = 1; ///< extinction of opacity 1
  bool colored = false;
  float albedo = 1, anisotropy = 0;
  Vec3 light;      ///< world, unit length, to the light
  Vec3 lightLocal; ///< the same in local space
  Vec3 lightColor, sky, ground;
  Vec3 worldToLocal[3]; ///< rows
  Vec3 viewUp;          ///< world; the sky is on that side
  LightView lights;     ///< of previews
  float step = 1;       ///< of previews, in world length
  int bounces = 1;

  NANOVTT_HD float extinction(float value, float& place) const {
    place = transfer->place(value);
    return transfer->opacityAt(place) * perUnit;
  }
  NANOVTT_HD Vec3 local(Vec3 w) const {
    return {dot(worldToLocal[0], w), dot(worldToLocal[1], w), dot(worldToLocal[2], w)};
  }
  NANOVTT_HD Vec3 skyAt(Vec3 direction) const {
    float const f = 0.5f + 0.5f * dot(direction, viewUp);
    return ground * (1 - f) + sky * f;
  }
  NANOVTT_HD Vec3 tint(float place) const {
    return (colored ? transfer->colorAt(place) : Vec3{1, 1, 1}) * albedo;
  }
};

struct FogSample {
  Vec3 color; ///< multiplied by opacity
  float opacity = 0;
  float depth = 0; ///< times opacity
};

/// Share of light that is scattered by that angle, of 1 in all directions together, times 4 pi.
/// @source L. Henyey and J. Greenstein, "Diffuse radiation in the Galaxy", 1941.
NANOVTT_HD inline float henyeyGreenstein(float cosine, float g) {
  float const d = 1 + g * g - 2 * g * cosine;
  return (1 - g * g) / (d * std::sqrt(d));
}
/// A direction drawn by it about `d`. @source The inverse of its integral, in closed form.
NANOVTT_HD inline Vec3 scatter(Vec3 d, float g, float u, float v) {
  float cosine = 1 - 2 * u;
  if (g > 1e-3f || g < -1e-3f) {
    float const s = (1 - g * g) / (1 - g + 2 * g * u);
    cosine = (1 + g * g - s * s) / (2 * g);
  }
  cosine = cosine < -1 ? -1 : cosine > 1 ? 1 : cosine;
  float const sine = std::sqrt(1 - cosine * cosine), phi = 6.28318530718f * v;
  Vec3 const other = d.x * d.x < 0.5f ? Vec3{1, 0, 0} : Vec3{0, 1, 0};
  Vec3 const a = normalized(cross(d, other)), b = cross(d, a);
  return normalized(a * (sine * std::cos(phi)) + b * (sine * std::sin(phi)) + d * cosine);
}

/// Optical depth along a ray, by midpoints of steps of that length; a step ends with its tile.
NANOVTT_HD inline float opticalDepth(FogView const& fog, Ray const& ray, float t0, float t1, float step) {
  Walk walk(fog.field, ray, t0, t1);
  Segment s;
  float sum = 0;
  while (walk.next(s)) {
    int const count = 1 + static_cast<int>((s.t1 - s.t0) / step);
    float const dt = (s.t1 - s.t0) / static_cast<float>(count);
    for (int n = 0; n < count; ++n) {
      float place;
      float const v = trilinear(s.brick, s.samples(ray.at(s.t0 + (static_cast<float>(n) + 0.5f) * dt)));
      sum += fog.extinction(v, place) * dt;
    }
  }
  return sum;
}

/// Emission and absorption along the ray, lit by the two lattices: single scattering, and for what is
/// scattered more often the same again, weaker and through less fog.
/// @source For the latter M. Wrenninge and others, "Oz: The Great and Volumetric", SIGGRAPH 2013 talks.
/// @param shift Samples lie at multiples of the step less this, all on the same spheres round the camera.
NANOVTT_HD inline FogSample marchFog(FogView const& fog, Ray const& ray, Vec3 world, float t0, float t1,
                                     float shift) {
  FogSample out;
  float through = 1;
  float const cosine = dot(world, fog.light);
  float const phase = henyeyGreenstein(cosine, fog.anisotropy);
  Lanes const origin(ray.origin), direction(ray.direction), lightColor(fog.lightColor), sky(fog.sky),
      ground(fog.ground), perPoint(fog.lights.scale);
  Lanes const lightsFrom = (origin - Lanes(fog.lights.low)) * perPoint, lightsAlong = direction * perPoint;
  Lanes color(0.0f);
  Walk walk(fog.field, ray, t0, t1);
  Segment s;
  while (through >= 2e-3f && walk.next(s)) {
    std::uint64_t const cells = fog.field.cells[s.tile];
    Lanes const from = (origin - Lanes(s.corner)) * s.scale, along = direction * s.scale;
    for (std::int32_t n = -floorOf(-(s.t0 + shift) / fog.step);; n += 4) {
      // Four at a time: what they scatter does not wait for one another.
      float t[4], place[4] = {0, 0, 0, 0}, sigma[4] = {0, 0, 0, 0};
      int count = 0;
      for (; count < 4; ++count) {
        t[count] = static_cast<float>(n + count) * fog.step - shift;
        if (!(t[count] < s.t1)) break;
        Cell const c = cellAt(s.brick, from + along * t[count]);
        if (s.brick.core == 4 && !(cells >> (c.at[0] + 4 * c.at[1] + 16 * c.at[2]) & 1)) continue;
        sigma[count] = fog.extinction(trilinear(s.brick, c), place[count]);
      }
      float alpha[4];
      (Lanes(1.0f) - decay(Lanes::load(sigma) * fog.step)).store(alpha);
      for (int k = 0; k < count && through >= 2e-3f; ++k) {
        if (!(sigma[k] > 0)) continue;
        auto const [lit, open] = fog.lights.at(lightsFrom + lightsAlong * t[k]);
        float const root = std::sqrt(std::sqrt(lit));
        float const w = through * alpha[k];
        Lanes light = lightColor * (0.65f * phase * lit + 0.175f * root * root + 0.1f * root) +
                      ground * (0.35f + 0.25f * root) + sky * open;
        if (fog.colored) light = light * Lanes(fog.transfer->colorAt(place[k]));
        color = color + light * w;
        out.opacity += w;
        out.depth += w * t[k];
        through *= 1 - alpha[k];
      }
      if (count < 4 || through < 2e-3f) break;
    }
  }
  out.color = Vec3{color.first(), color.second(), color.third()} * fog.albedo;
  return out;
}

/// The end of a free flight from `t` through matter of extinction `most`: always further on.
NANOVTT_HD inline float fly(float t, float most, Random& random) {
  float const end = t - std::log(1 - random.next()) / most;
  return end > t ? end : t + (t > -t ? t : -t) * 2e-7f + 1e-30f;
}

/// Share of light that comes through, without bias.
/// @source J. Novák, A. Selle, W. Jarosz, "Residual Ratio Tracking for Estimating Attenuation in
/// Participating Media", 2014.
NANOVTT_HD inline float ratioTrack(FogView const& fog, Ray const& ray, float t1, Random& random) {
  Walk walk(fog.field, ray, 0, t1);
  Segment s;
  float through = 1;
  while (walk.next(s)) {
    float const most = s.weight * fog.perUnit;
    float t = s.t0;
    for (;;) {
      t = fly(t, most, random);
      if (!(t < s.t1)) break;
      float place;
      through *= 1 - fog.extinction(trilinear(s.brick, s.samples(ray.at(t))), place) / most;
      if (through < 1e-3f) return 0;
    }
  }
  return through;
}

/// The next collision on a ray, drawn without bias.
/// @source E. Woodcock and others, 1965 ("delta tracking"), with a bound for each tile.
NANOVTT_HD inline bool collide(FogView const& fog, Ray const& ray, float t0, float t1, Random& random,
                               float& at, float& place) {
  Walk walk(fog.field, ray, t0, t1);
  Segment s;
  while (walk.next(s)) {
    float const most = s.weight * fog.perUnit;
    float t = s.t0;
    for (;;) {
      t = fly(t, most, random);
      if (!(t < s.t1)) break;
      float const sigma = fog.extinction(trilinear(s.brick, s.samples(ray.at(t))), place);
      if (random.next() * most < sigma) {
        at = t;
        return true;
      }
    }
  }
  return false;
}

/// One path from the camera: free flights, the light at each collision, the sky where it leaves.
NANOVTT_HD inline FogSample traceFog(FogView const& fog, Ray const& first, Vec3 world, float t0, float t1,
                                     Random& random) {
  FogSample out;
  Vec3 weight{1, 1, 1}, origin = first.origin;
  float t, place;
  if (!collide(fog, first, t0, t1, random, t, place)) return out;
  out.opacity = 1;
  out.depth = t;
  Vec3 p = origin + first.direction * t;
  constexpr float kFar = 3e38f;
  for (int bounce = 0;; ++bounce) {
    weight = weight * fog.tint(place);
    Ray const shadow(p, fog.lightLocal);
    float const phase = henyeyGreenstein(dot(world, fog.light), fog.anisotropy);
    out.color = out.color + weight * fog.lightColor * (phase * ratioTrack(fog, shadow, kFar, random));
    if (bounce >= fog.bounces) break;
    float const brightest = weight.x > weight.y ? (weight.x > weight.z ? weight.x : weight.z)
                                                : (weight.y > weight.z ? weight.y : weight.z);
    if (bounce > 3) {
      // Dark paths end early, the others stand for them.
      if (random.next() >= brightest) break;
      weight = weight * (1 / brightest);
    }
    float const u = random.next();
    world = scatter(world, fog.anisotropy, u, random.next());
    Ray const ray(p, fog.local(world));
    if (!collide(fog, ray, 0, kFar, random, t, place)) {
      out.color = out.color + weight * fog.skyAt(world);
      break;
    }
    p = ray.at(t);
  }
  return out;
}

} // namespace VLN::Render
