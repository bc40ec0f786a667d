// Opening the environment and its databases, committing, and how failures
// are reported. The other parts are listed in LmdbInternal.h.

#include <cstring>
#include <limits>
#include <vector>

#include "tnBackends/ImageRecord.h"
#include "tnBackends/LmdbFileCheck.h"
#include "tnUtils/Assert.h"

#include "tnBackends/LmdbInternal.h"

namespace tarn {

static_assert(std::is_same_v<MDB_dbi, unsigned int>, "database handles are kept as unsigned int");

std::unique_ptr<LmdbStore> LmdbStore::Open(const std::string& dir, OpenMode mode) {
    LmdbStoreOptions options;
    options.mode = mode;
    return Open(dir, options);
}

std::unique_ptr<LmdbStore> LmdbStore::Open(const std::string& dir,
                                           const LmdbStoreOptions& options) {
    PrepareDirectory(dir, options.mode);
    std::unique_ptr<LmdbStore> store(new LmdbStore(dir, options));
    // The lock comes first: LMDB must not touch a store another opener uses.
    store->LockDirectory();
    // LMDB maps the files it is given: a short or damaged one is caught first.
    const bool writer = options.mode != OpenMode::ReadOnly;
    CheckLmdbDataFile(dir, writer);
    // A reader of a store it may not write (another user's, a read-only
    // mount) cannot take a slot in LMDB's lock file: it reads without one.
    store->m_withoutLock = !writer && !LockFileWritable(dir);
    if (!store->m_withoutLock) {
        if (std::optional<std::string> repair = CheckLmdbLockFile(dir, writer)) {
            store->m_repairs.push_back(std::move(*repair));
        }
    }
    store->OpenEnvironment();
    store->OpenDatabases(options.mode);
    if (store->m_readOnly) {
        store->BeginSnapshot();
        *store->m_state = store->ReadState(store->m_reader, &store->m_foundVersion, nullptr);
    }
    return store;
}

LmdbStore::LmdbStore(std::string dir, const LmdbStoreOptions& options)
    : m_dir(std::move(dir)),
      m_options(options),
      m_readOnly(options.mode == OpenMode::ReadOnly),
      m_state(std::make_unique<LmdbStoreState>()) {}

LmdbStore::~LmdbStore() {
    if (m_reader != nullptr) {
        mdb_txn_abort(m_reader);
    }
    if (m_env != nullptr) {
        mdb_env_close(m_env);
    }
    UnlockDirectory();
}

void LmdbStore::OpenEnvironment() {
    InstallFaultHandler();
    Check(mdb_env_create(&m_env), "creating the environment");
    // (A library built without assertions takes no callback; nothing is lost.)
    mdb_env_set_assert(m_env, OnLmdbAssertion);
    Check(mdb_env_set_maxdbs(m_env, 2), "configuring the environment");
    Check(mdb_env_set_mapsize(m_env, m_options.initialMapSize), "setting the map size");
    unsigned int flags = MDB_NOTLS;
    if (m_readOnly) {
        flags |= MDB_RDONLY;
    }
    if (m_withoutLock) {
        flags |= MDB_NOLOCK;
    }
    if (!m_options.syncOnCommit) {
        flags |= MDB_NOSYNC;
    }
    const int rc = mdb_env_open(m_env, m_dir.c_str(), flags, 0644);
    if (rc == MDB_INVALID) {
        Fail("not a store: data.mdb is not an LMDB file");
    }
    if (rc == MDB_VERSION_MISMATCH) {
        Fail("not readable: data.mdb was written by an incompatible LMDB version");
    }
    Check(rc, "opening the environment");
    FindMap();
    MDB_stat stat;
    CheckGuarded("reading the page size", [&]() noexcept { return mdb_env_stat(m_env, &stat); });
    m_pageSize = stat.ms_psize;
    // Readers left behind by a process that died holding them.
    int dead = 0;
    Check(mdb_reader_check(m_env, &dead), "clearing stale readers");
}

// Sets the map's size (0: the size the file's meta page names); LMDB maps
// the file anew.
void LmdbStore::SetMapSize(std::size_t size, const char* doing) {
    CheckGuarded(doing, [&]() noexcept { return mdb_env_set_mapsize(m_env, size); });
    FindMap();
}

// Opens the meta database in `txn`; false when the environment has none.
bool LmdbStore::OpenMetaDatabase(MDB_txn* txn) {
    const int rc = Guarded("opening the meta database",
                           [&]() noexcept { return mdb_dbi_open(txn, kMetaDb, 0, &m_meta); });
    if (rc == MDB_NOTFOUND) {
        return false;
    }
    Check(rc, "opening the meta database");
    return true;
}

void LmdbStore::OpenImagesDatabase(MDB_txn* txn) {
    const int rc = Guarded("opening the images database",
                           [&]() noexcept { return mdb_dbi_open(txn, kImagesDb, 0, &m_images); });
    if (rc == MDB_NOTFOUND) {
        Fail("damaged store: the \"images\" database is missing", RuntimeError::Category::Damaged);
    }
    Check(rc, "opening the images database");
}

// A ReadOnly store's databases; it reads its meta record from its snapshot
// afterwards.
void LmdbStore::OpenDatabasesForReading() {
    MDB_txn* txn = nullptr;
    CheckGuarded("beginning a read transaction",
                 [&]() noexcept { return mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &txn); });
    try {
        if (!OpenMetaDatabase(txn)) {
            Fail("not a store: the environment has no \"meta\" database");
        }
        OpenImagesDatabase(txn);
    } catch (...) {
        mdb_txn_abort(txn);
        throw;
    }
    // Committing (not aborting) keeps the database handles for the store.
    CheckGuarded("opening the databases", [&]() noexcept { return mdb_txn_commit(txn); });
}

