#pragma once

#include "tnUtils/Types.h"

namespace tarn {

// A byte sink behind an output archive or a text stream.
class IOutputStream {
public:
    virtual ~IOutputStream() = default;
    virtual void WriteStream(const void* bytes, ssize_t n) = 0;
    virtual void FlushStream() = 0;
};

// A byte source; an archive can copy a whole stream into itself.
class IInputStream {
public:
    virtual ~IInputStream() = default;
    // Reads up to `n` bytes into `bytes`; returns how many were read, 0 at the end.
    virtual ssize_t ReadStream(void* bytes, ssize_t n) = 0;
};

}  // namespace tarn
