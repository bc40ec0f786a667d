#include "tnRuntime/LmdbStore.h"

// Without LMDB the library builds without the on-disk store.
#ifdef TARN_HAVE_LMDB

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <limits>
#include <set>
#include <span>
#include <type_traits>
#include <utility>
#include <vector>

#include <lmdb.h>

#include "tnRuntime/ImageRecord.h"
#include "tnRuntime/LmdbFileCheck.h"
#include "tnUtils/Assert.h"
#include "tnUtils/UniqueFd.h"

namespace tarn {

static_assert(std::is_same_v<MDB_dbi, unsigned int>, "database handles are kept as unsigned int");

namespace {

namespace fs = std::filesystem;

constexpr const char* kImagesDb = "images";
constexpr const char* kMetaDb = "meta";
constexpr std::string_view kFormatKey = "format";
constexpr std::string_view kNextIdentityKey = "next-identity";
constexpr std::string_view kRootPrefix = "root:";
constexpr std::string_view kCounterPrefix = "counter:";
constexpr std::string_view kFormatMagic = "TARNSTOR";
constexpr uint32 kFormatVersion = 1;
// ForEachIdentity reads identities in chunks of this many, so that the
// callback runs with no transaction open and may use the store itself.
constexpr std::size_t kIdentityChunk = 1024;

// Raised inside a write transaction when the map is full; the transaction is
// aborted, the map grown and the transaction run again.
struct MapFull {};

[[noreturn]] void FailAt(const std::string& dir, const std::string& what,
                         RuntimeError::Category category = RuntimeError::Category::Other) {
    throw RuntimeError(category, "LMDB store '" + dir + "': " + what);
}

MDB_val Val(const void* data, std::size_t size) {
    return MDB_val{size, const_cast<void*>(data)};
}

MDB_val Val(std::string_view text) {
    return Val(text.data(), text.size());
}

std::array<octet_t, 8> IdentityKey(uint64 oid) {
    std::array<octet_t, 8> key;
    for (int i = 0; i < 8; ++i) {
        key[i] = static_cast<octet_t>(oid >> (56 - 8 * i));
    }
    return key;
}

uint64 IdentityOfKey(const MDB_val& key) {
    const auto* bytes = static_cast<const octet_t*>(key.mv_data);
    uint64 oid = 0;
    for (int i = 0; i < 8; ++i) {
        oid = (oid << 8) | bytes[i];
    }
    return oid;
}

std::array<octet_t, 8> Le64(uint64 value) {
    std::array<octet_t, 8> bytes;
    for (int i = 0; i < 8; ++i) {
        bytes[i] = static_cast<octet_t>(value >> (8 * i));
    }
    return bytes;
}

uint64 FromLe64(const MDB_val& val) {
    const auto* bytes = static_cast<const octet_t*>(val.mv_data);
    uint64 value = 0;
    for (int i = 7; i >= 0; --i) {
        value = (value << 8) | bytes[i];
    }
    return value;
}

std::string MetaKey(std::string_view prefix, std::string_view name) {
    std::string key(prefix);
    key += name;
    return key;
}

// The store directories open in this process, by device and inode. A child
// made by fork() inherits the set but none of the stores in it (it must not
// use them, and LMDB's locks are not inherited): it starts with an empty set.
std::mutex g_openDirsMutex;
std::set<std::pair<uint64, uint64>> g_openDirs;
pid_t g_openDirsPid = 0;  // the process the set belongs to

std::string OidText(uint64 oid) {
    return "#" + std::to_string(oid);
}

// Checks what is at `dir` before LMDB sees it, creating the directory when
// the mode allows. A directory with files but no data.mdb is not taken over.
void PrepareDirectory(const std::string& dir, OpenMode mode) {
    std::error_code ec;
    const fs::file_status status = fs::status(dir, ec);
    if (status.type() == fs::file_type::not_found) {
        if (mode != OpenMode::CreateIfMissing) {
            FailAt(dir, "directory does not exist", RuntimeError::Category::NotFound);
        }
        fs::create_directories(dir, ec);
        if (ec) {
            FailAt(dir, "cannot create the directory: " + ec.message());
        }
        return;
    }
    if (ec) {
        FailAt(dir, "cannot examine the path: " + ec.message());
    }
    if (!fs::is_directory(status)) {
        FailAt(dir, "not a directory");
    }
    const fs::file_status data = fs::status(fs::path(dir) / "data.mdb", ec);
    if (data.type() != fs::file_type::not_found) {
        if (ec) {
            FailAt(dir, "cannot examine data.mdb: " + ec.message());
        }
        if (!fs::is_regular_file(data)) {
            FailAt(dir, "not a store: data.mdb is not a regular file");
        }
        return;
    }
    if (mode != OpenMode::CreateIfMissing) {
        FailAt(dir, "not a store: the directory holds no data.mdb");
    }
    for (fs::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
        if (it->path().filename() != "lock.mdb") {
            FailAt(dir, "not a store: the directory holds other files and no data.mdb");
        }
    }
    if (ec) {
        FailAt(dir, "cannot list the directory: " + ec.message());
    }
}

// An open cursor, closed when the scope ends.
class Cursor {
public:
    Cursor(MDB_txn* txn, MDB_dbi dbi, int* rc) { *rc = mdb_cursor_open(txn, dbi, &m_cursor); }
    ~Cursor() {
        if (m_cursor != nullptr) {
            mdb_cursor_close(m_cursor);
        }
    }
    Cursor(const Cursor&) = delete;
    Cursor& operator=(const Cursor&) = delete;

