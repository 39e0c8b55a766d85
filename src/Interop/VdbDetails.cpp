#include "Interop/VdbDetails.h"

#include "Interop/ChannelValues.h"
#include "Interop/IndexToWorldImpl.h"
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbRecord.h"

#include <sstream>

namespace VLN::Interop {

namespace {

openvdb::MetaMap read(std::string const& bytes) {
  openvdb::MetaMap map;
  std::istringstream in(bytes, std::ios::binary);
  try {
    if (!bytes.empty()) map.readMeta(in);
  } catch (std::exception const&) { map.clearMetadata(); }
  return map;
}

// Of these the rest of the report tells, or they say nothing to a reader.
bool listedElsewhere(std::string const& name) {
  for (char const* known : {"name", "class", "is_saved_as_half_float", "file_compression", "file_bbox_min",
                            "file_bbox_max", "file_mem_bytes", "file_voxel_count", "file_delayed_load"})
    if (name == known) return true;
  return false;
}

std::vector<VdbMetadatum> listOf(openvdb::MetaMap const& map) {
  std::vector<VdbMetadatum> list;
  for (auto it = map.beginMeta(); it != map.endMeta(); ++it)
    if (it->second && !listedElsewhere(it->first)) list.push_back({it->first, it->second->str()});
  return list;
}

std::string textOf(openvdb::MetaMap const& map, char const* name) {
  auto const found = map[name];
  return found ? found->str() : "";
}

} // namespace

std::vector<VdbGridDetails> detailsOf(VdbVolume const& volume) {
  // Beyond the domain there is nothing but the background.
  constexpr int kFar = VdbTraits::kMaxTileCoord + 1;
  constexpr Velorn::Math::int3 kNowhere{kFar, kFar, kFar};
  openvdb::initialize();
  std::vector<VdbGridDetails> all;
  Ostil::Any const holder = volume.object->getProperty(kVdbGridsProperty);
  auto const* records = holder.get<Ostil::Array<VdbGridRecord>>();
  if (!records) {
    for (VdbChannel const& channel : volume.channels) {
      VdbGridDetails details;
      details.gridClass = "unknown";
      if (auto const values = ChannelValues::of(volume, channel.name))
        details.background = values->text(kNowhere);
      all.push_back(std::move(details));
    }
    return all;
  }
  for (VdbGridRecord const& record : *records) {
    openvdb::MetaMap const map = read(record.metadata);
    VdbGridDetails details;
    details.gridClass = openvdb::GridBase::gridClassToMenuName(
        openvdb::GridBase::stringToGridClass(textOf(map, openvdb::GridBase::META_GRID_CLASS)));
    std::transform(details.gridClass.begin(), details.gridClass.end(), details.gridClass.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (details.gridClass == "other") details.gridClass = "unknown";
    details.half = textOf(map, openvdb::GridBase::META_SAVE_HALF_FLOAT) == "true";
    details.compression = textOf(map, openvdb::GridBase::META_FILE_COMPRESSION);
    details.metadata = listOf(map);
    if (auto const values = ChannelValues::of(volume, record.channel))
      details.background = values->text(kNowhere);
    all.push_back(std::move(details));
  }
  return all;
}

std::vector<VdbMetadatum> metadataOf(VdbImport const& content) { return listOf(read(content.metadata)); }

std::vector<std::vector<double>> matrixOf(IndexToWorld const& transform) {
  auto const& map = *transform.impl().transform;
  if (!map.isLinear()) return {};
  auto const m = map.baseMap()->getAffineMap()->getMat4();
  std::vector<std::vector<double>> rows(4, std::vector<double>(4));
  for (int row = 0; row < 4; ++row)
    for (int column = 0; column < 4; ++column) rows[row][column] = m(column, row); // it has row vectors
  return rows;
}

} // namespace VLN::Interop
