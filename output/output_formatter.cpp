#include "output/output_formatter.h"

bool VSOutputFormatter::implementsOperation(VSOptionalFormatterOperation) const { return false; }

// The driver never calls an optional operation that a formatter does not
// claim, so these bodies only keep such formatters free of boilerplate.
void VSOutputFormatter::printSpanlistLikeOutputForProcess(const VSProcess &,
                                                          const std::vector<const VSMemoryRegion *> &) {}

void VSOutputFormatter::printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                              const VSProcessGroup &, const VSProcess &,
                                              const VSCategoryTotals &) {}