    int Get(MDB_val* key, MDB_val* data, MDB_cursor_op op) {
        return mdb_cursor_get(m_cursor, key, data, op);
    }

private:
    MDB_cursor* m_cursor = nullptr;
};

}  // namespace

// A read transaction for the length of one call: a writer's reader renewed
// on entry and reset on exit, or a reader's snapshot, kept.
class LmdbStore::ReadScope {
public:
    explicit ReadScope(LmdbStore& store) : m_txn(store.BeginRead()), m_keep(store.m_readOnly) {}
    ~ReadScope() {
        if (!m_keep) {
            mdb_txn_reset(m_txn);
        }
    }
    ReadScope(const ReadScope&) = delete;
    ReadScope& operator=(const ReadScope&) = delete;

    MDB_txn* Txn() const { return m_txn; }

private:
    MDB_txn* m_txn;
    bool m_keep;
};

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
    if (std::optional<std::string> repair = CheckLmdbLockFile(dir, writer)) {
        store->m_repairs.push_back(std::move(*repair));
    }
    store->OpenEnvironment();
    store->OpenDatabases(options.mode);
    if (store->m_readOnly) {
        store->BeginSnapshot();
    }
    return store;
}

LmdbStore::LmdbStore(std::string dir, const LmdbStoreOptions& options)
    : m_dir(std::move(dir)), m_options(options), m_readOnly(options.mode == OpenMode::ReadOnly) {}

LmdbStore::~LmdbStore() {
    if (m_reader != nullptr) {
        mdb_txn_abort(m_reader);
    }
    if (m_env != nullptr) {
        mdb_env_close(m_env);
    }
    if (m_registered) {
        std::lock_guard<std::mutex> lock(g_openDirsMutex);
        if (g_openDirsPid == ::getpid()) {
            g_openDirs.erase(m_dirId);
        }
    }
    if (m_dirFd >= 0) {
        ::close(m_dirFd);
    }
}

