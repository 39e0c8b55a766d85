#include "Core.h"

#include "ToIndex.h"

#include "GeometryVolume/channels/ChannelBase.h"
#include "Interop/VdbRecord.h"
#include "Interop/VolumeIo.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::Python {

namespace {

using Ostil::Any;
using Records = Ostil::Array<Interop::VdbGridRecord>;
constexpr std::int64_t kPart = 1 << 18; ///< positions between two looks at signals

/// OpenVDB's own bytes of a map of strings: a count, then name, type, and content, each after its length.
std::string metadataBytes(std::vector<std::pair<std::string, std::string>> const& entries) {
  std::string bytes;
  auto const number = [&](std::uint32_t n) { bytes.append(reinterpret_cast<char const*>(&n), sizeof n); };
  auto const text = [&](std::string const& s) {
    number(static_cast<std::uint32_t>(s.size()));
    bytes += s;
  };
  number(static_cast<std::uint32_t>(entries.size()));
  for (auto const& [name, value] : entries) {
    text(name);
    text("string");
    text(value);
  }
  return bytes;
}

Records recordsOf(Object const& object) {
  Any const holder = object.getProperty(Interop::kVdbGridsProperty);
  auto const* const records = holder.get<Records>();
  return records ? *records : Records();
}

void checkDepth(int depth) {
  if (depth < 0 || depth > kFinest)
    throw py::value_error("depth " + std::to_string(depth) + " is none: depths are 0 to " +
                          std::to_string(kFinest));
}

/// Bytes of an array whose dtype and trailing shape must be those of the element.
/// @return The number of elements.
std::int64_t checkElements(py::array const& values, ElementInfo const& element, std::string const& name) {
  if (!values.dtype().equal(dtypeOf(element)) || !(values.flags() & py::array::c_style))
    throw py::type_error("values for channel '" + name + "' must be " +
                         std::string(py::str(dtypeOf(element))));
  auto const inner = static_cast<py::ssize_t>(element.shape.size());
  bool fits = values.ndim() >= inner;
  for (py::ssize_t a = 0; fits && a < inner; ++a)
    fits = values.shape(values.ndim() - inner + a) == element.shape[static_cast<std::size_t>(a)];
  if (!fits) throw py::value_error("values for channel '" + name + "' have the wrong shape");
  return values.nbytes() / element.bytes;
}

} // namespace

Core::Core(double voxelSize, std::array<double, 3> const& origin)
    : m_state() {
  Volume volume(static_cast<float>(voxelSize));
  Interop::IndexToWorld const map(voxelSize, {origin[0], origin[1], origin[2]});
  Object object = volume.object();
  object.setProperty(Interop::kVdbTransformProperty, Any(Ostil::String(map.bytes())));
  m_state = std::make_shared<State>(Volume(object));
  m_state->indexToWorld = map;
}

Core::Core(Volume volume, Interop::IndexToWorld const& indexToWorld)
    : m_state(std::make_shared<State>(std::move(volume))) {
  m_state->indexToWorld = indexToWorld;
}

std::map<std::string, GridNote> Core::notes() const {
  std::map<std::string, GridNote> result;
  for (auto const& record : recordsOf(m_state->volume.object())) {
    GridNote note;
    note.type = record.type;
    if (record.rule == Interop::VdbActiveRule::kInsideBand) note.rule.kind = ActiveRule::Kind::kInsideBand;
    if (record.rule == Interop::VdbActiveRule::kChannel &&
        m_state->volume.hasField<unsigned char>(record.stateChannel)) {
      note.rule.kind = ActiveRule::Kind::kStates;
      note.rule.states = record.stateChannel;
    }
    note.rule.also.assign(record.alsoActive.begin(), record.alsoActive.end());
    result[record.channel] = note;
  }
  return result;
}

ActiveRule Core::ruleOf(std::string const& name) const {
  auto const all = notes();
  auto const found = all.find(name);
  return found == all.end() ? ActiveRule() : found->second.rule;
}

std::vector<std::string> Core::names() const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  auto names = m_state->volume.fieldNames();
  for (auto const& [name, note] : notes()) std::erase(names, note.rule.states);
  return names;
}

py::tuple Core::typeOf(std::string const& name) const {
  ElementInfo element;
  std::string fileType;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    element = ChannelOps::of(m_state->volume, name)->element();
    auto const all = notes();
    if (auto const found = all.find(name); found != all.end()) fileType = found->second.type;
  }
  return py::make_tuple(element.name, dtypeOf(element), py::tuple(py::cast(element.shape)), fileType);
}

