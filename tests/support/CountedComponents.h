// Small components for tests of the object model.
#pragma once

#include "GeometryVolume/core/Component.h"
#include "Ostil/Ptr.h"

#include <atomic>
#include <utility>
#include <vector>

namespace Support {

/// Holds one number. Counts the copies that live.
class NumberComponent : public VLN::Component {
public:
  explicit NumberComponent(Ostil::String const& name, int number = 0)
      : Component(name)
      , m_number(number) {
    ++s_live;
  }
  NumberComponent(NumberComponent const& b)
      : Component(b)
      , m_number(b.m_number) {
    ++s_live;
  }
  ~NumberComponent() override { --s_live; }

  void copyTo(Ostil::Ptr<VLN::Component>& target) const override {
    if (target.get() == this) return;
    target = Ostil::makePtr<NumberComponent>(*this);
    Component::copyTo(target);
  }
  std::uint64_t size() const override { return static_cast<std::uint64_t>(m_number); }
  void update(VLN::Component const&) override {}

  int number() const { return m_number; }
  void setNumber(int number) { m_number = number; }
  static int live() { return s_live; }

private:
  int m_number;
  static inline std::atomic<int> s_live{0};
};

/// Another class, for wrong-type lookups.
class OtherComponent : public NumberComponent {
public:
  using NumberComponent::NumberComponent;
};

/// Its VLN::Component part does not lie at the start of the object.
struct Ballast {
  virtual ~Ballast() = default;
  std::uint64_t weight[5] = {1, 2, 3, 4, 5};
};
class ShiftedComponent : public Ballast, public NumberComponent {
public:
  using NumberComponent::NumberComponent;
};

} // namespace Support
