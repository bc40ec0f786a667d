#pragma once

// The embedded on-disk store: object images, named roots, named counters and
// the identity counter in one LMDB environment inside a directory.
//
// Directory contents: LMDB's "data.mdb" and "lock.mdb" (the files of callers,
// such as a journal, may sit beside them). The environment holds two named
// databases:
//   "images"  key: identity, 8 bytes big-endian (so byte order is numeric
//             order and the file reads the same on every host);
//             value: the framed image record of tnBackends/ImageRecord.h.
//   "meta"    one record under the key "state" that holds every meta value
//             under one checksum (format version 2). All integers are
//             little-endian:
//               offset  size  field
//               0       8     magic "TARNSTOR"
//               8       4     format version, 2
//               12      8     identity counter (the next identity to hand out)
//               20      8     image bytes: the sum of the sizes of all image
//                             records, as ImageCounts::numImageBytes reports
//               28      4     number of roots R
//               32            R roots in increasing byte order of their
//                             names, each: name length n (2), name (n bytes),
//                             identity (8)
//                       4     number of counters C
//                             C counters in increasing byte order of their
//                             names, each: name length n (2), name (n bytes),
//                             value (8)
//               end-8   8     XXH3-64 (seed 0) of all the bytes before it
//             A name has at most 1024 bytes; a record without roots and
//             counters has 44 bytes.
// A directory whose environment has no "meta" database is not a store and
// is refused. A "meta" database without the record (and without the marker
// of format 1), and a record that is shorter than 44 bytes, fails its
// checksum or does not parse, make a damaged store: every opener refuses it
// with a RuntimeError; none takes it for a store without roots. A record of
// another version is refused as an unsupported format.
//
// Format 1 kept each meta value under a key of its own, without a checksum:
// "format" -> "TARNSTOR" + version 1 (4 bytes), "next-identity" -> the
// identity counter, "root:<name>" -> an identity, "counter:<name>" -> a value
// (8 bytes each), and no image bytes. A ReadOnly opener reads such a store as
// it is and counts the image bytes when Stats asks. The first writable opener
// upgrades it in place in one write transaction: it walks the pages (as
// before any first change, see Faults below), counts the image bytes (one
// walk of the images' leaves), writes the record and removes the old keys, so
// that a crash leaves one format or the other; Repairs() reports the upgrade
// and FormatVersion() the version found.
//
// Decisions:
// - Atomicity: a Commit is one LMDB write transaction (images written, images
//   deleted, the meta record). LMDB's copy-on-write pages and its two meta
//   pages make the transaction all or nothing: after a crash the store holds
//   the previous commit or the new one. Commits are synced to disk unless
//   LmdbStoreOptions::syncOnCommit is off.
// - Map size: LMDB needs an upper bound for the file. It starts at
//   LmdbStoreOptions::initialMapSize (1 GiB: address space only, the file
//   grows with its contents) and doubles whenever a commit finds the map full;
//   the commit is then retried, so a caller never sees the limit.
// - One writer, any number of readers: Open takes an exclusive flock on the
//   directory for a writable store before LMDB touches it, so that a second
//   writer, in this or another process, is refused at once with a
//   RuntimeError ("in use") rather than left waiting. A ReadOnly store takes
//   no flock: readers in other processes work beside the writer (LMDB serves
//   readers beside its one writer). Within one process a store directory is
//   open at most once, whatever the modes (LMDB's locks are per process; a
//   second environment on the same files in one process would corrupt
//   them): a second opener in the same process is refused with "in use".
//   A child made by fork() may open the store afresh (never use a store it
//   inherited): it then counts as another process.
// - Meta values: every Commit writes the whole meta record anew, in the same
//   write transaction as the images. The writer keeps the values in memory:
//   a commit makes its new values in a copy, which replaces them once the
//   transaction has committed, so a failed commit leaves them as they were.
//   FindRoot, Roots, FindCounter and NextIdentity answer from memory: the
//   writer's as of its latest commit, a ReadOnly store's as read (and
//   verified) once from its snapshot at Open.
// - Stats: the number of images is LMDB's count and the image bytes are the
//   record's, so Stats costs the same for any number of images (except for a
//   format-1 store read as it is). Commit keeps the image bytes up to date:
//   for a record it replaces or deletes it looks up the old record's size
//   first, in the same transaction.
// - Snapshots: a ReadOnly store holds one LMDB read transaction from Open to
//   its destruction. Every read of it (Load, FindRoot, Roots, FindCounter,
//   NextIdentity, ForEachIdentity, Stats) sees the commit that was the
//   latest when it was opened, whatever the writer commits meanwhile; open
//   it again to see newer commits. While it is open the writer cannot reuse
//   the pages of that commit, so the file grows faster: keep readers short.
//   A writable store reads the latest commit, its own, at every call.
// - Stores this process may not write: a ReadOnly opener that cannot write
//   lock.mdb (a read-only mount, another user's store it may only read)
//   opens without LMDB's lock (MDB_NOLOCK) and takes no reader slot. Alone,
//   or beside other readers, that changes nothing. Beside a writer it does:
//   the writer does not know of the snapshot, and may reuse its pages two
//   commits later. Every image is checked against its checksum and identity
//   and the meta record against its own, so such a reader then meets an
//   error ("damaged store" or a checksum mismatch), not a wrong table; open
//   it again for a newer snapshot. Compact() cannot see such a reader
//   either: the file it mapped stays whole (the swap is a rename).
// - Threads: every member may be called from any thread; calls are serialised
//   by an internal mutex. A store must not be used in a child after fork().
// - Faults: a missing directory (when it must exist), a directory that is not a
//   store, a foreign or damaged file, permission problems and damaged records
//   are all reported as RuntimeError naming the directory and, for a record,
//   the identity. The record frame guards the image bytes, and the meta
//   record's checksum the meta values. Before LMDB maps the files
//   (tnBackends/LmdbFileCheck.h), data.mdb is checked against its meta pages (a
//   short file would fault when touched) and lock.mdb's header is checked: a
//   few reads, whatever the size of the store. A damaged lock file nobody uses
//   is made anew and reported in Repairs(). Opening walks no tree: it reads the
//   few pages that lead to the meta record (and the images' leaves when it
//   upgrades a format-1 store); LMDB reads the other pages as the calls need
//   them, and trusts them. Damage it detects itself (MDB_PAGE_NOTFOUND,
//   MDB_CORRUPTED, MDB_CURSOR_FULL), and a SIGSEGV or SIGBUS inside the map (or
//   at a null pointer), or one of LMDB's assertions, while it reads a page
//   (caught by a page guard: see LmdbInternal.h; the first Open installs a
//   process-wide handler for both signals, chained to the one before it),
//   arrive as a RuntimeError "damaged store: ..." and poison the store: every
//   later call throws the same error and nothing more is committed. A writer
//   trusts pages no read checks (page flags, the page counts of the overflow
//   runs it frees, the free-page lists), so before its first change after
//   opening it walks every page with CheckLmdbPages, and a store found damaged
//   then takes no change (its reads go on): a writer that writes pays for the
//   walk, an opening does not. A page that is sound in itself but wrong can
//   still give a wrong answer (most often an image not found). CheckLmdbPages
//   walks every page, for whole-store validation and backups; a compacting
//   CopyTo runs it itself. A write failed for a full disk says "no space left
//   on device". Misuse by the caller (writing identity 0, committing to a
//   read-only store) asserts.

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "tnBackends/DiskStore.h"

