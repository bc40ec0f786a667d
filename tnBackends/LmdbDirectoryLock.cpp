// The store directory before LMDB opens it: what it holds, the writer's
// flock, and the registry that keeps a directory open once per process.

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <set>

#include "tnBackends/LmdbInternal.h"

namespace tarn {

namespace {

namespace fs = std::filesystem;

// The store directories open in this process, by device and inode. A child
// made by fork() inherits the set but none of the stores in it (it must not
// use them, and LMDB's locks are not inherited): it starts with an empty set.
std::mutex g_openDirsMutex;

std::set<std::pair<uint64, uint64>> g_openDirs;

pid_t g_openDirsPid = 0;  // the process the set belongs to

}  // namespace

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

// Leaves the registry and lets go of the directory's locks.
void LmdbStore::UnlockDirectory() {
    if (m_registered) {
        std::lock_guard<std::mutex> lock(g_openDirsMutex);
        if (g_openDirsPid == ::getpid()) {
            g_openDirs.erase(m_dirId);
        }
        m_registered = false;
    }
    if (m_compactLockFd >= 0) {
        ::close(m_compactLockFd);
        m_compactLockFd = -1;
    }
    if (m_dirFd >= 0) {
        ::close(m_dirFd);
        m_dirFd = -1;
    }
}

}  // namespace tarn