// Enters the directory as open in this process (refused when it already
// is) and, for a writer, takes the exclusive flock.
void LmdbStore::LockDirectory() {
    m_dirFd = ::open(m_dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (m_dirFd < 0) {
        Fail(std::string("cannot open the directory: ") + std::strerror(errno));
    }
    struct stat st;
    if (::fstat(m_dirFd, &st) != 0) {
        Fail(std::string("cannot examine the directory: ") + std::strerror(errno));
    }
    m_dirId = {static_cast<uint64>(st.st_dev), static_cast<uint64>(st.st_ino)};
    {
        std::lock_guard<std::mutex> lock(g_openDirsMutex);
        if (g_openDirsPid != ::getpid()) {
            g_openDirs.clear();
            g_openDirsPid = ::getpid();
        }
        if (!g_openDirs.insert(m_dirId).second) {
            Fail("in use: the store is already open in this process",
                 RuntimeError::Category::InUse);
        }
        m_registered = true;
    }
    if (m_readOnly) {
        return;
    }
    if (::flock(m_dirFd, LOCK_EX | LOCK_NB) != 0) {
        if (errno == EWOULDBLOCK) {
            Fail("in use: another writer (in this or another process) holds the store",
                 RuntimeError::Category::InUse);
        }
        Fail(std::string("cannot lock the directory: ") + std::strerror(errno));
    }
}

void LmdbStore::OpenEnvironment() {
    Check(mdb_env_create(&m_env), "creating the environment");
    Check(mdb_env_set_maxdbs(m_env, 2), "configuring the environment");
    Check(mdb_env_set_mapsize(m_env, m_options.initialMapSize), "setting the map size");
    unsigned int flags = MDB_NOTLS;
    if (m_readOnly) {
        flags |= MDB_RDONLY;
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
    // Readers left behind by a process that died holding them.
    int dead = 0;
    Check(mdb_reader_check(m_env, &dead), "clearing stale readers");
}

void LmdbStore::OpenDatabases(OpenMode mode) {
    if (m_readOnly) {
        MDB_txn* txn = nullptr;
        Check(mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &txn), "beginning a read transaction");
        try {
            const int rc = mdb_dbi_open(txn, kMetaDb, 0, &m_meta);
            if (rc == MDB_NOTFOUND) {
                Fail("not a store: the environment has no \"meta\" database");
            }
            Check(rc, "opening the meta database");
            CheckFormat(txn);
            const int rcImages = mdb_dbi_open(txn, kImagesDb, 0, &m_images);
            if (rcImages == MDB_NOTFOUND) {
                Fail("damaged store: the \"images\" database is missing",
                     RuntimeError::Category::Damaged);
            }
            Check(rcImages, "opening the images database");
        } catch (...) {
            mdb_txn_abort(txn);
            throw;
        }
        // Committing (not aborting) keeps the database handles for the store.
        Check(mdb_txn_commit(txn), "opening the databases");
        return;
    }
    WriteTransaction([&](MDB_txn* txn) {
        const int rc = mdb_dbi_open(txn, kMetaDb, 0, &m_meta);
        if (rc == MDB_NOTFOUND) {
            if (mode != OpenMode::CreateIfMissing) {
                Fail("not a store: the environment has no \"meta\" database");
            }
            // A new environment is made a store; one with other contents is
            // somebody else's.
            MDB_dbi main = 0;
            MDB_stat stat;
            Check(mdb_dbi_open(txn, nullptr, 0, &main), "opening the main database");
            Check(mdb_stat(txn, main, &stat), "examining the environment");
            if (stat.ms_entries != 0) {
                Fail("not a store: an LMDB environment with other contents");
            }
            Check(mdb_dbi_open(txn, kMetaDb, MDB_CREATE, &m_meta), "creating the meta database");
            Check(mdb_dbi_open(txn, kImagesDb, MDB_CREATE, &m_images),
                  "creating the images database");
            std::string format(kFormatMagic);
            for (int i = 0; i < 4; ++i) {
                format += static_cast<char>(kFormatVersion >> (8 * i));
            }
            MDB_val key = Val(kFormatKey);
            MDB_val value = Val(format);
            Check(mdb_put(txn, m_meta, &key, &value, 0), "writing the format marker");
            const auto first = Le64(1);
            key = Val(kNextIdentityKey);
            value = Val(first.data(), first.size());
            Check(mdb_put(txn, m_meta, &key, &value, 0), "writing the identity counter");
            return;
        }
        Check(rc, "opening the meta database");
        CheckFormat(txn);
        const int rcImages = mdb_dbi_open(txn, kImagesDb, 0, &m_images);
        if (rcImages == MDB_NOTFOUND) {
            Fail("damaged store: the \"images\" database is missing",
                 RuntimeError::Category::Damaged);
        }
        Check(rcImages, "opening the images database");
    });
}

void LmdbStore::CheckFormat(MDB_txn* txn) {
    MDB_val key = Val(kFormatKey);
    MDB_val value;
    const int rc = mdb_get(txn, m_meta, &key, &value);
    if (rc == MDB_NOTFOUND) {
        Fail("not a store: no format marker");
    }
    Check(rc, "reading the format marker");
    const std::string_view marker(static_cast<const char*>(value.mv_data), value.mv_size);
    if (marker.size() != kFormatMagic.size() + 4 || !marker.starts_with(kFormatMagic)) {
        Fail("not a store: unrecognised format marker");
    }
    uint32 version = 0;
    for (int i = 3; i >= 0; --i) {
        version = (version << 8) | static_cast<unsigned char>(marker[kFormatMagic.size() + i]);
    }
    if (version != kFormatVersion) {
        Fail("store format version " + std::to_string(version) +
             " is not supported (this program " + "reads version " +
             std::to_string(kFormatVersion) + ")");
    }
}

// Runs `apply` in a write transaction and commits it; when the map fills
// up, anywhere in between, the transaction is dropped, the map doubled and
// the whole transaction run again.
template <class Apply>
void LmdbStore::WriteTransaction(Apply&& apply) {
    for (;;) {
        MDB_txn* txn = nullptr;
        int rc = mdb_txn_begin(m_env, nullptr, 0, &txn);
        if (rc == MDB_MAP_RESIZED) {
            Check(mdb_env_set_mapsize(m_env, 0), "adopting the grown map size");
            continue;
        }
        Check(rc, "beginning a write transaction");
        try {
            apply(txn);
        } catch (const MapFull&) {
            mdb_txn_abort(txn);
            GrowMap();
            continue;
        } catch (...) {
            mdb_txn_abort(txn);
            throw;
        }
        rc = mdb_txn_commit(txn);  // frees the transaction, committed or not
        if (rc == MDB_MAP_FULL) {
            GrowMap();
            continue;
        }
        Check(rc, "committing");
        return;
    }
}

void LmdbStore::GrowMap() {
    MDB_envinfo info;
    Check(mdb_env_info(m_env, &info), "reading the map size");
    const std::size_t current = info.me_mapsize;
    if (current > std::numeric_limits<std::size_t>::max() / 2) {
        Fail("the map cannot grow beyond " + std::to_string(current) + " bytes");
    }
    Check(mdb_env_set_mapsize(m_env, current * 2),
          "growing the map to " + std::to_string(current * 2) + " bytes");
}

// A reader's snapshot. The writer may have grown the map since this
// environment was opened; the map size is adopted from the file first (no
// transaction of this environment is open yet), and again should the writer
// grow it in between.
void LmdbStore::BeginSnapshot() {
    for (int attempt = 0;; ++attempt) {
        Check(mdb_env_set_mapsize(m_env, 0), "adopting the map size");
        const int rc = mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &m_reader);
        if (rc == MDB_SUCCESS) {
            return;
        }
        m_reader = nullptr;
        if (rc != MDB_MAP_RESIZED || attempt == 3) {
            Check(rc, "beginning the read snapshot");
        }
    }
}