py::array Core::background(std::string const& name) const {
  ElementInfo element;
  std::vector<char> bytes;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto const ops = ChannelOps::of(m_state->volume, name);
    element = ops->element();
    bytes.resize(static_cast<std::size_t>(element.bytes));
    ops->background(bytes.data());
  }
  auto result = newArray(element, {});
  std::memcpy(result.mutable_data(), bytes.data(), bytes.size());
  return result;
}

void Core::add(std::string const& name, std::string const& type, py::array const& background,
               std::string const& gridClass) {
  std::string const elementType = type == "bool" ? "uint8" : type;
  for (auto const& element : ChannelOps::types())
    if (element.name == elementType) checkElements(background, element, name);
  void const* const bytes = background.data();
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  ChannelOps::add(m_state->volume, name, elementType, bytes);
  if (type != "bool" && gridClass.empty()) return;
  static std::map<std::string, std::string> const fileTypes = {
      {"float3", "vec3s"}, {"double3", "vec3d"}, {"int3", "vec3i"}};
  Object object = m_state->volume.object();
  Records records = recordsOf(object);
  Interop::VdbGridRecord record;
  record.channel = name;
  record.type = fileTypes.contains(type) ? fileTypes.at(type) : type;
  std::vector<std::pair<std::string, std::string>> entries{{"name", name}};
  if (!gridClass.empty()) entries.emplace_back("class", gridClass);
  record.metadata = metadataBytes(entries);
  records.append(record);
  object.setProperty(Interop::kVdbGridsProperty, Any(std::move(records)));
  m_state->volume = Volume(object);
}

void Core::removeChannel(std::string const& name) {
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  m_state->volume.removeField(name);
}

py::object Core::box(std::string const& name) const {
  ActiveSamples found;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    found = ChannelOps::of(m_state->volume, name)->active(ruleOf(name), false);
  }
  if (found.count == 0) return py::none();
  auto const corner = [](int3 const& p) { return py::make_tuple(p.x, p.y, p.z); };
  return py::make_tuple(corner(found.low), corner(found.high));
}

std::int64_t Core::activeCount(std::string const& name) const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  return ChannelOps::of(m_state->volume, name)->active(ruleOf(name), false).count;
}

py::array Core::active(std::string const& name) const {
  std::vector<int3> all;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto found = ChannelOps::of(m_state->volume, name)->active(ruleOf(name), true);
    all = std::move(found.voxels);
    if (double(found.count) * sizeof(int3) > 1e14) throw std::bad_alloc();
    all.reserve(static_cast<std::size_t>(found.count));
    std::int64_t sinceLook = 0;
    for (auto const& wide : found.wide)
      for (int k = 0; k < wide.width; ++k)
        for (int j = 0; j < wide.width; ++j) {
          if ((sinceLook += wide.width) > (1 << 24)) checkSignals(), sinceLook = 0;
          for (int i = 0; i < wide.width; ++i)
            all.push_back({wide.corner.x + i, wide.corner.y + j, wide.corner.z + k});
        }
  }
  return rowsOf(all);
}

py::array Core::toNumpy(std::string const& name, Long3 const& low, Long3 const& count, int depth) const {
  checkDepth(depth);
  int3 const first = toInt3(low, "box"), size = toInt3(count, "box");
  py::array result;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto const ops = ChannelOps::of(m_state->volume, name);
    auto const& element = ops->element();
    char* out = nullptr;
    {
      py::gil_scoped_acquire const gil;
      result = newArray(element, {size.z, size.y, size.x});
      out = static_cast<char*>(result.mutable_data());
    }
    ops->dense(first, size, depth, out, [] { checkSignals(); });
  }
  return result;
}

