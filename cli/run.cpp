#include "cli/run.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <memory>
#include <set>
#include <utility>

#include "analysis/vestage.h"
#include "cli/heapfile_arguments.h"
#include "output/json_formatter.h"
#include "output/text_formatter.h"
#include "output/openmetrics_formatter.h"
#include "output/top_formatter.h"
#include "targets/corpse_process.h"
#include "targets/platform/linux/linux_platform.h"
#include "targets/process.h"

namespace vs {

namespace {

std::vector<std::string> asVector(const std::set<std::string> &descriptions) {
    return {descriptions.begin(), descriptions.end()};
}

// The corpse checks: a name, a positive pid and a usable corpse port.
std::optional<int> checkCorpseArguments(const VSRunOptions &options, uint32_t &corpsePort) {
    if (!options.corpseName || static_cast<int32_t>(options.corpsePid) <= 0) {
        std::fputs("Invalid arguments for corpse mode\n", stderr);
        printCorpseUsage();
        return 1;
    }
    std::vector<uint32_t> ports;
    VSReturnCode code = VSPlatform::current().ports_lookup(ports);
    if (code != kReturnSuccess || ports.empty() || ports.front() == kPortNull || ports.front() == kPortDead) {
        std::fputs("Failed to retrieve corpse port\n", stderr);
        printCorpseUsage();
        return 1;
    }
    corpsePort = ports.front();
    return std::nullopt;
}

}  // namespace

int runSequence(VSRunOptions &options, const std::vector<std::string> &bareArguments) {
    VSTargetMap targetMap;
    BreakdownModeState breakDown{options.breakDownRequested, options.breakDownRequested};

    for (const std::string &argument : bareArguments) {
        std::error_code error;
        if (!std::filesystem::exists(argument, error)) {
            options.processDescriptions.insert(argument);
            continue;
        }
        if (std::optional<int> status = loadHeapfileArgument(argument, breakDown, targetMap, options.pidTable)) {
            return *status;
        }
    }

    if (options.pidTable.empty() && targetMap.empty() && options.processDescriptions.empty() &&
        !options.allProcesses && !options.corpseMode) {
        std::fputs("Must specify at least one process or heapfile\n", stderr);
        printUsage();
        return 1;
    }

    VSPlatform &platform = VSPlatform::current();
    if (options.allProcesses && platform.effective_user_id() != 0) {
        std::fputs("Must run as root.\n", stderr);
        printUsage();
        return 1;
    }

    uint32_t corpsePort = kPortNull;
    if (options.corpseMode) {
        if (std::optional<int> status = checkCorpseArguments(options, corpsePort)) {
            return *status;
        }
    }

    if (breakDown.breakDown) {
        VSVestage::setBreakDownPhysVestage(true);
    }

    std::set<int32_t> excluded{platform.own_pid()};
    if (options.corpseMode) {
        excluded.insert(static_cast<int32_t>(options.corpsePid));
    }
    if (!options.excludeDescriptions.empty()) {
        if (std::optional<VSPidTable> pids = VSProcess::pidsForStringDescriptions(asVector(options.excludeDescriptions))) {
            for (const auto &entry : *pids) {
                excluded.insert(entry.first);
            }
        }
    }

    if (options.allProcesses) {
        std::optional<VSTargetMap> all = VSProcess::allProcessesExcludingPids(excluded);
        targetMap = all ? std::move(*all) : VSTargetMap{};
    } else {
        VSPidTable &pidTable = options.pidTable;
        if (!options.processDescriptions.empty()) {
            std::vector<std::string> errors;
            std::optional<VSPidTable> resolved =
                VSProcess::pidsForStringDescriptions(asVector(options.processDescriptions), &errors);
            if (resolved) {
                for (auto &[pid, name] : *resolved) {
                    pidTable[pid] = std::move(name);
                }
            }
            for (const std::string &error : errors) {
                std::fprintf(stderr, "%s\n", error.c_str());
            }
        }
        for (int32_t pid : excluded) {
            pidTable.erase(pid);
        }
        if (options.targetChildren) {
            std::vector<int32_t> parents;
            for (const auto &entry : pidTable) {
                parents.push_back(entry.first);
            }
            if (std::optional<std::vector<int32_t>> family = VSProcess::childPidsForPids(parents)) {
                for (int32_t pid : *family) {
                    pidTable[pid] = std::nullopt;
                }
            }
        }
        for (const auto &[pid, name] : pidTable) {
            std::unique_ptr<VSProcess> process = VSProcess::processWithPid(pid);
            if (process) {
                targetMap[pid] = std::move(process);
            } else if (name) {
                std::fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", name->c_str(),
                             static_cast<long>(pid));
            } else {
                std::fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", static_cast<long>(pid));
            }
        }
    }

