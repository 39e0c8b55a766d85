#include "ChannelOps.h"

#include "GeometryVolume/core/ElementTypes.h"

#include <stdexcept>

namespace VLN::Python {

#define VLN_DECLARE(type, name)                                                                              \
  std::unique_ptr<ChannelOps> makeOps_##name(Volume const& volume, std::string const& field);                \
  std::unique_ptr<ChannelOps> addField_##name(Volume& volume, std::string const& field,                      \
                                              void const* background);                                       \
  ElementInfo elementInfo_##name();
VLN_FOR_EACH_ELEMENT_TYPE(VLN_DECLARE)
#undef VLN_DECLARE

std::unique_ptr<ChannelOps> ChannelOps::of(Volume const& volume, std::string const& name) {
#define VLN_TRY(type, typeName)                                                                              \
  if (auto ops = makeOps_##typeName(volume, name)) return ops;
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY)
#undef VLN_TRY
  throw std::invalid_argument("the volume has no channel '" + name + "'");
}

std::unique_ptr<ChannelOps> ChannelOps::add(Volume& volume, std::string const& name, std::string const& type,
                                            void const* background) {
#define VLN_TRY(elementType, typeName)                                                                       \
  if (type == #typeName) return addField_##typeName(volume, name, background);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY)
#undef VLN_TRY
  throw std::invalid_argument("'" + type + "' is no element type of this build");
}

std::vector<ElementInfo> ChannelOps::types() {
  std::vector<ElementInfo> result;
#define VLN_TELL(type, typeName) result.push_back(elementInfo_##typeName());
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TELL)
#undef VLN_TELL
  return result;
}

} // namespace VLN::Python
