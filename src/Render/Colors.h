// Colour maps by the names that people know, and the way from light to bytes.
#pragma once

#include "Render/Export.h"
#include "Render/Vec.h"

#include <array>
#include <string>
#include <vector>

namespace VLN::Render {

/// The names of all maps: viridis, inferno, magma, cividis, turbo, coolwarm, gray.
VLN_RENDER_API std::vector<std::string> colorMapNames();
/// Linear light, from the low end to the high one. @return false for an unknown name.
VLN_RENDER_API bool colorMap(std::string const& name, std::array<Vec3, 256>& colors);

/// Of linear light 0 to 1.
VLN_RENDER_API std::uint8_t toSrgbByte(float linear);
/// 0xRRGGBB as linear light.
VLN_RENDER_API Vec3 fromSrgb(std::uint32_t rgb);

} // namespace VLN::Render
