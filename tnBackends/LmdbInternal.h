#pragma once

// The LMDB store's shared internals, for its own source files only: the
// names of its databases, the page guard, the small conversions between
// LMDB's values and ours, the meta values of a commit, and the scoped read
// transactions, cursors and write transactions every part uses.
//
// The store's parts, a file each:
//   LmdbStore.cpp          opening the environment and its databases,
//                          committing, failures
//   LmdbPageGuard.cpp      the page guard and the fault handler, the map's
//                          place in memory, releasing touched pages
//   LmdbMetaRecord.cpp     the meta record's codec, the format-1 reader
//   LmdbDirectoryLock.cpp  the directory's checks, its flock and the
//                          process's registry of open directories
//   LmdbReads.cpp          snapshots and reads
//   LmdbCopy.cpp           copies and compaction
//   LmdbDiskStore.cpp      the DiskStore words built on the above

#include <lmdb.h>
#include <setjmp.h>

#include <array>
#include <cstdint>
#include <map>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

#include "tnBackends/LmdbStore.h"
#include "tnUtils/RuntimeError.h"
#include "tnUtils/Types.h"

namespace tarn {

inline constexpr const char* kImagesDb = "images";
inline constexpr const char* kMetaDb = "meta";
// The meta record's format versions (see LmdbStore.h).
inline constexpr uint32 kFormatVersion = 2;
inline constexpr uint32 kFormat1 = 1;
// The longest name of a root or counter.
inline constexpr std::size_t kMaxNameBytes = 1024;

// Returned for a key or value that LMDB places partly past the end of the
// map: a damaged data size (LMDB's own codes are negative, errno values
// positive).
inline constexpr int kPastTheMap = -1;

// Raised inside a write transaction when the map is full; the transaction is
// aborted, the map grown and the transaction run again.
struct MapFull {};

// What LMDB checks of its own pages, and what this store adds.
//
// Debian's LMDB (0.9.24, as tried with damaged files) bounds every page
// number it follows by the transaction's next page number: a child or
// overflow page number at or past the end of the pages of the commit read
// gives MDB_PAGE_NOTFOUND, and Open has checked that data.mdb reaches to the
// end of those pages. A descent that ends on a page that is not a leaf (a
// meta page, say) gives MDB_CORRUPTED, and a cycle of branch pages fills the
// cursor's stack: MDB_CURSOR_FULL. These arrive as a RuntimeError naming the
// damage (see Check). What LMDB does not check is the inside of a page: node
// offsets, key sizes and data sizes are trusted, so a damaged page can make
// LMDB (or the caller reading a value) read past the page, past the end of
// the file (SIGBUS, since the map is larger than the file) or past the map
// (SIGSEGV); so can a data.mdb cut short while it is open.
//
// The store runs every LMDB call that reads pages, and its own reads of the
// keys and values LMDB returns, under a page guard (LmdbPageGuard). A
// SIGSEGV or SIGBUS of the thread inside a guard whose faulting address lies
// inside this environment's map jumps back to the guard
// (sigsetjmp/siglongjmp, from a process-wide handler chained to the handler
// installed before it) and becomes a RuntimeError; the store is then
// poisoned (see PageFault). So do two more ways in which LMDB meets a
// damaged page inside a guard: a fault in the first 64 KiB of the address
// space, where a process has nothing mapped (LMDB follows a node's flags to a
// structure this store never makes, such as the cursor of a duplicate-keys
// database, and dereferences its null pointer), and one of LMDB's own
// assertions (which would abort the process: the environment's assert
// callback jumps back instead). Any other fault goes on to the previous
// handler, or to the default action, unchanged. Between the guard's
// sigsetjmp and the call's end there are only LMDB's C frames and objects
// without destructors, so the jump skips no destructor; what LMDB was doing
// is abandoned, which is why the store is poisoned.
//
// Limits: any other fault stays unconfined: a read past the end of the map
// (from a page at the very end of a full map), or at a wild address LMDB
// computed from a damaged page. A page that is sound in itself but wrong (a
// child page number naming another leaf) gives a wrong answer without a
// fault: most often "no such image"; a record found instead of another fails
// its checksum, which binds it to its identity, and the meta record has a
// checksum of its own. CheckLmdbPages (tnBackends/LmdbFileCheck.h) walks
// every page for a whole-store validation. A program that installs its own
// SIGSEGV or SIGBUS handler after the first store was opened takes the
// faults from the guard (then they end as they would without it).
//
// AddressSanitizer installs its handlers for both signals at start-up. Under
// its default options (handle_segv=1, allow_user_segv_handler=1; as tried
// with GCC 12's) the handler here replaces them and passes every other fault
// on to them, so a sanitized program still reports its wild accesses; no
// option is needed. (handle_segv=2 would keep any handler but the
// sanitizer's from being installed: the guards would then confine nothing.)
struct LmdbPageGuard {
    sigjmp_buf jump;
    const MDB_env* env = nullptr;
    std::uintptr_t mapBegin = 0;
    std::uintptr_t mapEnd = 0;
    LmdbPageGuard* outer = nullptr;  // a guard this one runs inside of
    volatile std::uintptr_t faultAddress = 0;
    volatile int faultSignal = 0;  // 0: an assertion of LMDB's
    char assertion[256] = {};
};

// The innermost active guard of the thread.
extern constinit thread_local LmdbPageGuard* t_pageGuard;

// Installs the fault handler for SIGSEGV and SIGBUS, once per process.
void InstallFaultHandler();
// LMDB's assert callback (see LmdbPageGuard.cpp).
void OnLmdbAssertion(MDB_env* env, const char* message);

// Checks what is at `dir` before LMDB sees it, creating the directory when
// the mode allows. A directory with files but no data.mdb is not taken over.
void PrepareDirectory(const std::string& dir, OpenMode mode);
// Whether this process may write the lock file (or make it, when there is
// none).
bool LockFileWritable(const std::string& dir);

[[noreturn]] inline void FailAt(const std::string& dir, const std::string& what,
                                RuntimeError::Category category = RuntimeError::Category::Other) {
    throw RuntimeError(category, "store '" + dir + "': " + what);
}

inline MDB_val Val(const void* data, std::size_t size) {
    return MDB_val{size, const_cast<void*>(data)};
}

inline MDB_val Val(std::string_view text) {
    return Val(text.data(), text.size());
}

inline std::array<octet_t, 8> IdentityKey(uint64 oid) {
    std::array<octet_t, 8> key;
    for (int i = 0; i < 8; ++i) {
        key[i] = static_cast<octet_t>(oid >> (56 - 8 * i));
    }
    return key;
}

inline uint64 IdentityOfKey(const MDB_val& key) {
    const auto* bytes = static_cast<const octet_t*>(key.mv_data);
    uint64 oid = 0;
    for (int i = 0; i < 8; ++i) {
        oid = (oid << 8) | bytes[i];
    }
    return oid;
}

inline std::string_view Text(const MDB_val& val) {
    return {static_cast<const char*>(val.mv_data), val.mv_size};
}

inline std::span<const octet_t> Bytes(const MDB_val& val) {
    return {static_cast<const octet_t*>(val.mv_data), val.mv_size};
}

inline std::string OidText(uint64 oid) {
    return "#" + std::to_string(oid);
}

// The meta values of one commit: what the meta record holds.
struct LmdbStoreState {
    uint64 nextIdentity = 1;
    uint64 imageBytes = 0;        // the sum of the sizes of all image records
    bool imageBytesKnown = true;  // false for a format-1 store read as it is
    std::map<std::string, uint64, std::less<>> roots;
    std::map<std::string, uint64, std::less<>> counters;
};

inline std::string NameTooLong(std::string_view name) {
    return "the name has " + std::to_string(name.size()) + " bytes, more than the " +
           std::to_string(kMaxNameBytes) + " a name may have";
}

// Takes a replaced or deleted record's size off the image bytes. The count
// stays at zero or above even for records put into the images database
// behind the store's back, which it never counted.
inline void Uncount(LmdbStoreState& state, uint64 bytes) {
    state.imageBytes -= std::min<uint64>(bytes, state.imageBytes);
}

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

// Runs `call` (LMDB calls and reads of what they return, nothing that
// throws or owns a resource) under a page guard; returns what it returns.
template <class Call>
int LmdbStore::Guarded(const char* doing, Call&& call) {
    static_assert(std::is_nothrow_invocable_r_v<int, Call>, "a guarded call may not throw");
    LmdbPageGuard guard;
    guard.env = m_env;
    guard.mapBegin = m_mapBegin;
    guard.mapEnd = m_mapEnd;
    guard.outer = t_pageGuard;
    if (sigsetjmp(guard.jump, 0) != 0) {
        t_pageGuard = guard.outer;
        PageFault(doing, guard);
    }
    t_pageGuard = &guard;
    const int rc = call();
    t_pageGuard = guard.outer;
    return rc;
}

// Guarded, and a failure of `call` thrown as Check throws it.
template <class Call>
void LmdbStore::CheckGuarded(const char* doing, Call&& call) {
    Check(Guarded(doing, std::forward<Call>(call)), doing);
}

// An open cursor, closed when the scope ends; its reads run under the guard,
// and so do the caller's reads of the keys (and values) it returns.
class LmdbStore::Cursor {
public:
    enum class Touching : uint8 { Nothing, Key, KeyAndValue };

