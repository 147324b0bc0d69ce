#pragma once

// Numbers kept small while they wait: seven bits a byte, the high bit set on
// every byte but the last.

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace vs {

inline void putPackedNumber(std::vector<uint8_t> &out, uint64_t value) {
    while (value >= 0x80) {
        out.push_back(static_cast<uint8_t>(value | 0x80));
        value >>= 7;
    }
    out.push_back(static_cast<uint8_t>(value));
}

// The number at `at`, which moves past it; a cut number reads as far as it goes.
inline uint64_t takePackedNumber(std::span<const uint8_t> bytes, size_t &at) {
    uint64_t value = 0;
    for (unsigned shift = 0; at < bytes.size() && shift < 64; shift += 7) {
        const uint8_t byte = bytes[at++];
        value |= uint64_t{byte & 0x7Fu} << shift;
        if ((byte & 0x80) == 0) {
            break;
        }
    }
    return value;
}

} // namespace vs
