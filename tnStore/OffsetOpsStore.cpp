// Opening, recording, durable points, checkpoints and closing. The reading
// half of the API is in OffsetOpsStoreRead.cpp.

#include "tnStore/OffsetOpsStore.h"

#include <algorithm>
#include <filesystem>
#include <utility>

#include "tnBackends/LmdbStore.h"
#include "tnBackends/MemoryStore.h"
#include "tnBackends/OverlayStore.h"
#include "tnStore/RegisterClasses.h"
#include "tnStore/StoreImpl.h"
#include "tnStore/TreeSummary.h"

namespace tarn {

namespace {

namespace fs = std::filesystem;

// A reader whose snapshot is older than the journal's first entry (the
// writer checkpointed and started a new journal in between) takes a new
// snapshot; this many times at most.
constexpr int kReaderAttempts = 8;

// Raised inside a reader's replay when the journal starts after its snapshot.
struct SnapshotTooOld {};

std::string JournalPath(const std::string& dir) {
    return (fs::path(dir) / Journal::kFileName).string();
}

// Why `op` must not reach the record, or nothing. `table` is the field's
// current table (null when the field has none).
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

// Records one operation after the refusal checks; the caller holds the space
// exclusively. When the bounds rule a refusal out, the field's table is not
// looked up first, and a bounded store defers the operation.
//
// An operation is deferred only once the tree has more nodes than the
// bound (a tree that fits gains nothing from waiting operations), and only
// while the bound leaves room for a tree two
// levels higher than now: one batch (256 operations per object of a bound of
// at least 24) cannot grow a tree by three levels (from height h that takes
// more than 2 * 50^(h+2) new fields), so applying it never outgrows the
// bound. Past that height each operation is applied at once, and the one
// that would take the tree past the bound is refused by MakeRoom before it
// changes anything.
void CheckedRecord(OffsetOpsStore::Impl& s, const Opid& opid, const FieldId& field, int64 offset) {
    const bool cleared =
        opid.t >= 0 && opid.t <= kMaxTimeStamp && s.bounds.RulesOutRefusal(opid, offset);
    if (cleared && s.deferLimit > 0 && s.TreeOutgrowsTheBound() &&
        s.options.cacheObjects >=
            OffsetOpsStore::MinCacheObjects(std::max<ssize_t>(s.Map().m_height, 0) + 2)) {
        s.deferred.push_back(DeferredOperation{opid, field, offset});
        s.bounds.Note(opid, offset);
        if (s.deferred.size() >= s.deferLimit) {
            s.ApplyDeferred();
        }
        return;
    }
    s.ApplyDeferred();  // each field's operations keep their order
    if (!cleared) {
        FieldIdToOffsetOpsOnInt64FieldMap& map = s.Map();
        if (auto refusal = Refusal(opid, field, offset, map.rFind(field))) {
            throw *refusal;
        }
    }
    s.MakeRoom();
    s.Record().RecordOffset(opid, field, offset);
    s.bounds.Note(opid, offset);
}

// Replays one journal entry into the tree. A refused entry is damage: the
// writer accepted every entry it journaled.
void ReplayEntry(OffsetOpsStore::Impl& s, uint64 seq, const JournalEntry& e) {
    if (e.kind == JournalEntry::Kind::Clear) {
        s.ClearRecord();
    } else {
        try {
            CheckedRecord(s, Opid(e.site, e.t), e.field, e.offset);
        } catch (const RecordRefused& refused) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               "journal '" + JournalPath(s.dir) + "': entry " +
                                   std::to_string(seq) + " cannot be replayed: " + refused.what());
        }
    }
    ++s.replayed;
}

// The record of the space: the root's, or (writers of a store without one)
// a new record, committed at once with the journal position 0 and an empty
// summary. Only a store without any image is given a new record: one that
// holds images but names no record lost its root, and a new record would
// orphan the stored tree.
void FindOrCreateRecord(OffsetOpsStore::Impl& s) {
    CSpace& space = *s.space;
    OID oid = space.GetRoot(kRecordRoot);
    if (oid.IsNull()) {
        if (s.reader) {
            throw RuntimeError(RuntimeError::Category::NotFound,
                               "store '" + s.dir + "' holds no offsets record yet");
        }
        if (std::optional<uint64> largest = s.store->LargestIdentity()) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               "store '" + s.dir + "' is damaged: it holds images (up to #" +
                                   std::to_string(*largest) +
                                   ") but names no offsets record; run 'offsetops validate'");
        }
        CSpaceGuard guard(space, LockMode::Exclusive);
        OffsetOps* created = CreatePersistent<OffsetOps>();
        oid = created->GetPersistObjState().m_oid;
        space.SetRoot(kRecordRoot, oid);
        space.SetCounter(kJournalPositionCounter, 0);
        SetTreeSummary(space, RefusalBounds());
        s.CommitDurably();
    }
    s.record = std::make_unique<SpaceRef<OffsetOps>>(space, oid);
    CSpaceGuard guard(space, LockMode::Exclusive);
    // Loads the record and its map's header now, so that a root of another
    // class or a damaged image is reported before anything else happens.
    // The nodes are checked as they load.
    s.loadCheck.SetMap(s.Record().m_map.m_oid);
    (void)s.Map();
}

