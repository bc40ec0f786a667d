#pragma once

// Fixed-width integers and the count type used throughout the store.

#include <cstddef>
#include <cstdint>

namespace tarn {

using int64 = std::int64_t;
using int32 = std::int32_t;
using uint64 = std::uint64_t;
using uint32 = std::uint32_t;
using uint16 = std::uint16_t;
using uint8 = std::uint8_t;
using octet_t = unsigned char;

// Signed 64-bit count, index and time-stamp type.
using ssize_t = std::int64_t;

// Schema number of a persistable class's byte image.
using schema_t = std::int32_t;

}  // namespace tarn
