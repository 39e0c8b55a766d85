// The few records of DLPack's binary interface (version 0) that a buffer of bytes on the CPU needs.
#pragma once

#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"
#include "Interop/Flatten.h"

#include <pybind11/pybind11.h>

#include <memory>

namespace VLN::Python {

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
inline pybind11::object toDlPack(std::shared_ptr<Interop::FlatVolume> flat) {
  struct Held {
    DlManagedTensor managed;
    std::int64_t shape;
    std::shared_ptr<Interop::FlatVolume> flat;
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
    throw pybind11::error_already_set();
  }
  return pybind11::reinterpret_steal<pybind11::object>(capsule);
}

} // namespace VLN::Python
