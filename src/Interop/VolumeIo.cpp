#include "Interop/VolumeIo.h"

#include "GeometryVolume/core/ElementTypes.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Flatten.h"
#include "Interop/NvttWrite.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbTypesImpl.h"
#include "Interop/VolumeExport.h"

#include <algorithm>
#include <sstream>
#include <typeindex>

namespace VLN::Interop {

namespace {

using TileTree3D::ChannelBase;
using TileTree3D::Volume;

/// As OpenVDB names the type of a grid that keeps all values; empty where it has none.
std::string vdbTypeOf(std::type_index type) {
#define VLN_TRY_TYPE(known, name, pool, flat, vdb)                                                           \
  if (type == typeid(known)) return vdb;
  VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  return {};
}

std::string nameAsMetadata(std::string const& name) {
  openvdb::MetaMap map;
  map.insertMeta("name", openvdb::StringMetadata(name));
  std::ostringstream out(std::ios::binary);
  map.writeMeta(out);
  return out.str();
}

template <class T> T propertyOr(Object const& object, char const* key, T otherwise) {
  Ostil::Any const holder = object.getProperty(key);
  T const* const found = holder.get<T>();
  return found ? *found : otherwise;
}

/// The object with a record for each field, as exportVdb() wants it.
Object withRecords(Volume const& volume, std::string const& path) {
  openvdb::initialize();
  Object object = volume.object();
  auto const old = propertyOr(object, kVdbGridsProperty, Ostil::Array<VdbGridRecord>());
  Ostil::Array<VdbGridRecord> records;
  auto names = volume.fieldNames();
  auto const take = [&](std::string const& name) {
    auto const at = std::find(names.begin(), names.end(), name);
    if (at == names.end()) return false;
    names.erase(at);
    return true;
  };
  for (auto const& record : old)
    if (take(record.channel)) records.append(record);
  for (auto const& record : old) take(record.stateChannel);
  for (auto const& name : names) {
    std::string const type = vdbTypeOf(object.component<ChannelBase>(name)->elementType());
    if (type.empty())
      throw FileError(path, "the field '" + name + "' is of a type that .vdb files do not have");
    records.append({name, type, VdbActiveRule::kNotBackground, "", nameAsMetadata(name), {}});
  }
  object.setProperty(kVdbGridsProperty, Ostil::Any(std::move(records)));
  if (!object.hasProperty(kVdbTransformProperty))
    object.setProperty(
        kVdbTransformProperty,
        Ostil::Any(Ostil::String(IndexToWorld(double(volume.voxelSize()), {0, 0, 0}).bytes())));
  return object;
}

} // namespace

Volume load(std::string const& path) {
  auto const content = importVolumes(path);
  if (content.volumes.empty()) throw FileError(path, "holds no volume");
  if (content.volumes.size() > 1)
    throw FileError(path, "holds " + std::to_string(content.volumes.size()) +
                              " volumes, each with a transform of its own");
  return Volume(*content.volumes.front().object);
}

VdbVolume writtenVolume(Volume const& volume, std::string const& path) {
  VdbVolume written;
  written.object = Ostil::makePtr<Object>(withRecords(volume, path));
  written.indexToWorld = IndexToWorld(propertyOr(*written.object, kVdbTransformProperty, Ostil::String()));
  for (auto const& record : propertyOr(*written.object, kVdbGridsProperty, Ostil::Array<VdbGridRecord>())) {
    VdbChannel channel;
    channel.name = channel.gridName = record.channel;
    channel.type = record.type;
    written.channels.push_back(channel);
  }
  return written;
}

void save(Volume const& volume, std::string const& path) {
  FileFormat const format = checkOutputFor(FileContent::kVolumes, path);
  if (format == FileFormat::kNvtt) {
    auto const flat = flattenVolume(volume.object(), {});
    writeNvtt(path, {.buffer = flat.buffer.data(), .bufferLength = flat.buffer.size()});
    return;
  }
  VdbImport content;
  content.file = path;
  content.volumes.push_back(writtenVolume(volume, path));
  exportVolumes(content, path);
}

} // namespace VLN::Interop
