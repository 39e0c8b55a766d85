// Memory in huge pages: where much is written for the first time, most of the time goes into pages.
#pragma once

#include <cstddef>

namespace VLN::Internal {

/// Asks the system for huge pages for what of a block is made of whole ones: no huge page reaches beyond what
/// was asked for, so that nothing is held that nobody uses.
/// @cost None for blocks of less than 4 MB; else a call of the system.
void preferHugePages(void* block, std::size_t bytes) noexcept;

} // namespace VLN::Internal