// The refusal bounds and node counts kept with the last checkpoint. A store
// from before they were kept has its tree walked once: a writer commits what
// the walk found at once (the upgrade: counters only, no image changes), a
// reader keeps it in memory.
void LoadSummary(OffsetOpsStore::Impl& s) {
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    if (LoadTreeSummary(*s.space, s.bounds)) {
        return;
    }
    RebuildTreeSummary(s);
    if (!s.reader) {
        s.CommitDurably();
        s.repairs.push_back(
            "kept the tree's counts and bounds with the store (once, for a "
            "store made before they were kept)");
    }
    if (s.options.cacheObjects > 0) {
        s.space->EvictCleanResidents(s.options.cacheObjects / 2);
    }
}

std::unique_ptr<LmdbStore> OpenLmdb(OffsetOpsStore::Impl& s) {
    const std::string& dir = s.dir;
    const StoreOptions& options = s.options;
    LmdbStoreOptions lmdb;
    lmdb.mode = options.mode == StoreMode::Read            ? OpenMode::ReadOnly
                : options.mode == StoreMode::WriteExisting ? OpenMode::MustExist
                                                           : OpenMode::CreateIfMissing;
    lmdb.syncOnCommit = options.sync;
    std::unique_ptr<LmdbStore> store = LmdbStore::Open(dir, lmdb);
    s.lmdb = store.get();
    // What opening the environment repaired (a lock file made anew).
    s.repairs.insert(s.repairs.end(), store->Repairs().begin(), store->Repairs().end());
    return store;
}

void OpenSpace(OffsetOpsStore::Impl& s, std::unique_ptr<IStore> store) {
    s.record.reset();
    s.space.reset();
    s.overlay.reset();
    s.store = std::make_shared<CountingStore>(std::move(store));
    std::shared_ptr<IStore> spaceStore = s.store;
    if (s.options.cacheObjects > 0) {
        // A bounded store commits what it changed between checkpoints to an
        // overlay of its own, so that it can release those objects too; a
        // writer's checkpoint flushes the overlay into the store.
        s.overlay = std::make_shared<OverlayStore>(s.store);
        spaceStore = s.overlay;
        s.deferLimit = static_cast<std::size_t>(s.options.cacheObjects) *
                       StoreOptions::kDeferredPerCacheObject;
    }
    s.space = std::make_unique<CSpace>(spaceStore);
    s.space->SetLoadCheck(&s.loadCheck);
    s.checkpointed = s.space->GetCounter(kJournalPositionCounter).value_or(0);
}

// A checkpoint at operation P starts a new journal whose first entry is P; a
// writer that died between the two left the old journal, which ends at P (the
// next writer begins the new one when it opens). The stored position has no
// checksum of its own: any other value is damage, and replaying from it would
// drop or repeat operations.
void RequireCheckpointInJournal(const OffsetOpsStore::Impl& s, const std::string& path,
                                const JournalScan& scan) {
    if (s.checkpointed != scan.base && s.checkpointed != scan.end) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "store '" + s.dir + "': its last checkpoint is recorded at operation " +
                               std::to_string(s.checkpointed) + ", but journal '" + path +
                               "' holds operations " + std::to_string(scan.base) + " to " +
                               std::to_string(scan.end) +
                               ": the recorded position or the journal is damaged");
    }
}

RuntimeError MissingJournal(const OffsetOpsStore::Impl& s, const std::string& path) {
    return RuntimeError(RuntimeError::Category::Damaged,
                        "journal '" + path + "' is missing: the store's last checkpoint covers " +
                            std::to_string(s.checkpointed) +
                            " operations, and any made durable after it are lost");
}