struct MDB_env;
struct MDB_txn;
struct MDB_val;

namespace tarn {

struct LmdbStoreState;
struct LmdbPageGuard;

struct LmdbStoreOptions {
    static constexpr std::size_t kDefaultMapSize = std::size_t{1} << 30;

    OpenMode mode = OpenMode::CreateIfMissing;
    // Sync data and meta pages at each commit. Turning it off keeps the store
    // consistent after a crash of the process, but a crash of the machine may
    // lose the latest commits; meant for scratch stores only.
    bool syncOnCommit = true;
    std::size_t initialMapSize = kDefaultMapSize;
};

class LmdbStore final : public DiskStore {
public:
    static std::unique_ptr<LmdbStore> Open(const std::string& dir, OpenMode mode);
    static std::unique_ptr<LmdbStore> Open(const std::string& dir, const LmdbStoreOptions& options);
    ~LmdbStore() override;

    LmdbStore(const LmdbStore&) = delete;
    LmdbStore& operator=(const LmdbStore&) = delete;

    std::optional<StoredImage> Load(uint64 oid) override;
    std::optional<uint64> FindRoot(std::string_view name) override;
    std::map<std::string, uint64> Roots() override;
    std::optional<uint64> FindCounter(std::string_view name) override;
    std::map<std::string, uint64> Counters() override;
    uint64 NextIdentity() override;
    void Commit(const CommitBatch& batch) override;
    void ForEachIdentity(const std::function<void(uint64)>& fn) override;
    std::optional<uint64> LargestIdentity() override;
    ImageCounts Stats() override;

