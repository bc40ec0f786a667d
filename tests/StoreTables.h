#pragma once

// Every table of a store as plain values, for comparing a store with a model.

#include <map>
#include <utility>

#include "tnStore/OffsetOpsStore.h"

namespace tarn {

// field -> site -> (time stamp, sum)
using Tables = std::map<FieldId, std::map<Guid, std::pair<int64, int64>>>;

inline Tables AllTables(OffsetOpsStore& store) {
    Tables tables;
    store.ForEach([&](const FieldId& field, const FieldTable& table) {
        for (const SiteRecord& r : table) {
            tables[field][r.site] = {r.t, r.o};
        }
        return true;
    });
    return tables;
}

}  // namespace tarn
