// The module vln._vln: what Python's part of the package stands on.
#include "Core.h"
#include "Files.h"
#include "Flat.h"

#include "GeometryVolume/core/Version.h"
#include "Interop/FileError.h"
#include "Interop/VdbFile.h"

namespace VLN::Python {

void checkSignals() {
  py::gil_scoped_acquire const gil;
  if (PyErr_CheckSignals() != 0) throw py::error_already_set();
}

namespace {

using Interop::FlatVolume;

Interop::Quantisation quantisationOf(std::string const& name) {
  using Q = Interop::Quantisation;
  std::pair<char const*, Q> const table[] = {
      {"none", Q::kNone}, {"fp4", Q::kFp4}, {"fp8", Q::kFp8}, {"fp16", Q::kFp16}, {"fpn", Q::kFpN}};
  for (auto const& [known, value] : table)
    if (name == known) return value;
  throw py::value_error("quantisation '" + name + "' is none: it is none, fp4, fp8, fp16 or fpn");
}

std::shared_ptr<FlatVolume> flatten(Core const& core, std::string const& channels,
                                    std::string const& quantisation, double tolerance, bool morton,
                                    bool coalesce, int finestLevel, bool traversal) {
  Interop::FlattenOptions options;
  options.channels = channels;
  options.quantisation = quantisationOf(quantisation);
  options.tolerance = static_cast<float>(tolerance);
  options.morton = morton;
  options.coalesce = coalesce;
  options.finestLevel = finestLevel;
  options.traversal = traversal;
  return core.flatten(options);
}

void registerExceptions(py::module_& module) {
  static PyObject* fileError = PyErr_NewExceptionWithDoc(
      "vln.FileError", "A file that cannot be read or written, in one line.", PyExc_OSError, nullptr);
  module.add_object("FileError", py::handle(fileError));
  py::register_exception_translator([](std::exception_ptr thrown) {
    try {
      if (thrown) std::rethrow_exception(thrown);
    } catch (Interop::FileError const& error) {
      PyErr_SetString(fileError, error.what());
    } catch (ViewsAlive const& error) { PyErr_SetString(PyExc_BufferError, error.what()); }
  });
}

} // namespace

} // namespace VLN::Python

using namespace VLN::Python;

PYBIND11_MODULE(_vln, module) {
  registerExceptions(module);
  defineFlat(module);
  py::class_<Core, std::shared_ptr<Core>>(module, "Core")
      .def(py::init<double, std::array<double, 3> const&>())
      .def("names", &Core::names)
      .def("type_of", &Core::typeOf)
      .def("background", &Core::background)
      .def("add", &Core::add)
      .def("remove_channel", &Core::removeChannel)
      .def("box", &Core::box)
      .def("active_count", &Core::activeCount)
      .def("active", &Core::active)
      .def("to_numpy", &Core::toNumpy)
      .def("sample", &Core::sample)
      .def("get", &Core::get)
      .def("set", &Core::set)
      .def("from_numpy", &Core::fromNumpy)
      .def("values", &Core::values)
      .def("begin_write", &Core::beginWrite)
      .def("origins", &Core::origins)
      .def("tile_counts", &Core::tileCounts)
      .def("root_depth", &Core::rootDepth)
      .def("views", &Core::views)
      .def("refine_all", &Core::refineAll)
      .def("refine_tiles", &Core::refineTiles)
      .def("remove_tiles", &Core::removeTiles)
      .def("fill_halos", &Core::fillHalos)
      .def("fill_coarse", &Core::fillCoarse)
      .def("to_world", &Core::toWorld)
      .def("to_index", &Core::toIndex)
      .def("voxel_size", &Core::voxelSize)
      .def("besides_scale", &Core::besidesScale)
      .def("nbytes", &Core::bytes)
      .def("picture", &Core::picture)
      .def("render", &Core::render)
      .def("save", &Core::save)
      .def("save_dense", &Core::saveDense)
      .def("flatten", &flatten);

  module.def("open_file", &openFile);
  module.def("save_file", &saveFile);
  module.def("save_points", &savePoints);
  module.def("element_types", [] {
    py::dict types;
    for (auto const& e : ChannelOps::types())
      types[py::str(e.name)] = py::make_tuple(dtypeOf(e), py::tuple(py::cast(e.shape)));
    return types;
  });
  module.attr("FINEST") = kFinest;
  auto const& version = VLN::versionInfo();
  module.attr("VERSION") = std::to_string(version.majorNumber) + "." + std::to_string(version.minorNumber) +
                           "." + std::to_string(version.patchNumber);
  module.attr("OPENVDB_VERSION") = VLN::Interop::openvdbVersion();
}