// A new environment is made a store; one with other contents is somebody
// else's.
void LmdbStore::CreateDatabases(MDB_txn* txn) {
    MDB_dbi main = 0;
    MDB_stat stat;
    CheckGuarded("examining the environment", [&]() noexcept {
        const int opened = mdb_dbi_open(txn, nullptr, 0, &main);
        return opened != MDB_SUCCESS ? opened : mdb_stat(txn, main, &stat);
    });
    if (stat.ms_entries != 0) {
        Fail("not a store: an LMDB environment with other contents");
    }
    CheckGuarded("creating the databases", [&]() noexcept {
        const int meta = mdb_dbi_open(txn, kMetaDb, MDB_CREATE, &m_meta);
        return meta != MDB_SUCCESS ? meta : mdb_dbi_open(txn, kImagesDb, MDB_CREATE, &m_images);
    });
}

// The upgrade of a format-1 store, in the writer's opening transaction: the
// pages checked (see WritablePages), the image bytes counted once, the meta
// values moved into the meta record and their old keys removed.
void LmdbStore::UpgradeFormat1(MDB_txn* txn, LmdbStoreState& state,
                               const std::vector<std::string>& oldKeys) {
    WritablePages();
    state.imageBytes = SumImageBytes(txn);
    state.imageBytesKnown = true;
    for (const std::string& old : oldKeys) {
        MDB_val key = Val(old);
        CheckGuarded("upgrading the store",
                     [&]() noexcept { return mdb_del(txn, m_meta, &key, nullptr); });
    }
    WriteState(txn, state);
}

