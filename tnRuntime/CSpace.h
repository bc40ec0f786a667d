#pragma once

// An object space: the persistable objects of one store that are in memory,
// and the changes to them that the next commit writes.
//
// Ownership. The space owns every object registered in it (DollarNew) or
// loaded into it (by resolving a reference): these are its residents, keyed
// by identity. References between objects own nothing. The space destroys
// objects when a commit carries out their permanent deletion, when eviction
// releases clean residents, and when the space itself is destroyed (which
// discards uncommitted changes).
//
// Threads. A thread works in a space through a CSpaceGuard
// (tnRuntime/CSpaceGuard.h), which takes the space's lock shared or
// exclusive. Creating, changing, marking, deleting, committing and evicting
// need the lock exclusively (checked by assertion); resolving references
// works under either (shared holders resolve without binding, and loads are
// serialised by an internal mutex).
//
// Identities come from a counter persisted in the store (1 in a new store);
// RegisterGcObject hands out the next one at once.
//
// Commit writes, in one store transaction: the image of every queued (dirty)
// object through its Serialise slot, with its class name from
// GetReflectedClass()->m_name; the removal of every image queued for
// permanent deletion (AsyncPermanentlyDeleteSubTree is expanded along
// VisitPrefs at this point, loading as needed); the changed named roots; the
// counters set since the last commit (SetCounter); the identity counter. The
// store receives the writes and the removals each in increasing identity
// order. Only after the store has accepted the batch are the dirty flags
// cleared and the deleted objects destroyed; if anything throws before,
// memory and store are as they were (pending roots and counters stay
// pending) and the commit can be retried.
//
// Eviction (DropCleanResidents, EvictCleanResidents, or the resident bound
// checked after each commit) releases clean residents, never dirty ones nor
// ones queued for deletion: it first unbinds every reference to them held by
// the remaining residents (walking their VisitObjects) and by SpaceRefs, so
// that the next Get loads them again. Eviction and commit run only when the
// caller invokes them, between operations, never inside one.
//
// Holding objects across eviction. A T* or a bound cref outside the space's
// objects is not unbound by eviction and must not be kept across a commit or
// an eviction. To keep an object, keep its identity or a named root and
// resolve again, or keep a SpaceRef<T> (tnRuntime/SpaceRef.h), a reference
// that the space tracks and unbinds like its residents' references.
//
// Checks at loading. A space may be given a LoadCheck: every object read
// from the store is handed to it before it becomes resident, with the space's
// residents around it, and a check that throws refuses the load (the object is
// destroyed, the caller of Resolve receives the exception). The space knows
// no class; the check knows what its objects must look like.
//
// Populations. The space counts, per class, the objects that exist in the
// store once everything queued is committed: the stored count (the counter
// "population:<class name>", kept by every commit) plus the objects
// registered since, minus those queued for deletion since. A subtree deletion
// is counted when the commit expands it, since only then are its objects
// known. Counting costs constant time per registration and deletion.
//
// Costs. Registering, loading, marking, queueing a deletion and an object
// leaving the space cost constant time (amortised; hash lookups), whatever
// the number of residents, dirty objects or queued deletions. A commit costs
// the sorting of what it writes and removes, plus one walk over all
// residents when it deletes something (to unbind references to the deleted
// objects); an eviction round costs one walk over all residents. The space
// knows no class by itself: classes are registered with the ClassRegistry
// (tnRuntime/ClassRegistry.h) by whoever opens the space.

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "tnBackends/IStore.h"
#include "tnPersistStore/IPersistable.h"
#include "tnPersistStore/OID.h"

namespace tarn {

class prefbase;

// What a space counts of its own work (loads, commits, evictions), for
// tests, tools and benchmarks.
struct CSpaceCounts {
    int64 numRegistered = 0;  // objects registered (DollarNew)
    int64 numLoaded = 0;      // images loaded from the store
    int64 numMarkCalls = 0;   // MarkPersistentAsDirtyWithoutTrace calls reaching the space
    int64 numCommits = 0;
    int64 numWritten = 0;  // images written by commits
    int64 numDeleted = 0;  // objects permanently deleted by commits
    int64 numEvicted = 0;  // clean residents released
};

// A check of objects as they are loaded (see "Checks at loading" above).
class LoadCheck {
public:
    virtual ~LoadCheck() = default;
    // `obj` was read from the image of `oid` and is not yet resident; the
    // loader asked for an object of class `expected` (null: any class, which
    // the space does not check). Throw RuntimeError to refuse it. May read
    // residents of `space` (never load).
    virtual void Loaded(const CSpace& space, OID oid, ptr<IPersistable> obj,
                        const ReflectedClass* expected) = 0;
};

// The link between a SpaceRef and its space; the space nulls `space` when it
// goes away first.
struct SpaceRefLink {
    prefbase* ref = nullptr;
    CSpace* space = nullptr;
};

class CSpace {
public:
    // A space over `store`; a new in-memory store when null.
    explicit CSpace(std::shared_ptr<IStore> store = nullptr);
    // Discards uncommitted changes and destroys every resident.
    ~CSpace();
    CSpace(const CSpace&) = delete;
    CSpace& operator=(const CSpace&) = delete;

