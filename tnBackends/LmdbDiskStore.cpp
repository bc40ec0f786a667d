// The LMDB store in the words of DiskStore: the end of a checkpoint, a
// consistent copy with its progress, the check of the file, its size and
// its free share.

#include <sys/stat.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <mutex>
#include <thread>

#include "tnBackends/LmdbFileCheck.h"
#include "tnBackends/LmdbStore.h"

namespace tarn {

namespace {

namespace fs = std::filesystem;

constexpr auto kProgressInterval = std::chrono::milliseconds(200);

// Reports the growth of a file being written by someone else, from a thread
// of its own, until destroyed.
class FileGrowthReporter {
public:
    FileGrowthReporter(const DiskStore::CopyProgress& report, std::string path, uint64 total)
        : m_report(report), m_path(std::move(path)), m_total(total) {
        if (m_report) {
            m_thread = std::thread([this] { Run(); });
        }
    }
    ~FileGrowthReporter() {
        if (m_thread.joinable()) {
            {
                std::lock_guard lock(m_mutex);
                m_done = true;
            }
            m_wake.notify_one();
            m_thread.join();
        }
    }
    FileGrowthReporter(const FileGrowthReporter&) = delete;
    FileGrowthReporter& operator=(const FileGrowthReporter&) = delete;

private:
    void Run() {
        std::unique_lock lock(m_mutex);
        while (!m_wake.wait_for(lock, kProgressInterval, [this] { return m_done; })) {
            struct stat st;
            if (::stat(m_path.c_str(), &st) == 0) {
                m_report(static_cast<uint64>(st.st_size), m_total);
            }
        }
    }

    const DiskStore::CopyProgress& m_report;
    std::string m_path;
    uint64 m_total;
    std::mutex m_mutex;
    std::condition_variable m_wake;
    bool m_done = false;
    std::thread m_thread;
};

int64 SizeOf(const fs::path& path) {
    std::error_code ec;
    const auto size = fs::file_size(path, ec);
    return ec ? 0 : static_cast<int64>(size);
}

}  // namespace

void LmdbStore::FinishCheckpoint() {
    CommitBatch nothing;
    nothing.nextIdentity = NextIdentity();
    Commit(nothing);
}

DiskCopy LmdbStore::CopyTo(const std::string& dir, bool compact, const CopyProgress& progress) {
    const fs::path data = fs::path(dir) / "data.mdb";
    std::error_code ec;
    for (const fs::path& stale : {data, fs::path(dir) / "lock.mdb"}) {
        fs::remove(stale, ec);
    }
    {
        FileGrowthReporter reporter(progress, data.string(), DataBytes(compact));
        CopyTo(dir, compact);
    }
    return DiskCopy{SizeOf(data)};
}

void LmdbStore::CheckFile() {
    CheckLmdbPages(m_dir);
}

int64 LmdbStore::FileBytes() {
    return SizeOf(fs::path(m_dir) / "data.mdb");
}

double LmdbStore::FreeShare() {
    const int64 file = FileBytes();
    if (file <= 0) {
        return 0;
    }
    const double used = static_cast<double>(DataBytes(true)) / static_cast<double>(file);
    return used >= 1 ? 0 : 1 - used;
}

std::unique_ptr<DiskStore> OpenDiskStore(const std::string& dir, const DiskStoreOptions& options) {
    LmdbStoreOptions lmdb;
    lmdb.mode = options.mode;
    lmdb.syncOnCommit = options.syncOnCommit;
    return LmdbStore::Open(dir, lmdb);
}

}  // namespace tarn