MDB_txn* LmdbStore::BeginRead() {
    if (m_readOnly) {
        return m_reader;  // the snapshot
    }
    for (int attempt = 0;; ++attempt) {
        if (m_reader != nullptr) {
            if (mdb_txn_renew(m_reader) == MDB_SUCCESS) {
                return m_reader;
            }
            mdb_txn_abort(m_reader);
            m_reader = nullptr;
        }
        const int rc = mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &m_reader);
        if (rc == MDB_SUCCESS) {
            return m_reader;
        }
        m_reader = nullptr;
        if (rc == MDB_MAP_RESIZED && attempt == 0) {
            Check(mdb_env_set_mapsize(m_env, 0), "adopting the grown map size");
            continue;
        }
        Check(rc, "beginning a read transaction");
    }
}

uint64 LmdbStore::ReadMeta64(MDB_txn* txn, std::string_view key, bool* found) {
    MDB_val k = Val(key);
    MDB_val value;
    const int rc = mdb_get(txn, m_meta, &k, &value);
    *found = rc != MDB_NOTFOUND;
    if (!*found) {
        return 0;
    }
    if (rc != MDB_SUCCESS) {
        Check(rc, "reading meta entry '" + std::string(key) + "'");
    }
    if (value.mv_size != 8) {
        Fail("damaged store: meta entry '" + std::string(key) + "' has " +
                 std::to_string(value.mv_size) + " bytes, expected 8",
             RuntimeError::Category::Damaged);
    }
    return FromLe64(value);
}

std::optional<StoredImage> LmdbStore::Load(uint64 oid) {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    const auto keyBytes = IdentityKey(oid);
    MDB_val key = Val(keyBytes.data(), keyBytes.size());
    MDB_val value;
    const int rc = mdb_get(read.Txn(), m_images, &key, &value);
    if (rc == MDB_NOTFOUND) {
        return std::nullopt;
    }
    if (rc != MDB_SUCCESS) {
        Check(rc, "reading image " + OidText(oid));
    }
    try {
        return DecodeImageRecord(oid, {static_cast<const octet_t*>(value.mv_data), value.mv_size});
    } catch (const RuntimeError& e) {
        Fail(e.what());
    }
}

