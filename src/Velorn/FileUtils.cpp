#include "Velorn/FileUtils.h"

#include <filesystem>

namespace Velorn::FileUtils {

Ostil::String filePath(Ostil::String const& directory, Ostil::String const& name) {
  return (std::filesystem::path(directory) / name).string();
}

Ostil::String filename(Ostil::String const& path) { return std::filesystem::path(path).filename().string(); }

} // namespace Velorn::FileUtils
