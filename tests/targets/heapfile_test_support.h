#pragma once

// Small heapfiles for the tests: a snapshot built in code, written to a file
// of its own that disappears with the test.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "targets/heapfile_format.h"
#include "targets/heapfile_process.h"

namespace vs::testing {

// A file in a fresh temporary directory, removed with the object.
class ScratchFile {
public:
    explicit ScratchFile(const std::string &contents, const std::string &name = "target.heap") {
        static std::atomic<int> counter{0};
        _directory = std::filesystem::temp_directory_path() /
                     ("vestage-test-" + std::to_string(::getpid()) + "-" + std::to_string(counter++));
        std::filesystem::remove_all(_directory);  // left behind by a crashed run with the same pid
        std::filesystem::create_directories(_directory);
        _path = (_directory / name).string();
        std::ofstream(_path, std::ios::binary) << contents;
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

// A snapshot of pid 4242 "worker".
inline VSHeapfileSnapshot snapshotOf(std::vector<VSHeapfileRegion> regions,
                                     std::string description = "X86-64 process, no shared region",
                                     uint32_t pageSize = 4096) {
    return {4242, "worker", std::move(description), true, pageSize, 0, 0, false, std::move(regions)};
}

struct RegionSketch {
    uint64_t address, length;
    std::string type;
    std::optional<std::string> path = std::nullopt;
    bool externalPager = false;
    uint32_t userTag = 0;
    uint64_t resident = 0, dirty = 0, swapped = 0, objectId = 0;
    int32_t purgeableState = 3;
};

inline VSHeapfileRegion region(const RegionSketch &s) {
    // Every field in declaration order: protection 3 of 7, one reference, private share mode, not a submap.
    return {s.address, s.length, s.type, s.path, 3, 7, s.userTag, std::nullopt, s.resident, 0, s.swapped, s.dirty, 1,
            s.externalPager, 2, 0, s.objectId, s.purgeableState};
}

}  // namespace vs::testing