std::optional<uint64> LmdbStore::FindRoot(std::string_view name) {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    bool found = false;
    const uint64 oid = ReadMeta64(read.Txn(), MetaKey(kRootPrefix, name), &found);
    if (!found) {
        return std::nullopt;
    }
    return oid;
}

std::map<std::string, uint64> LmdbStore::Roots() {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    int rc = 0;
    Cursor cursor(read.Txn(), m_meta, &rc);
    Check(rc, "listing the roots");
    std::map<std::string, uint64> roots;
    MDB_val key = Val(kRootPrefix);
    MDB_val value;
    for (rc = cursor.Get(&key, &value, MDB_SET_RANGE); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT)) {
        const std::string_view name(static_cast<const char*>(key.mv_data), key.mv_size);
        if (!name.starts_with(kRootPrefix)) {
            break;
        }
        if (value.mv_size != 8) {
            Fail("damaged store: meta entry '" + std::string(name) + "' has " +
                     std::to_string(value.mv_size) + " bytes, expected 8",
                 RuntimeError::Category::Damaged);
        }
        roots.emplace(name.substr(kRootPrefix.size()), FromLe64(value));
    }
    if (rc != MDB_NOTFOUND && rc != MDB_SUCCESS) {
        Check(rc, "listing the roots");
    }
    return roots;
}

std::map<std::string, uint64> LmdbStore::Counters() {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    int rc = 0;
    Cursor cursor(read.Txn(), m_meta, &rc);
    Check(rc, "listing the counters");
    std::map<std::string, uint64> counters;
    MDB_val key = Val(kCounterPrefix);
    MDB_val value;
    for (rc = cursor.Get(&key, &value, MDB_SET_RANGE); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT)) {
        const std::string_view name(static_cast<const char*>(key.mv_data), key.mv_size);
        if (!name.starts_with(kCounterPrefix)) {
            break;
        }
        if (value.mv_size != 8) {
            Fail("damaged store: meta entry '" + std::string(name) + "' has " +
                     std::to_string(value.mv_size) + " bytes, expected 8",
                 RuntimeError::Category::Damaged);
        }
        counters.emplace(name.substr(kCounterPrefix.size()), FromLe64(value));
    }
    if (rc != MDB_NOTFOUND && rc != MDB_SUCCESS) {
        Check(rc, "listing the counters");
    }
    return counters;
}

std::optional<uint64> LmdbStore::FindCounter(std::string_view name) {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    bool found = false;
    const uint64 value = ReadMeta64(read.Txn(), MetaKey(kCounterPrefix, name), &found);
    if (!found) {
        return std::nullopt;
    }
    return value;
}

// A read transaction on the latest commit. A writable store renews its
// reader; a ReadOnly store opens a second transaction beside its snapshot
// (the environment is opened with MDB_NOTLS, so one thread may hold both).
// The store's mutex must be held.
class LmdbStore::LatestRead {
public:
    explicit LatestRead(LmdbStore& store) : m_own(store.m_readOnly) {
        if (!m_own) {
            m_txn = store.BeginRead();
            return;
        }
        const int rc = mdb_txn_begin(store.m_env, nullptr, MDB_RDONLY, &m_txn);
        if (rc == MDB_MAP_RESIZED) {
            store.Fail("the writer has grown the store since it was opened here; open it again");
        }
        store.Check(rc, "beginning a read transaction");
    }
    ~LatestRead() {
        if (m_own) {
            mdb_txn_abort(m_txn);
        } else {
            mdb_txn_reset(m_txn);
        }
    }
    LatestRead(const LatestRead&) = delete;
    LatestRead& operator=(const LatestRead&) = delete;

    MDB_txn* Txn() const { return m_txn; }

private:
    bool m_own;
    MDB_txn* m_txn = nullptr;
};

std::optional<uint64> LmdbStore::FindLatestCounter(std::string_view name) {
    std::lock_guard lock(m_mutex);
    LatestRead read(*this);
    bool found = false;
    const uint64 value = ReadMeta64(read.Txn(), MetaKey(kCounterPrefix, name), &found);
    if (!found) {
        return std::nullopt;
    }
    return value;
}

