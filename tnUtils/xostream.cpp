#include "tnUtils/xostream.h"

#include <cstdio>
#include <cstring>

namespace tarn {

void IndentingOutputStream::Write(const char* s, ssize_t n) {
    static const char spaces[] = "                                ";  // 32
    const char* end = s + n;
    while (s < end) {
        if (m_atLineStart) {
            for (ssize_t left = m_indent; left > 0; left -= 32) {
                m_os.WriteStream(spaces, left < 32 ? left : 32);
            }
            m_atLineStart = false;
        }
        const char* nl = static_cast<const char*>(std::memchr(s, '\n', end - s));
        const char* stop = nl ? nl + 1 : end;
        m_os.WriteStream(s, stop - s);
        s = stop;
        if (nl) {
            m_atLineStart = true;
        }
    }
}

xostream::xostream(IOutputStream& os) : m_os(new IndentingOutputStream(os)) {}

xostream::~xostream() {
    delete m_os;
}

xostream& xostream::put(const char* s) {
    return put(s, static_cast<ssize_t>(std::strlen(s)));
}

xostream& xostream::put(long x) {
    char text[24];
    int n = std::snprintf(text, sizeof text, "%ld", x);
    return put(text, n);
}

xostream& xostream::put(unsigned long x) {
    char text[24];
    int n = std::snprintf(text, sizeof text, "%lu", x);
    return put(text, n);
}

xostream& xostream::put(double x) {
    char text[64];
    int n = std::snprintf(text, sizeof text, "%.*g", static_cast<int>(m_precision), x);
    return put(text, n);
}

xostream& xostream::put(const void* p) {
    char text[24];
    int n = std::snprintf(text, sizeof text, "%p", p);
    return put(text, n);
}

xostream& xostream::writebytes(const uint8* bytes, ssize_t n) {
    static const char digits[] = "0123456789abcdef";
    for (ssize_t i = 0; i < n; ++i) {
        put(digits[bytes[i] >> 4]);
        put(digits[bytes[i] & 15]);
    }
    return *this;
}

xostream& xostream::put_internal(const xchar* s, ssize_t n, ssize_t width) {
    for (ssize_t pad = width - n; pad > 0; --pad) {
        put(' ');
    }
    return put(s, n);
}

xostream& xostream::flush() {
    m_os->Flush();
    return *this;
}

xostream& endl(xostream& os) {
    return os.endl();
}

void FileOutputStream::WriteStream(const void* bytes, ssize_t n) {
    std::fwrite(bytes, 1, static_cast<std::size_t>(n), m_file);
}

void FileOutputStream::FlushStream() {
    std::fflush(m_file);
}

}  // namespace tarn