    Cursor(LmdbStore& store, MDB_txn* txn, MDB_dbi dbi, const char* doing)
        : m_store(store), m_doing(doing) {
        store.Check(
            store.Guarded(doing, [&]() noexcept { return mdb_cursor_open(txn, dbi, &m_cursor); }),
            doing);
    }
    ~Cursor() {
        if (m_cursor != nullptr) {
            mdb_cursor_close(m_cursor);
        }
    }
    Cursor(const Cursor&) = delete;
    Cursor& operator=(const Cursor&) = delete;

    int Get(MDB_val* key, MDB_val* value, MDB_cursor_op op, Touching touching) {
        return m_store.Guarded(m_doing, [&]() noexcept {
            int rc = mdb_cursor_get(m_cursor, key, value, op);
            if (rc == MDB_SUCCESS && touching != Touching::Nothing) {
                rc = m_store.Touch(*key);
            }
            if (rc == MDB_SUCCESS && touching == Touching::KeyAndValue) {
                rc = m_store.Touch(*value);
            }
            return rc;
        });
    }

private:
    LmdbStore& m_store;
    const char* m_doing;
    MDB_cursor* m_cursor = nullptr;
};

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
        const int rc = store.Guarded("beginning a read transaction", [&]() noexcept {
            return mdb_txn_begin(store.m_env, nullptr, MDB_RDONLY, &m_txn);
        });
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

// Runs `apply` in a write transaction and commits it; when the map fills
// up, anywhere in between, the transaction is dropped, the map doubled and
// the whole transaction run again. A transaction that fails in any way is
// aborted, never committed.
template <class Apply>
void LmdbStore::WriteTransaction(Apply&& apply) {
    for (;;) {
        MDB_txn* txn = nullptr;
        int rc = Guarded("beginning a write transaction",
                         [&]() noexcept { return mdb_txn_begin(m_env, nullptr, 0, &txn); });
        if (rc == MDB_MAP_RESIZED) {
            SetMapSize(0, "adopting the grown map size");
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
        try {
            // Frees the transaction, committed or not, unless a fault
            // stops it half-way.
            rc = Guarded("committing", [&]() noexcept { return mdb_txn_commit(txn); });
        } catch (...) {
            mdb_txn_abort(txn);
            throw;
        }
        if (rc == MDB_MAP_FULL) {
            GrowMap();
            continue;
        }
        Check(rc, "committing");
        return;
    }
}

}  // namespace tarn
