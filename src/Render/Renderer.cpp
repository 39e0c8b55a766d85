#include "Render/Renderer.h"

#include "Render/Colors.h"
#include "Render/Fog.h"
#include "Render/LightLatticeImpl.h"
#include "Render/PixelBlocks.h"
#include "Render/RestlessPixelsImpl.h"
#include "Render/SparsePixelsImpl.h"
#include "Render/Surface.h"
#include "Render/Threads.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <limits>
#include <stdexcept>

namespace VLN::Render {

namespace {

using Clock = std::chrono::steady_clock;

constexpr float kNowhere = std::numeric_limits<float>::infinity();
constexpr Vec3 kKeyLight{1.0f, 0.96f, 0.9f}, kSky{0.55f, 0.6f, 0.68f}, kGround{0.22f, 0.2f, 0.19f};
constexpr Vec3 kClay{0.72f, 0.68f, 0.62f};
/// The most points of a lattice of light along its longest axis.
constexpr double kLatticePoints = 128;
/// Of a march through the diagonal: where voxels are large, steps are smaller than they are.
constexpr double kFewestSteps = 320;
/// And where one edge of a voxel is far shorter than the others, larger.
constexpr double kMostSteps = 65536;

/// A camera's ray in local space. Its origin is where it comes to the field's box, or to what is in it.
struct Start {
  Vec3d world; ///< unit
  Vec3 origin, direction;
  double base = 0; ///< distance from the camera to the origin
  float end = 0;   ///< distance from there to what it leaves
};

struct Scene {
  Field const& field;
  Camera const& camera;
  RenderOptions const& options;
  Affine toWorld; ///< from local space
  Affine toLocal;
  Vec3d eye;       ///< local
  Vec3d light;     ///< world, unit
  double diagonal; ///< of the field's box, world length; set with the depth

  /// From side to side of the field's box.
  bool start(double u, double v, Start& s) const {
    s.world = camera.ray(u, v);
    Vec3d const d = toLocal.vector(s.world);
    double t0 = 0, t1 = std::numeric_limits<double>::max();
    FieldView const& f = field.view();
    for (int a = 0; a < 3; ++a) {
      double const low = double(f.low[a]), high = double(f.high[a]);
      if (d[a] == 0) {
        if (eye[a] < low || eye[a] > high) return false;
        continue;
      }
      double const p = (low - eye[a]) / d[a], q = (high - eye[a]) / d[a];
      t0 = std::max(t0, std::min(p, q)), t1 = std::min(t1, std::max(p, q));
    }
    if (!(t0 < t1)) return false;
    cut(s, d, t0, t1);
    return true;
  }
  /// Through what lies in its block of pixels.
  void start(double u, double v, PixelBlocks::Span const& span, Start& s) const {
    s.world = camera.ray(u, v);
    cut(s, toLocal.vector(s.world), double(span.near), double(span.far));
  }

private:
  void cut(Start& s, Vec3d d, double t0, double t1) const {
    s.base = t0;
    s.origin = (eye + d * t0).as<float>();
    s.direction = d.as<float>();
    s.end = static_cast<float>(t1 - t0);
  }
};

struct Sample {
  Vec3 color;
  float opacity = 0, depth = 0; ///< depth times opacity
  Vec3 normal;
  float value = 0;
};

/// Smallest world length of a voxel's edges.
double voxelOf(Affine const& m) { return std::min({m.edge(0), m.edge(1), m.edge(2)}); }

// Surfaces

struct SurfaceShader {
  Scene const& scene;
  int occlusionRays;
  float reach; ///< of occlusion, world length
  float lift;  ///< off the surface before other rays start, world length

  Vec3 local(Vec3 w) const { return scene.toLocal.vector(w.as<double>()).as<float>(); }

  bool meets(Vec3 from, Vec3 world, float far) const {
    Ray const ray(from, local(world));
    float t;
    return hitSurface(scene.field.view(), ray, 0, far, scene.options.iso, t);
  }

