#include "GeometryVolume/core/Base.h"

#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"
#include "GeometryVolume/core/Version.h"

#include <ostream>
#include <utility>

namespace VLN {

namespace {
/// Brings the source of the version banner into programs that link the library statically.
[[gnu::used]] bool (*const g_bannerAnchor)() noexcept = &versionBannerAsked;

void registerBase(Base const* base) {
  if (auto const* hooks = loggerHooks()) hooks->baseBuilt(base);
}
} // namespace

Base::Base() { registerBase(this); }
Base::Base(Ostil::String name)
    : m_name(std::move(name)) {
  registerBase(this);
}
Base::Base(Base const& other)
    : m_name(other.m_name) {
  registerBase(this);
}

Base& Base::operator=(Base const& other) {
  if (this != &other) setName(other.m_name);
  return *this;
}

Base::~Base() {
  if (auto const* hooks = Internal::anyLoggerHooks()) hooks->baseDestroyed(this);
}

void Base::setName(Ostil::String const& name) {
  m_name = name;
  if (auto const* hooks = Internal::anyLoggerHooks(); hooks && hooks->baseRenamed) hooks->baseRenamed(this);
}

void Base::dump(std::ostream& os) const { os << Streaming::pad(os) << "name = " << m_name << '\n' << '\n'; }

void Base::memUse(std::uint64_t& used, std::uint64_t& allocated, bool) const {
  used = sizeof(Base);
  allocated = sizeof(Base);
}

void Base::copyTo(Base& target) const {
  if (&target != this) target.setName(m_name);
}

} // namespace VLN
