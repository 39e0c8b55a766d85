// ChannelParser: selects channels by name, with filters such as `density temp* !temp_old`.
//
//   filter:   names separated by white space
//   name:     letters, digits, `_`, `.`, `:`, and `*` for any run of characters; `!` or `^` in front excludes
//
// A name passes when at least one element accepts it and none rejects it. A negated element accepts all that
// it does not reject, so `!tmp*` alone passes everything else.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

#include <memory>
#include <stdexcept>

namespace VLN::Utils {

namespace Internal {

class Expression;

class ParseError : public std::runtime_error {
public:
  using std::runtime_error::runtime_error;
};

} // namespace Internal

class VLN_API ChannelParser {
public:
  struct Status {
    Ostil::String message;
    bool ok = false;
    explicit operator bool() const { return ok; }
  };

  ChannelParser();
  ChannelParser(ChannelParser&&) noexcept;
  ChannelParser& operator=(ChannelParser&&) noexcept;
  ~ChannelParser();

  /// Compiles a filter.
  /// @edges White space alone is an empty list, which passes nothing; the empty text is an error. What stands
  /// before a character that no filter has is kept, although the answer is an error.
  /// @error Told by the status; nothing is thrown.
  /// @cost Linear in the text.
  Status parses(Ostil::String const& text);

  /// @edges False as long as nothing was compiled.
  /// @cost Linear in the lengths of filter and name.
  bool accepts(Ostil::String const& name) const;

private:
  std::unique_ptr<Internal::Expression> m_root;
};

} // namespace VLN::Utils
