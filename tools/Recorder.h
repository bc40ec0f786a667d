#pragma once

// Records offset operations into the offsets record of a space, as the
// `record` command does, refusing what the record must not be given.
//
// The record is the object under the named root "offsets"; a space without
// that root gets a new record (CreatePersistent<OffsetOps>, which creates its
// empty map), committed at once.
//
// Refused, with nothing changed: a time stamp outside 0..kMaxTimeStamp (time
// stamps are stored as 32-bit values), a time stamp older than the one the
// field's table holds for the site (the record would stop the process on it),
// and an offset that would overflow the site's 64-bit sum for the field.
//
// Commits: after every `commitEvery` recorded operations, and whenever Commit
// is called. Cache bound: with cacheNodes > 0 the space never holds more than
// that many objects, not even in the middle of an operation. Before each
// operation the recorder makes room for the most one operation can add (the
// record and the map header, a root-to-leaf path, the leaf after the one that
// splits, and one new node per level plus a new root when splits run all the
// way up): it evicts clean objects
// and, when the changed objects alone fill the room, commits early. A bound
// far below the number of nodes therefore means more, smaller commits.
//
// Holds the space exclusively for its lifetime (the caller takes the guard)
// and is not thread-safe. The space owns the record; the recorder keeps it
// through a SpaceRef, which survives eviction.

#include <functional>
#include <string>

#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/SpaceRef.h"
#include "tools/OpsFile.h"

namespace tarn::tool {

// The named root under which a store keeps its offsets record.
inline constexpr const char* kRecordRoot = "offsets";

struct RecordSettings {
    int64 commitEvery = 10000;  // >= 1
    ssize_t cacheNodes = 0;     // 0: no bound
    // Called after every commit with the number of operations committed so far.
    std::function<void(int64 committed)> onCommit;
};

class Recorder {
public:
    // Throws RuntimeError when the root exists but is not a loadable record.
    Recorder(CSpace& space, const RecordSettings& settings);

    // Records `op`, or returns why it is refused (and changes nothing).
    // Throws RuntimeError when the cache bound is too small for the tree.
    std::string Record(const OffsetOperation& op);

    // Commits everything recorded so far.
    void Commit();

    bool CreatedRecord() const { return m_created; }
    int64 Recorded() const { return m_recorded; }
    int64 Committed() const { return m_committed; }
    int64 Commits() const { return m_commits; }
    // The most objects resident at once, measured after each operation
    // (residents only grow inside an operation).
    ssize_t PeakResidents() const { return m_peakResidents; }

    OffsetOps& RecordObject() { return *m_record; }
    FieldIdToOffsetOpsOnInt64FieldMap& Map() { return *m_record->m_map; }
    OID MapIdentity() const { return m_record->m_map.m_oid; }

    // The fewest resident objects an operation needs in a tree of `height`.
    static ssize_t Headroom(ssize_t height);

private:
    static OID FindOrCreate(CSpace& space, bool& created);
    std::string Check(const OffsetOperation& op);
    void MakeRoom();

    CSpace& m_space;
    RecordSettings m_settings;
    bool m_created = false;
    SpaceRef<OffsetOps> m_record;
    int64 m_recorded = 0;
    int64 m_committed = 0;
    int64 m_commits = 0;
    ssize_t m_peakResidents = 0;
};

}  // namespace tarn::tool
