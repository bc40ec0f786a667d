// The runtime's raw byte exchange (tnObject/RuntimeInterface.h).

#include "tnObject/RuntimeInterface.h"

#include <algorithm>

namespace tarn {

void memswap(void* a, void* b, std::size_t n) {
    auto* pa = static_cast<unsigned char*>(a);
    auto* pb = static_cast<unsigned char*>(b);
    std::swap_ranges(pa, pa + n, pb);
}

}  // namespace tarn
