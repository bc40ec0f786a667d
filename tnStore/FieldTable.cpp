#include "tnStore/FieldTable.h"

#include <algorithm>

namespace tarn {

const SiteRecord* FindSite(const FieldTable& table, const Guid& site) {
    auto it = std::lower_bound(table.begin(), table.end(), site,
                               [](const SiteRecord& r, const Guid& g) { return r.site < g; });
    return it != table.end() && it->site == site ? &*it : nullptr;
}

std::string ToString(const SiteRecord& record) {
    return "(" + std::to_string(record.t) + "," + std::to_string(record.o) + ")";
}

std::string ToString(const FieldTable& table) {
    std::string text = "{";
    for (const SiteRecord& r : table) {
        if (text.size() > 1) {
            text += ',';
        }
        text += "(" + ToString(r.site) + "," + ToString(r) + ")";
    }
    return text + "}";
}

}  // namespace tarn
