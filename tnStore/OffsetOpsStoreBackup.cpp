// Backups: a consistent copy of an on-disk store, made beside its writer.
//
// A store is its data file (the tree as of the last checkpoint, with the
// journal position that checkpoint covers) plus its journal (the durable
// points after it). The writer checkpoints and starts a new journal at any
// time, so the two are copied as a pair that belongs together:
//   1. open the journal (a later checkpoint renames a new one over the name,
//      but this descriptor keeps the file it opened);
//   2. copy the data file; the copy holds one commit, as of some checkpoint
//      P, which it names;
//   3. scan the opened journal: when it begins at P, its complete records are
//      the durable points after the copied checkpoint, and the copy gets
//      them; when it ends at P, the checkpoint holds all of it (it has been
//      replaced since), and the copy gets an empty journal that begins at P.
//      Anything else means the writer checkpointed twice between 1 and 2, a
//      moment apart: start again.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <limits>
#include <vector>

#include "tnBackends/DiskStore.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnStore/OffsetOpsStoreImpl.h"
#include "tnUtils/FileIo.h"
#include "tnUtils/UniqueFd.h"

namespace tarn {

namespace {

namespace fs = std::filesystem;

// Copies started again because the writer checkpointed twice as one began.
constexpr int kBackupAttempts = 8;

[[noreturn]] void IoFailure(const std::string& path, const char* doing, int error) {
    throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                       std::string(doing) + " '" + path + "': " + SystemErrorText(error));
}

void SyncPath(const std::string& path, int flags) {
    UniqueFd fd(::open(path.c_str(), flags | O_CLOEXEC));
    if (fd.Get() < 0 || ::fsync(fd.Get()) != 0) {
        IoFailure(path, "syncing", errno);
    }
}

// The target must be new or an empty directory; its parent is made if
// missing.
void RequireFreeTarget(const fs::path& to) {
    std::error_code ec;
    const fs::file_status status = fs::symlink_status(to, ec);
    if (fs::exists(status)) {
        if (!fs::is_directory(status)) {
            throw RuntimeError(RuntimeError::Category::Refused,
                               "backup target '" + to.string() + "' exists and is not a directory");
        }
        if (!fs::is_empty(to, ec) || ec) {
            throw RuntimeError(RuntimeError::Category::Refused,
                               "backup target '" + to.string() + "' exists and is not empty");
        }
    } else if (ec && ec != std::errc::no_such_file_or_directory) {
        throw RuntimeError(RuntimeError::CategoryOfErrno(ec.value()),
                           "backup target '" + to.string() + "': " + ec.message());
    }
    const fs::path parent = to.has_parent_path() ? to.parent_path() : fs::path(".");
    fs::create_directories(parent, ec);
    if (ec || !fs::is_directory(parent, ec)) {
        throw RuntimeError(
            ec ? RuntimeError::CategoryOfErrno(ec.value()) : RuntimeError::Category::Refused,
            "cannot make the directory '" + parent.string() +
                "': " + (ec ? ec.message() : std::string("it is not a directory")));
    }
}

// A sibling of the target in which the copy is made; removed unless Keep().
class PartialCopy {
public:
    explicit PartialCopy(const fs::path& to)
        : m_path(to.parent_path() /
                 ("." + to.filename().string() + ".backup-" + std::to_string(::getpid()))) {
        std::error_code ec;
        fs::remove_all(m_path, ec);  // left by an earlier run of this process id
        if (!fs::create_directory(m_path, ec)) {
            throw RuntimeError(
                ec ? RuntimeError::CategoryOfErrno(ec.value()) : RuntimeError::Category::InUse,
                "cannot make the directory '" + m_path.string() +
                    "': " + (ec ? ec.message() : std::string("it exists")));
        }
    }
    ~PartialCopy() {
        if (!m_kept) {
            std::error_code ec;
            fs::remove_all(m_path, ec);
        }
    }
    PartialCopy(const PartialCopy&) = delete;
    PartialCopy& operator=(const PartialCopy&) = delete;

