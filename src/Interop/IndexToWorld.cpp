#include "Interop/IndexToWorldImpl.h"

#include "Interop/VdbImportImpl.h"

#include <openvdb/io/io.h>

#include <sstream>
#include <stdexcept>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

double3 toDouble3(openvdb::Vec3d const& v) { return {v[0], v[1], v[2]}; }

openvdb::math::Transform::Ptr read(std::string const& bytes) {
  openvdb::initialize();
  std::istringstream in(bytes, std::ios::binary);
  openvdb::io::setCurrentVersion(in);
  in.exceptions(std::ios::failbit | std::ios::badbit | std::ios::eofbit);
  auto transform = openvdb::math::Transform::createLinearTransform();
  try {
    transform->read(in);
  } catch (std::exception const&) { throw std::runtime_error("a stored transform cannot be read"); }
  return transform;
}

} // namespace

std::string transformBytes(openvdb::math::Transform const& transform) {
  std::ostringstream out(std::ios::binary);
  transform.write(out);
  return out.str();
}

IndexToWorld::IndexToWorld()
    : m_impl(std::make_shared<Impl>(Impl{openvdb::math::Transform::createLinearTransform()})) {}
IndexToWorld::IndexToWorld(std::string const& bytes)
    : m_impl(std::make_shared<Impl>(Impl{read(bytes)})) {}
IndexToWorld::IndexToWorld(double scale, double3 const& origin) {
  auto transform = openvdb::math::Transform::createLinearTransform(scale);
  transform->postTranslate({origin.x, origin.y, origin.z});
  m_impl = std::make_shared<Impl>(Impl{std::move(transform)});
}

double3 IndexToWorld::toWorld(double3 const& p) const {
  return toDouble3(m_impl->transform->indexToWorld(openvdb::Vec3d(p.x, p.y, p.z)));
}
double3 IndexToWorld::toIndex(double3 const& p) const {
  return toDouble3(m_impl->transform->worldToIndex(openvdb::Vec3d(p.x, p.y, p.z)));
}
double3 IndexToWorld::gradientToWorld(double3 const& g, double3 const& p) const {
  return toDouble3(
      m_impl->transform->baseMap()->applyIJT(openvdb::Vec3d(g.x, g.y, g.z), openvdb::Vec3d(p.x, p.y, p.z)));
}
double3 IndexToWorld::voxelSize() const { return toDouble3(m_impl->transform->voxelSize()); }
std::string IndexToWorld::besidesScale() const { return transformBesidesScale(*m_impl->transform); }
std::string IndexToWorld::bytes() const { return transformBytes(*m_impl->transform); }

} // namespace VLN::Interop
