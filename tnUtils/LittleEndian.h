#pragma once

// Fixed-width little-endian integers in byte buffers, for the file formats
// that frame what they store (image records, the journal).

#include <cstddef>

#include "tnUtils/Types.h"

namespace tarn {

// Writes the low `width` bytes of `value` (1..8), least significant first.
inline void PutLe(octet_t* out, uint64 value, std::size_t width) {
    for (std::size_t i = 0; i < width; ++i) {
        out[i] = static_cast<octet_t>(value >> (8 * i));
    }
}

// Reads `width` bytes (1..8) written by PutLe.
inline uint64 GetLe(const octet_t* in, std::size_t width) {
    uint64 value = 0;
    for (std::size_t i = 0; i < width; ++i) {
        value |= static_cast<uint64>(in[i]) << (8 * i);
    }
    return value;
}

}  // namespace tarn
