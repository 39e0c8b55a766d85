// The three steps behind ChannelParser.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/utils/ChannelExpression.h"
#include "GeometryVolume/utils/ChannelToken.h"
#include "Ostil/String.h"

#include <cstddef>
#include <memory>
#include <vector>

namespace VLN::Utils::Internal {

/// All tokens of a filter, up to and including the end token.
VLN_API std::vector<Token> tokenize(Ostil::String const& text);

/// Parses a list from the token at `cursor` on, and moves the cursor past what it took.
/// @error ParseError
VLN_API std::unique_ptr<ListExpression> parseList(std::vector<Token> const& tokens, std::size_t& cursor);

/// @error std::runtime_error for binary operators and functions, which filters do not have.
VLN_API bool filterAccepts(Expression& root, Ostil::String const& name);

} // namespace VLN::Utils::Internal
