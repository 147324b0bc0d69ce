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
#include <string>

#include "cli/heapfile_capture_identities.h"
#include "targets/heapfile_capture.h"
#include "targets/platform/linux/linux_platform.h"

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
    const vs::HeapfileCapture capture(vs::linuxObjectIdentity);

    int status = 0;
    std::vector<int32_t> pids;
    for (int index = optind; index < argc; ++index) {
        int32_t pid = 0;
        if (!parsePid(argv[index], pid)) {
            std::fprintf(stderr, "vestage-capture: %s: not a process id\n", argv[index]);
            status = 1;
            continue;
        }
        pids.push_back(pid);
    }
    // Captured together: what a fork family shares stays shared.
    std::vector<vs::HeapfileCapture::Captured> captured = capture.captureTogether(pids);
    for (size_t index = 0; index < pids.size(); ++index) {
        const int32_t pid = pids[index];
        vs::HeapfileError error = captured[index].error;
        const std::optional<VSHeapfileSnapshot> &snapshot = captured[index].snapshot;
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