    if (options.corpseMode) {
        const int32_t corpsePid = static_cast<int32_t>(options.corpsePid);
        if (std::unique_ptr<VSProcess> corpse = VSCorpseProcess::processWithCorpse(
                corpsePort, corpsePid, *options.corpseName, options.corpseDirtyFlags, options.corpseProcFlags)) {
            targetMap[corpsePid] = std::move(corpse);
        }
    }

    if (targetMap.empty()) {
        std::fputs("Unable to find any processes matching the supplied process names or pids (try as root?)\n",
                   stderr);
        return 1;
    }

    if (options.skipIdleExitClean) {
        targetMap = VSProcess::removeIdleExitCleanProcessesFrom(std::move(targetMap));
    }

    std::vector<std::unique_ptr<VSProcess>> targets;
    targets.reserve(targetMap.size());
    for (auto &entry : targetMap) {
        targets.push_back(std::move(entry.second));
    }
    VSVestage vestage(std::move(targets));

    std::unique_ptr<InterruptSource> interrupt = VSVestage::installCancelHandler([&vestage] {
        vestage.cancel();
        std::fputs("Exiting early due to SIGINT\n", stderr);
    });
    vestage.gatherData();
    if (interrupt) {
        interrupt->cancel();
        interrupt.reset();
        // From here on an interrupt ends the program, also when it was
        // started with SIGINT ignored (a background job of a script).
        std::signal(SIGINT, SIG_DFL);
    }

    // "--json -": the document goes to standard output in place of the text.
    const bool documentOnStandardOutput =
        (options.jsonPath && *options.jsonPath == "-") || (options.openMetricsPath && *options.openMetricsPath == "-");
    if (options.top) {
        vestage.addOutputFormatter(std::make_unique<VSOutputFormatterTop>(*options.top, options.summaryFormat));
    } else if (!documentOnStandardOutput) {
        vestage.addOutputFormatter(
            std::make_unique<VSOutputFormatterText>(options.summaryFormat, options.outputOptions));
    }
    if (options.openMetricsPath) {
        vestage.addOutputFormatter(std::make_unique<VSOutputFormatterOpenMetrics>(*options.openMetricsPath));
    }
    if (options.jsonPath) {
        vestage.addOutputFormatter(std::make_unique<VSOutputFormatterJSON>(*options.jsonPath));
    }
    // A report cut short by a full disk must not pass for a whole one; the
    // reason is the first failed write's (later ones keep errno as it is).
    errno = 0;
    vestage.printOutputVerbose(options.verbose, options.summarize);
    const int printError = errno;
    errno = 0;
    const bool flushed = std::fflush(stdout) == 0;
    if (!flushed || std::ferror(stdout)) {
        const int error = !flushed && errno != 0 ? errno : (printError != 0 ? printError : EIO);
        std::fprintf(stderr, "vestage: cannot write the report to standard output: %s\n", std::strerror(error));
        return 1;
    }
    return 0;
}

}  // namespace vs

int vsMain(int argc, char **argv) {
    vs::OptionScanResult scan = vs::scanOptions(argc, argv);
    if (scan.exitStatus) {
        return *scan.exitStatus;
    }
    static VSLinuxPlatform linuxPlatform;
    VSPlatform::setCurrent(&linuxPlatform);
    return vs::runSequence(scan.options, scan.bareArguments);
}
