#include "tnUtils/Archive.h"

#include <algorithm>

#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {

Archive::Archive(IOutputStream* os)
    : m_pos(m_writeBuffer),
      m_oStream(os),
      m_numBytesWrittenToStream(0),
      m_oidHighSerialiser(nullptr) {}

void Archive::FlushBuffer() {
    ssize_t n = m_pos - m_writeBuffer;
    if (n > 0) {
        m_oStream->WriteStream(m_writeBuffer, n);
        m_numBytesWrittenToStream += n;
    }
    m_pos = m_writeBuffer;
}

void Archive::Flush() {
    FlushBuffer();
    m_oStream->FlushStream();
}

void Archive::WriteBuffer(const void* bytes, ssize_t n) {
    const auto* p = static_cast<const octet_t*>(bytes);
    while (n > 0) {
        ssize_t chunk = std::min<ssize_t>(n, ARCHIVE_BUFSIZE);
        octet_t* dst = BeginWrite(chunk);
        std::memcpy(dst, p, static_cast<std::size_t>(chunk));
        EndWrite(dst + chunk);
        p += chunk;
        n -= chunk;
    }
}

ssize_t Archive::WriteStream(IInputStream* is) {
    ssize_t total = 0;
    for (;;) {
        octet_t* dst = BeginWrite(ARCHIVE_BUFSIZE);
        ssize_t got = is->ReadStream(dst, ARCHIVE_BUFSIZE);
        if (got <= 0) {
            return total;
        }
        EndWrite(dst + got);
        total += got;
    }
}

ssize_t Archive::WriteStream(IInputStream* is, ssize_t n) {
    ssize_t total = 0;
    while (total < n) {
        ssize_t want = std::min<ssize_t>(n - total, ARCHIVE_BUFSIZE);
        octet_t* dst = BeginWrite(want);
        ssize_t got = is->ReadStream(dst, want);
        if (got <= 0) {
            break;
        }
        EndWrite(dst + got);
        total += got;
    }
    return total;
}

void SerialiseSchema(Archive& ar, schema_t schema) {
    TARN_ASSERT(schema > 0);
    ar << AsCompressedInt(schema);
}

void DeserialiseSchema(InputArchive& ar, schema_t currentSchema, schema_t& schema) {
    int64 stored = 0;
    DeserialiseVariableLengthUint<int64>(ar, stored);
    TARN_ASSERT(1 <= stored && stored <= currentSchema);
    schema = static_cast<schema_t>(stored);
}

}  // namespace tarn
