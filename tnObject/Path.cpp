#include "tnObject/Path.h"

#include <algorithm>
#include <cstring>

#include "tnUtils/Archive.h"
#include "tnUtils/Assert.h"
#include "tnUtils/VariableLengthSerialise.h"
#include "tnUtils/xostream.h"

namespace tarn {

Path::Path(const void* bytes, ssize_t n) : Path() {
    InitBuffer(n);
    if (n > 0) {
        std::memcpy(data(), bytes, static_cast<std::size_t>(n));
    }
    m_size = n;
}

Path::Path(const Path& rhs) : Path(rhs.data(), rhs.m_size) {}

Path& Path::operator=(const Path& rhs) {
    if (this == &rhs) {
        return *this;
    }
    if (rhs.m_size <= LOCAL_CAPACITY) {
        ReleaseHeap();
    } else if (m_capacity < rhs.m_size) {
        // Allocate first so that a failed allocation leaves this path intact.
        octet_t* buffer = new octet_t[static_cast<std::size_t>(rhs.m_size)];
        ReleaseHeap();
        m_heapBuffer = buffer;
        m_capacity = rhs.m_size;
    }
    if (rhs.m_size > 0) {
        std::memcpy(data(), rhs.data(), static_cast<std::size_t>(rhs.m_size));
    }
    m_size = rhs.m_size;
    return *this;
}

Path::~Path() {
    ReleaseHeap();
}

void Path::ReleaseHeap() {
    if (!IsLocal()) {
        delete[] m_heapBuffer;
        m_capacity = LOCAL_CAPACITY;
    }
}

void Path::InitLocalBuffer(ssize_t n) {
    TARN_ASSERT(0 <= n && n <= LOCAL_CAPACITY);
    ReleaseHeap();
    m_size = 0;
}

void Path::InitHeapBuffer(ssize_t n) {
    TARN_ASSERT(n > LOCAL_CAPACITY);
    octet_t* buffer = new octet_t[static_cast<std::size_t>(n)];
    ReleaseHeap();
    m_heapBuffer = buffer;
    m_capacity = n;
    m_size = 0;
}

void Path::InitBuffer(ssize_t n) {
    if (n <= LOCAL_CAPACITY) {
        InitLocalBuffer(n);
    } else {
        InitHeapBuffer(n);
    }
}

octet_t* Path::BeginReserveLocal() {
    TARN_ASSERT(m_size <= LOCAL_CAPACITY);
    if (!IsLocal()) {
        // Bring short content back from the heap into the value.
        octet_t* heap = m_heapBuffer;
        if (m_size > 0) {
            std::memcpy(m_localBuffer, heap, static_cast<std::size_t>(m_size));
        }
        delete[] heap;
        m_capacity = LOCAL_CAPACITY;
    }
    return m_localBuffer + m_size;
}

void Path::EndReserveLocal(octet_t* end) {
    m_size = end - m_localBuffer;
    TARN_ASSERT(0 <= m_size && m_size <= LOCAL_CAPACITY);
}

octet_t* Path::BeginReserveHeap(ssize_t n) {
    if (IsLocal() || m_capacity < m_size + n) {
        MoveToHeap(std::max({m_size + n, 2 * m_capacity, LOCAL_CAPACITY + 1}));
    }
    return m_heapBuffer + m_size;
}

void Path::EndReserveHeap(octet_t* end) {
    m_size = end - m_heapBuffer;
    TARN_ASSERT(0 <= m_size && m_size <= m_capacity);
}

octet_t* Path::BeginReserve(ssize_t n) {
    reserve(m_size + n);
    return data() + m_size;
}

void Path::EndReserve(octet_t* end) {
    m_size = end - data();
    TARN_ASSERT(0 <= m_size && m_size <= m_capacity);
}

void Path::reserve(ssize_t n) {
    if (n <= m_capacity) {
        return;
    }
    MoveToHeap(std::max(n, 2 * m_capacity));
}

void Path::MoveToHeap(ssize_t capacity) {
    octet_t* buffer = new octet_t[static_cast<std::size_t>(capacity)];
    if (m_size > 0) {
        std::memcpy(buffer, data(), static_cast<std::size_t>(m_size));
    }
    ReleaseHeap();
    m_heapBuffer = buffer;
    m_capacity = capacity;
}

void Path::Append(const void* bytes, ssize_t n) {
    octet_t* p = BeginReserve(n);
    if (n > 0) {
        std::memcpy(p, bytes, static_cast<std::size_t>(n));
    }
    EndReserve(p + n);
}

ssize_t Path::AppendUint32(uint32 v) {
    octet_t bytes[4];
    for (int i = 0; i < 4; ++i) {
        bytes[i] = static_cast<octet_t>(v >> (8 * i));
    }
    Append(bytes, 4);
    return m_size;
}

ssize_t Path::Append_ssize_t(ssize_t v) {
    octet_t bytes[8];
    for (int i = 0; i < 8; ++i) {
        bytes[i] = static_cast<octet_t>(static_cast<uint64>(v) >> (8 * i));
    }
    Append(bytes, 8);
    return m_size;
}

void Path::EraseTail(ssize_t n) {
    TARN_ASSERT(0 <= n && n <= m_size);
    m_size -= n;
}

bool Path::operator==(const Path& rhs) const {
    return m_size == rhs.m_size &&
           (m_size == 0 || std::memcmp(data(), rhs.data(), static_cast<std::size_t>(m_size)) == 0);
}

bool Path::operator<(const Path& rhs) const {
    ssize_t common = std::min(m_size, rhs.m_size);
    int c = common == 0 ? 0 : std::memcmp(data(), rhs.data(), static_cast<std::size_t>(common));
    return c < 0 || (c == 0 && m_size < rhs.m_size);
}

void Path::Write(xostream& os) const {
    static const char digits[] = "0123456789abcdef";
    for (octet_t b : *this) {
        os.put(digits[b >> 4]);
        os.put(digits[b & 15]);
    }
}

void Path::Serialise(Archive& ar) const {
    SerialiseVariableLengthUint<int64>(ar, m_size);
    ar.WriteBuffer(data(), m_size);
}

void Path::Deserialise(InputArchive& ar) {
    int64 n = 0;
    DeserialiseVariableLengthUint<int64>(ar, n);
    InitBuffer(n);
    ar.ReadBuffer(data(), n);
    m_size = n;
}

xostream& operator<<(xostream& os, const Path& p) {
    p.Write(os);
    return os;
}

}  // namespace tarn