py::object Core::sample(std::string const& name, Rows<double> const& xyz, bool gradient, bool world) const {
  auto const rows = rowCount(xyz, "xyz");
  auto const* const from = reinterpret_cast<double3 const*>(xyz.data());
  py::array result, slopes;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto const ops = ChannelOps::of(m_state->volume, name);
    auto const& element = ops->element();
    char* out = nullptr;
    float* slopesOut = nullptr;
    {
      py::gil_scoped_acquire const gil;
      if (gradient && element.name != "float")
        throw py::type_error("gradients are those of float channels; '" + name + "' holds " + element.name);
      result = newArray(element, {rows});
      out = static_cast<char*>(result.mutable_data());
      if (gradient) {
        slopes = py::array_t<float>({rows, py::ssize_t(3)});
        slopesOut = static_cast<float*>(slopes.mutable_data());
      }
    }
    auto const& map = m_state->indexToWorld;
    bool const asIs = !world;
    ToIndex const toIndex(map);
    std::vector<double3> index;
    std::vector<float3> slope;
    for (std::int64_t part = 0; part < rows; part += kPart) {
      if (part > 0) checkSignals();
      auto const n = static_cast<std::size_t>(std::min<std::int64_t>(kPart, rows - part));
      index.assign(from + part, from + part + n);
      for (std::size_t i = 0; i < n; ++i) {
        double3 const& p = index[i];
        if (!(std::isfinite(p.x) && std::isfinite(p.y) && std::isfinite(p.z)))
          throw std::invalid_argument("row " + std::to_string(part + std::int64_t(i)) +
                                      " of xyz is no position: it is not finite");
      }
      if (!asIs) toIndex(index);
      slope.resize(gradient ? n : 0);
      ops->sample(index.data(), std::int64_t(n), out + part * element.bytes,
                  gradient ? slope.data() : nullptr);
      for (std::size_t i = 0; gradient && i < n; ++i) {
        float3 const& g = slope[i];
        double3 const w = asIs ? double3{g.x, g.y, g.z} : map.gradientToWorld({g.x, g.y, g.z}, index[i]);
        float* const to = slopesOut + 3 * (part + std::int64_t(i));
        to[0] = float(w.x), to[1] = float(w.y), to[2] = float(w.z);
      }
    }
  }
  if (gradient) return py::make_tuple(result, slopes);
  return result;
}

py::array Core::transform(Rows<double> const& from, bool toWorld) const {
  auto const rows = rowCount(from, toWorld ? "ijk" : "xyz");
  py::array_t<double> result({rows, py::ssize_t(3)});
  auto const* const in = reinterpret_cast<double3 const*>(from.data());
  auto* const out = reinterpret_cast<double3*>(result.mutable_data());
  py::gil_scoped_release const nogil;
  auto const& map = m_state->indexToWorld;
  for (py::ssize_t n = 0; n < rows; ++n) {
    if (n > 0 && n % kPart == 0) checkSignals();
    out[n] = toWorld ? map.toWorld(in[n]) : map.toIndex(in[n]);
  }
  return result;
}

py::array Core::get(std::string const& name, Rows<int> const& ijk) const {
  auto const rows = rowCount(ijk, "ijk");
  auto const* const from = reinterpret_cast<int3 const*>(ijk.data());
  py::array result;
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  auto const ops = ChannelOps::of(m_state->volume, name);
  char* out = nullptr;
  {
    py::gil_scoped_acquire const gil;
    result = newArray(ops->element(), {rows});
    out = static_cast<char*>(result.mutable_data());
  }
  ops->get(from, rows, out);
  return result;
}

void Core::set(std::string const& name, Rows<int> const& ijk, py::array const& values) {
  auto const rows = rowCount(ijk, "ijk");
  auto const element = [&] {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    return ChannelOps::of(m_state->volume, name)->element();
  }();
  if (checkElements(values, element, name) != rows)
    throw py::value_error("values and ijk for channel '" + name + "' differ in length");
  auto const* const positions = reinterpret_cast<int3 const*>(ijk.data());
  void const* const bytes = values.data();
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  auto const ops = ChannelOps::of(m_state->volume, name);
  if (ops->element().name != element.name) throw std::runtime_error("the channel changed its type meanwhile");
  ops->set(positions, rows, bytes);
  if (auto const rule = ruleOf(name); rule.kind == ActiveRule::Kind::kStates) {
    std::vector<unsigned char> const on(static_cast<std::size_t>(rows),
                                        Interop::kVdbStateActive | Interop::kVdbStateLeaf);
    ChannelOps::of(m_state->volume, rule.states)->set(positions, rows, on.data());
  }
  m_state->volume.topology(); // everything follows now, so that reads find nothing to do
}

