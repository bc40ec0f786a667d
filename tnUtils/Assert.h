#pragma once

// The one assertion of the code base. A failed check writes
//   <source path>:<line>: <function signature>: Assertion "<expression>" failed.
// to standard error and aborts. The expression text is the stringified source
// expression, so checks whose text is part of the system's contract must be
// written exactly as that text reads (and kept away from the formatter with
// "clang-format off" where it would insert spaces).
//
// Checks are always on: they guard the persistent tree against corrupt or
// inconsistent state, and a release build must not silently continue past one.

namespace tarn {

[[noreturn]] void AssertionFailed(const char* file, int line, const char* function,
                                  const char* expression) noexcept;

}  // namespace tarn

#define TARN_ASSERT(expr)          \
    ((expr) ? static_cast<void>(0) \
            : ::tarn::AssertionFailed(__FILE__, __LINE__, __PRETTY_FUNCTION__, #expr))