// Writer: the journal after the last checkpoint, replayed; a torn tail cut.
void OpenJournalForWriting(OffsetOpsStore::Impl& s, bool legacy) {
    const std::string path = JournalPath(s.dir);
    std::error_code ec;
    if (!fs::exists(path, ec)) {
        if (!legacy) {
            throw MissingJournal(s, path);
        }
        Journal::Reset(s.dir, s.checkpointed, s.options.sync);
        s.repairs.push_back("started a journal in '" + s.dir +
                            "', which had none (a store made before journals)");
    }
    JournalScan scan;
    {
        CSpaceGuard guard(*s.space, LockMode::Exclusive);
        scan = Journal::Scan(path, s.checkpointed,
                             [&](uint64 seq, const JournalEntry& e) { ReplayEntry(s, seq, e); });
    }
    if (scan.base > s.checkpointed) {
        throw RuntimeError(
            RuntimeError::Category::Damaged,
            "journal '" + path + "' begins at operation " + std::to_string(scan.base) +
                " but the store's last checkpoint covers " + std::to_string(s.checkpointed) +
                ": the operations between are lost");
    }
    // Without syncs a machine crash may leave the journal behind the
    // checkpoint, which the repair below answers.
    if (s.options.sync || scan.end >= s.checkpointed) {
        RequireCheckpointInJournal(s, path, scan);
    }
    if (scan.tornTail()) {
        s.repairs.push_back("dropped " + std::to_string(scan.fileBytes - scan.validBytes) +
                            " bytes of an incomplete last record from journal '" + path +
                            "' (an append cut short by a crash)");
    }
    s.journal = std::make_unique<Journal>(s.dir, scan, s.options.sync);
    s.durable = std::max(scan.end, s.checkpointed);
    if (scan.base != s.checkpointed) {
        // The last checkpoint was cut short before its new journal began (or,
        // without syncs, the journal lost entries the checkpoint holds): the
        // checkpoint holds every entry of this one, begin the new one now.
        Journal::Reset(s.dir, s.checkpointed, s.options.sync);
        s.journal =
            std::make_unique<Journal>(s.dir,
                                      JournalScan{s.checkpointed, s.checkpointed,
                                                  Journal::kHeaderBytes, Journal::kHeaderBytes},
                                      s.options.sync);
        if (scan.end < s.checkpointed) {
            s.repairs.push_back("journal '" + path +
                                "' ended before the last checkpoint; started a "
                                "new one after it");
        }
    }
}

// The identity counter has no checksum: one not above a stored identity
// would hand that identity out again, and a checkpoint would write over its
// image.
void RequireIdentitiesAhead(OffsetOpsStore::Impl& s) {
    const uint64 next = s.store->NextIdentity();
    const uint64 largest = s.store->LargestIdentity().value_or(0);
    if (largest >= next) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "store '" + s.dir + "' is damaged: its identity counter " +
                               std::to_string(next) + " is not above the stored identity #" +
                               std::to_string(largest));
    }
}

void OpenWriter(OffsetOpsStore::Impl& s) {
    OpenSpace(s, OpenLmdb(s));
    RequireIdentitiesAhead(s);
    // A store made before journals has neither journal nor position counter.
    const bool legacy = !s.space->GetCounter(kJournalPositionCounter).has_value();
    const bool fresh = s.space->GetRoot(kRecordRoot).IsNull();
    if (fresh && !fs::exists(JournalPath(s.dir))) {
        Journal::Reset(s.dir, s.checkpointed, s.options.sync);
    }
    FindOrCreateRecord(s);
    LoadSummary(s);
    OpenJournalForWriting(s, legacy && !fresh);
}

