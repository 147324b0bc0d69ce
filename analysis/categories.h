#pragma once

// The category tables of the report. A table maps a category name to its
// category; the map keeps names in byte order, which is also the order in
// which categories of equal size are listed, so the same input always
// prints the same table.

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "model/memory_category.h"

using VSCategoryTable = std::map<std::string, VSMemoryCategory>;

// Sums over every category of a table before folding: the TOTAL row under
// a table and the figures of the summary line. Folding into "Other" does
// not change them.
struct VSCategoryTotals {
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::uint64_t clean = 0;
    std::uint64_t reclaimable = 0;
    std::uint64_t wired = 0;
    std::uint32_t regions = 0;

    bool operator==(const VSCategoryTotals &) const = default;
};

// Category names in printing order.
using VSSortedCategoryKeys = std::vector<std::string>;