    IStore& GetStore() const { return *m_store; }
    const std::shared_ptr<IStore>& GetStorePtr() const { return m_store; }

    // --- Objects (any lock) -------------------------------------------------

    // The object `oid`: a resident, or loaded from the store and made
    // resident. `expected` (null: any) is the class it must have. Throws
    // RuntimeError when the store has no image of `oid`, the image's class is
    // not registered or is not `expected`, or reading does not consume
    // exactly the image.
    ptr<IPersistable> Resolve(OID oid, const ReflectedClass* expected);
    // The resident object `oid`, or null; never loads.
    ptr<IPersistable> FindResident(OID oid) const;
    bool IsResident(OID oid) const { return FindResident(oid).m_self != nullptr; }

    ssize_t NumResidents() const;
    // Objects whose changes the next commit writes.
    ssize_t NumDirty() const { return m_numDirty; }
    // Objects queued for permanent deletion (each once, however often and
    // however queued).
    ssize_t NumQueuedDeletions() const { return m_numDeletions; }
    // The identities of the dirty objects in the order they were queued:
    // by registration, or by their first mark since the last commit. (The
    // store receives them in identity order; this keeps the order of an
    // operation's marks observable.) Exclusive.
    std::vector<OID> DirtyInQueueOrder() const;
    const CSpaceCounts& Stats() const { return m_stats; }
    // The identity the next registered object receives.
    uint64 NextIdentity() const { return m_nextIdentity; }

    // --- Creating (exclusive) -----------------------------------------------

    // A new registered object of the registered class `className`, after
    // its OnCreate(true). Throws RuntimeError for an unknown class.
    ptr<IPersistable> CreateObject(std::string_view className);

    // --- Named roots ----------------------------------------------------------

    // Sets (a null identity: removes) a root; stored by the next commit.
    // Exclusive.
    void SetRoot(const std::string& name, OID oid);
    void SetRoot(const std::string& name, const prefbase& ref);
    // The root's identity, null when there is none.
    OID GetRoot(std::string_view name) const;
    std::map<std::string, OID> Roots() const;

    // --- Checks and populations -------------------------------------------------

    // The check every load goes through (null: none). Not owned; it must
    // outlive the space or be reset first.
    void SetLoadCheck(LoadCheck* check) { m_loadCheck = check; }
    // The objects of class `className` once everything queued is committed,
    // but for the objects below subtree deletions that are not expanded yet.
    int64 Population(std::string_view className) const;
    static std::string PopulationCounter(std::string_view className);

    // --- Named counters -------------------------------------------------------

    // Sets a named 64-bit counter (e.g. the journal position the changes up
    // to now cover); stored by the next commit, atomically with its images,
    // and kept pending when that commit throws. Exclusive.
    void SetCounter(const std::string& name, uint64 value);
    // The counter's current value: set but not yet committed, else the
    // store's; nothing when it was never set.
    std::optional<uint64> GetCounter(std::string_view name) const;
    // Every counter whose name starts with `prefix`, current values.
    std::map<std::string, uint64> CountersWithPrefix(std::string_view prefix) const;

    // --- Commit and eviction (exclusive) --------------------------------------

    void Commit();
    // Releases every clean resident; returns how many.
    ssize_t DropCleanResidents() { return EvictCleanResidents(0); }
    // Releases clean residents, those without children along VisitPrefs
    // before inner ones, each kind least recently loaded or registered first,
    // until at most `maxResidents` remain or none is clean; returns how many.
    ssize_t EvictCleanResidents(ssize_t maxResidents);
    // After each commit that leaves more than `maxResidents` residents,
    // evict down to three quarters of it (0: no bound). The slack keeps the
    // unbinding walk over all residents from running at every commit.
    void SetResidentBound(ssize_t maxResidents) { m_residentBound = maxResidents; }

