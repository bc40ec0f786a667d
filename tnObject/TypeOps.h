#pragma once

// Type operations: how the runtime constructs, copies, assigns, destroys and
// prints instances of a type it knows only through its reflection record.
//
// A TypeOps table holds one function per operation; a null entry means the
// type does not support that operation. Array operations take byte strides:
// element i lies i * stride bytes after the first, so they apply to instances
// spaced at any distance (a stride larger than the instance size skips the
// bytes in between). A count of 0 or less does nothing.
//
// The typed templates (ConstructArray<T>(T*, ...)) are what code calls; each
// has an untyped overload of the same name (ConstructArray<T>(void*, ...))
// whose address fits the matching TypeOps entry, so a table is filled with
// `ops.m_ConstructArrayFn = ConstructArray<T>`.

#include <new>
#include <type_traits>

#include "tnObject/ReflectionByteCode.h"
#include "tnUtils/Types.h"

namespace tarn {

class Archive;
class InputArchive;
class IObjectVisitor;
class IPrefVisitor;
class xostream;

struct TypeOps {
    using EqualsFn = bool (*)(const void*, const void*);
    using LessFn = bool (*)(const void*, const void*);
    using PrintVariableFn = void (*)(xostream&, const void*);
    using ConstructArrayFn = void (*)(void* A, ssize_t s, ssize_t n);
    using CopyConstructArrayFn = void (*)(void* A1, ssize_t s1, const void* A2, ssize_t s2,
                                          ssize_t n);
    using AssignArrayFn = void (*)(void* A1, ssize_t s1, const void* A2, ssize_t s2, ssize_t n);
    using DestructArrayFn = void (*)(void* A, ssize_t s, ssize_t n);
    using SerialiseArrayFn = void (*)(Archive&, const void*, ssize_t, ssize_t);
    using DeserialiseArrayFn = void (*)(InputArchive&, void*, ssize_t, ssize_t);
    using VisitObjectsInArrayFn = void (*)(IObjectVisitor&, const void*, ssize_t, ssize_t);
    using VisitPrefsInArrayFn = void (*)(IPrefVisitor&, const void*, ssize_t, ssize_t);
    using BoundFn = ssize_t (*)(const void*, ssize_t, ssize_t, const void*);
    using FromSelfFn = bool (*)(ReflectionByteCode, const void*, const void*, bool);
    using ToSelfFn = bool (*)(void*, ReflectionByteCode, const void*, bool);

    ssize_t m_size;
    EqualsFn m_equalsFn;
    LessFn m_lessFn;
    PrintVariableFn m_PrintVariableFn;
    ConstructArrayFn m_ConstructArrayFn;
    CopyConstructArrayFn m_CopyConstructArrayFn;
    AssignArrayFn m_AssignArrayFn;
    DestructArrayFn m_DestructArrayFn;
    SerialiseArrayFn m_SerialiseArrayFn;
    DeserialiseArrayFn m_DeserialiseArrayFn;
    VisitObjectsInArrayFn m_VisitObjectsInArrayFn;
    VisitPrefsInArrayFn m_VisitPrefsInArrayFn;
    BoundFn m_LowerBoundFn;
    BoundFn m_UpperBoundFn;
    FromSelfFn m_ConstructVariableFromSelfFn;
    FromSelfFn m_AssignVariableFromSelfFn;
    ToSelfFn m_ConstructSelfFromVariableFn;
    ToSelfFn m_AssignSelfFromVariableFn;
};

// --- Single instances ------------------------------------------------------

template <typename T>
void ConstructVariable(T* p) {
    new (static_cast<void*>(p)) T();
}

template <typename T>
void CopyConstructVariable(T* p, const T* src) {
    new (static_cast<void*>(p)) T(*src);
}

template <typename T>
void AssignVariable(T* p, const T* src) {
    *p = *src;
}

// Runs the destructor; the memory stays with the caller.
template <typename T>
void DestructVariable(T* p) {
    p->~T();
}

// Advances `p` by `offset` bytes (not elements).
template <typename T>
void ApplyStride(T*& p, ssize_t offset) {
    using Byte = std::conditional_t<std::is_const_v<T>, const char, char>;
    p = reinterpret_cast<T*>(reinterpret_cast<Byte*>(p) + offset);
}

template <typename T>
void PrintVariable(xostream& os, const T* p) {
    os << *p;
}

// --- Arrays with byte strides ------------------------------------------------

template <typename T>
void ConstructArray(T* A, ssize_t s, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        ConstructVariable<T>(A);
        ApplyStride(A, s);
    }
}

template <typename T>
void CopyConstructArray(T* A1, ssize_t s1, const T* A2, ssize_t s2, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        CopyConstructVariable<T>(A1, A2);
        ApplyStride(A1, s1);
        ApplyStride(A2, s2);
    }
}

template <typename T>
void AssignArray(T* A1, ssize_t s1, const T* A2, ssize_t s2, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        AssignVariable<T>(A1, A2);
        ApplyStride(A1, s1);
        ApplyStride(A2, s2);
    }
}

template <typename T>
void DestructArray(T* A, ssize_t s, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        DestructVariable<T>(A);
        ApplyStride(A, s);
    }
}

// --- Untyped overloads, the shapes of the TypeOps entries ------------------

template <typename T>
void PrintVariable(xostream& os, const void* p) {
    PrintVariable<T>(os, static_cast<const T*>(p));
}

template <typename T>
void ConstructArray(void* A, ssize_t s, ssize_t n) {
    ConstructArray<T>(static_cast<T*>(A), s, n);
}

template <typename T>
void CopyConstructArray(void* A1, ssize_t s1, const void* A2, ssize_t s2, ssize_t n) {
    CopyConstructArray<T>(static_cast<T*>(A1), s1, static_cast<const T*>(A2), s2, n);
}

template <typename T>
void AssignArray(void* A1, ssize_t s1, const void* A2, ssize_t s2, ssize_t n) {
    AssignArray<T>(static_cast<T*>(A1), s1, static_cast<const T*>(A2), s2, n);
}

template <typename T>
void DestructArray(void* A, ssize_t s, ssize_t n) {
    DestructArray<T>(static_cast<T*>(A), s, n);
}

}  // namespace tarn
