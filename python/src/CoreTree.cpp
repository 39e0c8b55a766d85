// What changes the tree, and what leaves the volume whole.
#include "Core.h"

#include "Interop/DenseWrite.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/OmeZarrWrite.h"
#include "Interop/Slice.h"
#include "Interop/VolumeIo.h"

#include <algorithm>
#include <array>

namespace VLN::Python {

namespace {

/// Corners that can be asked for from many threads.
class CornerSet {
public:
  CornerSet() = default;
  CornerSet(int const* rows, std::int64_t count) {
    m_corners.reserve(static_cast<std::size_t>(count));
    for (std::int64_t n = 0; n < count; ++n)
      m_corners.push_back({rows[3 * n], rows[3 * n + 1], rows[3 * n + 2]});
    std::sort(m_corners.begin(), m_corners.end());
  }
  bool holds(int3 const& p) const {
    return std::binary_search(m_corners.begin(), m_corners.end(), std::array<int, 3>{p.x, p.y, p.z});
  }
  std::vector<std::array<int, 3>> const& all() const { return m_corners; }

private:
  std::vector<std::array<int, 3>> m_corners;
};

} // namespace

Interop::Progress teller(py::object const& progress) {
  py::handle const callback = progress.is_none() ? py::handle() : py::handle(progress);
  return [callback](char const* stage, double done) {
    py::gil_scoped_acquire const gil;
    if (PyErr_CheckSignals() != 0) throw py::error_already_set();
    if (callback) callback(stage, done);
  };
}

void Core::refineAll(Long3 const& low, Long3 const& high, int depth) {
  int3 const from = toInt3(low, "low"), to = toInt3(high, "high");
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  m_state->volume.refineWhere(
      from, to, [](TileTree3D::TileBox const&) { return true; }, depth);
  m_state->volume.topology();
}

void Core::refineTiles(std::vector<Rows<int>> const& corners, int firstDepth) {
  std::vector<std::pair<int const*, py::ssize_t>> lists;
  for (auto const& rows : corners) {
    auto const count = rowCount(rows, "corners");
    lists.emplace_back(rows.data(), count);
  }
  py::gil_scoped_release const nogil;
  std::vector<CornerSet> accepted;
  for (auto const& [rows, count] : lists) accepted.emplace_back(rows, count);
  if (accepted.empty() || accepted.front().all().empty()) return;
  int3 low{Shape::kMaxTileCoord, Shape::kMaxTileCoord, Shape::kMaxTileCoord},
      high{Shape::kMinTileCoord, Shape::kMinTileCoord, Shape::kMinTileCoord};
  for (auto const& p : accepted.front().all())
    for (int a = 0; a < 3; ++a) {
      auto const n = static_cast<std::size_t>(a);
      low[a] = std::min(low[a], p[n]);
      std::int64_t const end = std::int64_t(p[n]) + Shape::width(std::clamp(firstDepth, 0, kFinest));
      high[a] = std::max(high[a], int(std::min<std::int64_t>(end, Shape::kMaxTileCoord)));
    }
  Changing const changing(*m_state);
  m_state->volume.refineWhere(
      low, high,
      [&](TileTree3D::TileBox const& box) {
        auto const n = static_cast<std::size_t>(box.depth - firstDepth);
        return n < accepted.size() && accepted[n].holds(box.corner);
      },
      firstDepth + static_cast<int>(accepted.size()) - 1);
  m_state->volume.topology();
}

std::int64_t Core::removeTiles(Rows<int> const& corners) {
  auto const count = rowCount(corners, "corners");
  int const* const rows = corners.data();
  py::gil_scoped_release const nogil;
  CornerSet const going(rows, count);
  Changing const changing(*m_state);
  auto const removed =
      m_state->volume.removeWhere([&](TileTree3D::TileBox const& box) { return going.holds(box.corner); });
  m_state->volume.topology();
  return removed;
}

void Core::fillHalos(std::optional<std::string> const& name) {
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  if (name)
    m_state->volume.fillHalos(*name);
  else
    m_state->volume.fillHalos();
}

void Core::fillCoarse() {
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  m_state->volume.fillCoarse();
}

py::bytes Core::picture(std::string const& name, int axis, std::optional<double> at, int size,
                        bool gradient) const {
  std::vector<unsigned char> png;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto const found = ChannelOps::of(m_state->volume, name)->active(ruleOf(name), false);
    Interop::VdbVolume volume;
    volume.object = Ostil::makePtr<Object>(m_state->volume.object());
    volume.indexToWorld = m_state->indexToWorld;
    volume.voxelSize = m_state->indexToWorld.voxelSize().x;
    Interop::VdbChannel channel;
    channel.name = channel.gridName = name;
    channel.activeVoxels = found.count;
    if (found.count > 0) channel.activeBox = {found.low, found.high};
    volume.activeBox = channel.activeBox;
    volume.channels.push_back(channel);
    Interop::SliceOptions options;
    options.axis = axis;
    options.at = at;
    options.size = size;
    options.gradient = gradient;
    options.title = name;
    png = Interop::drawSlice(volume, name, options).image.png();
  }
  return {reinterpret_cast<char const*>(png.data()), png.size()};
}

void Core::save(std::string const& path) const {
  py::gil_scoped_release const nogil;
  UsingOpenVdb const alone;
  Reading const reading(*m_state);
  Interop::save(m_state->volume, path);
}

void Core::saveDense(std::string const& path, Long3 const& low, Long3 const& high, int depth,
                     py::object const& progress) const {
  auto const format = Interop::checkOutputFor(Interop::FileContent::kDense, path);
  Interop::DenseVolume dense;
  dense.box.min = toInt3(low, "box");
  dense.box.max = toInt3(high, "box");
  dense.depth = depth;
  auto const tell = teller(progress);
  for (auto const& name : names()) dense.channels.push_back(name);
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  for (auto const& [name, note] : notes())
    if (note.type == "bool" || note.type == "mask") dense.flags.push_back(name);
  dense.object = m_state->volume.object();
  dense.indexToWorld = m_state->indexToWorld;
  switch (format) {
  case Interop::FileFormat::kZarr:
    return Interop::writeOmeZarr(path, {dense}, tell);
  case Interop::FileFormat::kVti:
    return writeVti(path, dense, tell);
  default:
    return writeNpz(path, dense, tell);
  }
}

std::shared_ptr<Interop::FlatVolume> Core::flatten(Interop::FlattenOptions const& options) const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  return std::make_shared<Interop::FlatVolume>(Interop::flattenVolume(m_state->volume.object(), options));
}

Interop::VdbVolume Core::vdbVolume(std::string const& path) const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  auto volume = Interop::writtenVolume(m_state->volume, path);
  volume.indexToWorld = m_state->indexToWorld;
  volume.voxelSize = m_state->indexToWorld.voxelSize().x;
  for (auto& channel : volume.channels) {
    auto const found = ChannelOps::of(m_state->volume, channel.name)->active(ruleOf(channel.name), false);
    if (found.count == 0) continue;
    channel.activeVoxels = found.count;
    channel.activeBox = {found.low, found.high};
    volume.activeBox.grow(found.low);
    volume.activeBox.grow(found.high);
  }
  return volume;
}

} // namespace VLN::Python
