#include "Flat.h"

#include "Interop/Flatten.h"
#include "Interop/NvttWrite.h"

#include <pybind11/numpy.h>

#include <memory>

namespace VLN::Python {

namespace py = pybind11;

namespace {

using Interop::FlatVolume;

// The few records of DLPack's binary interface (version 0) that a buffer of bytes on the CPU needs.
struct DlTensor {
  void* data;
  std::int32_t deviceType, deviceId;
  std::int32_t dimensions;
  std::uint8_t code, bits;
  std::uint16_t lanes;
  std::int64_t* shape;
  std::int64_t* strides;
  std::uint64_t byteOffset;
};
struct DlManagedTensor {
  DlTensor tensor;
  void* context;
  void (*deleter)(DlManagedTensor*);
};

/// The bytes as a tensor that keeps the buffer alive. The interface has no word for "read-only".
py::object toDlPack(std::shared_ptr<FlatVolume> flat) {
  struct Held {
    DlManagedTensor managed;
    std::int64_t shape;
    std::shared_ptr<FlatVolume> flat;
  };
  auto* const held = new Held;
  held->flat = std::move(flat);
  held->shape = static_cast<std::int64_t>(held->flat->buffer.size());
  held->managed.tensor = {held->flat->buffer.data(), 1, 0, 1, 1, 8, 1, &held->shape, nullptr, 0};
  held->managed.context = held;
  held->managed.deleter = [](DlManagedTensor* managed) { delete static_cast<Held*>(managed->context); };
  // Whoever takes the tensor renames the capsule, and calls the deleter.
  PyObject* const capsule = PyCapsule_New(&held->managed, "dltensor", [](PyObject* self) {
    if (!PyCapsule_IsValid(self, "dltensor")) return;
    auto* const managed = static_cast<DlManagedTensor*>(PyCapsule_GetPointer(self, "dltensor"));
    managed->deleter(managed);
  });
  if (!capsule) {
    delete held;
    throw py::error_already_set();
  }
  return py::reinterpret_steal<py::object>(capsule);
}

void save(FlatVolume const& flat, std::string const& path) {
  py::gil_scoped_release const nogil;
  Interop::NvttContent content{.buffer = flat.buffer.data(), .bufferLength = flat.buffer.size()};
  if (flat.traversal.size() > 0) {
    content.traversal = flat.traversal.data();
    content.traversalLength = flat.traversal.size();
  }
  Interop::writeNvtt(path, content);
}

py::dict arrayInterface(FlatVolume const& flat) {
  py::dict result;
  result["shape"] = py::make_tuple(flat.buffer.size());
  result["typestr"] = "|u1";
  result["version"] = 3;
  result["data"] = py::make_tuple(reinterpret_cast<std::uintptr_t>(flat.buffer.data()), true);
  return result;
}

} // namespace

void defineFlat(py::module_& module) {
  py::class_<FlatVolume, std::shared_ptr<FlatVolume>>(
      module, "Flat", py::buffer_protocol(),
      "A flat buffer: bytes that readers on a CPU or a GPU take as they are. Read-only.\n\n"
      "It is given on without a copy through the buffer protocol, __array_interface__ and DLPack.")
      .def_buffer([](FlatVolume& flat) {
        return py::buffer_info(flat.buffer.data(), 1, py::format_descriptor<std::uint8_t>::format(), 1,
                               {flat.buffer.size()}, {std::size_t(1)}, true);
      })
      .def_property_readonly("__array_interface__", &arrayInterface)
      .def(
          "__dlpack__", [](std::shared_ptr<FlatVolume> flat, py::object const&) { return toDlPack(flat); },
          py::arg("stream") = py::none())
      .def("__dlpack_device__", [](FlatVolume const&) { return py::make_tuple(1, 0); })
      .def("__len__", [](FlatVolume const& f) { return f.buffer.size(); })
      .def("__repr__",
           [](FlatVolume const& f) { return "<vln.Flat " + std::to_string(f.buffer.size()) + " bytes>"; })
      .def(
          "to_numpy", [](py::object self) { return py::module_::import("numpy").attr("asarray")(self); },
          "The bytes, without a copy. The array keeps the buffer alive.")
      .def_property_readonly("nbytes", [](FlatVolume const& f) { return f.buffer.size(); })
      .def_property_readonly("seconds", [](FlatVolume const& f) { return f.seconds; })
      .def(
          "save",
          [](FlatVolume const& flat, py::object const& path) {
            save(flat, py::module_::import("os").attr("fsdecode")(path).cast<std::string>());
          },
          py::arg("path"), "Writes a .nvtt file.");
}

} // namespace VLN::Python