void LmdbStore::CopyTo(const std::string& dir, bool compact) {
    std::lock_guard lock(m_mutex);
    const int rc = mdb_env_copy2(m_env, dir.c_str(), compact ? MDB_CP_COMPACT : 0);
    if (rc == MDB_MAP_RESIZED) {
        Fail("the writer has grown the store since it was opened here; open it again");
    }
    if (rc != MDB_SUCCESS) {
        Fail("copying to '" + dir + "': " + LmdbFailureText(dir, rc, mdb_strerror(rc)));
    }
    // LMDB closes the copy without syncing it.
    const std::string copy = (std::filesystem::path(dir) / "data.mdb").string();
    UniqueFd fd(::open(copy.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.Get() < 0 || ::fsync(fd.Get()) != 0) {
        const int error = errno;
        Fail("syncing the copy '" + copy +
             "': " + LmdbFailureText(dir, error, std::strerror(error)));
    }
}

uint64 LmdbStore::NextIdentity() {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    bool found = false;
    const uint64 next = ReadMeta64(read.Txn(), kNextIdentityKey, &found);
    if (!found) {
        Fail("damaged store: the identity counter is missing", RuntimeError::Category::Damaged);
    }
    return next;
}

void LmdbStore::Commit(const CommitBatch& batch) {
    TARN_ASSERT(!m_readOnly);
    for (const auto& write : batch.writes) {
        TARN_ASSERT(write.first != 0);
    }
    std::lock_guard lock(m_mutex);
    // Writes go first and deletions after them: an identity both written and
    // deleted in one batch ends up without an image. Deleting an identity the
    // store has no image for is not an error.
    WriteTransaction([&](MDB_txn* txn) {
        const auto put = [&](uint64 oid, const StoredImage& image) {
            TARN_ASSERT(oid != 0);
            const auto keyBytes = IdentityKey(oid);
            MDB_val key = Val(keyBytes.data(), keyBytes.size());
            MDB_val value{ImageRecordSize(image), nullptr};
            if (const int rc = mdb_put(txn, m_images, &key, &value, MDB_RESERVE); rc != 0) {
                Check(rc, "commit: writing image " + OidText(oid));
            }
            EncodeImageRecord(oid, image, static_cast<octet_t*>(value.mv_data));
        };
        for (const auto& [oid, image] : batch.writes) {
            put(oid, image);
        }
        if (batch.streamedWrites) {
            batch.streamedWrites(put);
        }
        for (const uint64 oid : batch.deletes) {
            const auto keyBytes = IdentityKey(oid);
            MDB_val key = Val(keyBytes.data(), keyBytes.size());
            const int rc = mdb_del(txn, m_images, &key, nullptr);
            if (rc != MDB_SUCCESS && rc != MDB_NOTFOUND) {
                Check(rc, "commit: deleting image " + OidText(oid));
            }
        }
        for (const auto& [name, value] : batch.counters) {
            const std::string counterKey = MetaKey(kCounterPrefix, name);
            const auto bytes = Le64(value);
            MDB_val key = Val(counterKey);
            MDB_val val = Val(bytes.data(), bytes.size());
            if (const int rc = mdb_put(txn, m_meta, &key, &val, 0); rc != 0) {
                Check(rc, "commit: setting counter '" + name + "'");
            }
        }
        for (const auto& [name, oid] : batch.roots) {
            const std::string rootKey = MetaKey(kRootPrefix, name);
            const auto bytes = Le64(oid);
            MDB_val key = Val(rootKey);
            MDB_val value = Val(bytes.data(), bytes.size());
            if (const int rc = mdb_put(txn, m_meta, &key, &value, 0); rc != 0) {
                Check(rc, "commit: setting root '" + name + "'");
            }
        }
        const auto counter = Le64(batch.nextIdentity);
        MDB_val key = Val(kNextIdentityKey);
        MDB_val value = Val(counter.data(), counter.size());
        Check(mdb_put(txn, m_meta, &key, &value, 0), "commit: writing the identity counter");
    });
}

void LmdbStore::ForEachIdentity(const std::function<void(uint64)>& fn) {
    std::vector<uint64> chunk;
    uint64 from = 0;
    for (;;) {
        chunk.clear();
        {
            std::lock_guard lock(m_mutex);
            ReadScope read(*this);
            int rc = 0;
            Cursor cursor(read.Txn(), m_images, &rc);
            Check(rc, "listing the images");
            const auto fromBytes = IdentityKey(from);
            MDB_val key = Val(fromBytes.data(), fromBytes.size());
            MDB_val value;
            for (rc = cursor.Get(&key, &value, MDB_SET_RANGE);
                 rc == MDB_SUCCESS && chunk.size() < kIdentityChunk;
                 rc = cursor.Get(&key, &value, MDB_NEXT)) {
                if (key.mv_size != 8) {
                    Fail("damaged store: an image key has " + std::to_string(key.mv_size) +
                             " bytes, expected 8",
                         RuntimeError::Category::Damaged);
                }
                chunk.push_back(IdentityOfKey(key));
            }
            if (rc != MDB_NOTFOUND && rc != MDB_SUCCESS) {
                Check(rc, "listing the images");
            }
        }
        for (const uint64 oid : chunk) {
            fn(oid);
        }
        if (chunk.size() < kIdentityChunk || chunk.back() == std::numeric_limits<uint64>::max()) {
            return;
        }
        from = chunk.back() + 1;
    }
}

std::optional<uint64> LmdbStore::LargestIdentity() {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    int rc = 0;
    Cursor cursor(read.Txn(), m_images, &rc);
    Check(rc, "finding the largest identity");
    MDB_val key;
    MDB_val value;
    rc = cursor.Get(&key, &value, MDB_LAST);
    if (rc == MDB_NOTFOUND) {
        return std::nullopt;
    }
    Check(rc, "finding the largest identity");
    if (key.mv_size != 8) {
        Fail(
            "damaged store: an image key has " + std::to_string(key.mv_size) + " bytes, expected 8",
            RuntimeError::Category::Damaged);
    }
    return IdentityOfKey(key);
}

StoreStats LmdbStore::Stats() {
    std::lock_guard lock(m_mutex);
    ReadScope read(*this);
    MDB_stat stat;
    Check(mdb_stat(read.Txn(), m_images, &stat), "counting the images");
    StoreStats stats;
    stats.numImages = static_cast<ssize_t>(stat.ms_entries);
    int rc = 0;
    Cursor cursor(read.Txn(), m_images, &rc);
    Check(rc, "measuring the images");
    MDB_val key;
    MDB_val value;
    // Only the record sizes are read; the records' pages are not touched.
    for (rc = cursor.Get(&key, &value, MDB_FIRST); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT)) {
        stats.numImageBytes += static_cast<ssize_t>(value.mv_size);
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "measuring the images");
    }
    return stats;
}

