// ZipReader: the members of a zip archive that is in memory. Nothing in it is trusted.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace VLN::Interop {

class ZipReader {
public:
  struct Member {
    std::string name;
    std::uint64_t offset, packed, size;
    std::uint32_t checksum;
    int method;
  };

  /// @error FileError without a name, here and below. @param bytes Must outlive the reader.
  explicit ZipReader(std::string_view bytes);
  std::vector<Member> const& members() const { return m_members; }
  /// The content of a member, unpacked and checked.
  std::string content(Member const& member) const;

private:
  std::uint64_t number(std::uint64_t at, int bytes) const;
  std::string_view part(std::uint64_t at, std::uint64_t count) const;

  std::string_view m_bytes;
  std::vector<Member> m_members;
};

} // namespace VLN::Interop
