#include "Interop/OutputFile.h"
#include "ViewCommand.h"

#include <algorithm>
#include <stdexcept>

#include <nlohmann/json.hpp>
#include <zlib.h>

namespace Vln {

namespace {

std::string base64(std::string_view bytes) {
  static char const letters[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  auto const byte = [&](std::size_t n) {
    return n < bytes.size() ? static_cast<std::uint32_t>(static_cast<unsigned char>(bytes[n])) : 0u;
  };
  for (std::size_t n = 0; n < bytes.size(); n += 3) {
    std::uint32_t const three = byte(n) << 16 | byte(n + 1) << 8 | byte(n + 2);
    for (std::size_t c = 0; c < 4; ++c)
      text += n + c > bytes.size() ? '=' : letters[three >> (18 - 6 * c) & 63];
  }
  return text;
}

std::string gzip(std::string_view bytes) {
  z_stream stream{};
  constexpr int kGzipWindow = 15 + 16;
  if (deflateInit2(&stream, 6, Z_DEFLATED, kGzipWindow, 9, Z_DEFAULT_STRATEGY) != Z_OK)
    throw std::runtime_error("zlib cannot be started");
  std::string packed;
  std::vector<unsigned char> piece(std::size_t(1) << 18);
  constexpr std::size_t kMost = std::size_t(1) << 30; // zlib counts in 32 bits
  int state = Z_OK;
  while (state != Z_STREAM_END) {
    if (stream.avail_in == 0 && !bytes.empty()) {
      auto const count = std::min(bytes.size(), kMost);
      stream.next_in = reinterpret_cast<unsigned char*>(const_cast<char*>(bytes.data()));
      stream.avail_in = static_cast<uInt>(count);
      bytes.remove_prefix(count);
    }
    stream.next_out = piece.data(), stream.avail_out = static_cast<uInt>(piece.size());
    state = deflate(&stream, bytes.empty() ? Z_FINISH : Z_NO_FLUSH);
    packed.append(reinterpret_cast<char*>(piece.data()), piece.size() - stream.avail_out);
  }
  deflateEnd(&stream);
  return packed;
}

// For text between tags.
std::string escaped(std::string const& text) {
  std::string out;
  for (char c : text) {
    if (c == '<')
      out += "&lt;";
    else if (c == '>')
      out += "&gt;";
    else if (c == '&')
      out += "&amp;";
    else
      out += static_cast<unsigned char>(c) < 32 ? ' ' : c;
  }
  return out;
}

} // namespace

std::string packedText(std::string_view bytes) { return base64(gzip(bytes)); }

void writeViewPage(std::string const& path, std::string const& title, nlohmann::ordered_json const& about,
                   std::vector<std::string> const& blocks) {
  // What would end the script that holds it never stands in the text.
  std::string text = about.dump(-1, ' ', true, nlohmann::json::error_handler_t::replace);
  for (std::size_t at = 0; (at = text.find('<', at)) != std::string::npos;) text.replace(at, 1, "\\u003c");

  VLN::Interop::OutputFile file(path);
  file.write("<!doctype html>\n<html lang=\"en\">\n<head>\n<meta charset=\"utf-8\">\n");
  // The page can ask for nothing, neither from a network nor from a disk.
  file.write("<meta http-equiv=\"Content-Security-Policy\" content=\"default-src 'none'; script-src "
             "'unsafe-inline'; style-src 'unsafe-inline'; img-src data: blob:; font-src data:\">\n"
             "<meta name=\"viewport\" content=\"width=device-width, initial-scale=1\">\n");
  file.write("<title>" + escaped(title) + "</title>\n</head>\n<body>\n");
  file.write("<script type=\"application/json\" id=\"about\">" + text + "</script>\n");
  for (std::size_t n = 0; n < blocks.size(); ++n) {
    file.write("<script type=\"text/plain\" id=\"block" + std::to_string(n) + "\">");
    file.write(blocks[n]);
    file.write("</script>\n");
  }
  file.write("<script>\n");
  file.write(viewScript());
  file.write("</script>\n</body>\n</html>\n");
  file.commit();
}

} // namespace Vln