uint64 LmdbStore::DataBytes(bool withoutFreePages) {
    std::lock_guard lock(m_mutex);
    MDB_envinfo info;
    Check(mdb_env_info(m_env, &info), "reading the environment's size");
    MDB_stat stat;
    Check(mdb_env_stat(m_env, &stat), "reading the environment's page size");
    uint64 pages = static_cast<uint64>(info.me_last_pgno) + 1;
    if (withoutFreePages) {
        // LMDB's free list is its database 0: a record per transaction whose
        // value is an array of page numbers, the first element their count.
        LatestRead read(*this);
        int rc = 0;
        Cursor cursor(read.Txn(), 0, &rc);
        Check(rc, "reading the free list");
        MDB_val key;
        MDB_val value;
        uint64 free = 0;
        while ((rc = cursor.Get(&key, &value, MDB_NEXT)) == MDB_SUCCESS) {
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
    return pages * stat.ms_psize;
}

std::size_t LmdbStore::MapSize() {
    std::lock_guard lock(m_mutex);
    MDB_envinfo info;
    Check(mdb_env_info(m_env, &info), "reading the map size");
    return info.me_mapsize;
}

void LmdbStore::Fail(const std::string& what, RuntimeError::Category category) const {
    FailAt(m_dir, what, category);
}

void LmdbStore::Check(int rc, std::string_view doing) const {
    if (rc == MDB_SUCCESS) {
        return;
    }
    if (rc == MDB_MAP_FULL) {
        throw MapFull{};
    }
    Fail(std::string(doing) + ": " + LmdbFailureText(m_dir, rc, mdb_strerror(rc)),
         rc == MDB_CORRUPTED || rc == MDB_PAGE_NOTFOUND ? RuntimeError::Category::Damaged
         : rc > 0                                       ? RuntimeError::CategoryOfErrno(rc)
                                                        : RuntimeError::Category::Other);
}

std::unique_ptr<IStore> OpenStore(const std::string& dir, OpenMode mode) {
    return LmdbStore::Open(dir, mode);
}

}  // namespace tarn

#endif  // TARN_HAVE_LMDB
