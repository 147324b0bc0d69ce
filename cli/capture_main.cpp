// vestage-capture: writes heapfiles of live processes.
//
//   vestage-capture [-o DIR] PID...
//
// Each process is gathered through the Linux layer exactly as `vestage`
// gathers it and written to DIR/NAME-PID.heap (DIR defaults to the working
// directory). Processes captured in one invocation share memory objects
// as they do live; `vestage FILE...` analyses the files later.

#include <getopt.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "targets/heapfile_capture.h"
#include "targets/platform/linux/linux_platform.h"
#include "targets/platform/linux/smaps_parser.h"

namespace {

void printCaptureUsage(FILE *out) {
    std::fputs("Usage: vestage-capture [-o DIR] PID...\n"
               "  Writes a heapfile of each process to DIR/NAME-PID.heap\n"
               "  (DIR defaults to the working directory); `vestage FILE...`\n"
               "  analyses heapfiles like live processes.\n"
               "  -o, --output DIR   directory for the heapfiles\n"
               "  -h, --help         this text\n",
               out);
}

// Stable identities of file and kernel-provided mappings, so that
// heapfiles captured at different times still share what live processes
// share (a library, the vdso).
std::map<uint64_t, std::string> linuxRegionIdentities(VSLinuxPlatform &platform, VSTaskHandle task) {
    std::map<uint64_t, std::string> identities;
    std::vector<vs::SmapsRegion> regions;
    if (platform.task_regions(task, regions) != vs::kReturnSuccess) {
        return identities;
    }
    for (const vs::SmapsRegion &region : regions) {
        const std::string offset = std::to_string(region.offset);
        if (region.inode != 0) {
            identities[region.start] = "file " + std::to_string(region.devMajor) + ":" +
                                       std::to_string(region.devMinor) + " inode " + std::to_string(region.inode) +
                                       " offset " + offset;
        } else if (region.path == "[vdso]" || region.path == "[vvar]" || region.path == "[vvar_vclock]" ||
                   region.path == "[vsyscall]") {
            identities[region.start] = "kernel mapping " + region.path + " offset " + offset;
        }
    }
    return identities;
}

bool parsePid(const char *text, int32_t &pid) {
    errno = 0;
    char *end = nullptr;
    const long value = std::strtol(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || value < 0 || value > INT32_MAX) {
        return false;
    }
    pid = static_cast<int32_t>(value);
    return true;
}

}  // namespace

int main(int argc, char **argv) {
    std::string directory = ".";
    static const option longOptions[] = {
        {"output", required_argument, nullptr, 'o'},
        {"help", no_argument, nullptr, 'h'},
        {nullptr, 0, nullptr, 0},
    };
    int option;
    while ((option = getopt_long(argc, argv, "o:h", longOptions, nullptr)) != -1) {
        switch (option) {
        case 'o':
            directory = optarg;
            break;
        case 'h':
            printCaptureUsage(stdout);
            return 0;
        default:
            printCaptureUsage(stderr);
            return 1;
        }
    }
    if (optind >= argc) {
        std::fputs("vestage-capture: no process given\n", stderr);
        printCaptureUsage(stderr);
        return 1;
    }

    VSLinuxPlatform platform;
    VSPlatform::setCurrent(&platform);
    const vs::HeapfileCapture capture(
        [&platform](VSTaskHandle task) { return linuxRegionIdentities(platform, task); });

    int status = 0;
    for (int index = optind; index < argc; ++index) {
        int32_t pid = 0;
        if (!parsePid(argv[index], pid)) {
            std::fprintf(stderr, "vestage-capture: %s: not a process id\n", argv[index]);
            status = 1;
            continue;
        }
        vs::HeapfileError error;
        const std::optional<VSHeapfileSnapshot> snapshot = capture.capture(pid, &error);
        if (!snapshot) {
            std::fprintf(stderr, "vestage-capture: cannot capture %s\n", error.description.c_str());
            status = 1;
            continue;
        }
        const std::string path = directory + "/" + vs::heapfileFileName(*snapshot);
        if (!vs::writeFileAtomically(path, vs::heapfileText(*snapshot), &error)) {
            std::fprintf(stderr, "vestage-capture: cannot write heapfile of process %d: %s\n", pid,
                         error.description.c_str());
            status = 1;
            continue;
        }
        std::printf("%s\n", path.c_str());
    }
    VSPlatform::setCurrent(nullptr);
    return status;
}
