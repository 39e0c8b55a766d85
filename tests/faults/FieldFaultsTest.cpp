// What is made of fields when memory ends: halos, values of refined samples, samplers, flat buffers.
#include "Faults.h"

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/sampling/VoxelSamplerLogger.h"
#include "Reader/NanoVTTReader.h"
#include "sampling/SamplerVolume.h"
#include "support/FlatVolume.h"

#include <cstring>
#include <gtest/gtest.h>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using test::faults::After;
using test::faults::everyAllocation;
using Shape = PowerOfTwoTraits;
using Volume = VLN::Test::SamplerVolume<Shape>;

template <class C> std::string valuesOf(C const& channel) {
  std::ostringstream os;
  os << channel.tileCount(-1);
  for (auto const v : channel) os << ' ' << v;
  return os.str();
}
std::shared_ptr<Volume> volume(VoxelOffsetType type = kVoxelOffsetCorner) {
  auto v = std::make_shared<Volume>(type);
  v->addRandom(7, {0, 0, 0}, 40, Shape::kMaxDepth - 4);
  v->fill([](double x, double y, double z) { return float(x + 3 * y - z * z / 64); }, -1.0f);
  return v;
}

/// A volume and a channel to fill.
template <class Target> struct Filled {
  std::shared_ptr<Volume> v;
  std::shared_ptr<Target> target;
};
template <class Target> Filled<Target> toFill() {
  static auto const shared = volume();
  float const zero = 0;
  Filled<Target> f{
      shared, std::make_shared<Target>("", &zero, kInitializeDefaultValue, false, true, 0, Shape::kMaxDepth)};
  f.target->update(shared->topology);
  return f;
}
/// Values may be half filled when something is thrown; all tiles are there, and another call fills them.
template <class Target>
void tryFill(std::string const& name, std::function<void(Volume const&, Target&)> const& act) {
  everyAllocation<Filled<Target>>(
      name.c_str(),
      {&toFill<Target>, [&](Filled<Target>& f) { act(*f.v, *f.target); },
       [](Filled<Target> const& f) { return valuesOf(*f.target); }, After::kUsable,
       [](Filled<Target> const& f) { return f.target->tileCount(-1) == f.v->tree.tileCount(-1); }});
}

TEST(HaloFaults, RequirementPlainForms) {
  using Core = Channel<Shape, float, 4, 0>;
  using Halo = Channel<Shape, float, 4, 1>;
  using Wide = Channel<Shape, float, 5, 0>;
  tryFill<Core>("core",
                [](auto& v, auto& t) { computeHalo<Shape, float, 0, 0, 0, 0>(*v.core, v.tree, t, -1, -1); });
  tryFill<Halo>("one layer",
                [](auto& v, auto& t) { computeHalo<Shape, float, 0, 0, 0, 1>(*v.core, v.tree, t, -1, -1); });
  tryFill<Wide>("wide",
                [](auto& v, auto& t) { computeHalo<Shape, float, 0, 0, 1, 0>(*v.core, v.tree, t, -1, -1); });
  tryFill<Wide>("wide from wide",
                [](auto& v, auto& t) { computeHalo<Shape, float, 1, 0, 1, 0>(*v.wide, v.tree, t, -1, -1); });
  auto const source = toFill<Halo>();
  computeHalo<Shape, float, 0, 0, 0, 1>(*source.v->core, source.v->tree, *source.target, -1, -1);
  tryFill<Wide>("wide from one layer", [&](auto& v, auto& t) {
    computeHalo<Shape, float, 0, 1, 1, 0>(*source.target, v.tree, t, -1, -1);
  });
}
TEST(HaloFaults, RequirementModes) {
  using Halo = Channel<Shape, float, 4, 1>;
  auto const source = toFill<Halo>();
  computeHalo<Shape, float, 0, 0, 0, 1>(*source.v->core, source.v->tree, *source.target, -1, -1);
  for (int mode = 0; mode < 6; ++mode) {
    std::string const name = "mode " + std::to_string(mode);
    tryFill<Halo>(name + ", one layer", [=](auto& v, auto& t) {
      computeHalo<Shape, float, 4, 0, 1>(HaloMode(mode), kHaloAll, -1, -1, *v.core, v.tree, t, 0.5f,
                                         kVoxelOffsetCorner, 2.0f);
    });
    tryFill<Channel<Shape, float, 4, 2>>(name + ", two layers", [=](auto& v, auto& t) {
      computeHalo<Shape, float, 4, 0, 2>(HaloMode(mode), kHaloAll, -1, -1, *v.core, v.tree, t, 0.5f,
                                         kVoxelOffsetCenter, 2.0f);
    });
    tryFill<Halo>(name + ", from one layer", [&](auto& v, auto& t) {
      computeHalo<Shape, float, 4, 1, 1>(HaloMode(mode), kHaloAll, -1, -1, *source.target, v.tree, t, 0.5f,
                                         kVoxelOffsetCorner, 2.0f);
    });
  }
}
TEST(NonLeafFaults, RequirementValuesRise) {
  using Core = Channel<Shape, float, 4, 0>;
  tryFill<Core>("values rise", [](auto& v, auto& t) {
    for (std::int64_t n = 0; n < t.tileCount(-1); ++n) t.tileData(n).set(float(n));
    setNonLeafValueToChildValue(t, v.tree, kVoxelOffsetCorner, 0, Shape::kMaxDepth);
    checkIfNonLeafValueIsSetToChildValue(t, v.tree, kVoxelOffsetCorner, 0.0f, 0, Shape::kMaxDepth);
  });
}

