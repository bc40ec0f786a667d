// Copies of the environment and compaction.

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "tnBackends/LmdbFileCheck.h"
#include "tnUtils/Assert.h"
#include "tnUtils/UniqueFd.h"

#include "tnBackends/LmdbInternal.h"

namespace tarn {

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

}  // namespace tarn
