// VLN_API marks what the shared library exports; everything else is hidden.
#pragma once

#if defined(_WIN32)
#if defined(GeometryVolume_EXPORTS)
#define VLN_API __declspec(dllexport)
#else
#define VLN_API __declspec(dllimport)
#endif
#else
#define VLN_API __attribute__((visibility("default")))
#endif