    // --- Called by the runtime functions of tnPersistStore/IPersistable.h -----

    void AdoptNew(ptr<IPersistable> obj);
    void QueueDirty(ptr<IPersistable> obj);
    void QueueDeletion(ptr<IPersistable> obj, bool subTree);
    void Detach(ptr<IPersistable> obj);
    void CountMarkCall() { ++m_stats.numMarkCalls; }

    // --- SpaceRef tracking (any thread, any lock) ------------------------------

    void AttachExternalRef(SpaceRefLink* link);
    void DetachExternalRef(SpaceRefLink* link);

private:
    friend class CSpaceGuard;

    struct Resident {
        ptr<IPersistable> obj;
        uint64 tick;  // load or registration order, for eviction
    };
    // Dirty objects and queued deletions are kept in queue order as the
    // identity and the tick of the resident they were queued for. An object
    // that leaves the space (Detach) only has its flags cleared and the
    // counts lowered: its entries stay behind and are skipped at commit,
    // where an entry counts only while the resident of its identity is the
    // one of its tick and carries the flag. No entry points to an object.
    struct Queued {
        uint64 oid;
        uint64 tick;
    };
    struct Deletion {
        Queued queued;
        bool subTree;
    };
    using ObjectSet = std::unordered_set<const void*>;
    // Objects a commit writes, with their identities.
    using DirtyObjects = std::vector<std::pair<uint64, ptr<IPersistable>>>;

    void RequireExclusive() const;
    ptr<IPersistable> Load(OID oid, const ReflectedClass* expected);
    // The entry of a resident object of this space.
    Queued EntryOf(ptr<IPersistable> obj) const;
    // The resident object of the entry when it carries `flag`, else null.
    ptr<IPersistable> FlaggedResident(const Queued& entry, int flag) const;
    void ExpandDeletions(std::vector<ptr<IPersistable>>& doomed, ObjectSet& doomedSet,
                         std::map<std::string, int64, std::less<>>& expandedDelta);
    DirtyObjects DirtyToWrite(const ObjectSet& doomedSet) const;
    CommitBatch MakeBatch(const DirtyObjects& dirty, const std::vector<ptr<IPersistable>>& doomed,
                          const std::map<std::string, int64, std::less<>>& expandedDelta);
    void ClearCommitted(const DirtyObjects& dirty, const std::vector<ptr<IPersistable>>& doomed);
    // The population counters a commit stores: every class whose count
    // changed, with `expandedDelta` (the subtree deletions it expanded).
    void AddPopulationCounters(CommitBatch& batch,
                               const std::map<std::string, int64, std::less<>>& expandedDelta);
    void UnbindReferencesTo(const ObjectSet& objects);
    void DestroyDeleted(const std::vector<ptr<IPersistable>>& doomed);

    std::shared_mutex m_lock;  // taken by CSpaceGuard
    std::shared_ptr<IStore> m_store;

    mutable std::mutex m_residentsMutex;  // loads under a shared lock
    std::unordered_map<uint64, Resident> m_residents;
    uint64 m_tick = 0;

    std::vector<Queued> m_dirty;        // queued by registration or mark (DBP_PO_DIRTY)
    std::vector<Deletion> m_deletions;  // DBP_PO_MARKED_DURING_ASYNC_DELETION
    ssize_t m_numDirty = 0;             // objects with DBP_PO_DIRTY
    ssize_t m_numDeletions = 0;         // objects with DBP_PO_MARKED_DURING_ASYNC_DELETION

    uint64 m_nextIdentity = 1;
    std::map<std::string, uint64, std::less<>> m_roots;  // current view, 0 entries removed
    std::map<std::string, uint64> m_changedRoots;        // since the last commit
    std::map<std::string, uint64, std::less<>> m_pendingCounters;  // since the last commit

    ssize_t m_residentBound = 0;
    CSpaceCounts m_stats;
    LoadCheck* m_loadCheck = nullptr;
    // Registrations minus deletions per class since the last commit.
    std::map<std::string, int64, std::less<>> m_populationDelta;

    std::mutex m_externalRefsMutex;
    std::unordered_set<SpaceRefLink*> m_externalRefs;
};

// Creates a T with its default constructor, registers it in the thread's
// space and calls its OnCreate(true): how the runtime makes a new object of
// a class it knows (e.g. a new offset operations record, which creates its
// map then).
template <typename T>
T* CreatePersistent() {
    T* p = DollarNew(new T());
    ptr<IPersistable>(p)->OnCreate(true);
    return p;
}

}  // namespace tarn
