#pragma once

// A byte sink over a std::ostream, so that the runtime's text stream (xostream)
// can print to whatever stream a command was given. Does not own the stream.

#include <ostream>

#include "tnUtils/IOutputStream.h"

namespace tarn {

class OstreamOutputStream final : public IOutputStream {
public:
    explicit OstreamOutputStream(std::ostream& os) : m_os(os) {}
    void WriteStream(const void* bytes, ssize_t n) override {
        m_os.write(static_cast<const char*>(bytes), static_cast<std::streamsize>(n));
    }
    void FlushStream() override { m_os.flush(); }

private:
    std::ostream& m_os;
};

}  // namespace tarn
