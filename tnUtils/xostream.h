#pragma once

// The runtime's text stream, used for diagnostics and dumps.
//
// Text goes through an indenting layer: every line that the stream starts
// (its first character, and the first character after each line break) is
// preceded by the current indentation, in spaces. An Indenter deepens the
// indentation for its lifetime. Integers print as plain decimal.

#include <cstdio>
#include <iterator>
#include <string>
#include <string_view>

#include "tnUtils/IOutputStream.h"
#include "tnUtils/Types.h"

namespace tarn {

// Integers print through put(long); every 64-bit integer of the store is one.
static_assert(sizeof(long) == 8, "long is the 64-bit integer on the store's targets");

using xchar = char;
using streamsize = ssize_t;

// Inserts the indentation at line starts and forwards to the byte stream.
class IndentingOutputStream {
public:
    explicit IndentingOutputStream(IOutputStream& os) : m_os(os) {}

    void Write(const char* s, ssize_t n);
    void Flush() { m_os.FlushStream(); }

    ssize_t m_indent = 0;
    bool m_atLineStart = true;

private:
    IOutputStream& m_os;
};

class xostream {
public:
    using Manipulator = xostream& (*)(xostream&);

    explicit xostream(IOutputStream& os);
    ~xostream();
    xostream(const xostream&) = delete;
    xostream& operator=(const xostream&) = delete;

    xostream& put(char c) { return put(&c, 1); }
    xostream& put(const char* s, ssize_t n) {
        m_os->Write(s, n);
        return *this;
    }
    xostream& put(const char* s);
    xostream& put(long x);
    xostream& put(unsigned long x);
    xostream& put(int x) { return put(static_cast<long>(x)); }
    xostream& put(unsigned x) { return put(static_cast<unsigned long>(x)); }
    xostream& put(bool b) { return put(b ? "true" : "false"); }
    xostream& put(double x);
    xostream& put(const void* p);

    xostream& write(const xchar* s, ssize_t n) { return put(s, n); }
    // Bytes as lower-case hex, two digits each.
    xostream& writebytes(const uint8* bytes, ssize_t n);
    xostream& put_internal(const xchar* s, ssize_t n, ssize_t width);
    xostream& operator<<(Manipulator m) { return m(*this); }

    streamsize precision() const { return m_precision; }
    void precision(streamsize p) { m_precision = p; }
    streamsize width() const { return m_width; }
    void width(streamsize w) { m_width = w; }

    void Indent(ssize_t n) { m_os->m_indent += n; }
    ssize_t GetIndent() const { return m_os->m_indent; }

    xostream& flush();
    xostream& endl() { return put('\n'); }
    xostream& ends() { return put('\0'); }
    void close() { flush(); }

    IndentingOutputStream* m_os;

private:
    streamsize m_precision = 6;
    streamsize m_width = 0;
};

xostream& endl(xostream& os);

// Deepens the stream's indentation by `n` columns until it goes out of scope.
class Indenter {
public:
    Indenter(xostream& os, ssize_t n) : m_os(os), m_indent(n) { m_os.Indent(n); }
    ~Indenter() { m_os.Indent(-m_indent); }
    Indenter(const Indenter&) = delete;
    Indenter& operator=(const Indenter&) = delete;

    xostream& m_os;
    ssize_t m_indent;
};

inline xostream& operator<<(xostream& os, char c) {
    return os.put(c);
}
inline xostream& operator<<(xostream& os, const char* s) {
    return os.put(s);
}
inline xostream& operator<<(xostream& os, long x) {
    return os.put(x);
}
inline xostream& operator<<(xostream& os, int x) {
    return os.put(static_cast<long>(x));
}
inline xostream& operator<<(xostream& os, unsigned x) {
    return os.put(x);
}
inline xostream& operator<<(xostream& os, unsigned long x) {
    return os.put(x);
}
// long long and long are both 64 bits on the store's targets.
inline xostream& operator<<(xostream& os, long long x) {
    return os.put(static_cast<long>(x));
}
inline xostream& operator<<(xostream& os, unsigned long long x) {
    return os.put(static_cast<unsigned long>(x));
}
inline xostream& operator<<(xostream& os, double x) {
    return os.put(x);
}
inline xostream& operator<<(xostream& os, std::string_view s) {
    return os.put(s.data(), static_cast<ssize_t>(s.size()));
}
inline xostream& operator<<(xostream& os, const std::string& s) {
    return os.put(s.data(), static_cast<ssize_t>(s.size()));
}

// Views of a collection under another type, for printing.
template <typename C>
struct CommaSeparatedListMixin : C {};

template <typename C>
const CommaSeparatedListMixin<C>& AsCommaSeparatedList(const C& c) {
    return static_cast<const CommaSeparatedListMixin<C>&>(c);
}

struct CurlyBrackets {
    static constexpr const char* L = "{";
    static constexpr const char* R = "}";
};

template <typename L, typename R, typename X>
struct BracketedMixin : X {};

template <typename X>
const BracketedMixin<CurlyBrackets, CurlyBrackets, X>& AsCurlyBracketed(const X& x) {
    return static_cast<const BracketedMixin<CurlyBrackets, CurlyBrackets, X>&>(x);
}

template <typename I>
xostream& WriteCommaSeparatedListToStream(xostream& os, I p1, I p2) {
    for (I i = p1; i != p2; ++i) {
        if (i != p1) {
            os << ',';
        }
        os << *i;
    }
    return os;
}

template <typename C>
xostream& operator<<(xostream& os, const CommaSeparatedListMixin<C>& c) {
    return WriteCommaSeparatedListToStream(os, c.begin(), c.end());
}

template <typename L, typename R, typename X>
xostream& operator<<(xostream& os, const BracketedMixin<L, R, X>& x) {
    os << L::L;
    os << static_cast<const X&>(x);
    os << R::R;
    return os;
}

// A text stream that collects its text in a string, for tests and tools.
class StringOutputStream final : public IOutputStream {
public:
    void WriteStream(const void* bytes, ssize_t n) override {
        m_text.append(static_cast<const char*>(bytes), static_cast<std::size_t>(n));
    }
    void FlushStream() override {}
    const std::string& str() const { return m_text; }

private:
    std::string m_text;
};

// A text stream over a C file (standard output by default).
class FileOutputStream final : public IOutputStream {
public:
    explicit FileOutputStream(std::FILE* f = stdout) : m_file(f) {}
    void WriteStream(const void* bytes, ssize_t n) override;
    void FlushStream() override;

private:
    std::FILE* m_file;
};

}  // namespace tarn
