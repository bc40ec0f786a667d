#pragma once

// The front door of the offset operations record: open a store, record
// offset operations into it, make them durable, read the per-field tables
// back, close.
//
//   OffsetOpsStore store = OffsetOpsStore::Open("store");   // a directory
//   store.Record(Opid(site, 7), FieldId(OID(Seid(uint64{42})), Path("\x01", 1)), 12);
//   store.Sync();                                            // durable from here on
//   std::optional<FieldTable> table = store.Find(field);     // (site, t, o) by site
//   for (FieldCursor c(store); !c.AtEnd(); c.Next()) { ... } // tnStore/FieldCursor.h
//   store.Close();
//
// Handles. An OffsetOpsStore owns everything it opened (the object space, the
// on-disk environment, the journal); it is movable, not copyable, and closes
// itself when destroyed. A handle that was moved from holds nothing: every
// call on it but the destructor and assignment throws RuntimeError ("the
// store handle was moved from"). Tables handed out (Find, the ForEach
// callbacks, cursors) are copies (FieldTable, tnStore/FieldTable.h): they
// stay as they were when read, whatever the store does afterwards.
//
// Threads. One handle may be shared by any number of threads:
//   - Reads (Find, the ForEach walks, FieldCursor, Size, Height, Sites,
//     Stats, Check, Validate, Dump, Backup) run beside each other on an
//     unbounded store; on a bounded one (StoreOptions::cacheObjects) they
//     take turns, since each may release nodes.
//   - Writes (Record, Clear, Sync, Checkpoint, Merge, Compact, Close) may
//     come from any thread, one at a time; a read waits for the tree change
//     of a write in progress (not for its append or sync), and a write for
//     the reads in progress.
//   - A read sees the record after some prefix of the recorded operations:
//     never a table half changed, and no table going back in a later read.
//     Find copies one table at once; a walk or cursor reads a few hundred
//     fields at once, each batch one consistent view (see FieldCursor.h).
//   - Sync from several threads: the first to get its turn appends and syncs
//     every operation recorded so far, and the others, whose operations that
//     covered, return without another append (group commit). Each Sync
//     returns once its own thread's operations are durable.
//   - Close waits for the calls in progress; calls after it throw. Moving or
//     destroying a handle while another thread uses it is not allowed.
// Across handles and processes: one writer per store directory (a second
// writer is refused at once with "in use"), and any number of readers beside
// it in other processes. A reader sees, from the moment it opens, one
// consistent checkpoint plus every durable point the writer had reached by
// then; it never waits for the writer nor blocks it. Opening the same
// directory twice in one process is refused ("in use").
//
// Durability. Record changes memory only. Sync() makes every operation
// recorded so far durable: it appends them to the journal (one checksummed
// record) and syncs the file. A crash at any moment leaves exactly the
// operations up to the last completed Sync(); opening replays the journal's
// operations after the last checkpoint. A checkpoint writes the changed tree
// nodes in one transaction of the data file together with the journal
// position they cover. Checkpoints run at a durable point, never between two:
//   - when the journal has grown past StoreOptions::journalLimitBytes;
//   - on Checkpoint() and on Close().
// The cache bound (StoreOptions::cacheObjects) never forces one: between
// checkpoints, changed nodes leave memory for an overlay file of the
// handle's own, which is not durable.
// After a checkpoint the journal starts again, empty. A larger journal limit
// means fewer tree writes per operation and a longer replay when opening
// after a crash (about a million operations a second).
//
// Opening reads the store's meta values and replays the journal's tail;
// it walks neither the tree nor the file. What it needs to know about the
// tree (the numbers of leaves and internal nodes, each site's newest time
// stamp, a bound on every sum) is kept with each checkpoint and brought
// forward by replay, so Stats() and Sites() read no node either.
//
// Damaged trees. Every node is checked where it is loaded: its image's
// checksum (bound to its identity), its class against its level, its entry
// count, its keys in order and within the bounds its parent gives it. A
// lookup, walk or write that meets a damaged node throws RuntimeError (a
// writer's handle is then broken, see Failures). Check() and Validate() walk
// the whole tree, the leaf chain and the kept counts; Dump runs the
// whole-tree check first.
//
// Failures. Every failure is an exception derived from RuntimeError
// (tnUtils/RuntimeError.h) whose what() is one line naming the file and what
// is wrong, and whose GetCategory() says what kind of failure it is (NotFound,
// InUse, Damaged, NoSpace, ReadOnly, Refused, Io, Other) for a program to
// branch on: a missing, unreadable or damaged store, journal or lock file, a
// full disk ("no space left on device"), a second writer. Record refuses an
// operation that the record must not be given by throwing RecordRefused,
// which names the field and the site and changes nothing; so does a cache
// bound too small for the tree (a RuntimeError). After any other error while
// writing (a failed load, append, sync or checkpoint), the handle is broken:
// further writes throw, nothing more becomes durable, Close only releases,
// and the store on disk keeps its last durable point; reopen it to go on.

