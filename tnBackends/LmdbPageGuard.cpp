// The page guard: faults and LMDB assertions inside guarded calls become
// errors that poison the store (see LmdbInternal.h), the map's place in
// memory, and the release of the pages this process touched.

#include <signal.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <mutex>

#include "tnBackends/LmdbFileCheck.h"

#include "tnBackends/LmdbInternal.h"

namespace tarn {

namespace {

// Linux maps nothing into the lowest pages of a process (vm.mmap_min_addr: 4
// or 64 KiB by default), and the store maps nothing near them: a fault below
// this address inside a guard is LMDB dereferencing a null pointer.
constexpr std::uintptr_t kNullPageBytes = std::uintptr_t{1} << 16;

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

// A key or value is read one byte in this many while the guard is up.
constexpr std::size_t kTouchStride = 4096;

}  // namespace

constinit thread_local LmdbPageGuard* t_pageGuard = nullptr;

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

// mdb_get under the guard, the value touched.
int LmdbStore::Get(MDB_txn* txn, unsigned int dbi, MDB_val* key, MDB_val* value,
                   const char* doing) {
    return Guarded(doing, [&]() noexcept {
        const int rc = mdb_get(txn, dbi, key, value);
        return rc == MDB_SUCCESS ? Touch(*value) : rc;
    });
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

}  // namespace tarn
