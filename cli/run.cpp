#include "cli/run.h"

#include <cstdio>

namespace vs {

int runSequence(VSRunOptions &options, const std::vector<std::string> &bareArguments) {
    // Every bare argument ends up as a target, a pid or a process
    // description (or ends the run), so any of them means there is
    // something to analyse.
    bool haveArgumentTargets = !bareArguments.empty();

    if (options.pidTable.empty() && !haveArgumentTargets && options.processDescriptions.empty() &&
        !options.allProcesses && !options.corpseMode) {
        std::fputs("Must specify at least one process or heapfile\n", stderr);
        printUsage();
        return 1;
    }

    std::fputs("not yet\n", stderr);
    return 1;
}

}  // namespace vs

int vsMain(int argc, char **argv) {
    vs::OptionScanResult scan = vs::scanOptions(argc, argv);
    if (scan.exitStatus) {
        return *scan.exitStatus;
    }
    return vs::runSequence(scan.options, scan.bareArguments);
}