    // The named counter as the latest commit holds it, also for a ReadOnly
    // store (whose other reads see its snapshot): a ReadOnly store reads and
    // verifies the latest meta record (or format-1 keys) for it.
    std::optional<uint64> FindLatestCounter(std::string_view name) override;
    // Writes a copy of the environment as of the latest commit into the
    // existing directory `dir`, as its data.mdb (which must not exist yet),
    // synced. `compact` leaves out free pages and renumbers the rest, so the
    // copy is as small as its contents; it walks every page with
    // CheckLmdbPages first (LMDB's compacting copy reads them all
    // unguarded). Runs beside the writer; a copy holds one commit, whatever
    // the writer commits meanwhile.
    void CopyTo(const std::string& dir, bool compact);
    // Writers: rewrites data.mdb without its free pages (LMDB's compacting
    // copy, after a walk of every page) and puts the copy in its place, when
    // no other process has the store open. Returns false, changing nothing,
    // when another process (a reader) has it open: the file it has mapped
    // must stay as it is. The swap is a rename, so a crash leaves one file or
    // the other, each a whole store.
    //
    // How others are kept out: LMDB's openers take a lock on the first byte
    // of lock.mdb, exclusively if they can (then they are alone and set the
    // lock file up), shared otherwise, and hold it while the store is open.
    // With its own environment closed, the writer takes that lock exclusively
    // (refused while any other process holds it), renames the copy into
    // place and opens the new file, which LMDB then finds alone and sets up
    // afresh. The descriptor of that lock stays open for the store's life: a
    // process's locks on a file go with any descriptor of it that closes.
    // An opener that opened the old data.mdb just before the rename and then
    // waited for the lock sees one of the old file's two last commits: a
    // consistent, older snapshot, never a mix.
    bool Compact() override;
    // The DiskStore words (tnBackends/DiskStore.h), in LmdbDiskStore.cpp:
    // - FinishCheckpoint commits nothing: LMDB reuses the pages a commit
    //   freed only from the second commit after it, so that the next
    //   checkpoint writes over the pages this one freed instead of growing
    //   the file by another copy of what it changes.
    // - CopyTo is CopyTo below into a directory cleared of a failed earlier
    //   copy's data.mdb and lock.mdb, reporting data.mdb's growth.
    // - CheckFile is CheckLmdbPages of the directory; FileBytes data.mdb's
    //   size; FreeShare the share of it DataBytes(true) leaves out.
    void FinishCheckpoint() override;
    DiskCopy CopyTo(const std::string& dir, bool compact, const CopyProgress& progress) override;
    void CheckFile() override;
    int64 FileBytes() override;
    double FreeShare() override;

    // A reader that opened without a slot in LMDB's lock file (see Open).
    bool WithoutLock() const { return m_withoutLock; }
    // The bytes of the data file that the latest commit uses, or (when
    // `withoutFreePages`) about what a compacting copy of it takes.
    uint64 DataBytes(bool withoutFreePages = false);

    const std::string& Directory() const override { return m_dir; }
    // What opening repaired or changed (a lock file made anew, the store
    // upgraded from format 1), one line each.
    const std::vector<std::string>& Repairs() const override { return m_repairs; }
    // The store's format version as found when it was opened: 2, or 1 for a
    // store of the older format (which a writable opener has upgraded to 2;
    // see Repairs()). A store made by this opener is of version 2.
    uint32 FormatVersion() const { return m_foundVersion; }
    // The current upper bound of the data file; grows as commits need it.
    std::size_t MapSize();

private:
    class ReadScope;
    class LatestRead;
    class Cursor;