// Opens the two databases. A writer reads and verifies the meta record here;
// it makes a new store, and upgrades a format-1 store, in this same write
// transaction.
void LmdbStore::OpenDatabases(OpenMode mode) {
    if (m_readOnly) {
        OpenDatabasesForReading();
        return;
    }
    LmdbStoreState state;
    uint32 found = kFormatVersion;
    bool upgraded = false;
    WriteTransaction([&](MDB_txn* txn) {
        upgraded = false;
        if (!OpenMetaDatabase(txn)) {
            if (mode != OpenMode::CreateIfMissing) {
                Fail("not a store: the environment has no \"meta\" database");
            }
            CreateDatabases(txn);
            state = LmdbStoreState{};
            found = kFormatVersion;
            WriteState(txn, state);
            return;
        }
        OpenImagesDatabase(txn);
        std::vector<std::string> oldKeys;
        state = ReadState(txn, &found, &oldKeys);
        if (found == kFormat1) {
            UpgradeFormat1(txn, state, oldKeys);
            upgraded = true;
        }
    });
    *m_state = std::move(state);
    m_foundVersion = found;
    if (upgraded) {
        m_repairs.push_back(
            "upgraded the store from format 1 to 2: its meta values are now "
            "one record under a checksum");
    }
}

void LmdbStore::GrowMap() {
    MDB_envinfo info;
    CheckGuarded("reading the map size", [&]() noexcept { return mdb_env_info(m_env, &info); });
    const std::size_t current = info.me_mapsize;
    if (current > std::numeric_limits<std::size_t>::max() / 2) {
        Fail("the map cannot grow beyond " + std::to_string(current) + " bytes");
    }
    SetMapSize(current * 2, "growing the map");
}

void LmdbStore::Commit(const CommitBatch& batch) {
    TARN_ASSERT(!m_readOnly);
    for (const auto& write : batch.writes) {
        TARN_ASSERT(write.first != 0);
    }
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    WritablePages();
    // The new meta values are made in a copy, which replaces the store's
    // once the transaction has committed: a failed commit leaves them as
    // they were.
    LmdbStoreState next;
    // Writes go first and deletions after them: an identity both written and
    // deleted in one batch ends up without an image. Deleting an identity the
    // store has no image for is not an error.
    WriteTransaction([&](MDB_txn* txn) {
        next = *m_state;  // afresh whenever the transaction is run again
        const auto put = [&](uint64 oid, const StoredImage& image) {
            PutImage(txn, oid, image, next);
        };
        for (const auto& [oid, image] : batch.writes) {
            put(oid, image);
        }
        if (batch.streamedWrites) {
            batch.streamedWrites(put);
        }
        for (const uint64 oid : batch.deletes) {
            DeleteImage(txn, oid, next);
        }
        SetNamedValues(batch, next);
        WriteState(txn, next);
    });
    *m_state = std::move(next);
    ReleaseMappedPages();
}

// The image bytes follow every change: the size of a record replaced or
// deleted is looked up first. That is one more descent of the tree per
// image, through the pages the write or the deletion then changes anyway, so
// it reads no page the commit would not read; the record itself (on its
// overflow pages, when large) is not read.
void LmdbStore::PutImage(MDB_txn* txn, uint64 oid, const StoredImage& image, LmdbStoreState& next) {
    TARN_ASSERT(oid != 0);
    const auto keyBytes = IdentityKey(oid);
    MDB_val key = Val(keyBytes.data(), keyBytes.size());
    MDB_val old;
    MDB_val value{ImageRecordSize(image), nullptr};
    int found = MDB_NOTFOUND;
    const int rc = Guarded("committing", [&]() noexcept {
        found = mdb_get(txn, m_images, &key, &old);
        if (found != MDB_SUCCESS && found != MDB_NOTFOUND) {
            return found;
        }
        return mdb_put(txn, m_images, &key, &value, MDB_RESERVE);
    });
    if (rc != MDB_SUCCESS) {
        Check(rc, "commit: writing image " + OidText(oid));
    }
    EncodeImageRecord(oid, image, static_cast<octet_t*>(value.mv_data));
    if (found == MDB_SUCCESS) {
        Uncount(next, old.mv_size);
    }
    next.imageBytes += value.mv_size;
}