// Reader: one snapshot of the last checkpoint, plus the journal's complete
// records after it, replayed into memory.
void OpenReader(OffsetOpsStore::Impl& s) {
    const std::string path = JournalPath(s.dir);
    for (int attempt = 1;; ++attempt) {
        // A store directory is open at most once per process: release the
        // previous attempt's snapshot before taking the next.
        s.record.reset();
        s.space.reset();
        s.overlay.reset();
        s.lmdb = nullptr;
        s.store.reset();
        OpenSpace(s, OpenLmdb(s));
        const bool legacy = !s.space->GetCounter(kJournalPositionCounter).has_value();
        FindOrCreateRecord(s);
        LoadSummary(s);
        std::error_code ec;
        if (!fs::exists(path, ec)) {
            if (legacy) {
                return;
            }
            throw MissingJournal(s, path);
        }
        s.replayed = 0;
        try {
            CSpaceGuard guard(*s.space, LockMode::Exclusive);
            bool first = true;
            JournalScan scan =
                Journal::Scan(path, s.checkpointed, [&](uint64 seq, const JournalEntry& e) {
                    if (first && seq != s.checkpointed) {
                        throw SnapshotTooOld{};
                    }
                    first = false;
                    s.MakeRoom();
                    ReplayEntry(s, seq, e);
                });
            if (scan.base > s.checkpointed) {
                throw SnapshotTooOld{};
            }
            RequireCheckpointInJournal(s, path, scan);
            s.durable = std::max(scan.end, s.checkpointed);
            s.journalBytes = scan.validBytes;
            return;
        } catch (const SnapshotTooOld&) {
            if (attempt == kReaderAttempts) {
                throw RuntimeError(RuntimeError::Category::InUse,
                                   "journal '" + path +
                                       "' keeps moving past the store's "
                                       "checkpoints; try again");
            }
        }
    }
}

}  // namespace

// --- Impl ----------------------------------------------------------------------

ssize_t OperationHeadroom(ssize_t height) {
    const ssize_t h = std::max<ssize_t>(height, 0);
    // record + map header + a root-to-leaf path (h+1) + the split leaf's
    // successor + one new node per level (h+1) + a new root
    return 2 + (h + 1) + 1 + (h + 1) + 1;
}

ssize_t OffsetOpsStore::MinCacheObjects(ssize_t height) {
    return 2 * OperationHeadroom(height);
}

void OffsetOpsStore::Impl::RequireOpen() const {
    if (closed) {
        throw RuntimeError("the store" + (dir.empty() ? std::string() : " '" + dir + "'") +
                           " is closed");
    }
}

void OffsetOpsStore::Impl::RequireWritable() const {
    RequireOpen();
    if (reader) {
        throw RuntimeError(RuntimeError::Category::ReadOnly,
                           "store '" + dir + "' is open for reading only");
    }
    if (broken) {
        throw RuntimeError("the store" + (dir.empty() ? std::string() : " '" + dir + "'") +
                           " stopped accepting writes after an earlier error; it keeps its "
                           "last durable point");
    }
}

void OffsetOpsStore::Impl::CommitSpace() {
    space->Commit();
    cleared = ClearedNodes();
}

void OffsetOpsStore::Impl::CommitDurably() {
    CommitSpace();
    if (overlay != nullptr && !reader) {
        overlay->FlushIntoBase();
    }
}

void OffsetOpsStore::Impl::ApplyDeferred() {
    if (deferred.empty()) {
        return;
    }
    std::stable_sort(
        deferred.begin(), deferred.end(),
        [](const DeferredOperation& a, const DeferredOperation& b) { return a.field < b.field; });
    std::size_t applied = 0;
    try {
        for (const DeferredOperation& op : deferred) {
            MakeRoom();
            Record().RecordOffset(op.opid, op.field, op.offset);
            ++applied;
        }
    } catch (...) {
        deferred.erase(deferred.begin(), deferred.begin() + static_cast<std::ptrdiff_t>(applied));
        throw;
    }
    deferred.clear();
}

void OffsetOpsStore::Impl::ClearRecord() {
    deferred.clear();  // Clear removes what they would have changed
    Record().Clear();
    bounds.Clear();
    const auto [leaves, internalNodes] = NodeCounts();
    cleared.leaves += leaves;
    cleared.internalNodes += internalNodes;
}

bool OffsetOpsStore::Impl::TreeOutgrowsTheBound() const {
    const auto [leaves, internalNodes] = NodeCounts();
    return leaves + internalNodes > options.cacheObjects;
}

std::pair<int64, int64> OffsetOpsStore::Impl::NodeCounts() const {
    const int64 leaves =
        space->Population(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>().m_name);
    const int64 internalNodes = space->Population(
        GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>().m_name);
    return {leaves - cleared.leaves, internalNodes - cleared.internalNodes};
}

// Before each operation: room for the most one operation can add. The
// changed objects are committed to the overlay (never to the store between
// checkpoints: the store's tree may not hold operations the journal could
// lose) and then the clean ones released, down to half the bound, so that
// the bound holds at all times.
void OffsetOpsStore::Impl::MakeRoom() {
    const ssize_t bound = options.cacheObjects;
    if (bound <= 0) {
        return;
    }
    const ssize_t height = Map().m_height;
    const ssize_t room = OperationHeadroom(height);
    const ssize_t limit = bound - room;
    if (limit < room) {
        throw RuntimeError(
            RuntimeError::Category::Refused,
            "a cache of " + std::to_string(bound) + " objects is too small for a tree of height " +
                std::to_string(height) + ": it needs at least " + std::to_string(2 * room));
    }
    if (space->NumResidents() > limit) {
        NotePeak();
        if (overlay != nullptr) {
            CommitSpace();
        }
        space->EvictCleanResidents(limit / 2);
    }
}

