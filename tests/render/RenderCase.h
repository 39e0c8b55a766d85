// Fields of known values as flat buffers, for the renderer's tests.
#pragma once

#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "GeometryVolume/topology/Command.h"
#include "Reader/NanoVTTCursor.h"
#include "Render/Renderer.h"

#include <gtest/gtest.h>

#include <cmath>
#include <functional>

namespace VLN::Test {

struct FlatCase {
  float halo = 1;
  bool coalesce = false, textures = false, fp8 = false;
};

/// Roots 64 wide; tiles of the deepest depth where `fine` says so for their corners, and of the one above in
/// the rest of the box.
class RenderCase {
public:
  using Shape = TileTree3D::PowerOfTwoTraits;
  using Buffer = nanovtt::AlignedHostBuffer;
  using Function = std::function<float(double x, double y, double z)>;

  RenderCase(Function const& f, int low, int high, FlatCase const& flat = {}, float background = 0,
             std::function<bool(int, int, int)> const& fine = {}) {
    using namespace TileTree3D;
    using Velorn::Math::int3;
    int const first = low - 8, end = high + 8; // a shell of background, as files have it
    auto object =
        Command::createVoxelVLN<Shape>("voxel_tile_tree", "voxel_component", 1.0f, kVoxelOffsetCorner);
    auto tree = object->template extractComponent<Container<Shape>>("voxel_tile_tree");
    auto accessor = tree->tileAccessor();
    accessor.addTiles(int3{first, first, first}, int3{end - 1, end - 1, end - 1}, 24);
    if (!fine) {
      accessor.addTiles(int3{first, first, first}, int3{end - 1, end - 1, end - 1}, 28);
    } else {
      accessor.addTiles(int3{first, first, first}, int3{end - 1, end - 1, end - 1}, 27);
      for (int z = first; z < end; z += 4)
        for (int y = first; y < end; y += 4)
          for (int x = first; x < end; x += 4)
            if (fine(x, y, z)) accessor.addTiles(int3{x, y, z}, int3{x + 3, y + 3, z + 3}, 28);
    }
    auto topology = object->template extractComponent<VoxelTopology<Shape>>("voxel_component");
    topology->update(*tree);
    auto field = Command::createChannel<float, 2, 4, 4, 0, 0>("f", *topology, background,
                                                              kInitializeDefaultValue, 0, Shape::kMaxDepth);
    for (int d = 0; d <= Shape::kMaxDepth; ++d)
      for (std::int64_t n = 0; n < tree->tileCount(d); ++n) {
        auto const& tile = std::as_const(*tree).tile(n, d);
        auto data = field->tileData(tile.treeIndex());
        for (int s = 0; s < 64; ++s) {
          auto const p = tile.childDataTIJK(s % 4, s / 4 % 4, s / 16);
          bool const inside =
              p.x >= low && p.y >= low && p.z >= low && p.x < high && p.y < high && p.z < high;
          data(s) = inside ? f(p.x, p.y, p.z) : background;
        }
      }
    object->putComponent(std::move(field));
    object->putComponent(std::move(topology));
    object->putComponent(std::move(tree));
    Buffer const pool;
    auto const convert = [&]<class Build>(Build*) {
      return nanovtt::vttToNanoVTT<Buffer, Build, nanovdb::AbsDiff, true>(
          *object, "f", nanovdb::StatsMode(0), nanovdb::ChecksumMode(0), 0, -1.0f, false, flat.halo,
          Shape::kMaxDepth - 24, 0, false, flat.coalesce, false, 1, flat.textures, false, 0.0f, false, false,
          nullptr, nullptr, nullptr, pool);
    };
    m_flat = flat.fp8 ? convert(static_cast<nanovdb::Fp8*>(nullptr)) : convert(static_cast<void*>(nullptr));
  }

  nanovtt::GridReader grid() const { return nanovtt::BufferReader(m_flat.data()).grid(0); }

private:
  nanovtt::GridHandle<Buffer> m_flat;
};

/// Distance to a sphere about a point, cut to a band; negative inside.
inline RenderCase::Function sphereOf(double radius, Render::Vec3d center = {0, 0, 0}, double band = 3) {
  return [=](double x, double y, double z) {
    double const d = std::sqrt((x - center.x) * (x - center.x) + (y - center.y) * (y - center.y) +
                               (z - center.z) * (z - center.z)) -
                     radius;
    return static_cast<float>(std::clamp(d, -band, band));
  };
}

/// From straight before the box [-half, half]^3, seen along -z, y up.
inline Render::Camera frontCamera(double distance, double viewAngle, double aspect = 1) {
  Render::CameraOptions options;
  options.position = Render::Vec3d{0, 0, distance};
  options.focalPoint = Render::Vec3d{0, 0, 0};
  options.viewAngle = viewAngle;
  return Render::Camera(options, {{0, 0, 0}}, 0, aspect);
}

} // namespace VLN::Test
