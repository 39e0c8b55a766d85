#pragma once

/// Marks what the library exports; everything else stays hidden in it.
/// A class template needs it on its declaration, an explicitly instantiated function template too.
#if defined(__GNUC__)
#define VLN_API __attribute__((visibility("default")))
#else
#define VLN_API
#endif