#include <cstddef>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnOperation/src/Util/Opid.h"
#include "tnStore/FieldIdText.h"
#include "tnStore/FieldTable.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

// Time stamps are stored as variable-length integers that carry 32 bits.
inline constexpr int64 kMaxTimeStamp = 4294967295;

enum class StoreMode {
    Write,          // one writer; creates the directory and the store if missing
    WriteExisting,  // one writer; the store must exist
    Read,           // a reader beside any writer; never writes
};

struct StoreOptions {
    StoreMode mode = StoreMode::Write;
    // Sync the journal at each durable point and each checkpoint. Off: a
    // crash of the process loses nothing that Sync() returned from, a crash
    // of the machine may lose the latest durable points. For scratch stores.
    bool sync = true;
    // A durable point checkpoints when the journal has grown past this.
    std::size_t journalLimitBytes = std::size_t{64} << 20;
    // At most this many tree objects (the record, the map's header and the
    // nodes; a node of 100 fields from 4 sites takes about 30 KiB in memory)
    // in memory at any time (0: no bound). Must leave room for one operation:
    // see MinCacheObjects(). Between checkpoints, the objects a bounded store
    // changed go to a temporary file of its own (unlinked, in TMPDIR) before
    // they leave memory, and load again from there; a checkpoint moves them
    // into the store. A bounded store also defers up to
    // kDeferredPerCacheObject operations per object of the bound (about 80
    // bytes each) and applies them in key order, so that a leaf loaded
    // takes all its waiting operations at once (only while the tree has more
    // nodes than the bound): with C objects, memory is at most about
    // C * (30 KiB + 20 KiB) on top of the program's own.
    ssize_t cacheObjects = 0;
    static constexpr std::size_t kDeferredPerCacheObject = 256;
    // A writer's Close() compacts the data file (see Compact()) when free
    // pages take more than this share of it (0: never). Each checkpoint
    // rewrites the nodes it changed on new pages and frees the old ones: a
    // store whose checkpoints rewrite most of the tree carries up to its own
    // size in free pages between them.
    double compactFreeShare = 0.25;
};

class FieldCursor;
class OffsetOpsStoreImpl;

// An operation Record refused, with nothing changed (category Refused).
class RecordRefused : public RuntimeError {
public:
    enum class Reason { TimeStampOutOfRange, TimeStampOlder, SumOverflow };

    RecordRefused(Reason reason, const FieldId& field, const Guid& site, std::string message)
        : RuntimeError(Category::Refused, message),
          m_reason(reason),
          m_field(field),
          m_site(site) {}

    Reason GetReason() const { return m_reason; }
    const FieldId& Field() const { return m_field; }
    const Guid& Site() const { return m_site; }

private:
    Reason m_reason;
    FieldId m_field;
    Guid m_site;
};

struct StoreStatistics {
    int64 fields = 0;
    ssize_t height = -1;  // of the tree; -1 when empty
    int64 leaves = 0;
    int64 internalNodes = 0;
    int64 images = 0;              // stored images (on-disk: as of the last checkpoint)
    int64 imageBytes = 0;          // their bytes, framing included
    int64 journalBytes = 0;        // the journal file
    uint64 durableOperations = 0;  // journaled operations since the store was made
    uint64 checkpointedOperations = 0;
    int64 pendingOperations = 0;   // recorded, not yet durable
    int64 checkpoints = 0;         // by this handle
    int64 imagesWritten = 0;       // by this handle's checkpoints
    int64 imageBytesWritten = 0;   // their image bytes
    ssize_t residents = 0;         // tree objects in memory now
    ssize_t peakResidents = 0;     // the most at once
    int64 replayedOperations = 0;  // replayed from the journal when opening

