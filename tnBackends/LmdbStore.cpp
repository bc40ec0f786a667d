#include "tnBackends/LmdbStore.h"

// Without LMDB the library builds without the on-disk store.

#include <fcntl.h>
#include <setjmp.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <limits>
#include <set>
#include <span>
#include <type_traits>
#include <utility>
#include <vector>

#include <lmdb.h>
#include <xxhash.h>

#include "tnBackends/ImageRecord.h"
#include "tnBackends/LmdbFileCheck.h"
#include "tnUtils/Assert.h"
#include "tnUtils/LittleEndian.h"
#include "tnUtils/UniqueFd.h"

namespace tarn {

static_assert(std::is_same_v<MDB_dbi, unsigned int>, "database handles are kept as unsigned int");

namespace {

// Loads between two releases of the map's touched pages (ReleaseMappedPages).
constexpr uint64 kLoadsPerRelease = 4096;

}  // namespace

namespace {

namespace fs = std::filesystem;

constexpr const char* kImagesDb = "images";
constexpr const char* kMetaDb = "meta";
constexpr std::string_view kStateKey = "state";
constexpr std::string_view kFormatMagic = "TARNSTOR";
constexpr uint32 kFormatVersion = 2;
// The meta record's layout (see LmdbStore.h): magic 8, version 4, identity
// counter 8, image bytes 8, then the roots and the counters, each a count 4
// and per entry a name length 2, the name and a value 8; the checksum 8 last.
constexpr std::size_t kStateVersionOffset = 8;
constexpr std::size_t kStateBodyOffset = 12;
constexpr std::size_t kChecksumBytes = 8;
constexpr std::size_t kEmptyStateBytes = kStateBodyOffset + 8 + 8 + 4 + 4 + kChecksumBytes;
constexpr std::size_t kMaxNameBytes = 1024;
// Format 1 kept each meta value under a key of its own, without a checksum.
constexpr uint32 kFormat1 = 1;
constexpr std::string_view kFormatKey = "format";
constexpr std::string_view kNextIdentityKey = "next-identity";
constexpr std::string_view kRootPrefix = "root:";
constexpr std::string_view kCounterPrefix = "counter:";
// ForEachIdentity reads identities in chunks of this many, so that the
// callback runs with no transaction open and may use the store itself.
constexpr std::size_t kIdentityChunk = 1024;

}  // namespace

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

namespace {

// Linux maps nothing into the lowest pages of a process (vm.mmap_min_addr: 4
// or 64 KiB by default), and the store maps nothing near them: a fault below
// this address inside a guard is LMDB dereferencing a null pointer.
constexpr std::uintptr_t kNullPageBytes = std::uintptr_t{1} << 16;

// The innermost active guard of the thread.
constinit thread_local LmdbPageGuard* t_pageGuard = nullptr;

// The handlers installed before this store's, by signal.
struct sigaction g_previousSegv;
struct sigaction g_previousBus;

// Hands a fault outside every guard to the handler installed before, or
// ends the process as the default action does. Async-signal-safe.
void PassFaultOn(int signal, siginfo_t* info, void* context) {
    const struct sigaction& previous = signal == SIGBUS ? g_previousBus : g_previousSegv;
    if ((previous.sa_flags & SA_SIGINFO) != 0) {
        previous.sa_sigaction(signal, info, context);
        return;
    }
    if (previous.sa_handler == SIG_IGN && info->si_code <= 0) {
        return;  // sent by a process, and ignored as before
    }
    if (previous.sa_handler == SIG_DFL || previous.sa_handler == SIG_IGN) {
        // (a fault cannot be ignored: the kernel ends the process for it)
        struct sigaction fallback = {};
        fallback.sa_handler = SIG_DFL;
        sigemptyset(&fallback.sa_mask);
        ::sigaction(signal, &fallback, nullptr);
        ::raise(signal);
        return;
    }
    previous.sa_handler(signal);
}

void OnFault(int signal, siginfo_t* info, void* context) {
    LmdbPageGuard* guard = t_pageGuard;
    const auto address = reinterpret_cast<std::uintptr_t>(info->si_addr);
    if (guard != nullptr &&
        ((address >= guard->mapBegin && address < guard->mapEnd) || address < kNullPageBytes)) {
        guard->faultAddress = address;
        guard->faultSignal = signal;
        siglongjmp(guard->jump, 1);
    }
    PassFaultOn(signal, info, context);
}

// LMDB's assert callback: inside a guard of the environment, the assertion
// ends the guarded call instead of the process. Otherwise LMDB goes on to
// print it and abort, as without the callback.
void OnLmdbAssertion(MDB_env* env, const char* message) {
    LmdbPageGuard* guard = t_pageGuard;
    if (guard == nullptr || guard->env != env) {
        return;
    }
    std::snprintf(guard->assertion, sizeof guard->assertion, "%s", message);
    guard->faultSignal = 0;
    siglongjmp(guard->jump, 1);
}

// Installs OnFault for SIGSEGV and SIGBUS, once per process. SA_NODEFER
// leaves the signal unblocked in the handler, so that the jump out of it
// (which does not restore the signal mask: saving it would cost a system call
// per guard) leaves the mask as it was.
void InstallFaultHandler() {
    static std::once_flag once;
    std::call_once(once, [] {
        struct sigaction action = {};
        action.sa_sigaction = OnFault;
        action.sa_flags = SA_SIGINFO | SA_ONSTACK | SA_NODEFER;
        sigemptyset(&action.sa_mask);
        ::sigaction(SIGSEGV, &action, &g_previousSegv);
        ::sigaction(SIGBUS, &action, &g_previousBus);
    });
}

// Returned for a key or value that LMDB places partly past the end of the
// map: a damaged data size (LMDB's own codes are negative, errno values
// positive).
constexpr int kPastTheMap = -1;

// A key or value is read one byte in this many while the guard is up.
constexpr std::size_t kTouchStride = 4096;

// Raised inside a write transaction when the map is full; the transaction is
// aborted, the map grown and the transaction run again.
struct MapFull {};

[[noreturn]] void FailAt(const std::string& dir, const std::string& what,
                         RuntimeError::Category category = RuntimeError::Category::Other) {
    throw RuntimeError(category, "store '" + dir + "': " + what);
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

std::string_view Text(const MDB_val& val) {
    return {static_cast<const char*>(val.mv_data), val.mv_size};
}

std::span<const octet_t> Bytes(const MDB_val& val) {
    return {static_cast<const octet_t*>(val.mv_data), val.mv_size};
}

// A name in the meta record; the caller adds what it names.
void PutName(std::string& out, std::string_view name) {
    TARN_ASSERT(name.size() <= kMaxNameBytes);
    octet_t length[2];
    PutLe(length, name.size(), 2);
    out.append(reinterpret_cast<const char*>(length), 2);
    out += name;
}

void PutValue(std::string& out, uint64 value, std::size_t width) {
    octet_t bytes[8];
    PutLe(bytes, value, width);
    out.append(reinterpret_cast<const char*>(bytes), width);
}

// A meta record that does not parse; what is wrong.
struct Unparsable {
    std::string what;
};

// Reads a meta record's body front to back.
class StateReader {
public:
    explicit StateReader(std::span<const octet_t> body) : m_body(body) {}

    uint64 Value(std::size_t width, const char* what) {
        return GetLe(Take(width, what).data(), width);
    }

    // The named values of one section (roots or counters), in strictly
    // increasing name order.
    void Section(std::map<std::string, uint64, std::less<>>& into, const char* what) {
        const uint64 count = Value(4, what);
        for (uint64 i = 0; i < count; ++i) {
            const std::size_t length = Value(2, what);
            if (length > kMaxNameBytes) {
                throw Unparsable{std::string("a name of the ") + what + " has " +
                                 std::to_string(length) + " bytes"};
            }
            const std::span<const octet_t> name = Take(length, what);
            std::string key(reinterpret_cast<const char*>(name.data()), name.size());
            if (!into.empty() && !(into.rbegin()->first < key)) {
                throw Unparsable{std::string("the ") + what + " are out of order"};
            }
            const uint64 value = Value(8, what);
            into.emplace_hint(into.end(), std::move(key), value);
        }
    }

    std::size_t Left() const { return m_body.size() - m_at; }

private:
    std::span<const octet_t> Take(std::size_t size, const char* what) {
        if (size > Left()) {
            throw Unparsable{std::string("the record ends inside the ") + what};
        }
        const std::span<const octet_t> taken = m_body.subspan(m_at, size);
        m_at += size;
        return taken;
    }

    std::span<const octet_t> m_body;
    std::size_t m_at = 0;
};

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

}  // namespace

// The meta values of one commit: what the meta record holds.
struct LmdbStoreState {
    uint64 nextIdentity = 1;
    uint64 imageBytes = 0;        // the sum of the sizes of all image records
    bool imageBytesKnown = true;  // false for a format-1 store read as it is
    std::map<std::string, uint64, std::less<>> roots;
    std::map<std::string, uint64, std::less<>> counters;
};

namespace {

[[noreturn]] void FailUnsupported(const std::string& dir, uint64 version) {
    FailAt(dir, "store format version " + std::to_string(version) +
                    " is not supported (this program reads versions 1 and 2)");
}

std::string NameTooLong(std::string_view name) {
    return "the name has " + std::to_string(name.size()) + " bytes, more than the " +
           std::to_string(kMaxNameBytes) + " a name may have";
}

// Takes a replaced or deleted record's size off the image bytes. The count
// stays at zero or above even for records put into the images database
// behind the store's back, which it never counted.
void Uncount(LmdbStoreState& state, uint64 bytes) {
    state.imageBytes -= std::min<uint64>(bytes, state.imageBytes);
}

std::string EncodeState(const LmdbStoreState& state) {
    std::string out(kFormatMagic);
    PutValue(out, kFormatVersion, 4);
    PutValue(out, state.nextIdentity, 8);
    PutValue(out, state.imageBytes, 8);
    for (const auto* section : {&state.roots, &state.counters}) {
        PutValue(out, section->size(), 4);
        for (const auto& [name, value] : *section) {
            PutName(out, name);
            PutValue(out, value, 8);
        }
    }
    PutValue(out, XXH3_64bits(out.data(), out.size()), 8);
    return out;
}

// The meta record `record` of the store in `dir`, verified: its length, its
// checksum, its magic and version, then its body.
LmdbStoreState DecodeState(const std::string& dir, std::span<const octet_t> record) {
    const std::string damaged = "damaged store: the meta record \"state\" ";
    if (record.size() < kEmptyStateBytes) {
        FailAt(dir,
               damaged + "has " + std::to_string(record.size()) + " bytes, fewer than the " +
                   std::to_string(kEmptyStateBytes) + " of the smallest (wrong length)",
               RuntimeError::Category::Damaged);
    }
    const std::size_t body = record.size() - kChecksumBytes;
    if (XXH3_64bits(record.data(), body) != GetLe(record.data() + body, kChecksumBytes)) {
        FailAt(dir, damaged + "does not match its checksum (checksum mismatch)",
               RuntimeError::Category::Damaged);
    }
    if (!std::equal(kFormatMagic.begin(), kFormatMagic.end(), record.begin())) {
        FailAt(dir, damaged + "lacks the magic \"TARNSTOR\"", RuntimeError::Category::Damaged);
    }
    if (const uint64 version = GetLe(record.data() + kStateVersionOffset, 4);
        version != kFormatVersion) {
        FailUnsupported(dir, version);
    }
    LmdbStoreState state;
    try {
        StateReader reader(record.subspan(kStateBodyOffset, body - kStateBodyOffset));
        state.nextIdentity = reader.Value(8, "identity counter");
        state.imageBytes = reader.Value(8, "image bytes");
        reader.Section(state.roots, "roots");
        reader.Section(state.counters, "counters");
        if (reader.Left() != 0) {
            throw Unparsable{std::to_string(reader.Left()) + " bytes follow the counters"};
        }
    } catch (const Unparsable& e) {
        FailAt(dir, damaged + "cannot be parsed: " + e.what, RuntimeError::Category::Damaged);
    }
    return state;
}

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

// Reads a byte of every page of a key or value LMDB returned, so that a part
// of it past the end of the file faults under the guard, before the caller
// reads it. A key or value that starts outside the map lies in a page the
// write transaction has changed (LMDB keeps those in memory) and is read as
// it is; one that starts inside the map and ends past it is damage.
int LmdbStore::Touch(const MDB_val& val) const noexcept {
    if (val.mv_size == 0) {
        return MDB_SUCCESS;
    }
    const auto begin = reinterpret_cast<std::uintptr_t>(val.mv_data);
    if (begin < m_mapBegin || begin >= m_mapEnd) {
        return MDB_SUCCESS;
    }
    if (val.mv_size > m_mapEnd - begin) {
        return kPastTheMap;
    }
    const auto* bytes = static_cast<const volatile octet_t*>(val.mv_data);
    for (std::size_t at = 0; at < val.mv_size; at += kTouchStride) {
        static_cast<void>(bytes[at]);
    }
    static_cast<void>(bytes[val.mv_size - 1]);
    return MDB_SUCCESS;
}

// After a fault under a guard: LMDB's state inside the environment cannot be
// trusted any more, so the store is poisoned: this call and every later one
// throw the same error. What can be aborted is aborted as the error unwinds
// (a write transaction, a read scope); nothing is committed.
void LmdbStore::PageFault(const char* doing, const LmdbPageGuard& guard) {
    const std::string damaged = "store '" + m_dir + "': damaged store: ";
    const std::uintptr_t address = guard.faultAddress;
    const std::string signal = guard.faultSignal == SIGBUS ? "SIGBUS" : "SIGSEGV";
    if (guard.faultSignal == 0) {
        m_poisoned = damaged + "LMDB found its pages inconsistent while " + doing + " (" +
                     guard.assertion + ")";
    } else if (address < kNullPageBytes) {
        m_poisoned = damaged + "a page of data.mdb led LMDB to a null pointer while " + doing +
                     " (" + signal + " at address " + std::to_string(address) + ")";
    } else {
        const std::uintptr_t offset = address - m_mapBegin;
        std::string fileBytes = "an unknown number of";
        int fd = -1;
        struct stat st;
        if (mdb_env_get_fd(m_env, &fd) == MDB_SUCCESS && ::fstat(fd, &st) == 0) {
            fileBytes = std::to_string(st.st_size);
        }
        m_poisoned = damaged + "a page of data.mdb could not be read while " + doing + " (" +
                     signal + " at byte " + std::to_string(offset) + " of the map, in page " +
                     std::to_string(offset / std::max<std::size_t>(m_pageSize, 1)) +
                     "; data.mdb has " + fileBytes + " bytes)";
    }
    throw RuntimeError(RuntimeError::Category::Damaged, m_poisoned);
}

// Before the writer's first change, every page is walked (CheckLmdbPages),
// once per opening. Readers meet damage where they read it, but a writer
// acts on pages it does not read as a reader would and trusts them: a page's
// flags, the page counts of the overflow runs it frees, the free-page lists
// it takes pages from. Damage there would have it write over pages in use
// and spread the damage to a store that read well before. The walk costs
// what the file holds, paid by a writer that writes, not by an opening;
// when it finds damage, this and every later change is refused with its
// error (reads go on).
void LmdbStore::WritablePages() {
    if (m_pagesChecked) {
        return;
    }
    if (m_unwritable.empty()) {
        try {
            CheckLmdbPages(m_dir);
            m_pagesChecked = true;
            return;
        } catch (const RuntimeError& e) {
            m_unwritable = std::string(e.what()) + "; the store takes no more changes";
        }
    }
    throw RuntimeError(RuntimeError::Category::Damaged, m_unwritable);
}

void LmdbStore::ThrowIfPoisoned() const {
    if (!m_poisoned.empty()) {
        throw RuntimeError(RuntimeError::Category::Damaged, m_poisoned);
    }
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

// mdb_get under the guard, the value touched.
int LmdbStore::Get(MDB_txn* txn, unsigned int dbi, MDB_val* key, MDB_val* value,
                   const char* doing) {
    return Guarded(doing, [&]() noexcept {
        const int rc = mdb_get(txn, dbi, key, value);
        return rc == MDB_SUCCESS ? Touch(*value) : rc;
    });
}

namespace {

// Whether this process may write the lock file (or make it, when there is
// none): not on a read-only mount, nor in a directory of another user's that
// it may only read.
bool LockFileWritable(const std::string& dir) {
    const std::string lock = dir + "/lock.mdb";
    if (::access(lock.c_str(), F_OK) == 0) {
        return ::access(lock.c_str(), W_OK) == 0;
    }
    return ::access(dir.c_str(), W_OK) == 0;
}

}  // namespace

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
    if (m_registered) {
        std::lock_guard<std::mutex> lock(g_openDirsMutex);
        if (g_openDirsPid == ::getpid()) {
            g_openDirs.erase(m_dirId);
        }
    }
    if (m_compactLockFd >= 0) {
        ::close(m_compactLockFd);
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

// Finds where LMDB has mapped data.mdb, for the page guards: the mapping of
// this file in /proc/self/maps. Where that cannot be read, no address is
// taken for this map's and the guards confine no fault.
void LmdbStore::FindMap() {
    m_mapBegin = 0;
    m_mapEnd = 0;
    int fd = -1;
    struct stat st;
    if (mdb_env_get_fd(m_env, &fd) != MDB_SUCCESS || ::fstat(fd, &st) != 0) {
        return;
    }
    std::ifstream maps("/proc/self/maps");
    for (std::string line; std::getline(maps, line);) {
        unsigned long long begin = 0;
        unsigned long long end = 0;
        unsigned long long offset = 0;
        unsigned long long inode = 0;
        unsigned int major = 0;
        unsigned int minor = 0;
        char perms[8];
        if (std::sscanf(line.c_str(), "%llx-%llx %7s %llx %x:%x %llu", &begin, &end, perms, &offset,
                        &major, &minor, &inode) != 7 ||
            inode != st.st_ino || major != major(st.st_dev) || minor != minor(st.st_dev)) {
            continue;
        }
        m_mapBegin = m_mapBegin == 0 ? begin : std::min<std::uintptr_t>(m_mapBegin, begin);
        m_mapEnd = std::max<std::uintptr_t>(m_mapEnd, end);
    }
}

// Sets the map's size (0: the size the file's meta page names); LMDB maps
// the file anew.
void LmdbStore::SetMapSize(std::size_t size, const char* doing) {
    CheckGuarded(doing, [&]() noexcept { return mdb_env_set_mapsize(m_env, size); });
    FindMap();
}

// Opens the two databases. A ReadOnly store reads its meta record from its
// snapshot afterwards. A writer reads and verifies it here; it makes a new
// store, and upgrades a format-1 store, in this same write transaction.
void LmdbStore::OpenDatabases(OpenMode mode) {
    if (m_readOnly) {
        MDB_txn* txn = nullptr;
        CheckGuarded("beginning a read transaction",
                     [&]() noexcept { return mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &txn); });
        try {
            const int rc = Guarded("opening the meta database", [&]() noexcept {
                return mdb_dbi_open(txn, kMetaDb, 0, &m_meta);
            });
            if (rc == MDB_NOTFOUND) {
                Fail("not a store: the environment has no \"meta\" database");
            }
            Check(rc, "opening the meta database");
            const int rcImages = Guarded("opening the images database", [&]() noexcept {
                return mdb_dbi_open(txn, kImagesDb, 0, &m_images);
            });
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
        CheckGuarded("opening the databases", [&]() noexcept { return mdb_txn_commit(txn); });
        return;
    }
    LmdbStoreState state;
    uint32 found = kFormatVersion;
    bool upgraded = false;
    WriteTransaction([&](MDB_txn* txn) {
        upgraded = false;
        const int rc = Guarded("opening the meta database",
                               [&]() noexcept { return mdb_dbi_open(txn, kMetaDb, 0, &m_meta); });
        if (rc == MDB_NOTFOUND) {
            if (mode != OpenMode::CreateIfMissing) {
                Fail("not a store: the environment has no \"meta\" database");
            }
            // A new environment is made a store; one with other contents is
            // somebody else's.
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
                return meta != MDB_SUCCESS ? meta
                                           : mdb_dbi_open(txn, kImagesDb, MDB_CREATE, &m_images);
            });
            state = LmdbStoreState{};
            found = kFormatVersion;
            WriteState(txn, state);
            return;
        }
        Check(rc, "opening the meta database");
        const int rcImages = Guarded("opening the images database", [&]() noexcept {
            return mdb_dbi_open(txn, kImagesDb, 0, &m_images);
        });
        if (rcImages == MDB_NOTFOUND) {
            Fail("damaged store: the \"images\" database is missing",
                 RuntimeError::Category::Damaged);
        }
        Check(rcImages, "opening the images database");
        std::vector<std::string> oldKeys;
        state = ReadState(txn, &found, &oldKeys);
        if (found == kFormat1) {
            // The upgrade: the pages checked (see WritablePages), the image
            // bytes counted once, the meta values moved into the meta
            // record, all in this transaction.
            WritablePages();
            state.imageBytes = SumImageBytes(txn);
            state.imageBytesKnown = true;
            for (const std::string& old : oldKeys) {
                MDB_val key = Val(old);
                CheckGuarded("upgrading the store",
                             [&]() noexcept { return mdb_del(txn, m_meta, &key, nullptr); });
            }
            WriteState(txn, state);
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

// The meta values of the commit `txn` sees, verified, with the format found
// in `version`. A format-1 store's values are read from their keys, which
// `oldKeys` (when given) receives.
LmdbStoreState LmdbStore::ReadState(MDB_txn* txn, uint32* version,
                                    std::vector<std::string>* oldKeys) {
    MDB_val key = Val(kStateKey);
    MDB_val value;
    int rc = Get(txn, m_meta, &key, &value, "reading the meta record");
    if (rc == MDB_SUCCESS) {
        *version = kFormatVersion;
        return DecodeState(m_dir, Bytes(value));
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "reading the meta record");
    }
    // No meta record: a store of format 1, or one that lost its record.
    key = Val(kFormatKey);
    rc = Get(txn, m_meta, &key, &value, "reading the format marker");
    if (rc == MDB_NOTFOUND) {
        Fail(
            "damaged store: the meta record \"state\" is missing (and there is no format-1 "
            "marker)",
            RuntimeError::Category::Damaged);
    }
    Check(rc, "reading the format marker");
    const std::string_view marker = Text(value);
    if (marker.size() != kFormatMagic.size() + 4 || !marker.starts_with(kFormatMagic)) {
        Fail("not a store: unrecognised format marker");
    }
    const uint64 markerVersion = GetLe(Bytes(value).data() + kFormatMagic.size(), 4);
    if (markerVersion != kFormat1) {
        FailUnsupported(m_dir, markerVersion);
    }
    *version = kFormat1;
    return ReadFormat1(txn, oldKeys);
}

// A format-1 store's meta values, each under a key of its own. The image
// bytes were not kept: they are counted on demand (or at the upgrade).
LmdbStoreState LmdbStore::ReadFormat1(MDB_txn* txn, std::vector<std::string>* oldKeys) {
    LmdbStoreState state;
    state.imageBytesKnown = false;
    bool haveNext = false;
    Cursor cursor(*this, txn, m_meta, "reading the meta values");
    MDB_val key;
    MDB_val value;
    const auto touching = Cursor::Touching::KeyAndValue;
    int rc = 0;
    for (rc = cursor.Get(&key, &value, MDB_FIRST, touching); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT, touching)) {
        const std::string_view name = Text(key);
        const bool root = name.starts_with(kRootPrefix);
        const bool counter = name.starts_with(kCounterPrefix);
        const bool next = name == kNextIdentityKey;
        if (!root && !counter && !next) {
            if (name == kFormatKey && oldKeys != nullptr) {
                oldKeys->emplace_back(name);
            }
            continue;
        }
        if (value.mv_size != 8) {
            Fail("damaged store: meta entry '" + std::string(name) + "' has " +
                     std::to_string(value.mv_size) + " bytes, expected 8",
                 RuntimeError::Category::Damaged);
        }
        const uint64 number = GetLe(Bytes(value).data(), 8);
        if (next) {
            state.nextIdentity = number;
            haveNext = true;
        } else if (root) {
            state.roots.emplace(name.substr(kRootPrefix.size()), number);
        } else {
            state.counters.emplace(name.substr(kCounterPrefix.size()), number);
        }
        if (oldKeys != nullptr) {
            oldKeys->emplace_back(name);
        }
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "reading the meta values");
    }
    if (!haveNext) {
        Fail("damaged store: the identity counter is missing", RuntimeError::Category::Damaged);
    }
    return state;
}

void LmdbStore::WriteState(MDB_txn* txn, const LmdbStoreState& state) {
    const std::string record = EncodeState(state);
    MDB_val key = Val(kStateKey);
    MDB_val value = Val(record);
    CheckGuarded("writing the meta record",
                 [&]() noexcept { return mdb_put(txn, m_meta, &key, &value, 0); });
}

// The sum of the sizes of all image records, from a walk of the images'
// leaves (the records themselves are not read).
uint64 LmdbStore::SumImageBytes(MDB_txn* txn) {
    Cursor cursor(*this, txn, m_images, "measuring the images");
    MDB_val key;
    MDB_val value;
    uint64 bytes = 0;
    const auto touching = Cursor::Touching::Nothing;
    int rc = 0;
    for (rc = cursor.Get(&key, &value, MDB_FIRST, touching); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT, touching)) {
        bytes += value.mv_size;
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "measuring the images");
    }
    return bytes;
}

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

void LmdbStore::GrowMap() {
    MDB_envinfo info;
    CheckGuarded("reading the map size", [&]() noexcept { return mdb_env_info(m_env, &info); });
    const std::size_t current = info.me_mapsize;
    if (current > std::numeric_limits<std::size_t>::max() / 2) {
        Fail("the map cannot grow beyond " + std::to_string(current) + " bytes");
    }
    SetMapSize(current * 2, "growing the map");
}

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

// LMDB reads the file through its map, and every page a process touched
// counts in its resident memory until the kernel reclaims it, although it is
// only the page cache: a walk of a large store would look like a store held
// in memory, and a memory bound on the tree would not show in the process's
// size. So the pages are let go of (MADV_DONTNEED on the read-only shared
// map: the next touch finds them in the page cache again) after every
// commit, after a compaction and every kLoadsPerRelease loads.
void LmdbStore::ReleaseMappedPages() {
    m_loadsSinceRelease = 0;
    if (m_mapBegin != 0 && m_mapEnd > m_mapBegin) {
        (void)::madvise(reinterpret_cast<void*>(m_mapBegin), m_mapEnd - m_mapBegin, MADV_DONTNEED);
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

void LmdbStore::CopyTo(const std::string& dir, bool compact) {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    // A compacting copy walks every page of the latest commit in LMDB's
    // copying code, which runs a second thread that no guard could leave
    // behind: the pages are walked with plain reads first (at about the
    // cost of the copy's own walk). A plain copy writes the file's pages out
    // as they are, reading none.
    if (compact) {
        CheckLmdbPages(m_dir);
    }
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

bool LmdbStore::Compact() {
    TARN_ASSERT(!m_readOnly);
    namespace fs = std::filesystem;
    const fs::path staging = fs::path(m_dir) / (".compact-" + std::to_string(::getpid()));
    std::error_code ec;
    fs::remove_all(staging, ec);
    if (!fs::create_directory(staging, ec)) {
        Fail("compacting: cannot make '" + staging.string() + "': " + ec.message());
    }
    struct Cleanup {
        fs::path dir;
        ~Cleanup() {
            std::error_code ignored;
            fs::remove_all(dir, ignored);
        }
    } cleanup{staging};
    CopyTo(staging.string(), true);

    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    const std::string lockPath = (fs::path(m_dir) / "lock.mdb").string();
    if (m_reader != nullptr) {
        mdb_txn_abort(m_reader);
        m_reader = nullptr;
    }
    mdb_env_close(m_env);
    m_env = nullptr;
    UniqueFd lockFd(::open(lockPath.c_str(), O_RDWR | O_CLOEXEC));
    struct flock first {};
    first.l_type = F_WRLCK;
    first.l_whence = SEEK_SET;
    first.l_start = 0;
    first.l_len = 1;
    const bool alone = lockFd.Get() >= 0 && ::fcntl(lockFd.Get(), F_SETLK, &first) == 0;
    if (alone) {
        if (::rename((staging / "data.mdb").c_str(), (fs::path(m_dir) / "data.mdb").c_str()) != 0) {
            const int error = errno;
            Fail("compacting: cannot put the copy in place: " + std::string(std::strerror(error)));
        }
        UniqueFd dirFd(::open(m_dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (dirFd.Get() < 0 || ::fsync(dirFd.Get()) != 0) {
            const int error = errno;
            Fail("compacting: syncing the directory: " + std::string(std::strerror(error)));
        }
    }
    // Open again: the new file when alone, the old one otherwise.
    OpenEnvironment();
    OpenDatabases(OpenMode::MustExist);
    if (alone) {
        if (m_compactLockFd >= 0) {
            ::close(m_compactLockFd);
        }
        m_compactLockFd = lockFd.Release();
        m_pagesChecked = true;  // the copy was made from pages walked just now
    }
    ReleaseMappedPages();
    return alone;
}

uint64 LmdbStore::NextIdentity() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    return m_state->nextIdentity;
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
        // The image bytes follow every change: the size of a record replaced
        // or deleted is looked up first. That is one more descent of the tree
        // per image, through the pages the write or the deletion then
        // changes anyway, so it reads no page the commit would not read; the
        // record itself (on its overflow pages, when large) is not read.
        const auto put = [&](uint64 oid, const StoredImage& image) {
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
            MDB_val old;
            const int rc = Guarded("committing", [&]() noexcept {
                const int found = mdb_get(txn, m_images, &key, &old);
                return found != MDB_SUCCESS ? found : mdb_del(txn, m_images, &key, nullptr);
            });
            if (rc == MDB_NOTFOUND) {
                continue;
            }
            Check(rc, "commit: deleting image " + OidText(oid));
            Uncount(next, old.mv_size);
        }
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
        WriteState(txn, next);
    });
    *m_state = std::move(next);
    ReleaseMappedPages();
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

StoreStats LmdbStore::Stats() {
    std::lock_guard lock(m_mutex);
    ThrowIfPoisoned();
    ReadScope read(*this);
    MDB_stat stat;
    CheckGuarded("counting the images",
                 [&]() noexcept { return mdb_stat(read.Txn(), m_images, &stat); });
    StoreStats stats;
    stats.numImages = static_cast<ssize_t>(stat.ms_entries);
    // A format-1 store read as it is kept no count of the bytes: they are
    // counted here, from the leaves of the images' tree.
    stats.numImageBytes = static_cast<ssize_t>(
        m_state->imageBytesKnown ? m_state->imageBytes : SumImageBytes(read.Txn()));
    return stats;
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

}  // namespace tarn
