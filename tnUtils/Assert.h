#pragma once

// The one assertion of the code base. A failed check writes
//   <source path>:<line>: <function signature>: Assertion "<expression>" failed.
// to standard error and aborts.
//
// The source path is __FILE__, which the build maps to the repository root
// (-fmacro-prefix-map), so that it reads "tnPersistStore/pref.h" wherever the
// sources live; the installed package passes the same mapping for its include
// directory to the programs built against it.
//
// The function is named as the compiler prints it (__PRETTY_FUNCTION__), so
// its spelling depends on the compiler. For the assignment of a pointer to an
// untyped persistent reference, GCC prints
//   tarn::cref<void>& tarn::cref<void>::operator=(void*)
// Clang prints
//   tarn::cref<void> &tarn::cref<void>::operator=(void *)
// and others print Clang's spacing with the return type unqualified:
//   cref<void> &tarn::cref<void>::operator=(void *)
// Tools that match assertion lines should match the expression text and the
// function's qualified name, not the whole signature.
// In a member of a class template GCC names the template and appends the
// arguments, e.g. "T* tarn::cref<T>::GetNotNull() const [with T = tarn::X]".
//
// The expression text is the stringified source expression, so checks whose
// text is part of the system's contract must be written exactly as that text
// reads. The repository's .clang-format lists TARN_ASSERT among its
// whitespace-sensitive macros, so the formatter leaves the spacing inside the
// parentheses as written.
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
