#include "tnUtils/Guid.h"

#include <cstdio>

#include "tnUtils/Hex.h"
#include "tnUtils/xostream.h"

namespace tarn {

std::string ToString(const Guid& g) {
    char text[37];
    std::snprintf(text, sizeof text, "%08x-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x",
                  static_cast<unsigned>(g.Data1), static_cast<unsigned>(g.Data2),
                  static_cast<unsigned>(g.Data3), g.Data4[0], g.Data4[1], g.Data4[2], g.Data4[3],
                  g.Data4[4], g.Data4[5], g.Data4[6], g.Data4[7]);
    return std::string(text, 36);
}

std::optional<Guid> ParseGuid(std::string_view text) {
    // The canonical form is 36 characters: dashes at 8, 13, 18 and 23 and a
    // hex digit everywhere else, two digits a byte, most significant first.
    if (text.size() != 36) {
        return std::nullopt;
    }
    uint8 bytes[16];
    int n = 0;
    int hi = -1;
    for (std::size_t i = 0; i < text.size(); ++i) {
        bool dashPosition = i == 8 || i == 13 || i == 18 || i == 23;
        if (dashPosition) {
            if (text[i] != '-') {
                return std::nullopt;
            }
            continue;
        }
        int digit = HexDigitValue(text[i]);
        if (digit < 0) {
            return std::nullopt;
        }
        if (hi < 0) {
            hi = digit;
        } else {
            bytes[n++] = static_cast<uint8>(hi * 16 + digit);
            hi = -1;
        }
    }
    Guid g;
    g.Data1 =
        (uint32{bytes[0]} << 24) | (uint32{bytes[1]} << 16) | (uint32{bytes[2]} << 8) | bytes[3];
    g.Data2 = static_cast<uint16>((bytes[4] << 8) | bytes[5]);
    g.Data3 = static_cast<uint16>((bytes[6] << 8) | bytes[7]);
    std::memcpy(g.Data4, bytes + 8, 8);
    return g;
}

xostream& operator<<(xostream& os, const Guid& g) {
    std::string text = ToString(g);
    os.put(text.data(), static_cast<ssize_t>(text.size()));
    return os;
}

}  // namespace tarn
