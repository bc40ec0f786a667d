#pragma once

// Output and input archives.
//
// An Archive gathers bytes in a fixed 4096-byte buffer of its own and hands
// full buffers to its IOutputStream. Every write first makes room for all of
// its bytes, so a value is never split across two flushes. Fixed-width values
// are written as their little-endian in-memory image, unaligned, with nothing
// between them.
//
// An InputArchive is a bare read position over memory that already holds the
// whole image; it tests no bounds. Whoever hands bytes to a reader (the
// runtime's loader) checks first that they are a complete image of the
// reader's class.

#include <cstring>

#include "tnUtils/Assert.h"
#include "tnUtils/Guid.h"
#include "tnUtils/IOutputStream.h"
#include "tnUtils/Types.h"

namespace tarn {

constexpr ssize_t ARCHIVE_BUFSIZE = 4096;

class Archive;

// Writes one item of some type into an archive; not used by the module.
class IItemSerialiser {
public:
    virtual ~IItemSerialiser() = default;
    virtual void SerialiseItem(Archive& ar, const void* item) = 0;
};

class Archive {
public:
    explicit Archive(IOutputStream* os);
    // Does not flush: the owner calls Flush when writing ends.
    ~Archive() = default;
    Archive(const Archive&) = delete;
    Archive& operator=(const Archive&) = delete;

    IOutputStream* GetOutputStream() const { return m_oStream; }

    // Makes sure `reserveSize` bytes are free at the write position and
    // returns it; the caller writes at most that many bytes and then calls
    // EndWrite with the position just past the last one.
    octet_t* BeginWrite(ssize_t reserveSize) {
        TARN_ASSERT(m_writeBuffer <= m_pos && m_pos <= m_writeBuffer+ARCHIVE_BUFSIZE);
        TARN_ASSERT(reserveSize <= ARCHIVE_BUFSIZE);
        if (m_pos - m_writeBuffer > ARCHIVE_BUFSIZE - reserveSize) {
            FlushBuffer();
        }
        return m_pos;
    }

    void EndWrite(octet_t* pos) {
        TARN_ASSERT(m_writeBuffer <= m_pos && m_pos <= pos && pos <= m_writeBuffer+ARCHIVE_BUFSIZE);
        m_pos = pos;
    }

    template <typename T>
    void SerialisePod(const T& t) {
        TARN_ASSERT(m_writeBuffer <= m_pos && m_pos <= m_writeBuffer+ARCHIVE_BUFSIZE);
        if (m_pos > m_writeBuffer + ARCHIVE_BUFSIZE - static_cast<ssize_t>(sizeof(T))) {
            FlushBuffer();
        }
        std::memcpy(m_pos, &t, sizeof(T));
        m_pos += sizeof(T);
    }

    // Writes `n` raw bytes, splitting them over as many buffers as needed.
    void WriteBuffer(const void* bytes, ssize_t n);
    // Copies a whole stream (or its first `n` bytes) into the archive;
    // returns the number of bytes copied.
    ssize_t WriteStream(IInputStream* is);
    ssize_t WriteStream(IInputStream* is, ssize_t n);

    // Hands the buffered bytes to the stream and empties the buffer.
    void FlushBuffer();
    // FlushBuffer, then flushes the stream itself.
    void Flush();

    ssize_t NumBufferedWrites() const { return m_pos - m_writeBuffer; }
    void ClearWriteBuffer() { m_pos = m_writeBuffer; }
    void ClearWriteBufferAndNumBytesWritten() {
        ClearWriteBuffer();
        m_numBytesWrittenToStream = 0;
    }
    int64 GetNumBytesWrittenToStream() const { return m_numBytesWrittenToStream; }
    // Bytes handed to the stream plus bytes still buffered.
    int64 GetNumBytesWritten() const { return m_numBytesWrittenToStream + NumBufferedWrites(); }

    octet_t m_writeBuffer[ARCHIVE_BUFSIZE];
    octet_t* m_pos;
    IOutputStream* m_oStream;
    int64 m_numBytesWrittenToStream;
    IItemSerialiser* m_oidHighSerialiser;
};

class InputArchive {
public:
    explicit InputArchive(const octet_t* p) : p_(p) {}

    operator const octet_t*() const { return p_; }
    const octet_t* ptr() const { return p_; }
    void SetPtr(const octet_t* p) { p_ = p; }
    InputArchive& operator+=(ssize_t n) {
        p_ += n;
        return *this;
    }
    InputArchive& operator-=(ssize_t n) {
        p_ -= n;
        return *this;
    }

    void ReadBuffer(void* bytes, ssize_t n) {
        if (n > 0) {
            std::memcpy(bytes, p_, static_cast<std::size_t>(n));
        }
        p_ += n;
    }

    template <typename T>
    void DeserialisePod(T& t) {
        std::memcpy(&t, p_, sizeof(T));
        p_ += sizeof(T);
    }

    const octet_t* p_;
};

// Fixed-width values.
inline void Serialise(Archive& ar, int64 v) {
    ar.SerialisePod<int64>(v);
}
inline void Deserialise(InputArchive& ar, int64& v) {
    ar.DeserialisePod<int64>(v);
}
inline void Serialise(Archive& ar, const Guid& g) {
    ar.SerialisePod<Guid>(g);
}
inline void Deserialise(InputArchive& ar, Guid& g) {
    ar.DeserialisePod<Guid>(g);
}

inline Archive& operator<<(Archive& ar, int64 v) {
    Serialise(ar, v);
    return ar;
}
inline InputArchive& operator>>(InputArchive& ar, int64& v) {
    Deserialise(ar, v);
    return ar;
}
inline Archive& operator<<(Archive& ar, const Guid& g) {
    Serialise(ar, g);
    return ar;
}
inline InputArchive& operator>>(InputArchive& ar, Guid& g) {
    Deserialise(ar, g);
    return ar;
}

// Every object image opens with its class's schema number (> 0), written as
// a variable-length unsigned integer.
void SerialiseSchema(Archive& ar, schema_t schema);

// Reads the schema number into `schema`. A stored number below 1 or above
// `currentSchema` (an image from a newer program) stops the process: it is
// not guessed at.
void DeserialiseSchema(InputArchive& ar, schema_t currentSchema, schema_t& schema);

}  // namespace tarn
