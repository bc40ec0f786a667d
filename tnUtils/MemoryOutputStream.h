#pragma once

#include <string>
#include <vector>

#include "tnUtils/IOutputStream.h"

namespace tarn {

// An output stream that collects everything written to it in memory.
// Used to build object images and text in tests and in the runtime.
class MemoryOutputStream final : public IOutputStream {
public:
    void WriteStream(const void* bytes, ssize_t n) override {
        const auto* p = static_cast<const octet_t*>(bytes);
        m_bytes.insert(m_bytes.end(), p, p + n);
        ++m_numWrites;
    }
    void FlushStream() override {}

    const std::vector<octet_t>& bytes() const { return m_bytes; }
    std::string str() const { return std::string(m_bytes.begin(), m_bytes.end()); }
    void clear() { m_bytes.clear(); }
    // How many times bytes were handed over (one per archive flush).
    ssize_t NumWrites() const { return m_numWrites; }

private:
    std::vector<octet_t> m_bytes;
    ssize_t m_numWrites = 0;
};

}  // namespace tarn