void Core::fromNumpy(std::string const& name, py::array const& array, Long3 const& low, double tolerance) {
  int3 const corner = toInt3(low, "origin");
  auto const element = [&] {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    return ChannelOps::of(m_state->volume, name)->element();
  }();
  if (!array.dtype().equal(dtypeOf(element)))
    throw py::type_error("the array must be " + std::string(py::str(dtypeOf(element))));
  auto const inner = static_cast<py::ssize_t>(element.shape.size());
  if (array.ndim() != 3 + inner) throw py::value_error("the array has the wrong number of axes");
  StridedArray strided;
  strided.data = static_cast<char const*>(array.data());
  for (int a = 0; a < 3; ++a) {
    strided.count[a] = array.shape(a);
    strided.step[a] = array.strides(a);
    if (std::int64_t(corner[a]) + array.shape(a) - 1 > Shape::kMaxTileCoord ||
        corner[a] < Shape::kMinTileCoord)
      throw py::index_error("the array reaches beyond the volume's domain");
  }
  for (py::ssize_t a = 0; a < inner; ++a) {
    if (array.shape(3 + a) != element.shape[static_cast<std::size_t>(a)])
      throw py::value_error("the array's elements have the wrong shape");
    strided.innerCount.push_back(array.shape(3 + a));
    strided.innerStep.push_back(array.strides(3 + a));
  }
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  auto const ops = ChannelOps::of(m_state->volume, name);
  if (ops->element().name != element.name) throw std::runtime_error("the channel changed its type meanwhile");
  ops->fromDense(strided, corner, tolerance, [] { checkSignals(); });
  m_state->volume.topology();
}

void Core::pack(std::string const& name) {
  Object object = m_state->volume.object();
  object.addComponent(ChannelOps::of(m_state->volume, name)->packed());
  m_state->volume = Volume(object);
}

void Core::beginWrite(std::string const& name) {
  py::gil_scoped_release const nogil;
  Changing const changing(*m_state);
  ChannelOps::of(m_state->volume, name)->prepareWrite();
}

py::array Core::values(std::string const& name, int depth, bool writable) {
  checkDepth(depth);
  ElementInfo element;
  TileBlockView block;
  std::unique_ptr<Pin> pin;
  {
    py::gil_scoped_release const nogil;
    for (int attempt = 0; !pin; ++attempt) {
      {
        Reading const reading(*m_state);
        auto const ops = ChannelOps::of(m_state->volume, name);
        element = ops->element();
        block = ops->block(depth);
        if (block.regular) pin = std::make_unique<Pin>(m_state, name);
      }
      if (pin) break;
      if (attempt > 2) throw std::runtime_error("the tiles of '" + name + "' do not lie in one block");
      Changing const changing(*m_state, name);
      pack(name);
    }
  }
  if (block.tiles == 0) return newArray(element, {0, block.elements});
  py::capsule const owner(pin.release(), [](void* p) { delete static_cast<Pin*>(p); });
  std::vector<py::ssize_t> shape{block.tiles, block.elements};
  for (int const n : element.shape) shape.push_back(n);
  py::array result(dtypeOf(element), shape, {}, block.data, owner);
  if (!writable) result.attr("flags").attr("writeable") = false;
  return result;
}

py::array Core::origins(int depth) const {
  checkDepth(depth);
  std::vector<int3> list;
  {
    py::gil_scoped_release const nogil;
    Reading const reading(*m_state);
    auto const& tree = std::as_const(m_state->volume).tree();
    auto const count = tree.tileCount(depth);
    list.reserve(static_cast<std::size_t>(count));
    for (std::int64_t n = 0; n < count; ++n) list.push_back(tree.tile(n, depth).tijk());
  }
  return rowsOf(list);
}

std::vector<std::int64_t> Core::tileCounts() const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  std::vector<std::int64_t> counts;
  for (int d = 0; d <= kFinest; ++d) counts.push_back(std::as_const(m_state->volume).tree().tileCount(d));
  return counts;
}

int Core::rootDepth() const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  auto const& tree = std::as_const(m_state->volume).tree();
  for (int d = 0; d <= kFinest; ++d)
    if (tree.tileCount(d) > 0) return d;
  return kFinest - 10; // new roots are 4096 samples wide
}

double Core::voxelSize() const { return m_state->indexToWorld.voxelSize().x; }

std::uint64_t Core::bytes() const {
  py::gil_scoped_release const nogil;
  Reading const reading(*m_state);
  std::uint64_t used = 0, allocated = 0;
  auto const object = m_state->volume.object();
  for (auto const& name : object.componentRange()) object.component(name)->memUse(used, allocated, true);
  return allocated;
}

} // namespace VLN::Python
