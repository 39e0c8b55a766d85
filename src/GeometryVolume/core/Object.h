// Object: a volume as the host sees it, a value handle on a property object whose components it knows by
// name.
//
//   Object --Ptr--> Velorn::Object { "density" : Any(Ptr<Component>), "author" : Any(String), ... }
//
// Handles share the property object. Writing through one handle never changes what another handle sees.
#pragma once

#include "GeometryVolume/core/Component.h"
#include "GeometryVolume/core/Const.h"
#include "Ostil/Any.h"
#include "Ostil/Array.h"
#include "Velorn/Object.h"

namespace VLN {

/// @threads Concurrent readers of one handle are safe; a writer needs the handle for itself. Handles that
/// share a property object may be written from different threads.
class VLN_API Object {
public:
  Object();
  // Copying shares. Moving does the same: a handle is never without an object.
  Object(Object const&) = default;
  Object& operator=(Object const&) = default;

  // Properties
  std::uint64_t size() const { return m_object->size(); }
  bool empty() const { return m_object->empty(); }
  bool hasProperty(Ostil::String const& key) const { return m_object->hasProperty(key); }
  Ostil::Any getProperty(Ostil::String const& key) const { return m_object->getProperty(key); }
  Ostil::Ptr<Ostil::Array<Ostil::String>> keys() const { return m_object->keys(); }
  Ostil::Any extractProperty(Ostil::String const& key);
  bool eraseProperty(Ostil::String const& key);
  void eraseAllProperties();
  void clear() { eraseAllProperties(); }
  /// Stores a plain property.
  void setProperty(Ostil::String const& key, Ostil::Any value);

  // Components
  /// Stores a component under its name, replacing what was there. A component without a name is not stored.
  void addComponent(Ostil::Ptr<Component> component);
  void putComponent(Ostil::MutablePtr<Component> component);
  /// The component of that name, shared with this object; null when there is none.
  Ostil::Ptr<Component> component(Ostil::String const& name) const;
  template <class T> Ostil::Ptr<T> component(Ostil::String const& name) const {
    return Ostil::dynamicCast<T>(component(name));
  }
  bool hasComponentFromName(Ostil::String const& name) const { return bool(component(name)); }
  template <class T> bool hasComponentFromName(Ostil::String const& name) const {
    return bool(component<T>(name));
  }
  /// Whether a component of that name exists; not whether it is `c`.
  bool hasComponent(Component const& c) const { return hasComponentFromName(c.name()); }
  /// Takes a component out. The caller owns it alone: a component that others still hold is cloned.
  /// A property that is no component stays, and the result is null.
  Ostil::MutablePtr<Component> extractComponent(Ostil::String const& name);
  template <class T> Ostil::MutablePtr<T> extractComponent(Ostil::String const& name) {
    if (!component<T>(name)) return nullptr;
    Ostil::Ptr<Component> taken = extractComponent(name);
    auto* object = dynamic_cast<T*>(taken.get());
    Ostil::Ptr<T> cast(object, taken.block());
    taken.forget();
    return Ostil::MutablePtr<T>(std::move(cast));
  }
  /// Takes a component out and clears it; a plain property stays. The second argument is ignored.
  void removeComponent(Ostil::String const& name, Component* ignored = nullptr);
  /// Names of the components in the order of keys().
  Ostil::Array<Ostil::String> componentRange() const;
  /// Number of handles that share the property object.
  std::int64_t componentsUseCount() const { return m_object.useCount(); }

  /// Deep copy of all components into a new object. Plain properties are not carried over.
  void copyTo(Ostil::Ptr<Object>& target) const;

private:
  class WriteAccess;

  Ostil::Ptr<Velorn::Object> m_object;
};

/// A new object without properties.
VLN_API Ostil::MutablePtr<Object> createEmptyVLN();

} // namespace VLN
