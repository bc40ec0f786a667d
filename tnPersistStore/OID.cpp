#include "tnPersistStore/OID.h"

#include "tnUtils/xostream.h"

namespace tarn {

std::string ToString(const OID& oid) {
    return "#" + std::to_string(oid.value_);
}

xostream& operator<<(xostream& os, const OID& oid) {
    std::string text = ToString(oid);
    os.put(text.data(), static_cast<ssize_t>(text.size()));
    return os;
}

}  // namespace tarn
