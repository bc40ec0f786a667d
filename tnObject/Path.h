#pragma once

// A byte string that addresses a field inside an object.
//
// Up to 16 bytes are held in the value itself; longer paths live in a heap
// buffer. The local bytes and the heap pointer share one union and the value
// never points into itself, so a Path (and anything containing one) may be
// relocated by copying its bytes, without running a constructor or destructor.
//
//   m_capacity == 16  -> bytes in m_localBuffer
//   m_capacity  > 16  -> bytes in m_heapBuffer[0 .. m_capacity)

#include "tnUtils/Types.h"

namespace tarn {

class Archive;
class InputArchive;
class xostream;

class Path {
public:
    static constexpr ssize_t LOCAL_CAPACITY = 16;

    Path() : m_size(0), m_capacity(LOCAL_CAPACITY) {}
    Path(const void* bytes, ssize_t n);
    Path(const Path& rhs);
    Path& operator=(const Path& rhs);
    ~Path();

    // Empties the path and makes room for `n` bytes, without keeping content.
    void InitLocalBuffer(ssize_t n);
    void InitHeapBuffer(ssize_t n);
    void InitBuffer(ssize_t n);

    // Reservation protocol: Begin… returns where up to `n` bytes may be
    // written after the current content, End… takes the position just past
    // the last byte written and sets the size from it.
    octet_t* BeginReserveLocal();
    void EndReserveLocal(octet_t* end);
    octet_t* BeginReserveHeap(ssize_t n);
    void EndReserveHeap(octet_t* end);
    octet_t* BeginReserve(ssize_t n);
    void EndReserve(octet_t* end);

    // Makes room for at least `n` bytes, keeping the content.
    void reserve(ssize_t n);
    void clear() { m_size = 0; }
    bool empty() const { return m_size == 0; }
    ssize_t size() const { return m_size; }

    void Append(const void* bytes, ssize_t n);
    // Append a fixed-width integer little-endian; both return the new size.
    ssize_t AppendUint32(uint32 v);
    ssize_t Append_ssize_t(ssize_t v);
    // Removes the last `n` bytes.
    void EraseTail(ssize_t n);

    const octet_t* begin() const { return data(); }
    const octet_t* end() const { return data() + m_size; }

    bool operator==(const Path& rhs) const;
    bool operator!=(const Path& rhs) const { return !(*this == rhs); }
    // Lexicographic over unsigned bytes; a proper prefix is less.
    bool operator<(const Path& rhs) const;

    // Text: lower-case hex, two digits a byte, nothing for an empty path.
    void Write(xostream& os) const;
    // Byte form: the length as a variable-length integer, then the bytes.
    void Serialise(Archive& ar) const;
    void Deserialise(InputArchive& ar);

    bool IsLocal() const { return m_capacity == LOCAL_CAPACITY; }
    const octet_t* data() const { return IsLocal() ? m_localBuffer : m_heapBuffer; }
    octet_t* data() { return IsLocal() ? m_localBuffer : m_heapBuffer; }

    ssize_t m_size;
    ssize_t m_capacity;
    union {
        octet_t m_localBuffer[LOCAL_CAPACITY];
        octet_t* m_heapBuffer;
    };

private:
    void ReleaseHeap();
    // Copies the content into a new heap buffer of `capacity` (> 16) bytes.
    void MoveToHeap(ssize_t capacity);
};

xostream& operator<<(xostream& os, const Path& p);

}  // namespace tarn
