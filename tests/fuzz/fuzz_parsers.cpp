// Fuzz targets for every parser of text or bytes that vestage does not
// control: heapfiles, smaps, stat and status, the kernel's memory files and
// ELF program headers. One source, one target per FUZZ_TARGET value; built
// by `make fuzz` with clang's libFuzzer. Each target also checks what must
// hold whatever the input (a parsed region never ends before it starts).

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "targets/heapfile_format.h"
#include "targets/platform/linux/elf_images.h"
#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/proc_text.h"
#include "targets/platform/linux/smaps_parser.h"

namespace {

[[maybe_unused]] void fuzzHeapfile(std::string_view text) {
    vs::HeapfileError error;
    if (auto snapshot = vs::parseHeapfile(text, &error)) {
        for (const VSHeapfileRegion &region : snapshot->regions) {
            if (region.end() < region.address || region.dirtyBytes > region.length) std::abort();
        }
        // What was read writes back and reads again the same.
        if (vs::parseHeapfile(vs::heapfileText(*snapshot), &error) != snapshot) std::abort();
    }
}

[[maybe_unused]] void fuzzSmaps(std::string_view text) {
    std::vector<vs::SmapsRegion> regions;
    vs::parseSmaps(text, regions);
    for (const vs::SmapsRegion &region : regions) {
        if (region.end < region.start) std::abort();
    }
}

[[maybe_unused]] void fuzzProc(std::string_view text) {
    (void)vs::parseStat(text);
    (void)vs::statusBytes(text, "VmRSS");
    (void)vs::parseSyscallStackPointer(text);
}

[[maybe_unused]] void fuzzKernel(std::string_view text) {
    (void)vs::parseSlabinfo(text);
    (void)vs::parseMeminfo(text);
    (void)vs::parseVmallocinfo(text);
    (void)vs::parseModules(text);
    (void)vs::parsePerCpuFreePages(text);
}

[[maybe_unused]] void fuzzElf(std::string_view bytes) {
    uint64_t end = 0;
    if (auto info = vs::parseElfProgramHeaders(bytes, end)) {
        for (const vs::ImageSegment &segment : vs::imageSegments(*info, 0x7f0000000000ull, 4096)) {
            if (segment.start + segment.size < segment.start) std::abort();
        }
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string_view input(reinterpret_cast<const char *>(data), size);
#if FUZZ_TARGET == 1
    fuzzHeapfile(input);
#elif FUZZ_TARGET == 2
    fuzzSmaps(input);
#elif FUZZ_TARGET == 3
    fuzzProc(input);
#elif FUZZ_TARGET == 4
    fuzzKernel(input);
#else
    fuzzElf(input);
#endif
    return 0;
}
