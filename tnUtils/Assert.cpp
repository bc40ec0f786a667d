#include "tnUtils/Assert.h"

#include <cstdio>
#include <cstdlib>

namespace tarn {

void AssertionFailed(const char* file, int line, const char* function,
                     const char* expression) noexcept {
    std::fprintf(stderr, "%s:%d: %s: Assertion \"%s\" failed.\n", file, line, function, expression);
    std::fflush(stderr);
    std::abort();
}

}  // namespace tarn
