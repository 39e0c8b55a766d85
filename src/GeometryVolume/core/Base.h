// Base: root of all named data.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

#include <cstdint>
#include <iosfwd>

namespace VLN {

/// A named object that is registered with the object logger for as long as it lives.
class VLN_API Base {
public:
  Base();
  explicit Base(Ostil::String name);
  /// A new registered object that bears the same name.
  Base(Base const& other);
  /// Assigns the name only.
  Base& operator=(Base const& other);
  virtual ~Base();

  /// Writes the pad, "name = ", the name, and an empty line.
  virtual void dump(std::ostream& os) const;
  /// Bytes in use and bytes held by this object. The flag asks to charge shared data whole.
  virtual void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const;

  Ostil::String const& name() const { return m_name; }
  void setName(Ostil::String const& name);

protected:
  /// Assigns the name to `target`, unless it is this object.
  void copyTo(Base& target) const;

private:
  Ostil::String m_name;
};

} // namespace VLN
