// Pictures of channels by rays.
#include "Core.h"

#include "Interop/Image.h"
#include "Interop/VdbDetails.h"
#include "Reader/NanoVTTReader.h"
#include "Render/Colors.h"
#include "Render/Look.h"

#include <algorithm>

namespace VLN::Python {

namespace {

constexpr std::uint32_t kBackground =
    0x6b727a; ///< between what is lit and what is dark, as the program has it

Render::LookMode modeNamed(std::string const& name) {
  using enum Render::LookMode;
  for (auto const& [known, mode] : {std::pair<char const*, Render::LookMode>{"fog", kFog},
                                    {"surface", kSurface},
                                    {"mip", kMaximum},
                                    {"mean", kMean},
                                    {"isosurface", kIsosurface}})
    if (name == known) return mode;
  throw py::value_error("mode is 'fog', 'surface', 'mip', 'mean' or 'isosurface', not '" + name + "'");
}

/// The others gone: their names may be anything, and so no filter.
Object withOneChannel(Object object, std::vector<std::string> const& channels, std::string const& channel) {
  for (auto const& name : channels)
    if (name != channel) object.eraseProperty(name);
  return object;
}

} // namespace

py::bytes Core::render(std::string const& name, int width, int height, py::dict const& how,
                       py::object const& progress) const {
  Render::RenderOptions options;
  Render::LookHints hints;
  Render::CameraOptions from;
  hints.channel = name;
  options.width = width, options.height = height;
  for (auto const& [key, value] : how) {
    auto const text = key.cast<std::string>();
    if (text == "mode") hints.mode = modeNamed(value.cast<std::string>());
    if (text == "iso") hints.iso = value.cast<double>();
    if (text == "clim") hints.range = value.cast<std::pair<double, double>>();
    if (text == "cmap") hints.colors = value.cast<std::string>();
    if (text == "samples") options.samples = value.cast<int>();
    if (text == "azimuth") from.azimuth = value.cast<double>();
    if (text == "elevation") from.elevation = value.cast<double>();
    if (text == "zoom") from.zoom = value.cast<double>();
  }
  auto const tell = teller(progress);
  std::vector<unsigned char> png;
  {
    py::gil_scoped_release const nogil;
    Interop::FlatVolume flat;
    Render::Affine tileToWorld;
    {
      Reading const reading(*m_state);
      ChannelOps::of(m_state->volume, name); // raises where there is no such channel
      Interop::VdbVolume volume;
      volume.object = Ostil::makePtr<Object>(m_state->volume.object());
      volume.channels.emplace_back().name = name;
      hints.gridClass = Interop::detailsOf(volume).front().gridClass;
      if (hints.gridClass == "unknown") hints.gridClass.clear();
      Interop::FlattenOptions flatten;
      flatten.haloFraction = 1;
      flatten.checksum = 0;
      flat = Interop::flattenVolume(
          withOneChannel(m_state->volume.object(), m_state->volume.fieldNames(), name), flatten);
      auto const rows = Interop::matrixOf(m_state->indexToWorld);
      // Of a transform that is not linear the picture is one of index space.
      for (std::size_t a = 0; a < 3 && !rows.empty(); ++a) {
        tileToWorld.rows[a] = {rows[a][0], rows[a][1], rows[a][2]};
        tileToWorld.shift[int(a)] = rows[a][3];
      }
    }
    nanovtt::BufferReader const reader(flat.buffer.data());
    if (reader.gridCount() != 1) throw std::invalid_argument("the channel is of a type that cannot be drawn");
    Render::Field field(reader.grid(0));
    if (field.empty()) throw std::invalid_argument("the channel has no active voxel");
    Render::chooseLook(field, hints, options);
    double margin = 0;
    for (int a = 0; a < 3; ++a) margin = std::max(margin, 0.5 * tileToWorld.edge(a));
    Render::Camera const camera(from, Render::outlineOf(field, tileToWorld, options), margin,
                                double(width) / height);
    auto const picture = Render::render(field, tileToWorld, camera, options, [&](double done) {
      if (tell) tell("drawing", done);
    });
    auto const bytes = Render::toBytes(picture, Render::fromSrgb(kBackground), true);
    Interop::Image image(width, height);
    for (int y = 0; y < height; ++y)
      for (int x = 0; x < width; ++x) {
        auto const* const p = &bytes[4 * (std::size_t(y) * std::size_t(width) + std::size_t(x))];
        image(x, y) = {p[0], p[1], p[2]};
      }
    png = image.png();
  }
  return {reinterpret_cast<char const*>(png.data()), png.size()};
}

} // namespace VLN::Python
