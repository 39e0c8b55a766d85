#include "Velorn/Object.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace Velorn {

namespace {

/// Volumes hold tens of properties: a scan of a vector in insertion order beats a map.
class PropertyList final : public Object {
public:
  std::uint64_t size() const override { return m_properties.size(); }
  bool empty() const override { return m_properties.empty(); }
  bool hasProperty(Ostil::String const& key) const override { return find(key) != m_properties.end(); }

  Ostil::Any getProperty(Ostil::String const& key) const override {
    auto const at = find(key);
    return at == m_properties.end() ? Ostil::Any() : at->second;
  }
  Ostil::Any extractProperty(Ostil::String const& key) override {
    auto const at = find(key);
    if (at == m_properties.end()) return {};
    Ostil::Any value = std::move(m_properties[at - m_properties.begin()].second);
    m_properties.erase(at);
    return value;
  }
  bool eraseProperty(Ostil::String const& key) override {
    auto const at = find(key);
    if (at == m_properties.end()) return false;
    m_properties.erase(at);
    return true;
  }
  void eraseAllProperties() override { m_properties.clear(); }

  Ostil::Ptr<Ostil::Array<Ostil::String>> keys() const override {
    auto list = Ostil::makePtr<Ostil::Array<Ostil::String>>();
    list->reserve(m_properties.size());
    for (auto const& property : m_properties) list->append(property.first);
    return list;
  }
  void setProperty(Ostil::String const& key, Ostil::Any value) override {
    auto const at = find(key);
    if (at == m_properties.end())
      m_properties.emplace_back(key, std::move(value));
    else
      m_properties[at - m_properties.begin()].second = std::move(value);
  }

private:
  using Properties = std::vector<std::pair<Ostil::String, Ostil::Any>>;

  Properties::const_iterator find(Ostil::String const& key) const {
    return std::find_if(m_properties.begin(), m_properties.end(),
                        [&](auto const& p) { return p.first == key; });
  }

  Properties m_properties;
};

} // namespace

Object::~Object() = default;

Ostil::MutablePtr<Object> createObject() { return Ostil::makeMutable<PropertyList>(); }

} // namespace Velorn