    int64 Nodes() const { return leaves + internalNodes; }
};

// The non-aborting check of the tree: every node of the kind its level needs,
// entries in order and within bounds, counts within limits, the leaf chain,
// the size. Loads the whole tree (within the cache bound).
struct StoreCheck {
    std::vector<std::string> problems;  // one line each, the first 50
    int64 numProblems = 0;
    bool Ok() const { return numProblems == 0; }
};

// The check above, the map's own validation and the stored images no root
// reaches.
struct StoreValidation {
    StoreCheck check;
    bool mapValid = false;  // the map's own Validate, run only on a tree the check passed
    int64 images = 0;       // stored
    int64 reached = 0;      // of those, reached from a root
    std::vector<uint64> unreachable;
    OID record;  // the record's identity
    OID map;     // the map's identity
    bool Ok() const { return check.Ok() && mapValid && unreachable.empty(); }
};

// A conflict between two replicas' records of one field and site: the same
// time stamp with other sums (one replica saw only some of several offsets
// that carry that stamp). A merge leaves the record as it is.
struct MergeConflict {
    FieldId field;
    Guid site;
    SiteRecord ours;    // in the store merged into (of `site`)
    SiteRecord theirs;  // in the store merged from
};

struct MergeOptions {
    // Find what would be taken and the conflicts; record nothing.
    bool dryRun = false;
    // The cache bound of the store merged from (0: none).
    ssize_t cacheObjects = 0;
    // A durable point after this many merged operations (and one at the end).
    int64 durableEvery = 10000;
    // Called for each conflict, in key order, as it is found.
    std::function<void(const MergeConflict&)> onConflict;
};

struct MergeResult {
    int64 fields = 0;      // fields of the store merged from
    int64 taken = 0;       // site records taken from it (with a dry run: would be)
    int64 operations = 0;  // operations recorded for them
    int64 conflicts = 0;
};

struct CompactResult {
    bool compacted = false;  // false: another process has the store open
    int64 bytesBefore = 0;   // the data file
    int64 bytesAfter = 0;
};

struct BackupOptions {
    // Leave out free pages and renumber the rest (LMDB's compacting copy):
    // the copy is as small as its contents.
    bool compact = false;
    // Called a few times a second while the data file is copied, from
    // another thread, with the bytes copied so far and about how many there
    // are in all.
    using ProgressFn = std::function<void(uint64 copied, uint64 total)>;
    ProgressFn progress;
};

// What a backup holds.
struct BackupResult {
    uint64 durableOperations = 0;       // the durable point it holds
    uint64 checkpointedOperations = 0;  // of those, in its data file
    int64 dataBytes = 0;                // its data file
    int64 journalBytes = 0;             // its journal
};

class OffsetOpsStore {
public:
    // Opens the store in directory `dir` (see StoreOptions::mode).
    static OffsetOpsStore Open(const std::filesystem::path& dir, const StoreOptions& options = {});
    // A store that lives in memory only, for tests and scratch work: nothing
    // outlives the handle, Sync and Close write nothing, and Checkpoint (or a
    // cache bound) copies the changed nodes into in-memory images, from which
    // released nodes load again.
    static OffsetOpsStore OpenInMemory(const StoreOptions& options = {});

    OffsetOpsStore(OffsetOpsStore&&) noexcept;
    OffsetOpsStore& operator=(OffsetOpsStore&&) noexcept;
    // Closes the store: Close(), errors swallowed.
    ~OffsetOpsStore();

    // --- Writing (writers only) -----------------------------------------------

    // Adds `offset` to the table of `field` under the site and time stamp of
    // `opid`. Throws RecordRefused (and changes nothing) for a time stamp
    // outside 0..kMaxTimeStamp, one older than the site's recorded one for
    // the field, or a sum that would overflow.
    void Record(const Opid& opid, const FieldId& field, int64 offset);
    // Removes every field's table.
    void Clear();
    // A durable point: every operation recorded so far is in the journal and
    // synced when this returns. May checkpoint (see above).
    void Sync();
    // A durable point, then a checkpoint.
    void Checkpoint();

    // --- Reading (any handle) ---------------------------------------------------