    const fs::path& Path() const { return m_path; }
    // Renames the finished copy to `to` (over an empty directory there) and
    // syncs both directories.
    void MoveTo(const fs::path& to) {
        SyncPath(m_path.string(), O_RDONLY | O_DIRECTORY);
        if (::rename(m_path.c_str(), to.c_str()) != 0) {
            const int error = errno;
            if (error == ENOTEMPTY || error == EEXIST) {
                throw RuntimeError(RuntimeError::Category::InUse,
                                   "backup target '" + to.string() +
                                       "' is no longer empty: something wrote into it meanwhile");
            }
            IoFailure(to.string(), "renaming the copy to", error);
        }
        m_kept = true;
        const fs::path parent = to.has_parent_path() ? to.parent_path() : fs::path(".");
        SyncPath(parent.string(), O_RDONLY | O_DIRECTORY);
    }

private:
    fs::path m_path;
    bool m_kept = false;
};

// Copies the first `bytes` bytes of the open file `fd` into a new file
// `target`, synced.
void CopyPrefix(int fd, const std::string& source, uint64 bytes, const std::string& target) {
    UniqueFd out(::open(target.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
    if (out.Get() < 0) {
        IoFailure(target, "creating", errno);
    }
    std::vector<char> buffer(std::size_t{1} << 20);
    for (uint64 at = 0; at < bytes;) {
        const std::size_t want =
            static_cast<std::size_t>(std::min<uint64>(buffer.size(), bytes - at));
        const ssize_t got = ReadAt(fd, buffer.data(), want, at);
        if (got < 0) {
            IoFailure(source, "reading", errno);
        }
        if (got < static_cast<ssize_t>(want)) {
            throw RuntimeError(RuntimeError::Category::InUse,
                               "journal '" + source + "' was cut while being copied");
        }
        if (const int error = WriteAt(out.Get(), buffer.data(), want, at)) {
            IoFailure(target, "writing", error);
        }
        at += want;
    }
    if (::fsync(out.Get()) != 0) {
        IoFailure(target, "syncing", errno);
    }
}

int64 FileBytes(const fs::path& path) {
    std::error_code ec;
    const auto size = fs::file_size(path, ec);
    return ec ? 0 : static_cast<int64>(size);
}

// A copy rewrites every message about it to name the source store.
RuntimeError AsSourceError(const std::string& dir, const fs::path& copy, const RuntimeError& e) {
    std::string what = e.what();
    for (std::size_t at; (at = what.find(copy.string())) != std::string::npos;) {
        what.replace(at, copy.string().size(), dir);
    }
    return RuntimeError(e.GetCategory(), "no backup made: " + what);
}

// Opens the copied data file as any opening does (which makes its lock
// file, whose absence a later opening would report as a repair), looks up
// every image in it and each root's (each image is
// checked against its checksum: a copy that cannot be read back is no
// backup), and returns the journal
// position its checkpoint covers (0 when it has none: a store made before
// journals). Damage is reported as the source store's.
uint64 CheckCopy(const std::string& dir, const fs::path& copy) {
    try {
        DiskStoreOptions options;
        options.mode = OpenMode::ReadOnly;
        std::unique_ptr<DiskStore> copied = OpenDiskStore(copy.string(), options);
        std::vector<uint64> identities;
        copied->ForEachIdentity([&](uint64 oid) { identities.push_back(oid); });
        // A key the walk finds and the lookup misses means damaged index
        // pages: a reader of the copy would find that image missing.
        for (uint64 oid : identities) {
            if (!copied->Load(oid)) {
                throw RuntimeError(RuntimeError::Category::Damaged,
                                   "store '" + copy.string() + "': image #" + std::to_string(oid) +
                                       " is listed but cannot be looked up: its index is damaged");
            }
        }
        for (const auto& [name, oid] : copied->Roots()) {
            if (!copied->Load(oid)) {
                throw RuntimeError(RuntimeError::Category::Damaged,
                                   "store '" + copy.string() + "': root '" + name + "' names #" +
                                       std::to_string(oid) + ", which has no image");
            }
        }
        return copied->FindCounter(kJournalPositionCounter).value_or(0);
    } catch (const RuntimeError& e) {
        throw AsSourceError(dir, copy, e);
    }
}

// The walks that check a copy keep at most this many tree objects in memory.
constexpr ssize_t kCheckCacheObjects = 4096;

// Opens the finished copy as a reader of it would (its meta values, its
// record, its journal replayed onto the copied checkpoint) and checks the
// whole of it: every node, the leaf chain, the counts it keeps, every image
// reached. A copy that a reader could not use is no backup.
void CheckCopyAsReader(const std::string& dir, const fs::path& copy) {
    try {
        StoreOptions options;
        options.mode = StoreMode::Read;
        options.cacheObjects = kCheckCacheObjects;
        OffsetOpsStore copied = OffsetOpsStore::Open(copy.string(), options);
        const StoreValidation v = copied.Validate();  // the file's structure included
        if (!v.check.Ok()) {
            throw RuntimeError(
                RuntimeError::Category::Damaged,
                "store '" + copy.string() + "': " +
                    (v.check.problems.empty() ? std::string("damaged") : v.check.problems.front()));
        }
    } catch (const RuntimeError& e) {
        throw AsSourceError(dir, copy, e);
    }
}

// Copies the data file and the journal of the store in `dir` (whose data
// file `disk` has open) into `copy`. False when the writer checkpointed
// twice between opening the journal and starting the copy.
bool TryCopy(DiskStore& disk, const std::string& dir, const fs::path& copy,
             const BackupOptions& options, BackupResult& result) {
    const std::string journalPath = (fs::path(dir) / Journal::kFileName).string();
    std::error_code ec;
    std::optional<UniqueFd> journal;
    if (fs::exists(journalPath, ec) ||
        disk.FindLatestCounter(kJournalPositionCounter).has_value()) {
        journal.emplace(Journal::OpenForReading(journalPath));
    }
    const fs::path journalCopy = copy / Journal::kFileName;
    fs::remove(journalCopy, ec);  // left by an earlier attempt
    const DiskCopy copied = disk.CopyTo(copy.string(), options.compact, options.progress);
    const uint64 checkpoint = CheckCopy(dir, copy);
    result.checkpointedOperations = checkpoint;
    result.durableOperations = checkpoint;
    result.dataBytes = copied.dataBytes;
    result.journalBytes = 0;
    if (!journal) {
        return true;  // a store made before journals: its data file is all of it
    }
    const JournalScan scan =
        Journal::Scan(journal->Get(), journalPath, std::numeric_limits<uint64>::max(),
                      [](uint64, const JournalEntry&) {});
    if (scan.base == checkpoint) {
        CopyPrefix(journal->Get(), journalPath, scan.validBytes, journalCopy.string());
        result.durableOperations = scan.end;
    } else if (scan.end == checkpoint) {
        Journal::Reset(copy.string(), checkpoint, true);
    } else {
        return false;
    }
    result.journalBytes = FileBytes(journalCopy);
    return true;
}

BackupResult BackupWith(DiskStore& disk, const std::string& dir, const std::string& to,
                        const BackupOptions& options) {
    if (to.empty()) {
        throw RuntimeError(RuntimeError::Category::Refused, "a backup needs a target directory");
    }
    // "b/" and "b/." name the directory b.
    fs::path target = fs::path(to).lexically_normal();
    if (target.filename().empty() && target.has_parent_path()) {
        target = target.parent_path();
    }
    if (target.empty() || target == "." || target == "..") {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "backup target '" + to + "' exists and is not empty");
    }
    RequireFreeTarget(target);
    std::error_code ec;
    const fs::path store = fs::weakly_canonical(dir, ec);
    const fs::path inside = fs::weakly_canonical(target, ec).lexically_relative(store);
    if (!ec && !inside.empty() && *inside.begin() != "..") {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "backup target '" + to + "' is inside the store '" + dir + "'");
    }
    PartialCopy copy(target);
    BackupResult result;
    for (int attempt = 1; !TryCopy(disk, dir, copy.Path(), options, result); ++attempt) {
        if (attempt == kBackupAttempts) {
            throw RuntimeError(RuntimeError::Category::InUse,
                               "no backup made: in " + std::to_string(kBackupAttempts) +
                                   " attempts, the checkpoint copied from store '" + dir +
                                   "' never met its journal: the store is damaged, or its writer "
                                   "checkpointed twice as each attempt began");
        }
    }
    CheckCopyAsReader(dir, copy.Path());
    copy.MoveTo(target);
    return result;
}

}  // namespace

BackupResult OffsetOpsStore::Backup(const std::filesystem::path& from,
                                    const std::filesystem::path& to, const BackupOptions& options) {
    DiskStoreOptions reading;
    reading.mode = OpenMode::ReadOnly;
    std::unique_ptr<DiskStore> disk = OpenDiskStore(from.string(), reading);
    return BackupWith(*disk, from.string(), to.string(), options);
}

BackupResult OffsetOpsStore::Backup(const std::filesystem::path& to, const BackupOptions& options) {
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    handle.RequireOpen();
    DiskStore* disk = handle.Tree().Disk();
    if (disk == nullptr) {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "an in-memory store cannot be backed up");
    }
    return BackupWith(*disk, handle.Dir(), to.string(), options);
}

}  // namespace tarn