    LmdbStore(std::string dir, const LmdbStoreOptions& options);

    void LockDirectory();
    void UnlockDirectory();
    void OpenEnvironment();
    void FindMap();
    void SetMapSize(std::size_t size, const char* doing);
    void OpenDatabases(OpenMode mode);
    void OpenDatabasesForReading();
    bool OpenMetaDatabase(MDB_txn* txn);
    void OpenImagesDatabase(MDB_txn* txn);
    void CreateDatabases(MDB_txn* txn);
    void UpgradeFormat1(MDB_txn* txn, LmdbStoreState& state,
                        const std::vector<std::string>& oldKeys);
    void PutImage(MDB_txn* txn, uint64 oid, const StoredImage& image, LmdbStoreState& next);
    void DeleteImage(MDB_txn* txn, uint64 oid, LmdbStoreState& next);
    void SetNamedValues(const CommitBatch& batch, LmdbStoreState& next);
    void BeginSnapshot();
    LmdbStoreState ReadState(MDB_txn* txn, uint32* version, std::vector<std::string>* oldKeys);
    LmdbStoreState ReadFormat1(MDB_txn* txn, std::vector<std::string>* oldKeys);
    void WriteState(MDB_txn* txn, const LmdbStoreState& state);
    uint64 SumImageBytes(MDB_txn* txn);
    template <class Apply>
    void WriteTransaction(Apply&& apply);
    void GrowMap();
    // Lets go of the map's pages this process has touched (see the .cpp).
    void ReleaseMappedPages();
    MDB_txn* BeginRead();
    template <class Call>
    int Guarded(const char* doing, Call&& call);
    template <class Call>
    void CheckGuarded(const char* doing, Call&& call);
    int Touch(const MDB_val& val) const noexcept;
    int Get(MDB_txn* txn, unsigned int dbi, MDB_val* key, MDB_val* value, const char* doing);
    [[noreturn]] void PageFault(const char* doing, const LmdbPageGuard& guard);
    void ThrowIfPoisoned() const;
    void WritablePages();

    [[noreturn]] void Fail(const std::string& what,
                           RuntimeError::Category category = RuntimeError::Category::Other) const;
    void Check(int rc, std::string_view doing);

    std::string m_dir;
    LmdbStoreOptions m_options;
    bool m_readOnly = false;
    int m_dirFd = -1;                         // holds a writer's flock
    int m_compactLockFd = -1;                 // lock.mdb, kept open after a compaction
    bool m_withoutLock = false;               // a reader that may not write lock.mdb
    bool m_registered = false;                // the directory is entered as open in this process
    std::pair<uint64, uint64> m_dirId{0, 0};  // the directory's device and inode
    MDB_env* m_env = nullptr;
    // Where data.mdb is mapped (0, 0: not known), for the page guards.
    std::uintptr_t m_mapBegin = 0;
    std::uintptr_t m_mapEnd = 0;
    uint64 m_loadsSinceRelease = 0;
    std::size_t m_pageSize = 0;
    // Once LMDB met a damaged page: the error every call throws.
    std::string m_poisoned;
    // A writer's walk of the pages before its first change: done, or the
    // damage it found.
    bool m_pagesChecked = false;
    std::string m_unwritable;
    // A writer's reader: a reset read transaction, renewed per read. A
    // ReadOnly store's snapshot: one read transaction for its lifetime.
    MDB_txn* m_reader = nullptr;
    unsigned int m_images = 0;  // LMDB database handles (MDB_dbi)
    unsigned int m_meta = 0;
    uint32 m_foundVersion = 0;
    // The meta values: a writer's as of its latest commit, a ReadOnly
    // store's as of its snapshot.
    std::unique_ptr<LmdbStoreState> m_state;
    std::vector<std::string> m_repairs;
    std::mutex m_mutex;
};

// Opens the on-disk store in `dir` as an IStore, for tools and embedders that
// need nothing beyond the interface.
std::unique_ptr<IStore> OpenStore(const std::string& dir,
                                  OpenMode mode = OpenMode::CreateIfMissing);

}  // namespace tarn
