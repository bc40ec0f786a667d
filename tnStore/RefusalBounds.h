#pragma once

#include <algorithm>
#include <map>

#include "tnOperation/src/Util/Opid.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn {

// What the record's refusals depend on: the newest time stamp of each site in
// any table, and an upper bound on the magnitude of every sum. An operation
// whose stamp is not older than its site's newest and whose offset cannot
// carry any sum past the 64-bit range can be refused for nothing but its
// stamp's range, so Record skips looking up the field's table for it.
//
// Both are kept with every checkpoint (tnStore/TreeSummary.h) and brought forward
// by recording and replay, so that opening never walks the tree for them.
// The newest stamps are exact: a site's stamps for one field never go back,
// and only Clear removes tables, which empties them.
class RefusalBounds {
public:
    bool RulesOutRefusal(const Opid& opid, int64 offset) const {
        auto it = m_newest.find(opid.s);
        return (it == m_newest.end() || opid.t >= it->second) &&
               Magnitude(offset) <= kMaxSum - m_sum;
    }
    void Note(const Opid& opid, int64 offset) {
        NoteStamp(opid.s, opid.t);
        m_sum = std::min(kMaxSum, m_sum + std::min(kMaxSum, Magnitude(offset)));
    }
    // A table's record of one site, as a walk of the tree finds it.
    void NoteStored(const Guid& site, const SiteOffset<int64>& so) {
        NoteStamp(site, so.t);
        m_sum = std::min(kMaxSum, std::max(m_sum, Magnitude(so.o)));
    }
    void NoteStamp(const Guid& site, int64 t) {
        auto [it, added] = m_newest.emplace(site, t);
        if (!added && it->second < t) {
            it->second = t;
        }
    }
    void SetSumBound(uint64 sum) { m_sum = std::min(kMaxSum, sum); }
    uint64 SumBound() const { return m_sum; }
    const std::map<Guid, int64>& Newest() const { return m_newest; }
    void Clear() { *this = RefusalBounds(); }

private:
    static constexpr uint64 kMaxSum = 9223372036854775807;
    static uint64 Magnitude(int64 v) {
        return v < 0 ? uint64{0} - static_cast<uint64>(v) : static_cast<uint64>(v);
    }

    std::map<Guid, int64> m_newest;
    uint64 m_sum = 0;  // at least the magnitude of every sum, at most kMaxSum
};

}  // namespace tarn
