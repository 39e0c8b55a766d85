// The options of `view`, and the page that it writes.
#pragma once

#include "RenderCommand.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json_fwd.hpp>

namespace Vln {

struct ViewCommandOptions {
  RenderCommandOptions look; ///< file, first look and camera; also the output and the depth
  std::vector<std::string> channels;
  std::uint64_t maxSize = std::uint64_t(20) << 20;
  bool hasMaxSize = false; ///< it was asked for; a depth that was asked for has no other limit
};
void view(ViewCommandOptions const& options);

/// The scripts of the page, as one; empty in a program that was built without them.
std::string_view viewScript();

/// Bytes, packed by gzip, in base64.
std::string packedText(std::string_view bytes);

/// Writes the page, whole or not at all.
/// @param about What the page's scripts read first. @param blocks By packedText(), in the order in which
/// `about` counts them.
/// @error FileError.
void writeViewPage(std::string const& path, std::string const& title, nlohmann::ordered_json const& about,
                   std::vector<std::string> const& blocks);

} // namespace Vln
