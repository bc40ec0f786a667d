#pragma once

// Exchange of raw bytes, a service of the runtime (defined in
// tnRuntime/MemSwap.cpp).

#include <cstddef>

namespace tarn {

// Exchanges the `n` bytes at `a` with the `n` bytes at `b`; the two ranges
// must not overlap. No constructor, assignment or destructor runs, so only
// values that never point into themselves may be exchanged this way (a Path,
// a FieldId, a persistent reference, a per-site table).
void memswap(void* a, void* b, std::size_t n);

}  // namespace tarn
