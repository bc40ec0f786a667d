#include "tools/Recorder.h"

#include <algorithm>

#include "tnUtils/RuntimeError.h"

namespace tarn::tool {

OID Recorder::FindOrCreate(CSpace& space, bool& created) {
    OID oid = space.GetRoot(kRecordRoot);
    created = oid.IsNull();
    if (created) {
        OffsetOps* record = CreatePersistent<OffsetOps>();
        oid = record->GetPersistObjState().m_oid;
        space.SetRoot(kRecordRoot, oid);
        space.Commit();
    }
    return oid;
}

Recorder::Recorder(CSpace& space, const RecordSettings& settings)
    : m_space(space), m_settings(settings), m_record(space, FindOrCreate(space, m_created)) {
    // Load the record and its map now, so that a root of another class or a
    // damaged image is reported before anything is recorded.
    (void)Map();
}

ssize_t Recorder::Headroom(ssize_t height) {
    const ssize_t h = std::max<ssize_t>(height, 0);
    // record + map header + path (h+1) + the split leaf's successor
    // + one new node per level (h+1) + a new root
    return 2 + (h + 1) + 1 + (h + 1) + 1;
}

void Recorder::MakeRoom() {
    const ssize_t bound = m_settings.cacheNodes;
    if (bound <= 0) {
        return;
    }
    const ssize_t height = Map().m_height;
    const ssize_t room = Headroom(height);
    const ssize_t limit = bound - room;
    if (limit < room) {
        throw RuntimeError("--cache-nodes " + std::to_string(bound) +
                           " is too small for a tree of height " + std::to_string(height) +
                           ": it needs at least " + std::to_string(2 * room));
    }
    if (m_space.NumResidents() <= limit) {
        return;
    }
    m_space.EvictCleanResidents(limit / 2);
    if (m_space.NumResidents() > limit) {
        Commit();
        m_space.EvictCleanResidents(limit / 2);
    }
}

std::string Recorder::Check(const OffsetOperation& op) {
    if (op.t < 0 || op.t > kMaxTimeStamp) {
        return "time stamp " + std::to_string(op.t) + " is outside 0.." +
               std::to_string(kMaxTimeStamp) + " (time stamps are stored as 32-bit values)";
    }
    const OffsetOpsOnField<int64>* table = Map().rFind(op.field);
    if (table == nullptr) {
        return {};
    }
    const auto& sites = table->m_map.getmap();
    auto it = sites.find(op.site);
    if (it == sites.end()) {
        return {};
    }
    const SiteOffset<int64>& so = it->second;
    if (op.t < so.t) {
        return "time stamp " + std::to_string(op.t) + " of site " + ToString(op.site) +
               " is older than " + std::to_string(so.t) + ", the one recorded for field " +
               ToString(op.field);
    }
    int64 sum;
    if (__builtin_add_overflow(so.o, op.offset, &sum)) {
        return "offset " + std::to_string(op.offset) + " would overflow the sum " +
               std::to_string(so.o) + " of site " + ToString(op.site) + " for field " +
               ToString(op.field);
    }
    return {};
}

std::string Recorder::Record(const OffsetOperation& op) {
    MakeRoom();
    std::string refusal = Check(op);
    if (!refusal.empty()) {
        return refusal;
    }
    m_record->RecordOffset(Opid(op.site, op.t), op.field, op.offset);
    ++m_recorded;
    m_peakResidents = std::max(m_peakResidents, m_space.NumResidents());
    if (m_recorded - m_committed >= m_settings.commitEvery) {
        Commit();
    }
    return {};
}

void Recorder::Commit() {
    m_space.Commit();
    m_committed = m_recorded;
    ++m_commits;
    if (m_settings.onCommit) {
        m_settings.onCommit(m_committed);
    }
}

}  // namespace tarn::tool
