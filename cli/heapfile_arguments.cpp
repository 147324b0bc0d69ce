#include "cli/heapfile_arguments.h"

#include <memory>
#include <vector>

#include "targets/heapfile_process.h"

namespace vs {

int64_t heapfileTargetKey(std::string_view argument) {
    uint64_t hash = 0xcbf29ce484222325ull;  // FNV-1a, 64-bit
    for (unsigned char c : argument) {
        hash ^= c;
        hash *= 0x100000001b3ull;
    }
    hash = (hash & ~(3ull << 62)) | (1ull << 63);
    return static_cast<int64_t>(hash);
}

std::optional<int> loadHeapfileArgument(const std::string &argument, BreakdownModeState &state,
                                        VSTargetMap &targetMap, VSPidTable &pidTable, FILE *err) {
    HeapfileError error;
    std::unique_ptr<VSHeapfileProcess> heapfile = VSHeapfileProcess::processWithHeapfile(argument, &error);
    if (heapfile) {
        const bool mode = heapfile->breakDownPhysVestage();
        targetMap[heapfileTargetKey(argument)] = std::move(heapfile);
        if (state.fixed && mode != state.breakDown) {
            std::fprintf(err,
                         "Heapfile was gathered with an analysis mode that conflicts with other heapfiles or "
                         "command line arguments: %s\n",
                         argument.c_str());
            return 1;
        }
        state.breakDown = mode;
        state.fixed = true;
        return std::nullopt;
    }

    // A file that happens to carry a process's name (or a pid) still names
    // that process.
    const std::optional<VSPidTable> found = VSProcess::pidsForStringDescriptions({argument}, nullptr);
    if (!found || found->empty()) {
        std::fprintf(err, "Error opening heapfile %s: %s\n", argument.c_str(), error.description.c_str());
        return 1;
    }
    const auto &[pid, matchedName] = *found->begin();
    pidTable[pid] = matchedName;
    return std::nullopt;
}

}  // namespace vs
