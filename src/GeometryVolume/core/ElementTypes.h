// The element types of channels.
//
// VLN_FOR_EACH_ELEMENT_TYPE(X) expands X(type, name) once for each type that this build
// instantiates, in a fixed order. A full build has all 18; CMake's VLN_ELEMENT_TYPES narrows the
// list for quick and sanitizer builds. Names and order here must match cmake/VlnElementTypes.cmake.
#pragma once

#include "GeometryVolume/core/ElementTypesConfig.h"
#include "Velorn/Math.h"

#include <cstdint>

#if VLN_HAS_ELEMENT_INT8
#define VLN_ELEMENT_INT8(X) X(signed char, int8)
#else
#define VLN_ELEMENT_INT8(X)
#endif
#if VLN_HAS_ELEMENT_UINT8
#define VLN_ELEMENT_UINT8(X) X(unsigned char, uint8)
#else
#define VLN_ELEMENT_UINT8(X)
#endif
#if VLN_HAS_ELEMENT_INT16
#define VLN_ELEMENT_INT16(X) X(short, int16)
#else
#define VLN_ELEMENT_INT16(X)
#endif
#if VLN_HAS_ELEMENT_UINT16
#define VLN_ELEMENT_UINT16(X) X(unsigned short, uint16)
#else
#define VLN_ELEMENT_UINT16(X)
#endif
#if VLN_HAS_ELEMENT_INT32
#define VLN_ELEMENT_INT32(X) X(int, int32)
#else
#define VLN_ELEMENT_INT32(X)
#endif
#if VLN_HAS_ELEMENT_UINT32
#define VLN_ELEMENT_UINT32(X) X(unsigned int, uint32)
#else
#define VLN_ELEMENT_UINT32(X)
#endif
#if VLN_HAS_ELEMENT_INT64
#define VLN_ELEMENT_INT64(X) X(std::int64_t, int64)
#else
#define VLN_ELEMENT_INT64(X)
#endif
#if VLN_HAS_ELEMENT_UINT64
#define VLN_ELEMENT_UINT64(X) X(std::uint64_t, uint64)
#else
#define VLN_ELEMENT_UINT64(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT
#define VLN_ELEMENT_FLOAT(X) X(float, float)
#else
#define VLN_ELEMENT_FLOAT(X)
#endif
#if VLN_HAS_ELEMENT_DOUBLE
#define VLN_ELEMENT_DOUBLE(X) X(double, double)
#else
#define VLN_ELEMENT_DOUBLE(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT2
#define VLN_ELEMENT_FLOAT2(X) X(Velorn::Math::float2, float2)
#else
#define VLN_ELEMENT_FLOAT2(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT3
#define VLN_ELEMENT_FLOAT3(X) X(Velorn::Math::float3, float3)
#else
#define VLN_ELEMENT_FLOAT3(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT4
#define VLN_ELEMENT_FLOAT4(X) X(Velorn::Math::float4, float4)
#else
#define VLN_ELEMENT_FLOAT4(X)
#endif
#if VLN_HAS_ELEMENT_DOUBLE3
#define VLN_ELEMENT_DOUBLE3(X) X(Velorn::Math::double3, double3)
#else
#define VLN_ELEMENT_DOUBLE3(X)
#endif
#if VLN_HAS_ELEMENT_INT3
#define VLN_ELEMENT_INT3(X) X(Velorn::Math::int3, int3)
#else
#define VLN_ELEMENT_INT3(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT3X3
#define VLN_ELEMENT_FLOAT3X3(X) X(Velorn::Math::float3x3, float3x3)
#else
#define VLN_ELEMENT_FLOAT3X3(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT4X2
#define VLN_ELEMENT_FLOAT4X2(X) X(Velorn::Math::float4x2, float4x2)
#else
#define VLN_ELEMENT_FLOAT4X2(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT4X4
#define VLN_ELEMENT_FLOAT4X4(X) X(Velorn::Math::float4x4, float4x4)
#else
#define VLN_ELEMENT_FLOAT4X4(X)
#endif

#define VLN_FOR_EACH_ELEMENT_TYPE(X)                                                                         \
  VLN_ELEMENT_INT8(X)                                                                                        \
  VLN_ELEMENT_UINT8(X)                                                                                       \
  VLN_ELEMENT_INT16(X)                                                                                       \
  VLN_ELEMENT_UINT16(X)                                                                                      \
  VLN_ELEMENT_INT32(X)                                                                                       \
  VLN_ELEMENT_UINT32(X)                                                                                      \
  VLN_ELEMENT_INT64(X)                                                                                       \
  VLN_ELEMENT_UINT64(X)                                                                                      \
  VLN_ELEMENT_FLOAT(X)                                                                                       \
  VLN_ELEMENT_DOUBLE(X)                                                                                      \
  VLN_ELEMENT_FLOAT2(X)                                                                                      \
  VLN_ELEMENT_FLOAT3(X)                                                                                      \
  VLN_ELEMENT_FLOAT4(X)                                                                                      \
  VLN_ELEMENT_DOUBLE3(X)                                                                                     \
  VLN_ELEMENT_INT3(X)                                                                                        \
  VLN_ELEMENT_FLOAT3X3(X)                                                                                    \
  VLN_ELEMENT_FLOAT4X2(X)                                                                                    \
  VLN_ELEMENT_FLOAT4X4(X)
