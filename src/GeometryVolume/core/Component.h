// Component: a named part of a volume that may depend on another part by name.
#pragma once

#include "GeometryVolume/core/Base.h"
#include "Ostil/Ptr.h"

namespace VLN {

class VLN_API Component : public Base {
public:
  Component() = default;
  explicit Component(Ostil::String const& name)
      : Base(name) {}
  Component(Component const& other) = default;
  Component& operator=(Component const& other);
  ~Component() override;

  /// As Base::dump, then the size and the address of the component.
  void dump(std::ostream& os) const override;
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;
  /// Deep copy into `target`. This level copies target name and name onto the object that `target` holds, and
  /// does nothing when `target` is empty or this object.
  virtual void copyTo(Ostil::Ptr<Component>& target) const;
  virtual std::uint64_t size() const = 0;
  virtual bool empty() const;
  /// Brings this component into step with the one it depends on.
  virtual void update(Component const& source) = 0;

  Ostil::String const& getTargetName() const { return m_targetName; }
  void setTargetName(Ostil::String const& name) { m_targetName = name; }
  /// Empties the target name only.
  void clear() { m_targetName.clear(); }

private:
  Ostil::String m_targetName;
};

} // namespace VLN
