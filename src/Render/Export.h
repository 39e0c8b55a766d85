// VLN_RENDER_API marks what the shared library GeometryVolumeRender exports.
#pragma once

#if defined(_WIN32)
#if defined(GeometryVolumeRender_EXPORTS)
#define VLN_RENDER_API __declspec(dllexport)
#else
#define VLN_RENDER_API __declspec(dllimport)
#endif
#else
#define VLN_RENDER_API __attribute__((visibility("default")))
#endif
