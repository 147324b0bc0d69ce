#pragma once

// Images: one segment of one loaded executable or library, and a
// forward-only cursor that finds the image covering each range of an
// address-ordered walk.

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "model/memory_region.h"

class VSImage {
public:
    VSImage() = default;

    // Set by setName(); VSSegmentUnknown on a new image.
    VSSegmentKind segment() const { return _segment; }
    void setSegment(VSSegmentKind segment) { _segment = segment; }

    std::uint64_t start() const { return _start; }
    void setStart(std::uint64_t start) { _start = start; }

    std::uint64_t size() const { return _size; }
    void setSize(std::uint64_t size) { _size = size; }

    std::uint64_t end() const { return _start + _size; }

    const std::optional<std::string> &name() const { return _name; }
    // Stores the name, then classifies it: a name beginning with "__DATA"
    // gives VSSegmentData, exactly "__TEXT" VSSegmentText, exactly
    // "__LINKEDIT" VSSegmentLinkedit; any other name (or none) leaves the
    // kind as it was, which the heapfile walk relies on.
    void setName(std::optional<std::string> name);

    const std::optional<std::string> &ownerPath() const { return _ownerPath; }
    void setOwnerPath(std::optional<std::string> path) { _ownerPath = std::move(path); }

private:
    VSSegmentKind _segment = VSSegmentUnknown;
    std::uint64_t _start = 0;
    std::uint64_t _size = 0;
    std::optional<std::string> _name;
    std::optional<std::string> _ownerPath;
};

// A target's images, in ascending order of start.
using VSImageList = std::vector<VSImage>;

// Walks the caller's image list itself, not a copy: images appended to the
// list during the walk are seen by later calls. The list must outlive the
// enumerator. Ranges must be asked in ascending order of start; the cursor
// never moves back.
class VSImageEnumerator {
public:
    explicit VSImageEnumerator(const VSImageList &images) : _images(&images) {}

    // The image covering or overlapping [start, end), or null. A returned
    // image is not passed, so it can match the next range too. The pointer
    // stays valid until the list is next modified.
    const VSImage *nextImageForStart(std::uint64_t start, std::uint64_t end);

private:
    const VSImageList *_images;
    std::uint64_t _index = 0;
};
