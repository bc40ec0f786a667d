// Commit: one store transaction with every queued change, then the in-memory
// consequences (clean flags, destroyed deletions).

#include <algorithm>
#include <memory>

#include "tnPersistStore/IPrefVisitor.h"
#include "tnPersistStore/pref.h"
#include "tnRuntime/CSpace.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"

namespace tarn {

namespace {

// Collects the references an object reports along VisitPrefs.
class PrefCollector final : public IPrefVisitor {
public:
    void VisitPref(const prefbase& ref) override {
        if (ref) {
            m_refs.push_back(&ref);
        }
    }
    void VisitParentPref(const prefbase&) override {}

    std::vector<const prefbase*> m_refs;
};

}  // namespace

// The objects that the queued deletions remove: each queued object, and for
// a subtree deletion everything below it along VisitPrefs (resolved, and so
// loaded, as needed). Each object once, in queue order and then depth first.
// Entries of objects that left the space meanwhile are skipped.
// Objects found below a subtree deletion that were not queued themselves
// leave the population here, in `expandedDelta`, which the commit applies
// once the store has taken it (a failed commit expands again).
void CSpace::ExpandDeletions(std::vector<ptr<IPersistable>>& doomed, ObjectSet& doomedSet,
                             std::map<std::string, int64, std::less<>>& expandedDelta) {
    std::vector<ptr<IPersistable>> pending;
    for (const Deletion& d : m_deletions) {
        ptr<IPersistable> queued = FlaggedResident(d.queued, DBP_PO_MARKED_DURING_ASYNC_DELETION);
        if (queued.m_self == nullptr) {
            continue;
        }
        if (!doomedSet.insert(queued.m_self).second) {
            if (!d.subTree) {
                continue;
            }
        } else {
            doomed.push_back(queued);
        }
        if (!d.subTree) {
            continue;
        }
        pending.push_back(queued);
        while (!pending.empty()) {
            ptr<IPersistable> obj = pending.back();
            pending.pop_back();
            PrefCollector children;
            obj->VisitPrefs(children);
            for (const prefbase* ref : children.m_refs) {
                ptr<IPersistable> child = ref->Get();
                if (child->GetSysState().m_cspace != this) {
                    continue;  // never registered: not the space's to delete
                }
                if (doomedSet.insert(child.m_self).second) {
                    doomed.push_back(child);
                    pending.push_back(child);
                    if (!child->GetSysState().GetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION)) {
                        --expandedDelta[child->GetReflectedClass()->m_name];
                    }
                }
            }
        }
    }
}

// Commit, in steps:
//   1. expand the queued deletions (may load objects);
//   2. serialise every dirty object that is not being deleted into the
//      batch, with its class name, in identity order;
//   3. add the removals of deleted objects that have an image (in identity
//      order), the changed roots, the counters set and the identity counter;
//   4. hand the batch to the store as one transaction;
//   5. only then: clear the written objects' flags, empty the queues, and
//      destroy the deleted objects (after unbinding every reference to them).
// An exception in steps 1-4 leaves the space and the store unchanged.
void CSpace::Commit() {
    RequireExclusive();
    std::vector<ptr<IPersistable>> doomed;
    ObjectSet doomedSet;
    std::map<std::string, int64, std::less<>> expandedDelta;
    ExpandDeletions(doomed, doomedSet, expandedDelta);
    const DirtyObjects dirty = DirtyToWrite(doomedSet);
    m_store->Commit(MakeBatch(dirty, doomed, expandedDelta));
    ClearCommitted(dirty, doomed);
    if (!doomed.empty()) {
        UnbindReferencesTo(doomedSet);
        DestroyDeleted(doomed);
    }
    if (m_residentBound > 0 && NumResidents() > m_residentBound) {
        EvictCleanResidents(m_residentBound - m_residentBound / 4);
    }
}

