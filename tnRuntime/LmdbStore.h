#pragma once

// The embedded on-disk store: object images, named roots and the identity
// counter in one LMDB environment inside a directory.
//
// Directory contents: LMDB's "data.mdb" and "lock.mdb", nothing else. The
// environment holds two named databases:
//   "images"  key: identity, 8 bytes big-endian (so byte order is numeric
//             order and the file reads the same on every host);
//             value: the framed image record of tnRuntime/ImageRecord.h.
//   "meta"    "format"        -> "TARNSTOR" + format version, 4 bytes LE (1)
//             "next-identity" -> the identity counter, 8 bytes LE
//             "root:<name>"   -> the identity of root <name>, 8 bytes LE
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
// - One opener at a time: Open takes a flock on the directory before LMDB
//   touches it, exclusive for a writable store and shared for ReadOnly. A
//   second opener, in this or another process, is refused at once with a
//   RuntimeError ("in use") rather than left waiting. Read-only openers may
//   share a store with each other, not with a writer.
// - Threads: every member may be called from any thread; calls are serialised
//   by an internal mutex. A store must not be used in a child after fork().
// - Faults: a missing directory (when it must exist), a directory that is not
//   a store, a foreign or damaged file, permission problems and damaged
//   records are all reported as RuntimeError naming the directory and, for a
//   record, the identity. The record frame guards the image bytes; LMDB's own
//   page structure is LMDB's to check, and the damage it detects
//   (MDB_CORRUPTED) arrives as a RuntimeError too. Misuse by the caller
//   (writing identity 0, committing to a read-only store) asserts.

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>

#include "tnRuntime/IStore.h"

struct MDB_env;
struct MDB_txn;

namespace tarn {

enum class OpenMode {
    CreateIfMissing,  // make the directory and an empty store when there is none
    MustExist,        // the directory must already hold a store
    ReadOnly,         // an existing store, for reading only; Commit asserts
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
    uint64 NextIdentity() override;
    void Commit(const CommitBatch& batch) override;
    void ForEachIdentity(const std::function<void(uint64)>& fn) override;
    StoreStats Stats() override;

    const std::string& Directory() const { return m_dir; }
    // The current upper bound of the data file; grows as commits need it.
    std::size_t MapSize();

private:
    class ReadScope;

    LmdbStore(std::string dir, const LmdbStoreOptions& options);

    void LockDirectory();
    void OpenEnvironment();
    void OpenDatabases(OpenMode mode);
    void CheckFormat(MDB_txn* txn);
    template <class Apply>
    void WriteTransaction(Apply&& apply);
    void GrowMap();
    MDB_txn* BeginRead();
    uint64 ReadMetaIdentity(MDB_txn* txn, std::string_view key, bool* found);

    [[noreturn]] void Fail(const std::string& what) const;
    void Check(int rc, std::string_view doing) const;

    std::string m_dir;
    LmdbStoreOptions m_options;
    bool m_readOnly = false;
    int m_dirFd = -1;  // holds the opener's flock
    MDB_env* m_env = nullptr;
    MDB_txn* m_reader = nullptr;  // a reset read transaction, renewed per read
    unsigned int m_images = 0;    // LMDB database handles (MDB_dbi)
    unsigned int m_meta = 0;
    std::mutex m_mutex;
};

// Opens the on-disk store in `dir` as an IStore, for tools and embedders that
// need nothing beyond the interface.
std::unique_ptr<IStore> OpenStore(const std::string& dir,
                                  OpenMode mode = OpenMode::CreateIfMissing);

}  // namespace tarn
