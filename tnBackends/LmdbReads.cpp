// Reads: snapshots and read transactions, images, roots, counters,
// identities and statistics.

#include <limits>
#include <vector>

#include "tnBackends/ImageRecord.h"

#include "tnBackends/LmdbInternal.h"

namespace tarn {

namespace {

// Loads between two releases of the map's touched pages (ReleaseMappedPages).
constexpr uint64 kLoadsPerRelease = 4096;

// ForEachIdentity reads identities in chunks of this many, so that the
// callback runs with no transaction open and may use the store itself.
constexpr std::size_t kIdentityChunk = 1024;

}  // namespace

// A reader's snapshot. The writer may have grown the map since this
// environment was opened; the map size is adopted from the file first (no
// transaction of this environment is open yet), and again should the writer
// grow it in between.
void LmdbStore::BeginSnapshot() {
    for (int attempt = 0;; ++attempt) {
        SetMapSize(0, "adopting the map size");
        const int rc = Guarded("beginning the read snapshot", [&]() noexcept {
            return mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &m_reader);
        });
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
            if (Guarded("beginning a read transaction",
                        [&]() noexcept { return mdb_txn_renew(m_reader); }) == MDB_SUCCESS) {
                return m_reader;
            }
            mdb_txn_abort(m_reader);
            m_reader = nullptr;
        }
        const int rc = Guarded("beginning a read transaction", [&]() noexcept {
            return mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &m_reader);
        });
        if (rc == MDB_SUCCESS) {
            return m_reader;
        }
        m_reader = nullptr;
        if (rc == MDB_MAP_RESIZED && attempt == 0) {
            SetMapSize(0, "adopting the grown map size");
            continue;
        }
        Check(rc, "beginning a read transaction");
    }
}

std::optional<StoredImage> LmdbStore::Load(uint64 oid) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    ReadScope read(*this);
    const auto keyBytes = IdentityKey(oid);
    MDB_val key = Val(keyBytes.data(), keyBytes.size());
    MDB_val value;
    const int rc = Get(read.Txn(), m_images, &key, &value, "reading an image");
    if (rc == MDB_NOTFOUND) {
        return std::nullopt;
    }
    if (rc != MDB_SUCCESS) {
        Check(rc, "reading image " + OidText(oid));
    }
    try {
        std::optional<StoredImage> image = DecodeImageRecord(oid, Bytes(value));
        if (++m_loadsSinceRelease == kLoadsPerRelease) {
            ReleaseMappedPages();
        }
        return image;
    } catch (const RuntimeError& e) {
        Fail(e.what());
    }
}

std::optional<uint64> LmdbStore::FindRoot(std::string_view name) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    const auto it = m_state->roots.find(name);
    if (it == m_state->roots.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::map<std::string, uint64> LmdbStore::Roots() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    return {m_state->roots.begin(), m_state->roots.end()};
}

std::map<std::string, uint64> LmdbStore::Counters() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    return {m_state->counters.begin(), m_state->counters.end()};
}

std::optional<uint64> LmdbStore::FindCounter(std::string_view name) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    const auto it = m_state->counters.find(name);
    if (it == m_state->counters.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::optional<uint64> LmdbStore::FindLatestCounter(std::string_view name) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    if (!m_readOnly) {
        // The writer's own record is the latest.
        const auto it = m_state->counters.find(name);
        return it == m_state->counters.end() ? std::nullopt : std::optional(it->second);
    }
    LatestRead read(*this);
    uint32 version = 0;
    const LmdbStoreState latest = ReadState(read.Txn(), &version, nullptr);
    const auto it = latest.counters.find(name);
    if (it == latest.counters.end()) {
        return std::nullopt;
    }
    return it->second;
}

uint64 LmdbStore::NextIdentity() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    return m_state->nextIdentity;
}

void LmdbStore::ForEachIdentity(const std::function<void(uint64)>& fn) {
    std::vector<uint64> chunk;
    uint64 from = 0;
    for (;;) {
        chunk.clear();
        {
            std::lock_guard lock(m_mutex);
            ThrowIfPoisoned();
            ReadScope read(*this);
            Cursor cursor(*this, read.Txn(), m_images, "listing the images");
            const auto fromBytes = IdentityKey(from);
            MDB_val key = Val(fromBytes.data(), fromBytes.size());
            MDB_val value;
            const auto touching = Cursor::Touching::Key;
            int rc = 0;
            for (rc = cursor.Get(&key, &value, MDB_SET_RANGE, touching);
                 rc == MDB_SUCCESS && chunk.size() < kIdentityChunk;
                 rc = cursor.Get(&key, &value, MDB_NEXT, touching)) {
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
    ThrowIfPoisoned();
    ReadScope read(*this);
    Cursor cursor(*this, read.Txn(), m_images, "finding the largest identity");
    MDB_val key;
    MDB_val value;
    const int rc = cursor.Get(&key, &value, MDB_LAST, Cursor::Touching::Key);
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

ImageCounts LmdbStore::Stats() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    ReadScope read(*this);
    MDB_stat stat;
    CheckGuarded("counting the images",
                 [&]() noexcept { return mdb_stat(read.Txn(), m_images, &stat); });
    ImageCounts stats;
    stats.numImages = static_cast<ssize_t>(stat.ms_entries);
    // A format-1 store read as it is kept no count of the bytes: they are
    // counted here, from the leaves of the images' tree.
    stats.numImageBytes = static_cast<ssize_t>(
        m_state->imageBytesKnown ? m_state->imageBytes : SumImageBytes(read.Txn()));
    return stats;
}

}  // namespace tarn
