#include "tnStore/Recorder.h"

#include <algorithm>
#include <optional>
#include <string>

#include "tnStore/OffsetOpsStore.h"

namespace tarn {

namespace {

// Why the operation must not reach the record, or nothing. `table` is the
// field's current table (null when the field has none).
std::optional<RecordRefused> Refusal(const Opid& opid, const FieldId& field, int64 offset,
                                     const OffsetOpsOnField<int64>* table) {
    if (opid.t < 0 || opid.t > kMaxTimeStamp) {
        return RecordRefused(RecordRefused::Reason::TimeStampOutOfRange, field, opid.s,
                             "time stamp " + std::to_string(opid.t) + " of site " +
                                 ToString(opid.s) + " for field " + ToString(field) +
                                 " is outside 0.." + std::to_string(kMaxTimeStamp));
    }
    if (table == nullptr) {
        return std::nullopt;
    }
    const auto& sites = table->m_map.getmap();
    auto it = sites.find(opid.s);
    if (it == sites.end()) {
        return std::nullopt;
    }
    const SiteOffset<int64>& so = it->second;
    if (opid.t < so.t) {
        return RecordRefused(RecordRefused::Reason::TimeStampOlder, field, opid.s,
                             "time stamp " + std::to_string(opid.t) + " of site " +
                                 ToString(opid.s) + " is older than " + std::to_string(so.t) +
                                 ", the one recorded for field " + ToString(field));
    }
    int64 sum;
    if (__builtin_add_overflow(so.o, offset, &sum)) {
        return RecordRefused(RecordRefused::Reason::SumOverflow, field, opid.s,
                             "offset " + std::to_string(offset) + " would overflow the sum " +
                                 std::to_string(so.o) + " of site " + ToString(opid.s) +
                                 " for field " + ToString(field));
    }
    return std::nullopt;
}

}  // namespace

Recorder::Recorder(TreeSpace& tree, MemoryBound& memory)
    : m_tree(tree),
      m_memory(memory),
      m_deferLimit(static_cast<std::size_t>(std::max<ssize_t>(memory.Objects(), 0)) *
                   StoreOptions::kDeferredPerCacheObject) {}

bool Recorder::MayDefer() const {
    return m_deferLimit > 0 && m_memory.TreeOutgrowsTheBound() && m_memory.RoomForGrowth(2);
}

void Recorder::Record(const Opid& opid, const FieldId& field, int64 offset) {
    const bool cleared =
        opid.t >= 0 && opid.t <= kMaxTimeStamp && m_bounds.RulesOutRefusal(opid, offset);
    if (cleared && MayDefer()) {
        m_deferred.push_back(DeferredOperation{opid, field, offset});
        m_bounds.Note(opid, offset);
        if (m_deferred.size() >= m_deferLimit) {
            ApplyDeferred();
        }
        return;
    }
    ApplyDeferred();  // each field's operations keep their order
    if (!cleared) {
        if (auto refusal = Refusal(opid, field, offset, m_tree.Map().rFind(field))) {
            throw *refusal;
        }
    }
    Apply(opid, field, offset);
    m_bounds.Note(opid, offset);
}

void Recorder::Apply(const Opid& opid, const FieldId& field, int64 offset) {
    m_memory.MakeRoomForOperation();
    m_tree.Record().RecordOffset(opid, field, offset);
}

void Recorder::ApplyDeferred() {
    if (m_deferred.empty()) {
        return;
    }
    std::stable_sort(
        m_deferred.begin(), m_deferred.end(),
        [](const DeferredOperation& a, const DeferredOperation& b) { return a.field < b.field; });
    std::size_t applied = 0;
    try {
        for (const DeferredOperation& op : m_deferred) {
            Apply(op.opid, op.field, op.offset);
            ++applied;
        }
    } catch (...) {
        m_deferred.erase(m_deferred.begin(),
                         m_deferred.begin() + static_cast<std::ptrdiff_t>(applied));
        throw;
    }
    m_deferred.clear();
}

void Recorder::Clear() {
    m_deferred.clear();  // Clear removes what they would have changed
    m_tree.Record().Clear();
    m_bounds.Clear();
    m_tree.NoteCleared();
}

}  // namespace tarn