  Sample operator()(Start const& s, std::uint32_t pixel, std::uint32_t sample) const {
    Sample out;
    Ray const ray(s.origin, s.direction);
    float t;
    if (!hitSurface(scene.field.view(), ray, 0, s.end, scene.options.iso, t)) return out;
    Vec3 const p = ray.at(t);
    // Gradients go from local space to the world by the transposed inverse.
    Vec3 n = normalized(scene.toLocal.transposed(gradientAt(scene.field.view(), p).as<double>()).as<float>());
    Vec3 const view = s.world.as<float>();
    if (dot(n, n) == 0 || dot(n, view) > 0) n = -n;
    if (dot(n, n) == 0) n = -view;
    Vec3 const off = p + local(n) * lift;
    Vec3 const up = scene.camera.up.as<float>(), toLight = scene.light.as<float>();

    float open = 1;
    if (occlusionRays > 0) {
      // One set of directions for all pixels, shifted by pixel: evenly spread, and without a pattern.
      Random random(pixel, 0xA0u);
      float const shiftU = random.next(), shiftV = random.next();
      int met = 0;
      Vec3 const other = n.x * n.x < 0.5f ? Vec3{1, 0, 0} : Vec3{0, 1, 0};
      Vec3 const a = normalized(cross(n, other)), b = cross(n, a);
      for (int r = 0; r < occlusionRays; ++r) {
        auto const k = static_cast<float>(sample * static_cast<std::uint32_t>(occlusionRays) +
                                          static_cast<std::uint32_t>(r) + 1);
        // Additive recurrence by powers of the plastic number (M. Roberts, 2018).
        float u = shiftU + 0.7548776662f * k, v = shiftV + 0.5698402910f * k;
        u -= std::floor(u), v -= std::floor(v);
        float const radius = std::sqrt(u), phi = 6.28318530718f * v;
        Vec3 const d = a * (radius * std::cos(phi)) + b * (radius * std::sin(phi)) + n * std::sqrt(1 - u);
        met += meets(off, d, reach);
      }
      open = 1 - static_cast<float>(met) / static_cast<float>(occlusionRays);
    }
    float const toward = std::max(0.0f, dot(n, toLight));
    float const lit = toward > 0 && !(occlusionRays > 0 && meets(off, toLight, 3e38f)) ? toward : 0;
    float const side = 0.5f + 0.5f * dot(n, up);
    Vec3 const half = normalized(toLight - view);
    float const gloss = lit > 0 ? 0.12f * std::pow(std::max(0.0f, dot(n, half)), 40.0f) : 0;
    Vec3 const ambient = (kGround * (1 - side) + kSky * side) * (0.75f * open);
    out.color = kClay * (ambient + kKeyLight * (0.85f * lit)) + kKeyLight * gloss;
    out.opacity = 1;
    out.depth = static_cast<float>(s.base) + t;
    out.normal = n;
    return out;
  }
};

// Projections

struct ProjectionShader {
  Scene const& scene;
  float step; ///< world length
  bool isMean;

  Sample operator()(Start const& s, std::uint32_t, std::uint32_t) const {
    Sample out;
    FieldView const& f = scene.field.view();
    float const background = f.background;
    Ray const ray(s.origin, s.direction);
    Walk walk(f, ray, 0, s.end);
    Segment piece;
    float best = scene.field.low(), first = -1;
    double sum = 0;
    bool any = false;
    while (walk.next(piece, isMean || !any ? 0 : best - scene.field.low())) {
      int const count = 1 + static_cast<int>((piece.t1 - piece.t0) / step);
      float const dt = (piece.t1 - piece.t0) / static_cast<float>(count);
      for (int n = 0; n < count; ++n) {
        float const t = piece.t0 + (static_cast<float>(n) + 0.5f) * dt;
        float const v = trilinear(piece.brick, piece.samples(ray.at(t)));
        if (isMean) {
          sum += double(v - background) * double(dt);
          if (first < 0 && v != background) first = t;
        } else if (!any || v > best) {
          best = v, first = t;
        }
        any = true;
      }
    }
    if (!any) return out;
    out.value = isMean ? background + static_cast<float>(sum / double(s.end)) : best;
    out.opacity = 1;
    out.depth = static_cast<float>(s.base) + std::max(first, 0.0f);
    return out;
  }
};

// Fogs

struct FogShader {
  FogView const& fog;
  bool isFinal;

