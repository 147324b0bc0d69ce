#pragma once

#include <cstdint>

// How every size of the report is written; chosen with -f / --format.
inline constexpr int64_t VSSummaryFormatBytes = 0;
inline constexpr int64_t VSSummaryFormatFormatted = 1;
inline constexpr int64_t VSSummaryFormatPages = 2;

// Bits of the text report's option set: each adds one column.
inline constexpr int64_t VSOutputOptionWired = 1;
inline constexpr int64_t VSOutputOptionSwapped = 2;
