#pragma once

// vestage heapfiles: a snapshot of one process's memory that stands in for
// the live process in a later run. One file is one JSON document holding
// the process's identity, its page size, its physical vestage and, for
// every region of its address space in ascending order, the region's
// attributes and page-class byte counts. docs/heapfile.md describes the
// document key by key.
//
// Compatibility: the "version" number changes only when a reader of the old
// version would misread a new file. Keys added later are optional and old
// readers skip keys they do not know, so a file keeps its version when a
// key is added.
//
// The reader checks every value before a target is built from it: a
// heapfile is input, so a bad one gives an error that names the problem,
// never an assertion or an exception.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vs {

// The value of the "format" key of every heapfile.
inline constexpr std::string_view kHeapfileFormatName = "vestage-heapfile";
// The only version this build reads and writes.
inline constexpr int64_t kHeapfileVersion = 2;
// Version 1 had no region offsets and one region per mapping; it is read
// as it stands.
inline constexpr int64_t kOldestHeapfileVersion = 1;

// Error domains. Errors this program makes itself (a reader that could not
// be opened, an unknown platform) carry the program's own domain; a file
// that cannot be read carries the system error number; a document that is
// no usable heapfile carries the heapfile domain with one of the codes below.
inline constexpr std::string_view kVestageErrorDomain = "VestageErrorDomain";
inline constexpr std::string_view kPosixErrorDomain = "POSIX";
inline constexpr std::string_view kHeapfileErrorDomain = "HeapfileErrorDomain";

enum HeapfileErrorCode : int64_t {
    kHeapfileErrorEmpty = 1,           // no bytes at all
    kHeapfileErrorSyntax = 2,          // not JSON, or JSON cut short
    kHeapfileErrorNotHeapfile = 3,     // JSON, but not our format
    kHeapfileErrorVersion = 4,         // a version this build cannot read
    kHeapfileErrorMissingKey = 5,      // a required key is absent
    kHeapfileErrorBadValue = 6,        // a value of the wrong kind or out of range
    kHeapfileErrorInconsistent = 7,    // values that cannot all be true at once
};

// A failure with a printable description.
struct HeapfileError {
    std::string domain;
    int64_t code = 0;
    std::string description;
};

}  // namespace vs

// One region as the heapfile records it. Byte counts are bytes, not pages.
struct VSHeapfileRegion {
    uint64_t address = 0;
    uint64_t length = 0;
    // The image segment the region belongs to ("__TEXT", "__DATA",
    // "__DATA_CONST", "__LINKEDIT") or another descriptive name.
    std::string type;
    // The mapped file, or the owning image's path for a segment.
    std::optional<std::string> path;
    int32_t protection = 0;
    int32_t maxProtection = 0;
    uint32_t userTag = 0;
    // The name of a tag that was assigned at run time (named anonymous
    // memory): tag numbers of that kind mean nothing in another run, so the
    // reader registers the name again and uses this run's tag for it.
    std::optional<std::string> userTagName;
    uint64_t residentBytes = 0;
    uint64_t sharedNowPrivateBytes = 0;
    uint64_t swappedBytes = 0;
    uint64_t dirtyBytes = 0;
    uint16_t referenceCount = 0;
    uint8_t externalPager = 0;  // 1: backed by a file
    uint8_t shareMode = 0;
    uint8_t submap = 0;  // the lowest bit counts
    uint64_t objectId = 0;  // the walk uses the low 32 bits
    int32_t purgeableState = 3;  // VSPurgeableState
    uint64_t offset = 0;    // where the region lies in its object

    uint64_t end() const { return address + length; }
    bool operator==(const VSHeapfileRegion &) const = default;
};

// A whole heapfile.
struct VSHeapfileSnapshot {
    int32_t pid = 0;
    std::string name;
    // Free text naming the recorded platform; it selects the shared cache
    // region (see vs::platformCodeForHeapfileDescription).
    std::string description;
    bool is64bit = true;
    uint32_t pageSize = 0;
    uint64_t physVestage = 0;
    uint64_t physVestagePeak = 0;
    bool breakDownPhysVestage = false;
    std::vector<VSHeapfileRegion> regions;  // ascending, not overlapping

    bool operator==(const VSHeapfileSnapshot &) const = default;
};

// The reader a heapfile target keeps for its whole life. Immutable once
// opened, so the target's worker may read it while nothing else does.
class VSHeapfileReader {
public:
    // Parses and checks the whole document. Null, with the problem in
    // `error` when one is given, for anything that is no usable heapfile.
    static std::unique_ptr<VSHeapfileReader> openFromData(std::string_view bytes, vs::HeapfileError *error);

    explicit VSHeapfileReader(VSHeapfileSnapshot snapshot) : _snapshot(std::move(snapshot)) {}

    bool is64bit() const { return _snapshot.is64bit; }
    int32_t pid() const { return _snapshot.pid; }
    const std::string &processName() const { return _snapshot.name; }
    const std::string &processDescription() const { return _snapshot.description; }
    uint32_t pageSize() const { return _snapshot.pageSize; }
    uint64_t physVestage() const { return _snapshot.physVestage; }
    uint64_t physVestagePeak() const { return _snapshot.physVestagePeak; }
    bool breakDownPhysVestage() const { return _snapshot.breakDownPhysVestage; }

    // Calls back with each region in ascending address order; setting
    // `stop` ends the enumeration after that region.
    void enumerateRegions(const std::function<void(const VSHeapfileRegion &region, bool &stop)> &callback) const;

    const VSHeapfileSnapshot &snapshot() const { return _snapshot; }

private:
    VSHeapfileSnapshot _snapshot;
};

namespace vs {

// Parses and checks a heapfile document (what openFromData does, without
// registering run-time tag names).
std::optional<VSHeapfileSnapshot> parseHeapfile(std::string_view bytes, HeapfileError *error);

// The document text of a snapshot: top-level keys one per line, one region
// per line, addresses and lengths as hexadecimal strings. Parsing the text
// gives the snapshot back unchanged.
std::string heapfileText(const VSHeapfileSnapshot &snapshot);

// The platform code (VSPlatformCode) a heapfile's description selects.
// "no shared region" anywhere selects VSPlatformNone, so that a Linux
// snapshot never gains a shared cache region whatever architecture it
// names. Otherwise, case-sensitively and in this order: "X86-64",
// "X86", "ARM64" ("ARM64-32" when directly followed by "-32"), "ARM";
// anything else is VSPlatformUnknown.
uint64_t platformCodeForHeapfileDescription(std::string_view description);

}  // namespace vs
