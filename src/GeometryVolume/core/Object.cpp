#include "GeometryVolume/core/Object.h"

#include "GeometryVolume/core/ScopedExtraction.h"

#include <utility>

namespace VLN {

/// Holds the property object alone while it is written; the handle is null meanwhile.
class Object::WriteAccess {
public:
  explicit WriteAccess(Object& handle)
      : m_handle(handle)
      , m_object(makeUnique(handle.m_object)) {}
  ~WriteAccess() { m_handle.m_object = std::move(m_object); }
  WriteAccess(WriteAccess const&) = delete;
  WriteAccess& operator=(WriteAccess const&) = delete;
  Velorn::Object* operator->() const { return m_object.get(); }

private:
  /// Leaves the handle whole when the clone throws.
  static Ostil::MutablePtr<Velorn::Object> makeUnique(Ostil::Ptr<Velorn::Object>& shared) {
    if (shared.unique()) return Ostil::MutablePtr<Velorn::Object>(std::move(shared));
    Ostil::MutablePtr<Velorn::Object> own{Ostil::Ptr<Velorn::Object>(shared)};
    shared.reset();
    return own;
  }

  Object& m_handle;
  Ostil::MutablePtr<Velorn::Object> m_object;
};

namespace {

Ostil::Ptr<Component> heldComponent(Ostil::Any const& property) {
  auto const* held = property.get<Ostil::Ptr<Component>>();
  return held ? *held : nullptr;
}

} // namespace

Object::Object()
    : m_object(Velorn::createObject()) {}

Ostil::Any Object::extractProperty(Ostil::String const& key) {
  return WriteAccess(*this)->extractProperty(key);
}
bool Object::eraseProperty(Ostil::String const& key) { return WriteAccess(*this)->eraseProperty(key); }
void Object::eraseAllProperties() { WriteAccess(*this)->eraseAllProperties(); }
void Object::setProperty(Ostil::String const& key, Ostil::Any value) {
  WriteAccess(*this)->setProperty(key, std::move(value));
}

void Object::addComponent(Ostil::Ptr<Component> component) {
  if (!component || component->name().empty()) return;
  Ostil::String const key = component->name();
  WriteAccess(*this)->setProperty(key, Ostil::Any(std::move(component)));
}

void Object::putComponent(Ostil::MutablePtr<Component> component) { addComponent(std::move(component)); }

Ostil::Ptr<Component> Object::component(Ostil::String const& name) const {
  return heldComponent(m_object->getProperty(name));
}

Ostil::MutablePtr<Component> Object::extractComponent(Ostil::String const& name) {
  if (!component(name)) return nullptr;
  return Internal::ScopedExtraction<Component>(*this, name).keep();
}

void Object::removeComponent(Ostil::String const& name, Component*) {
  auto const extracted = extractComponent(name);
  if (extracted) extracted->clear();
}

Ostil::Array<Ostil::String> Object::componentRange() const {
  Ostil::Array<Ostil::String> names;
  auto const all = keys(); // held: a range-for does not keep the pointer behind its range alive
  for (auto const& key : *all) {
    if (component(key)) names.append(key);
  }
  return names;
}

void Object::copyTo(Ostil::Ptr<Object>& target) const {
  if (target.get() == this) return;
  auto copied = Ostil::makePtr<Object>();
  for (auto const& name : componentRange()) {
    Ostil::Ptr<Component> copy;
    component(name)->copyTo(copy);
    copied->addComponent(std::move(copy));
  }
  target = std::move(copied);
}

Ostil::MutablePtr<Object> createEmptyVLN() { return Ostil::makeMutable<Object>(); }

} // namespace VLN
