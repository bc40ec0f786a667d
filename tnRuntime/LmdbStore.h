#pragma once

// The embedded on-disk store: object images, named roots, named counters and
// the identity counter in one LMDB environment inside a directory.
//
// Directory contents: LMDB's "data.mdb" and "lock.mdb", nothing else. The
// environment holds two named databases:
//   "images"  key: identity, 8 bytes big-endian (so byte order is numeric
//             order and the file reads the same on every host);
//             value: the framed image record of tnRuntime/ImageRecord.h.
//   "meta"    "format"        -> "TARNSTOR" + format version, 4 bytes LE (1)
//             "next-identity" -> the identity counter, 8 bytes LE
//             "root:<name>"   -> the identity of root <name>, 8 bytes LE
//             "counter:<name>" -> the value of counter <name>, 8 bytes LE
// A directory whose environment has no "meta" database with this format
// marker is not a store and is refused.
//
// Decisions:
// - Atomicity: a Commit is one LMDB write transaction (images written, images
//   deleted, roots, counter). LMDB's copy-on-write pages and its two meta
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
// - Snapshots: a ReadOnly store holds one LMDB read transaction from Open to
//   its destruction. Every read of it (Load, FindRoot, Roots, FindCounter,
//   NextIdentity, ForEachIdentity, Stats) sees the commit that was the
//   latest when it was opened, whatever the writer commits meanwhile; open
//   it again to see newer commits. While it is open the writer cannot reuse
//   the pages of that commit, so the file grows faster: keep readers short.
//   A writable store reads the latest commit at every call.
// - Threads: every member may be called from any thread; calls are serialised
//   by an internal mutex. A store must not be used in a child after fork().
// - Faults: a missing directory (when it must exist), a directory that is not
//   a store, a foreign or damaged file, permission problems and damaged
//   records are all reported as RuntimeError naming the directory and, for a
//   record, the identity. The record frame guards the image bytes. LMDB
//   trusts its own pages, so before it maps the files (tnRuntime/
//   LmdbFileCheck.h) data.mdb is checked against its meta pages (a short file
//   would fault when touched) and its branch and leaf pages are walked, and
//   lock.mdb's header is checked: a damaged lock file nobody uses is made
//   anew and reported in Repairs(). Damage LMDB detects itself
//   (MDB_CORRUPTED) arrives as a RuntimeError too. A write failed for a full
//   disk says "no space left on device". Misuse by the caller (writing
//   identity 0, committing to a read-only store) asserts.

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "tnRuntime/IStore.h"

struct MDB_env;
struct MDB_txn;

namespace tarn {

enum class OpenMode {
    CreateIfMissing,  // make the directory and an empty store when there is none
    MustExist,        // the directory must already hold a store
    ReadOnly,         // an existing store, read as one snapshot beside any writer; Commit asserts
};

struct LmdbStoreOptions {
    static constexpr std::size_t kDefaultMapSize = std::size_t{1} << 30;

    OpenMode mode = OpenMode::CreateIfMissing;
    // Sync data and meta pages at each commit. Turning it off keeps the store
    // consistent after a crash of the process, but a crash of the machine may
    // lose the latest commits; meant for scratch stores only.
    bool syncOnCommit = true;
    std::size_t initialMapSize = kDefaultMapSize;
};

class LmdbStore : public IStore {
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
    StoreStats Stats() override;

    // The named counter as the latest commit holds it, also for a ReadOnly
    // store (whose other reads see its snapshot).
    std::optional<uint64> FindLatestCounter(std::string_view name);
    // Writes a copy of the environment as of the latest commit into the
    // existing directory `dir`, as its data.mdb (which must not exist yet),
    // synced. `compact` leaves out free pages and renumbers the rest, so the
    // copy is as small as its contents. Runs beside the writer; a copy holds
    // one commit, whatever the writer commits meanwhile.
    void CopyTo(const std::string& dir, bool compact);
    // The bytes of the data file that the latest commit uses, or (when
    // `withoutFreePages`) about what a compacting copy of it takes.
    uint64 DataBytes(bool withoutFreePages = false);

    const std::string& Directory() const { return m_dir; }
    // What opening repaired (a lock file made anew), one line each.
    const std::vector<std::string>& Repairs() const { return m_repairs; }
    // The current upper bound of the data file; grows as commits need it.
    std::size_t MapSize();

private:
    class ReadScope;
    class LatestRead;

    LmdbStore(std::string dir, const LmdbStoreOptions& options);

    void LockDirectory();
    void OpenEnvironment();
    void OpenDatabases(OpenMode mode);
    void BeginSnapshot();
    void CheckFormat(MDB_txn* txn);
    template <class Apply>
    void WriteTransaction(Apply&& apply);
    void GrowMap();
    MDB_txn* BeginRead();
    uint64 ReadMeta64(MDB_txn* txn, std::string_view key, bool* found);

    [[noreturn]] void Fail(const std::string& what,
                           RuntimeError::Category category = RuntimeError::Category::Other) const;
    void Check(int rc, std::string_view doing) const;

    std::string m_dir;
    LmdbStoreOptions m_options;
    bool m_readOnly = false;
    int m_dirFd = -1;                         // holds a writer's flock
    bool m_registered = false;                // the directory is entered as open in this process
    std::pair<uint64, uint64> m_dirId{0, 0};  // the directory's device and inode
    MDB_env* m_env = nullptr;
    // A writer's reader: a reset read transaction, renewed per read. A
    // ReadOnly store's snapshot: one read transaction for its lifetime.
    MDB_txn* m_reader = nullptr;
    unsigned int m_images = 0;  // LMDB database handles (MDB_dbi)
    unsigned int m_meta = 0;
    std::vector<std::string> m_repairs;
    std::mutex m_mutex;
};

// Opens the on-disk store in `dir` as an IStore, for tools and embedders that
// need nothing beyond the interface.
std::unique_ptr<IStore> OpenStore(const std::string& dir,
                                  OpenMode mode = OpenMode::CreateIfMissing);

}  // namespace tarn