// A checkpoint: the changed nodes and the journal position they reach, in
// one store transaction; then a new, empty journal. Runs only at a durable
// point, so that the stored tree never holds an operation the journal could
// lose. A failure before the transaction ends leaves memory and store as
// they were (the checkpoint can be retried).
void OffsetOpsStore::Impl::WriteCheckpoint() {
    {
        CSpaceGuard guard(*space, LockMode::Exclusive);
        ApplyDeferred();
        space->SetCounter(kJournalPositionCounter, durable);
        SetTreeSummary(*space, bounds);
        CommitDurably();
        if (lmdb != nullptr) {
            // LMDB reuses the pages a commit freed only from the second
            // commit after it: an empty one now lets the next checkpoint
            // write over the pages this one freed, instead of growing the
            // file by another copy of what it changes.
            CommitBatch nothing;
            nothing.nextIdentity = store->NextIdentity();
            store->Commit(nothing);
        }
        checkpointed = durable;
        ++checkpoints;
        NotePeak();
        if (options.cacheObjects > 0) {
            space->EvictCleanResidents(options.cacheObjects / 2);
        }
    }
    if (journal != nullptr && journal->FileBytes() > Journal::kHeaderBytes) {
        Journal::Reset(dir, durable, options.sync);
        journal = std::make_unique<Journal>(
            dir, JournalScan{durable, durable, Journal::kHeaderBytes, Journal::kHeaderBytes},
            options.sync);
    }
}

// Residents only grow inside operations and shrink only by eviction, so the
// peak is taken before every eviction and whenever statistics are read.
void OffsetOpsStore::Impl::NotePeak() {
    peakResidents = std::max(peakResidents, space->NumResidents());
}

void OffsetOpsStore::Impl::Release() {
    record.reset();
    space.reset();
    overlay.reset();
    journal.reset();
    lmdb = nullptr;
    store.reset();
    closed = true;
}

namespace {

int64 DataFileBytes(const std::string& dir) {
    std::error_code ec;
    const auto size = fs::file_size(fs::path(dir) / "data.mdb", ec);
    return ec ? 0 : static_cast<int64>(size);
}

// Whether free pages take more than `share` of the data file (of at least a
// MiB: a smaller file is not worth a copy).
bool WorthCompacting(OffsetOpsStore::Impl& s, double share) {
    constexpr int64 kFloor = int64{1} << 20;
    const int64 file = DataFileBytes(s.dir);
    if (s.lmdb == nullptr || share <= 0 || file < kFloor) {
        return false;
    }
    const double used = static_cast<double>(s.lmdb->DataBytes(true));
    return used < (1.0 - share) * static_cast<double>(file);
}

}  // namespace

// --- Opening and closing -----------------------------------------------------------

OffsetOpsStore::OffsetOpsStore(std::unique_ptr<Impl> impl) : m_impl(std::move(impl)) {}
OffsetOpsStore::OffsetOpsStore(OffsetOpsStore&&) noexcept = default;
OffsetOpsStore& OffsetOpsStore::operator=(OffsetOpsStore&& rhs) noexcept {
    if (this != &rhs) {
        if (m_impl != nullptr) {
            try {
                Close();
            } catch (...) {
                m_impl->Release();
            }
        }
        m_impl = std::move(rhs.m_impl);
    }
    return *this;
}

OffsetOpsStore::~OffsetOpsStore() {
    if (m_impl == nullptr) {
        return;
    }
    try {
        Close();
    } catch (...) {
        m_impl->Release();
    }
}

OffsetOpsStore OffsetOpsStore::Open(const std::filesystem::path& dir, const StoreOptions& options) {
    RegisterOffsetOpsClasses();
    auto impl = std::make_unique<Impl>();
    impl->dir = dir.string();
    impl->options = options;
    impl->reader = options.mode == StoreMode::Read;
    if (impl->reader) {
        OpenReader(*impl);
    } else {
        OpenWriter(*impl);
    }
    impl->peakResidents = impl->space->NumResidents();
    return OffsetOpsStore(std::move(impl));
}

