#include "GeometryVolume/core/LogPathImpl.h"

#include "Velorn/FileUtils.h"

#include <cstdlib>
#include <filesystem>
#include <random>
#include <string_view>
#include <system_error>

namespace VLN::Utils {

namespace {

Ostil::String temporaryDirectory() {
  for (char const* variable : {"TEMP", "tmp", "temp"})
    if (char const* value = std::getenv(variable)) return value;
  std::error_code error;
  auto const path = std::filesystem::temp_directory_path(error);
  return error ? Ostil::String("/tmp") : path.string();
}

Ostil::String uniquePart(std::random_device& random) {
  constexpr std::string_view kLetters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  Ostil::String part = "vlndump";
  std::uniform_int_distribution<std::size_t> letter(0, kLetters.size() - 1);
  for (int i = 0; i < 6; ++i) part += kLetters[letter(random)];
  return part;
}

} // namespace

Ostil::String createLogPath(Ostil::String const& name) {
  using namespace Velorn::FileUtils;
  Ostil::String const directory = temporaryDirectory();
  Ostil::String const last = filename(name);
  std::random_device random;
  for (;;) {
    Ostil::String const unique = uniquePart(random);
    Ostil::String path = filePath(directory, last.empty() ? unique : unique + "_" + last);
    std::error_code error;
    if (!std::filesystem::exists(path, error)) return path;
  }
}

} // namespace VLN::Utils