  Sample operator()(Start const& s, std::uint32_t pixel, std::uint32_t sample) const {
    Ray const ray(s.origin, s.direction);
    Random random(pixel, sample);
    float const shift = static_cast<float>(std::fmod(s.base, double(fog.step)));
    Vec3 const world = s.world.as<float>();
    FogSample const f =
        isFinal ? traceFog(fog, ray, world, 0, s.end, random) : marchFog(fog, ray, world, 0, s.end, shift);
    Sample out;
    out.color = f.color, out.opacity = f.opacity;
    out.depth = f.depth + static_cast<float>(s.base) * f.opacity;
    return out;
  }
};

/// A length over which the field is neither clear nor a wall: most rays from the camera that meet anything
/// have an optical depth below 3, the denser half of them more than about 1.
double chooseUnit(Scene const& scene, FogView& fog, double voxel) {
  constexpr int kAcross = 40;
  constexpr double kThick = 3.0, kShare = 0.9;
  std::vector<float> depths(kAcross * kAcross);
  fog.perUnit = 1;
  forRanges(kAcross * kAcross, 16, scene.options.threads, [&](std::int64_t begin, std::int64_t end) {
    for (std::int64_t n = begin; n < end; ++n) {
      Start s;
      if (!scene.start((double(n % kAcross) + 0.5) / kAcross, (double(n / kAcross) + 0.5) / kAcross, s))
        continue;
      Ray const ray(s.origin, s.direction);
      depths[n] = opticalDepth(fog, ray, 0, s.end, static_cast<float>(2 * voxel));
    }
  });
  std::erase_if(depths, [](float d) { return !(d > 0); });
  if (depths.empty()) return voxel;
  auto const at = depths.begin() + static_cast<std::ptrdiff_t>(kShare * double(depths.size() - 1));
  std::nth_element(depths.begin(), at, depths.end());
  return double(*at) / kThick;
}

/// Below the size of voxels, and above what a march of bounded length takes: voxels may be far from cubes.
double stepOf(Scene const& scene, double voxel) {
  return std::clamp(0.8 * voxel, scene.diagonal / kMostSteps, scene.diagonal / kFewestSteps);
}

/// Rays end at the depth whose samples are about as wide as a pixel where the camera is nearest.
void limitDepth(Field& field, Scene& scene, RenderOptions const& options, double voxel) {
  int depth = options.depth;
  if (depth < 0) {
    Vec3d nearest = scene.eye; // of the box, local
    for (int a = 0; a < 3; ++a)
      nearest[a] = std::clamp(nearest[a], double(field.activeLow()[a]), double(field.activeHigh()[a]));
    double const distance = dot(scene.toWorld.point(nearest) - scene.camera.position, scene.camera.forward);
    double const pixel = 2 * scene.camera.halfHeight / options.height * std::max(distance, 0.0);
    double const voxels = std::min(pixel / voxel, 1e9);
    depth = nanovtt::kMaxDepth - (voxels >= 2 ? static_cast<int>(std::floor(std::log2(voxels))) : 0);
  }
  int const root = nanovtt::kTileSpaceBits - field.view().rootShift;
  field.limitDepth(std::clamp(depth, root, nanovtt::kMaxDepth), options.threads);
  scene.diagonal = length(scene.toWorld.vector((field.view().high - field.view().low).as<double>()));
}

Scene sceneOf(Field const& field, Affine const& tileToWorld, Camera const& camera,
              RenderOptions const& options) {
  double const determinant = tileToWorld.determinant();
  if (!std::isfinite(determinant) || determinant == 0)
    throw std::invalid_argument("its transform cannot be inverted");
  Affine toWorld = tileToWorld;
  toWorld.shift = tileToWorld.point(field.origin());
  Scene scene{field, camera, options, toWorld, toWorld.inverse(), {}, {}, {}};
  scene.eye = scene.toLocal.point(camera.position);
  scene.light = length(options.light) > 0
                    ? normalized(options.light)
                    : normalized(camera.up * 0.9 - camera.right * 0.75 - camera.forward * 0.8);
  return scene;
}

/// Tells the field where rays have something to find, for modes other than fog.
void weighField(Field& field, RenderOptions const& options) {
  float const low = field.low(), background = field.background();
  auto const isEmpty = [background](float from, float to) { return from == to && to == background; };
  switch (options.mode) {
  case Mode::kSurface:
    return field.weigh([&](float from, float to) { return crosses(from, to, options.iso) ? 1.0f : 0.0f; },
                       options.threads);
  case Mode::kMaximum:
    return field.weigh(
        [&](float from, float to) { return isEmpty(from, to) ? 0 : std::max(to - low, 1e-30f); },
        options.threads);
  case Mode::kMean:
    return field.weigh([&](float from, float to) { return isEmpty(from, to) ? 0.0f : 1.0f; },
                       options.threads);
  case Mode::kFog:
    return;
  }
}

/// A fog, and the lattices of light that its preview reads.
struct FogScene {
  FogView view;
  double unit = 0; ///< of opacity
  LightLattice lights;
};

/// World lengths between the points of a lattice of light, in samples.
Vec3 latticeSpacing(FieldView const& field, Affine const& tileToWorld) {
  double longest = 0;
  for (int a = 0; a < 3; ++a)
    longest = std::max(longest, tileToWorld.edge(a) * double(field.high[a] - field.low[a]));
  Vec3 spacing;
  for (int a = 0; a < 3; ++a)
    spacing[a] = static_cast<float>(std::max(1.0, longest / kLatticePoints / tileToWorld.edge(a)));
  return spacing;
}

/// Weighs the field by its opacity. Unit and lattices of light are still to come.
FogView fogOf(Field& field, Scene const& scene, Transfer const& transfer, double voxel) {
  RenderOptions const& options = scene.options;
  bool const isFinal = options.quality == Quality::kFinal;
  field.weigh([&](float low, float high) { return transfer.largestOpacity(low, high); }, options.threads);
  FogView fog;
  fog.transfer = &transfer.view();
  fog.field = field.view();
  fog.colored = options.colored;
  fog.albedo = static_cast<float>(options.albedo);
  fog.anisotropy = static_cast<float>(options.anisotropy);
  fog.light = scene.light.as<float>();
  fog.lightLocal = scene.toLocal.vector(scene.light).as<float>();
  for (int a = 0; a < 3; ++a) fog.worldToLocal[a] = scene.toLocal.rows[a].as<float>();
  fog.viewUp = scene.camera.viewUp.as<float>();
  fog.lightColor = kKeyLight * (isFinal ? 0.32f : 1.6f);
  fog.sky = kSky * (isFinal ? 0.8f : 0.35f);
  fog.ground = kGround * (isFinal ? 1.2f : 0.5f);
  fog.bounces = options.bounces;
  fog.step = static_cast<float>(stepOf(scene, voxel));
  return fog;
}

FogScene prepareFog(Field& field, Scene const& scene, Transfer const& transfer, Affine const& tileToWorld) {
  RenderOptions const& options = scene.options;
  double const voxel = voxelOf(tileToWorld);
  FogScene result;
  FogView& fog = result.view;
  fog = fogOf(field, scene, transfer, voxel);
  if (options.opacityUnit > 0 && options.opacityUnit < 1e-3 * voxel)
    throw std::invalid_argument("the unit of opacity is less than a thousandth of a voxel");
  result.unit = options.opacityUnit > 0 ? options.opacityUnit : chooseUnit(scene, fog, voxel);
  fog.perUnit = static_cast<float>(1 / result.unit);
  if (options.quality == Quality::kFinal) return result;
  Vec3 const spacing = latticeSpacing(fog.field, tileToWorld);
  Vec3 const up = scene.toLocal.vector(scene.camera.viewUp).as<float>();
  result.lights = sweepLights(fog, fog.lightLocal, up, spacing, options.threads);
  fog.lights = result.lights.view;
  return result;
}

int samplesOf(RenderOptions const& options) {
  if (options.samples > 0) return options.samples;
  bool const isFinal = options.quality == Quality::kFinal;
  switch (options.mode) {
  case Mode::kSurface:
    return isFinal ? 64 : 4;
  case Mode::kFog:
    return isFinal ? 64 : 1;
  default:
    return isFinal ? 16 : 1;
  }
}

/// Adds one sample to every pixel, or to those that are marked.
template <class Shader>
void addSample(Picture& picture, Scene const& scene, PixelBlocks const& blocks,
               std::vector<std::uint8_t> const& marked, int sample, int samples, Shader const& shader,
               std::function<void(double)> const& watch) {
  bool const isWhole = scene.options.mode == Mode::kMean; // over all of the box
  auto const rows = [&](std::int64_t begin, std::int64_t end) {
    for (std::int64_t y = begin; y < end; ++y)
      for (int x = 0; x < picture.width; ++x) {
        auto const& span = blocks.at(x, static_cast<int>(y));
        if (span.empty()) continue;
        auto const n = static_cast<std::size_t>(y) * static_cast<std::size_t>(picture.width) +
                       static_cast<std::size_t>(x);
        if (!marked.empty() && !marked[n]) continue;
        double du = 0.5, dv = 0.5;
        if (samples > 1) {
          // The recurrence of the occlusion rays, from the middle on.
          du += 0.7548776662 * (sample + 1), dv += 0.5698402910 * (sample + 1);
          du -= std::floor(du), dv -= std::floor(dv);
        }
        double const u = (x + du) / picture.width, v = (double(y) + dv) / picture.height;
        Start s;
        if (!isWhole)
          scene.start(u, v, span, s);
        else if (!scene.start(u, v, s))
          continue;
        Sample const got = shader(s, static_cast<std::uint32_t>(n), static_cast<std::uint32_t>(sample));
        if (!(got.opacity > 0)) continue;
        picture.color[n] = picture.color[n] + got.color;
        picture.opacity[n] += got.opacity;
        picture.depth[n] += got.depth;
        picture.normal[n] = picture.normal[n] + got.normal;
        if (!picture.value.empty()) picture.value[n] += got.value;
      }
  };
  forRanges(picture.height, PixelBlocks::kWidth, scene.options.threads, rows, [&](double share) {
    if (watch) watch((sample + share) / samples);
  });
}

/// Pixels from one ray to the next of a fog's preview, at first: where voxels are seen several pixels wide,
/// what lies between follows from those about it. Opacities of pairs may have peaks that are narrower than
/// voxels.
int strideOf(Scene const& scene, double voxel) {
  RenderOptions const& options = scene.options;
  FieldView const& field = scene.field.view();
  if (options.mode != Mode::kFog || options.quality == Quality::kFinal || options.samples > 0 ||
      field.maxDepth < nanovtt::kMaxDepth || options.transfer.opacity.find(':') != std::string::npos)
    return 1;
  double farthest = 0;
  for (int corner = 0; corner < 8; ++corner) {
    Vec3d const p{double(corner & 1 ? field.high.x : field.low.x),
                  double(corner & 2 ? field.high.y : field.low.y),
                  double(corner & 4 ? field.high.z : field.low.z)};
    farthest = std::max(farthest, dot(scene.toWorld.point(p) - scene.camera.position, scene.camera.forward));
  }
  double const pixels = voxel / (2 * scene.camera.halfHeight / options.height * farthest);
  return pixels >= 5 ? 4 : pixels >= 2.5 ? 2 : 1;
}

/// Draws a preview of a fog in which not every pixel needs a ray of its own.
std::int64_t drawSparsely(Picture& picture, Scene const& scene, PixelBlocks const& blocks, int stride,
                          FogShader const& shader, std::function<void(double)> const& watch) {
  auto const trace = [&](int x, int y) {
    Start s;
    scene.start((x + 0.5) / picture.width, (y + 0.5) / picture.height, blocks.at(x, y), s);
    Sample const got = shader(s, 0, 0);
    auto const n =
        static_cast<std::size_t>(y) * static_cast<std::size_t>(picture.width) + static_cast<std::size_t>(x);
    picture.color[n] = got.color, picture.opacity[n] = got.opacity, picture.depth[n] = got.depth;
  };
  SparsePixels pixels(picture, blocks, scene.options.threads);
  return pixels.draw(stride, trace, [&](double share) {
    if (watch) watch(share);
  });
}

/// From sums to means.
void divide(Picture& picture) {
  float const scale = picture.samples > 0 ? 1 / static_cast<float>(picture.samples) : 0;
  for (std::size_t n = 0; n < picture.color.size(); ++n) {
    float const opacity = picture.opacity[n];
    picture.depth[n] = opacity > 0 ? picture.depth[n] / opacity : kNowhere;
    picture.normal[n] = normalized(picture.normal[n]);
    if (!picture.value.empty() && opacity > 0) picture.value[n] /= opacity;
    picture.color[n] = picture.color[n] * scale;
    picture.opacity[n] = opacity * scale;
  }
}

/// The colours of a projection's values, over their own range where the options ask for it.
void colorValues(Picture& picture, RenderOptions const& options, Transfer transfer) {
  if (options.rangeFromPicture) {
    picture.low = std::numeric_limits<float>::max(), picture.high = -picture.low;
    for (std::size_t n = 0; n < picture.value.size(); ++n)
      if (picture.opacity[n] > 0)
        picture.low = std::min(picture.low, picture.value[n]),
        picture.high = std::max(picture.high, picture.value[n]);
    if (!(picture.low < picture.high))
      picture.low = options.transfer.low, picture.high = options.transfer.high;
    TransferOptions own = options.transfer;
    own.low = own.log ? std::max(picture.low, picture.high * 1e-4f) : picture.low, own.high = picture.high;
    if (own.low < own.high && (!own.log || own.low > 0))
      transfer = Transfer(own);
    else
      own = options.transfer;
    picture.low = own.low, picture.high = own.high;
  }
  auto const& map = transfer.view();
  for (std::size_t n = 0; n < picture.value.size(); ++n) {
    float const place = map.place(picture.value[n]);
    // The lowest tenth of the range fades, so that what is nearly nothing does not cover the background.
    picture.opacity[n] *= std::min(1.0f, 10 * place);
    picture.color[n] = map.colorAt(place) * picture.opacity[n];
  }
}

} // namespace

double opacityUnit(Field& field, Affine const& tileToWorld, Camera const& camera,
                   RenderOptions const& options) {
  Scene scene = sceneOf(field, tileToWorld, camera, options);
  Transfer const transfer(options.transfer);
  double const voxel = voxelOf(tileToWorld);
  limitDepth(field, scene, options, voxel);
  FogView fog = fogOf(field, scene, transfer, voxel);
  return chooseUnit(scene, fog, voxel);
}

Picture render(Field& field, Affine const& tileToWorld, Camera const& camera, RenderOptions const& options,
               std::function<void(double)> const& watch) {
  if (options.width < 1 || options.height < 1 || options.width > 32768 || options.height > 32768)
    throw std::invalid_argument("a picture has 1 to 32768 pixels an axis");
  Scene scene = sceneOf(field, tileToWorld, camera, options);

  bool const isFinal = options.quality == Quality::kFinal;
  double const voxel = voxelOf(tileToWorld);
  Picture picture;
  picture.width = options.width, picture.height = options.height;
  picture.low = options.transfer.low, picture.high = options.transfer.high;
  // Surfaces have no colours of their own: their values may span what a transfer function cannot.
  Transfer const transfer(options.mode == Mode::kSurface ? TransferOptions() : options.transfer);
  limitDepth(field, scene, options, voxel);
  picture.deepest = field.view().maxDepth, picture.light = scene.light;
  FogScene fog;
  if (options.mode == Mode::kFog) {
    fog = prepareFog(field, scene, transfer, tileToWorld);
    picture.opacityUnit = fog.unit;
  } else {
    weighField(field, options);
  }

  auto const count = static_cast<std::size_t>(options.width) * static_cast<std::size_t>(options.height);
  picture.color.resize(count), picture.opacity.resize(count);
  picture.depth.resize(count), picture.normal.resize(count);
  if (options.mode == Mode::kMaximum || options.mode == Mode::kMean) picture.value.resize(count);

  int const samples = samplesOf(options);
  auto const began = Clock::now();
  auto const seconds = [&] { return std::chrono::duration<double>(Clock::now() - began).count(); };
  PixelBlocks const blocks(field.view(), scene.toWorld, camera, options.width, options.height);
  // Of surfaces in previews those pixels get more samples that need them.
  bool const mayRest = options.mode == Mode::kSurface && !isFinal && options.samples == 0;
  std::vector<std::uint8_t> marked;
  auto const addOne = [&](auto const& shader) {
    addSample(picture, scene, blocks, marked, picture.samples, samples, shader, watch);
  };
  int const stride = strideOf(scene, voxel);
  if (stride > 1) {
    picture.rays = drawSparsely(picture, scene, blocks, stride, FogShader{fog.view, isFinal}, watch);
    picture.samples = 1;
  }
  auto rays = static_cast<std::int64_t>(count);
  for (; picture.samples < samples; ++picture.samples) {
    if (mayRest && picture.samples == 1) {
      marked = markRestless(picture, options.threads);
      rays = std::count(marked.begin(), marked.end(), std::uint8_t(1));
    }
    if (picture.samples > 0 && options.timeLimit > 0 && seconds() >= options.timeLimit) break;
    if (stride == 1) picture.rays += rays;
    if (options.mode == Mode::kSurface) {
      int const occlusion = options.occlusionRays >= 0 ? options.occlusionRays : 2;
      addOne(SurfaceShader{scene, occlusion, static_cast<float>(0.15 * scene.diagonal),
                           static_cast<float>(0.5 * voxel)});
    } else if (options.mode == Mode::kFog) {
      addOne(FogShader{fog.view, isFinal});
    } else {
      addOne(ProjectionShader{scene, static_cast<float>(0.5 * voxel), options.mode == Mode::kMean});
    }
  }
  picture.seconds = seconds();
  repeatUnmarked(picture, marked);
  divide(picture);
  if (!picture.value.empty()) colorValues(picture, options, transfer);
  return picture;
}

std::vector<std::uint8_t> toBytes(Picture const& picture, Vec3 background, bool opaque) {
  std::vector<std::uint8_t> bytes(picture.color.size() * 4);
  for (std::size_t n = 0; n < picture.color.size(); ++n) {
    Vec3 c = picture.color[n];
    float const a = std::min(picture.opacity[n], 1.0f);
    if (opaque)
      c = c + background * (1 - a);
    else if (a > 0)
      c = c * (1 / a);
    for (int channel = 0; channel < 3; ++channel)
      bytes[4 * n + static_cast<std::size_t>(channel)] = toSrgbByte(c[channel]);
    bytes[4 * n + 3] = opaque ? 255 : static_cast<std::uint8_t>(std::lround(255 * a));
  }
  return bytes;
}

} // namespace VLN::Render