OffsetOpsStore OffsetOpsStore::OpenInMemory(const StoreOptions& options) {
    RegisterOffsetOpsClasses();
    auto impl = std::make_unique<Impl>();
    impl->options = options;
    impl->options.mode = StoreMode::Write;
    OpenSpace(*impl, std::make_unique<MemoryStore>());
    FindOrCreateRecord(*impl);
    return OffsetOpsStore(std::move(impl));
}

void OffsetOpsStore::Close() {
    Impl& s = Live();
    if (s.closed) {
        return;
    }
    if (!s.reader && !s.broken) {
        try {
            Sync();
            // Nothing of an in-memory store outlives the handle.
            const bool changed =
                !s.dir.empty() &&
                (s.space->NumDirty() > 0 || s.space->NumQueuedDeletions() > 0 ||
                 s.checkpointed != s.durable ||
                 (s.journal != nullptr && s.journal->FileBytes() > Journal::kHeaderBytes));
            if (changed) {
                s.WriteCheckpoint();
            }
            if (WorthCompacting(s, s.options.compactFreeShare)) {
                // The store is whole whatever happens here: a compaction
                // that cannot run (another process has the store open) or
                // fails leaves the old file in place.
                try {
                    (void)s.lmdb->Compact();
                } catch (const RuntimeError&) {
                }
            }
        } catch (...) {
            s.Release();
            throw;
        }
    }
    s.Release();
}

bool OffsetOpsStore::IsReader() const {
    return Live().reader;
}

std::filesystem::path OffsetOpsStore::Directory() const {
    return Live().dir;
}

const std::vector<std::string>& OffsetOpsStore::Repairs() const {
    return Live().repairs;
}

OffsetOpsStore::Impl& OffsetOpsStore::Live() const {
    if (m_impl == nullptr) {
        throw RuntimeError("the store handle was moved from");
    }
    return *m_impl;
}

// --- Writing -------------------------------------------------------------------------

void OffsetOpsStore::Record(const Opid& opid, const FieldId& field, int64 offset) {
    Impl& s = Live();
    s.RequireWritable();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    s.MakeRoom();  // a bound too small for the tree throws before anything changes
    try {
        CheckedRecord(s, opid, field, offset);
    } catch (const RecordRefused&) {
        throw;
    } catch (...) {
        // A load that failed inside the write-find may leave the tree half
        // changed in memory: nothing more may become durable.
        s.broken = true;
        throw;
    }
    if (s.journal != nullptr) {
        try {
            s.journal->AddRecord(opid.s, opid.t, field, offset);
        } catch (...) {
            s.broken = true;
            throw;
        }
    }
    ++s.pending;
}

void OffsetOpsStore::Clear() {
    Impl& s = Live();
    s.RequireWritable();
    CSpaceGuard guard(*s.space, LockMode::Exclusive);
    try {
        s.ClearRecord();
        if (s.journal != nullptr) {
            s.journal->AddClear();
        }
    } catch (...) {
        s.broken = true;
        throw;
    }
    ++s.pending;
}

// A failed append or checkpoint breaks the handle: the store keeps its last
// durable point, and nothing recorded after it may become durable later (a
// caller told of the failure counts those operations as lost). Reopen the
// store to go on.
void OffsetOpsStore::Sync() {
    Impl& s = Live();
    s.RequireWritable();
    try {
        if (s.journal != nullptr) {
            s.journal->Commit();
        }
        s.durable += static_cast<uint64>(s.pending);
        s.pending = 0;
        if (s.journal != nullptr && s.journal->FileBytes() > s.options.journalLimitBytes) {
            s.WriteCheckpoint();
        }
    } catch (...) {
        s.broken = true;
        throw;
    }
}

CompactResult OffsetOpsStore::Compact() {
    Impl& s = Live();
    s.RequireWritable();
    if (s.lmdb == nullptr) {
        throw RuntimeError("an in-memory store has no file to compact");
    }
    Checkpoint();
    CompactResult result;
    result.bytesBefore = DataFileBytes(s.dir);
    try {
        result.compacted = s.lmdb->Compact();
    } catch (...) {
        s.broken = true;  // the files are whole; this handle's environment may not be
        throw;
    }
    result.bytesAfter = DataFileBytes(s.dir);
    return result;
}

void OffsetOpsStore::Checkpoint() {
    Sync();
    Impl& s = Live();
    try {
        s.WriteCheckpoint();
    } catch (...) {
        s.broken = true;
        throw;
    }
}

}  // namespace tarn
