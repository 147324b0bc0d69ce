#pragma once

// Small heapfiles for the tests: a snapshot built in code, written to a
// file of its own that disappears with the test.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <utility>

#include "targets/heapfile_format.h"
#include "targets/heapfile_process.h"

namespace vs::testing {

// A file in a fresh temporary directory, removed with the object.
class ScratchFile {
public:
    explicit ScratchFile(const std::string &contents, const std::string &name = "target.heap") {
        static std::atomic<int> counter{0};
        _directory = std::filesystem::temp_directory_path() /
                     ("vestage-heapfile-test-" + std::to_string(::testing::UnitTest::GetInstance()->random_seed()) +
                      "-" + std::to_string(counter++) + "-" + std::to_string(reinterpret_cast<uintptr_t>(this)));
        std::filesystem::create_directories(_directory);
        _path = (_directory / name).string();
        std::FILE *file = std::fopen(_path.c_str(), "wb");
        if (file != nullptr) {
            std::fwrite(contents.data(), 1, contents.size(), file);
            std::fclose(file);
        }
    }
    ~ScratchFile() {
        std::error_code ignored;
        std::filesystem::remove_all(_directory, ignored);
    }
    ScratchFile(const ScratchFile &) = delete;
    ScratchFile &operator=(const ScratchFile &) = delete;

    const std::string &path() const { return _path; }
    std::string directory() const { return _directory.string(); }

private:
    std::filesystem::path _directory;
    std::string _path;
};

// Collects what is written to a stdio stream.
class CapturedStream {
public:
    CapturedStream() : _stream(open_memstream(&_buffer, &_length)) {}
    ~CapturedStream() {
        std::fclose(_stream);
        std::free(_buffer);
    }
    CapturedStream(const CapturedStream &) = delete;
    CapturedStream &operator=(const CapturedStream &) = delete;
    std::FILE *stream() const { return _stream; }
    std::string text() {
        std::fflush(_stream);
        return std::string(_buffer, _length);
    }

private:
    char *_buffer = nullptr;
    size_t _length = 0;
    std::FILE *_stream;
};

// A snapshot of pid 4242 "worker" with page size 4096 and no shared region.
inline VSHeapfileSnapshot snapshotOf(std::vector<VSHeapfileRegion> regions,
                                     std::string description = "X86-64 process, no shared region",
                                     uint32_t pageSize = 4096) {
    VSHeapfileSnapshot snapshot;
    snapshot.pid = 4242;
    snapshot.name = "worker";
    snapshot.description = std::move(description);
    snapshot.pageSize = pageSize;
    snapshot.regions = std::move(regions);
    return snapshot;
}

struct RegionSketch {
    uint64_t address;
    uint64_t length;
    std::string type;
    std::optional<std::string> path = std::nullopt;
    bool externalPager = false;
    uint32_t userTag = 0;
    uint64_t resident = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t objectId = 0;
    int32_t purgeableState = 3;
};

inline VSHeapfileRegion region(const RegionSketch &sketch) {
    VSHeapfileRegion region;
    region.address = sketch.address;
    region.length = sketch.length;
    region.type = sketch.type;
    region.path = sketch.path;
    region.externalPager = sketch.externalPager ? 1 : 0;
    region.userTag = sketch.userTag;
    region.residentBytes = sketch.resident;
    region.dirtyBytes = sketch.dirty;
    region.swappedBytes = sketch.swapped;
    region.objectId = sketch.objectId;
    region.purgeableState = sketch.purgeableState;
    region.protection = 3;
    region.maxProtection = 7;
    region.shareMode = 2;
    region.referenceCount = 1;
    return region;
}

// Reaches the protected parts of a heapfile target.
class OpenHeapfileProcess : public VSHeapfileProcess {
public:
    static std::unique_ptr<OpenHeapfileProcess> open(const std::string &path, HeapfileError *error = nullptr) {
        auto process = std::make_unique<OpenHeapfileProcess>();
        if (!process->initWithHeapfile(path, error)) {
            return nullptr;
        }
        return process;
    }
    using VSHeapfileProcess::_regionInfoForHeapfileRegion;
    using VSHeapfileProcess::enumerateRegions;
};

}  // namespace vs::testing
