#include "model/image.h"

#include <string_view>

void VSImage::setName(std::optional<std::string> name) {
    _name = std::move(name);
    if (!_name) {
        return;
    }
    const std::string_view text = *_name;
    if (text.starts_with("__DATA")) {
        _segment = VSSegmentData;
    } else if (text == "__TEXT") {
        _segment = VSSegmentText;
    } else if (text == "__LINKEDIT") {
        _segment = VSSegmentLinkedit;
    }
    // Any other name keeps the kind: callers test for a change.
}

const VSImage *VSImageEnumerator::nextImageForStart(std::uint64_t start, std::uint64_t end) {
    while (_index < _images->size()) {
        const VSImage &image = (*_images)[_index];
        const std::uint64_t imageStart = image.start();
        const std::uint64_t imageEnd = image.end();
        if (imageStart <= start && imageEnd > start) {
            return &image; // the range starts inside the image
        }
        if (imageStart < end && imageEnd >= end) {
            return &image; // the image reaches to or past the range's end
        }
        if (imageEnd <= end && imageStart >= start) {
            return &image; // the image lies inside the range
        }
        if (imageStart >= start) {
            return nullptr; // wholly after the range; a later range may match it
        }
        ++_index; // ends at or before the range's start: passed for good
    }
    return nullptr;
}