    // A copy of the table of `field`; nothing when the field has none.
    std::optional<FieldTable> Find(const FieldId& field);
    // Calls `fn` for every field from the first not less than `from`, in key
    // order, until it returns false. The walk reads a few hundred fields at a
    // time and calls `fn` between reads, so `fn` may use the store; it sees
    // what a FieldCursor would (tnStore/FieldCursor.h).
    using FieldVisitor = std::function<bool(const FieldId&, const FieldTable&)>;
    void ForEachFrom(const FieldId& from, const FieldVisitor& fn);
    void ForEach(const FieldVisitor& fn) { ForEachFrom(FieldId(), fn); }
    // Every field of the object `oid`, in path order.
    void ForEachOfObject(OID oid, const FieldVisitor& fn);
    // The number of fields that hold a table.
    int64 Size();
    // The tree's height: its internal levels above the leaves, -1 when it has
    // no root yet.
    ssize_t Height();
    bool Empty() { return Size() == 0; }

    // Each site's newest time stamp in any table: what the store has seen of
    // each site's stream (its version vector). Kept with every checkpoint and
    // brought forward by replay: no walk.
    std::map<Guid, int64> Sites();

    // The counts the store keeps (fields, nodes, images) and this handle's
    // figures; no walk.
    StoreStatistics Stats();
    StoreCheck Check();
    StoreValidation Validate();
    // The tree, node by node (after the check; throws RuntimeError on a
    // damaged tree).
    void Dump(std::ostream& out);

    // --- Replicas (writers only) ---------------------------------------------------

    // Joins the store in directory `from` (another replica, opened as a
    // reader beside any writer of it) into this one: for every field and
    // site, its record is taken where its time stamp is later than this
    // store's (a site this store lacks counts as stamp -1). The same stamp
    // with another sum is a conflict: reported, and this store's record
    // kept. A record is taken through Record (its stamp, the difference of
    // the sums; two operations when the difference would overflow), so the
    // time-stamp rule holds, and it is journaled and made durable like any
    // operation: after a crash this store holds exactly a durable point. Both
    // stores are walked in key order, the one merged from within
    // `options.cacheObjects`, this one within its own bound.
    MergeResult Merge(const std::filesystem::path& from, const MergeOptions& options = {});

    // Writers of on-disk stores: a checkpoint, then the data file rewritten
    // without its free pages and put in place of the old one (a rename: a
    // crash leaves one or the other, each whole). Only when no other process
    // has the store open (a reader maps the file); otherwise nothing changes
    // and `compacted` is false. Costs a read of the whole file and a write
    // of what it holds.
    CompactResult Compact();

    // --- Backups ----------------------------------------------------------------

    // Copies the store in directory `from` into the directory `to`, which must
    // not exist or be empty: the data file as of its latest checkpoint and
    // the journal's complete records after it, so that the copy holds the
    // latest durable point reached before the copy finished. Runs beside a
    // writer in another process, which it neither waits for nor blocks;
    // nothing of the source changes. The copy appears at `to` only when
    // complete (it is made in a sibling directory, synced, and renamed);
    // on failure nothing is left behind. A store that is open in this
    // process is copied with the member below.
    static BackupResult Backup(const std::filesystem::path& from, const std::filesystem::path& to,
                               const BackupOptions& options = {});
    // The same for the store of this handle (on-disk stores only); a
    // writer's operations since its last durable point are not in the copy.
    BackupResult Backup(const std::filesystem::path& to, const BackupOptions& options = {});

    // --- Lifetime ---------------------------------------------------------------

    // Writers: a durable point and a checkpoint, then releases everything.
    // Readers: releases everything. Further calls other than the destructor
    // throw. Idempotent.
    void Close();

    bool IsReader() const;
    std::filesystem::path Directory() const;  // empty for an in-memory store
    // What opening repaired (a torn journal tail dropped, a lock file made
    // anew), one line each.
    const std::vector<std::string>& Repairs() const;

    // The fewest objects StoreOptions::cacheObjects may allow for a tree of
    // `height`.
    static ssize_t MinCacheObjects(ssize_t height);

private:
    friend class FieldCursor;

    explicit OffsetOpsStore(std::unique_ptr<OffsetOpsStoreImpl> impl);
    // The state of a handle that was not moved from; throws for one that was.
    OffsetOpsStoreImpl& State() const;
    std::unique_ptr<OffsetOpsStoreImpl> m_impl;
};

}  // namespace tarn