TEST(SamplerFaults, RequirementCachesFillOrNot) {
  using Sampler = FloatVoxelSamplerLinear<Shape>;
  struct Sampled {
    std::shared_ptr<Volume> v;
    std::shared_ptr<Sampler> sampler;
    std::vector<float> values;
  };
  for (auto const type : {kVoxelOffsetCorner, kVoxelOffsetCenter}) {
    auto const v = volume(type);
    auto const positions = [] {
      std::vector<VLN::TileTree3D::float3> p;
      for (int n = 0; n < 60; ++n)
        p.push_back({float(n % 7) * 1.9f - 4, float(n % 5) * 1.1f, float(n) * 0.3f - 9});
      return p;
    }();
    auto const act = [&](Sampled& s) {
      std::vector<float> values;
      VLN::TileTree3D::float3 slope;
      for (auto const& p : positions) values.push_back(s.sampler->sample(p));
      for (auto const& p : positions) values.push_back(s.sampler->sampleGradient(p, &slope));
      s.values = std::move(values);
    };
    auto const state = [](Sampled const& s) {
      std::ostringstream os;
      for (float const x : s.values) os << x << ' ';
      return os.str();
    };
    // What the caches hold cannot be seen; what comes of them can.
    everyAllocation<Sampled>(
        "a core channel", {[&] {
                             return Sampled{v, std::make_shared<Sampler>(v->tree, v->topology, *v->core), {}};
                           },
                           act, state});
    everyAllocation<Sampled>(
        "a wide channel", {[&] {
                             return Sampled{v, std::make_shared<Sampler>(v->tree, v->topology, *v->wide), {}};
                           },
                           act, state});
    everyAllocation<Sampled>("a sampler is made and copied",
                             {[&] {
                                return Sampled{v, nullptr, {}};
                              },
                              [&](Sampled& s) {
                                Sampler const made(v->tree, v->topology, *v->core);
                                s.sampler = std::make_shared<Sampler>(made);
                              },
                              [](Sampled const& s) { return std::string(s.sampler ? "made" : "none"); }});
  }
}

/// A volume with channels of several kinds, and the buffers made of it.
struct Flat {
  std::shared_ptr<Support::FlatVolume> volume;
  std::string bytes;
};
Flat toFlatten() {
  static auto const shared = [] {
    auto v = std::make_shared<Support::FlatVolume>();
    for (int n = 0; n < 4; ++n) v->add({16 * n - 40, 4 * (n % 3), 8 * (n % 4)}, 22, 28 - n % 3);
    v->complete({512, 0, 0}, 26, 2);
    v->finish();
    v->channel<float>("density", 0.0f,
                      [](auto const& t, int k) { return float(t.index() % 17) + float(k) / 64; });
    v->channel<Velorn::Math::float3>("velocity", {0, 0, 0}, [](auto const& t, int k) {
      return Velorn::Math::float3{float(t.depth()), float(k), 1};
    });
    v->channel<std::int32_t>("count", 0, [](auto const&, int k) { return k; });
    return v;
  }();
  return {shared, ""};
}
template <class BuildT>
void tryFlatten(std::string const& name, Support::FlatOptions const& options, bool structures, bool pooled) {
  using Buffer = nanovtt::AlignedHostBuffer;
  everyAllocation<Flat>(
      name.c_str(),
      {&toFlatten,
       [=](Flat& f) {
         Buffer traversal, neighbors, pool;
         if (pooled) pool = Buffer::createPool(1 << 22);
         auto const handle =
             Support::flatten<BuildT>(*f.volume->object, options, structures ? &traversal : nullptr,
                                      structures ? &neighbors : nullptr, nullptr, pool);
         std::string bytes(reinterpret_cast<char const*>(handle.data()), handle.size());
         for (auto const* b : {&traversal, &neighbors})
           if (b->size()) bytes.append(reinterpret_cast<char const*>(b->data()), b->size());
         f.bytes = std::move(bytes);
       },
       [](Flat const& f) {
         return std::to_string(f.bytes.size()) + ' ' + std::to_string(std::hash<std::string>()(f.bytes));
       },
       After::kUnchanged,
       {},
       24,
       true});
}

TEST(FlatFaults, RequirementBuffersAreMadeOrNot) {
  Support::FlatOptions plain;
  plain.checksum = nanovdb::ChecksumMode(2);
  tryFlatten<void>("flat", plain, false, false);
  tryFlatten<void>("flat, from a pool", plain, true, true);
  Support::FlatOptions rich = plain;
  rich.haloFraction = 0.5f, rich.morton = true, rich.traversal = true;
  tryFlatten<void>("flat, with halos in Morton order", rich, true, false);
  Support::FlatOptions merged = plain;
  merged.coalesce = true, merged.setCoarser = true;
  tryFlatten<void>("flat, merged", merged, false, false);
  tryFlatten<nanovdb::Fp8>("flat, codes of 8 bits", plain, false, false);
  plain.tolerance = 0.01f;
  tryFlatten<nanovdb::FpN>("flat, codes of any width", plain, false, false);
}

} // namespace
