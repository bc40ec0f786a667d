#pragma once

// What the store hands out for a field: its table, one record per site that
// moved the field, in ascending site order. A record is the site's newest
// time stamp for the field and the sum of all its offsets to it.
//
// Threads: plain values, copies of what the store held; like any standard
// container, one may be read by several threads at once and changed by one.

#include <string>
#include <vector>

#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn {

struct SiteRecord {
    Guid site{};
    int64 t = 0;  // the site's newest time stamp for the field
    int64 o = 0;  // the sum of the site's offsets to the field

    friend bool operator==(const SiteRecord& a, const SiteRecord& b) {
        return a.site == b.site && a.t == b.t && a.o == b.o;
    }
};

// Sorted by site, each site once.
using FieldTable = std::vector<SiteRecord>;

// The record of `site` in `table`, or null.
const SiteRecord* FindSite(const FieldTable& table, const Guid& site);

// The text form: "(t,o)" for a record, "{(site,(t,o)),...}" for a table.
std::string ToString(const SiteRecord& record);
std::string ToString(const FieldTable& table);

}  // namespace tarn
