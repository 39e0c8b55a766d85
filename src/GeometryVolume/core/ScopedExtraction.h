// ScopedExtraction: a component that is out of its object for as long as this lives.
#pragma once

#include "GeometryVolume/core/Object.h"

#include <utility>

namespace VLN::Internal {

/// As Object::extractComponent and putComponent, but the key keeps its place among the object's properties,
/// and the component comes back whatever is thrown. A component that only the object holds is not copied, so
/// the caller must hold no handle of its own.
template <class T> class ScopedExtraction {
public:
  /// @pre The property is a `T`.
  ScopedExtraction(VLN::Object& object, Ostil::String const& name)
      : m_object(&object)
      , m_name(name) {
    auto shared = Ostil::staticCast<T>(object.component(name));
    object.setProperty(name, Ostil::Any());
    if (shared.unique()) {
      m_component = Ostil::MutablePtr<T>(std::move(shared));
      return;
    }
    try {
      m_component = Ostil::MutablePtr<T>(Ostil::Ptr<T>(shared));
    } catch (...) {
      putBack(std::move(shared));
      throw;
    }
  }
  ScopedExtraction(ScopedExtraction&& other) noexcept
      : m_object(std::exchange(other.m_object, nullptr))
      , m_name(std::move(other.m_name))
      , m_component(std::move(other.m_component)) {}
  ScopedExtraction& operator=(ScopedExtraction&&) = delete;
  ~ScopedExtraction() {
    if (m_object) putBack(std::move(m_component));
  }
  T& operator*() const { return *m_component; }
  /// The component for good: its key goes.
  Ostil::MutablePtr<T> keep() {
    std::exchange(m_object, nullptr)->eraseProperty(m_name);
    return std::move(m_component);
  }

private:
  void putBack(Ostil::Ptr<VLN::Component> component) {
    m_object->setProperty(m_name, Ostil::Any(std::move(component)));
  }

  VLN::Object* m_object;
  Ostil::String m_name;
  Ostil::MutablePtr<T> m_component;
};

} // namespace VLN::Internal
