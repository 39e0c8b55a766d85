// A folder of its own for a test, removed with all that lies in it.
#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

namespace VLN::Test {

class TempFolder {
public:
  TempFolder() {
    std::string name = (std::filesystem::temp_directory_path() / "vln-test.XXXXXX").string();
    if (!mkdtemp(name.data())) throw std::runtime_error("no folder for temporary files");
    m_path = name;
  }
  TempFolder(TempFolder const&) = delete;
  TempFolder& operator=(TempFolder const&) = delete;
  ~TempFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(m_path, ignored);
  }

  std::string const& path() const { return m_path; }
  std::string operator/(std::string const& name) const { return m_path + "/" + name; }
  /// Names of what lies in the folder.
  std::vector<std::string> names() const {
    std::vector<std::string> found;
    for (auto const& entry : std::filesystem::directory_iterator(m_path))
      found.push_back(entry.path().filename().string());
    return found;
  }

private:
  std::string m_path;
};

inline std::string readAll(std::string const& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}
inline void writeAll(std::string const& path, std::string const& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
}

/// A file of the shared test data; empty when it is not there.
inline std::string dataFile(std::string const& name) {
  std::string const folder = VLN_TEST_DATA_DIR;
  std::string const path = folder + "/" + name;
  return !folder.empty() && std::filesystem::exists(path) ? path : std::string();
}

} // namespace VLN::Test
