#include "tnPersistStore/OID.h"

#include <cstdio>

#include "tnUtils/xostream.h"

namespace tarn {

std::string ToString(const OID& oid) {
    char text[24];
    int n = std::snprintf(text, sizeof text, "#%llu", static_cast<unsigned long long>(oid.value_));
    return std::string(text, static_cast<std::size_t>(n));
}

xostream& operator<<(xostream& os, const OID& oid) {
    std::string text = ToString(oid);
    os.put(text.data(), static_cast<ssize_t>(text.size()));
    return os;
}

}  // namespace tarn
