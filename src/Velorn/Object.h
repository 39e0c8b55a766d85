// Object: the host's property object, a set of string-keyed values.
#pragma once

#include "Ostil/Any.h"
#include "Ostil/Array.h"
#include "Ostil/Export.h"
#include "Ostil/Ptr.h"
#include "Ostil/String.h"

#include <cstdint>

namespace Velorn {

class VLN_API Object {
public:
  virtual ~Object();
  virtual std::uint64_t size() const = 0;
  virtual bool empty() const = 0;
  virtual bool hasProperty(Ostil::String const& key) const = 0;
  /// A copy of the value; empty when the key is absent.
  virtual Ostil::Any getProperty(Ostil::String const& key) const = 0;
  /// Removes the property and returns its value; empty when the key is absent.
  virtual Ostil::Any extractProperty(Ostil::String const& key) = 0;
  virtual bool eraseProperty(Ostil::String const& key) = 0;
  virtual void eraseAllProperties() = 0;
  /// Keys in order of insertion. Replacing a value keeps its place.
  virtual Ostil::Ptr<Ostil::Array<Ostil::String>> keys() const = 0;
  virtual void setProperty(Ostil::String const& key, Ostil::Any value) = 0;
};

/// A new, empty property object.
VLN_API Ostil::MutablePtr<Object> createObject();

} // namespace Velorn
