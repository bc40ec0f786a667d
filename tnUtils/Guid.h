#pragma once

// A 16-byte globally unique identifier. Names a site (SiteNum) in the
// per-site offset tables. Plain and trivially copyable.

#include <cstring>
#include <optional>
#include <string>
#include <string_view>

#include "tnUtils/Types.h"

namespace tarn {

class xostream;

struct Guid {
    uint32 Data1;
    uint16 Data2;
    uint16 Data3;
    uint8 Data4[8];
};

static_assert(sizeof(Guid) == 16, "a Guid is 16 bytes with no padding");

// A site of the replicated store is named by its Guid.
using SiteNum = Guid;

inline bool operator==(const Guid& a, const Guid& b) {
    return a.Data1 == b.Data1 && a.Data2 == b.Data2 && a.Data3 == b.Data3 &&
           std::memcmp(a.Data4, b.Data4, sizeof a.Data4) == 0;
}

inline bool operator!=(const Guid& a, const Guid& b) {
    return !(a == b);
}

// Data1, then Data2, then Data3 as numbers, then Data4 bytewise.
inline bool operator<(const Guid& a, const Guid& b) {
    if (a.Data1 != b.Data1) {
        return a.Data1 < b.Data1;
    }
    if (a.Data2 != b.Data2) {
        return a.Data2 < b.Data2;
    }
    if (a.Data3 != b.Data3) {
        return a.Data3 < b.Data3;
    }
    return std::memcmp(a.Data4, b.Data4, sizeof a.Data4) < 0;
}

// Text form: 32 lower-case hex digits in 8-4-4-4-12 groups, no braces, e.g.
// "0123abcd-0000-0001-8000-00000000002a".
std::string ToString(const Guid& g);

// Parses the text form above (upper-case digits accepted); nothing on failure.
std::optional<Guid> ParseGuid(std::string_view text);

xostream& operator<<(xostream& os, const Guid& g);

}  // namespace tarn
