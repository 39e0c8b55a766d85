// The conversion without its template arguments: the order of the passes, over bytes that a caller provides.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/nanovtt/ConversionSettingsImpl.h"

namespace nanovtt::Internal {

/// Converts the object into buffers of `makeBuffer`. `settings` are those of the caller, after
/// applyOptionRules().
/// @return false, without a main buffer, when the object is no volume or cannot be converted.
bool convert(VLN::Object const& object, Ostil::String const& filter, ConversionSettings const& settings,
             BufferMaker const& makeBuffer, Velorn::Math::bbox<Velorn::Math::float3, float>* outBox);

} // namespace nanovtt::Internal