// The dirty objects in identity order, but for those being deleted. Each
// has one live entry: the flag is set once per queueing and cleared only by
// a commit or when the object leaves the space.
CSpace::DirtyObjects CSpace::DirtyToWrite(const ObjectSet& doomedSet) const {
    DirtyObjects dirty;
    dirty.reserve(m_dirty.size());
    for (const Queued& entry : m_dirty) {
        ptr<IPersistable> obj = FlaggedResident(entry, DBP_PO_DIRTY);
        if (obj.m_self != nullptr && doomedSet.count(obj.m_self) == 0) {
            dirty.emplace_back(entry.oid, obj);
        }
    }
    std::sort(dirty.begin(), dirty.end(),
              [](const auto& a, const auto& b) { return a.first < b.first; });
    return dirty;
}

// Steps 2 and 3. Images are made one at a time as the store takes them, so
// that a commit of the whole tree holds one image in memory, not all of
// them; the batch refers to `dirty`, which must outlive it.
CommitBatch CSpace::MakeBatch(const DirtyObjects& dirty,
                              const std::vector<ptr<IPersistable>>& doomed,
                              const std::map<std::string, int64, std::less<>>& expandedDelta) {
    CommitBatch batch;
    batch.streamedWrites = [&dirty](const CommitBatch::ImageSink& sink) {
        MemoryOutputStream bytes;
        auto ar = std::make_unique<Archive>(&bytes);
        StoredImage image;
        for (const auto& [oid, obj] : dirty) {
            bytes.clear();
            ar->ClearWriteBufferAndNumBytesWritten();
            obj->Serialise(*ar);
            ar->Flush();
            image.className = obj->GetReflectedClass()->m_name;
            image.bytes = bytes.bytes();
            sink(oid, image);
        }
    };
    for (const ptr<IPersistable>& obj : doomed) {
        if (!obj->GetSysState().GetFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT)) {
            batch.deletes.push_back(obj->GetPersistObjState().m_oid.value_);
        }
    }
    std::sort(batch.deletes.begin(), batch.deletes.end());
    batch.roots = m_changedRoots;
    batch.counters.insert(m_pendingCounters.begin(), m_pendingCounters.end());
    AddPopulationCounters(batch, expandedDelta);
    batch.nextIdentity = m_nextIdentity;
    return batch;
}

// Step 5, before the deleted objects go: every dirty object was written or
// is deleted, and every queued deletion was expanded, so the flags are
// cleared and the queues start afresh.
void CSpace::ClearCommitted(const DirtyObjects& dirty,
                            const std::vector<ptr<IPersistable>>& doomed) {
    for (const auto& [oid, obj] : dirty) {
        ObjSysState& state = obj->GetSysState();
        state.ClearFlag(DBP_PO_DIRTY);
        state.ClearFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT);
    }
    for (const ptr<IPersistable>& obj : doomed) {
        ObjSysState& state = obj->GetSysState();
        state.ClearFlag(DBP_PO_DIRTY);
        state.ClearFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION);
    }
    m_dirty.clear();
    m_deletions.clear();
    m_numDirty = 0;
    m_numDeletions = 0;
    m_changedRoots.clear();
    m_pendingCounters.clear();
    m_populationDelta.clear();
    ++m_stats.numCommits;
    m_stats.numWritten += static_cast<int64>(dirty.size());
}

void CSpace::AddPopulationCounters(CommitBatch& batch,
                                   const std::map<std::string, int64, std::less<>>& expandedDelta) {
    std::map<std::string, int64, std::less<>> delta = m_populationDelta;
    for (const auto& [name, d] : expandedDelta) {
        delta[name] += d;
    }
    for (const auto& [name, d] : delta) {
        if (d == 0) {
            continue;
        }
        const std::string counter = PopulationCounter(name);
        const int64 stored = static_cast<int64>(GetCounter(counter).value_or(0));
        batch.counters[counter] = static_cast<uint64>(std::max<int64>(0, stored + d));
    }
}

// Each deleted object is collected (its OnGarbageCollect slot takes it out of
// the space) and destroyed.
void CSpace::DestroyDeleted(const std::vector<ptr<IPersistable>>& doomed) {
    for (const ptr<IPersistable>& obj : doomed) {
        ObjSysState& state = obj->GetSysState();
        state.SetFlag(DBP_PO_SYNC_DELETED);
        obj->OnGarbageCollect();
        if (state.m_cspace == this) {
            Detach(obj);  // a class whose OnGarbageCollect does not report
        }
        obj->Destroy();
        ++m_stats.numDeleted;
    }
}

}  // namespace tarn