void LmdbStore::DeleteImage(MDB_txn* txn, uint64 oid, LmdbStoreState& next) {
    const auto keyBytes = IdentityKey(oid);
    MDB_val key = Val(keyBytes.data(), keyBytes.size());
    MDB_val old;
    const int rc = Guarded("committing", [&]() noexcept {
        const int found = mdb_get(txn, m_images, &key, &old);
        return found != MDB_SUCCESS ? found : mdb_del(txn, m_images, &key, nullptr);
    });
    if (rc == MDB_NOTFOUND) {
        return;
    }
    Check(rc, "commit: deleting image " + OidText(oid));
    Uncount(next, old.mv_size);
}

// The batch's roots, counters and identity counter, into `next`.
void LmdbStore::SetNamedValues(const CommitBatch& batch, LmdbStoreState& next) {
    for (const auto& [name, oid] : batch.roots) {
        if (name.size() > kMaxNameBytes) {
            Fail("commit: setting root '" + name + "': " + NameTooLong(name));
        }
        next.roots.insert_or_assign(name, oid);
    }
    for (const auto& [name, value] : batch.counters) {
        if (name.size() > kMaxNameBytes) {
            Fail("commit: setting counter '" + name + "': " + NameTooLong(name));
        }
        next.counters.insert_or_assign(name, value);
    }
    next.nextIdentity = batch.nextIdentity;
}

void LmdbStore::Fail(const std::string& what, RuntimeError::Category category) const {
    FailAt(m_dir, what, category);
}

// LMDB's codes for damage it found in its pages poison the store as a fault
// does: LMDB refuses to go on with a transaction that met one (a ReadOnly
// store's snapshot among them), and a writer must not go on changing a tree
// it found damaged.
void LmdbStore::Check(int rc, std::string_view doing) {
    if (rc == MDB_SUCCESS) {
        return;
    }
    if (rc == MDB_MAP_FULL) {
        throw MapFull{};
    }
    if (rc == MDB_PAGE_NOTFOUND || rc == MDB_CORRUPTED || rc == MDB_CURSOR_FULL ||
        rc == kPastTheMap) {
        m_poisoned = "store '" + m_dir + "': damaged store: " + std::string(doing) + ": " +
                     (rc == kPastTheMap ? "LMDB places a key or value past the end of its map"
                                        : mdb_strerror(rc));
        throw RuntimeError(RuntimeError::Category::Damaged, m_poisoned);
    }
    Fail(std::string(doing) + ": " + LmdbFailureText(m_dir, rc, mdb_strerror(rc)),
         rc > 0 ? RuntimeError::CategoryOfErrno(rc) : RuntimeError::Category::Other);
}

std::unique_ptr<IStore> OpenStore(const std::string& dir, OpenMode mode) {
    return LmdbStore::Open(dir, mode);
}

uint64 LmdbStore::DataBytes(bool withoutFreePages) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    MDB_envinfo info;
    CheckGuarded("reading the environment's size",
                 [&]() noexcept { return mdb_env_info(m_env, &info); });
    uint64 pages = static_cast<uint64>(info.me_last_pgno) + 1;
    if (withoutFreePages) {
        // LMDB's free list is its database 0: a record per transaction whose
        // value is an array of page numbers, the first element their count.
        LatestRead read(*this);
        Cursor cursor(*this, read.Txn(), 0, "reading the free list");
        MDB_val key;
        MDB_val value;
        uint64 free = 0;
        int rc = 0;
        while ((rc = cursor.Get(&key, &value, MDB_NEXT, Cursor::Touching::KeyAndValue)) ==
               MDB_SUCCESS) {
            if (value.mv_size >= sizeof(std::size_t)) {
                std::size_t count;
                std::memcpy(&count, value.mv_data, sizeof count);
                free += count;
            }
        }
        if (rc != MDB_NOTFOUND) {
            Check(rc, "reading the free list");
        }
        pages -= std::min(free, pages);
    }
    return pages * m_pageSize;
}

std::size_t LmdbStore::MapSize() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    MDB_envinfo info;
    CheckGuarded("reading the map size", [&]() noexcept { return mdb_env_info(m_env, &info); });
    return info.me_mapsize;
}

}  // namespace tarn
