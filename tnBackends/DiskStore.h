#pragma once

// What the layers above ask of an on-disk store beyond IStore, in their own
// words: a checkpoint's transaction, a consistent copy, compaction, a check of
// the whole file, the file's size and its share of free space. How a backend
// does each (its files, its page walks, its transactions) stays inside it;
// the one backend today is tnBackends/LmdbStore.h, opened by OpenDiskStore.
//
// Threads: as the implementation says (LmdbStore: any thread, calls
// serialised by its own mutex).

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tnBackends/IStore.h"

namespace tarn {

enum class OpenMode {
    CreateIfMissing,  // make the directory and an empty store when there is none
    MustExist,        // the directory must already hold a store
    ReadOnly,         // an existing store, read as one snapshot beside any writer; Commit asserts
};

// What a consistent copy wrote.
struct DiskCopy {
    int64 dataBytes = 0;  // the copied data file
};

class DiskStore : public IStore {
public:
    // Called about five times a second while a copy is written, from another
    // thread, with the bytes written so far and about how many there are.
    using CopyProgress = std::function<void(uint64 copied, uint64 total)>;

    // The directory the store lives in.
    virtual const std::string& Directory() const = 0;
    // What opening repaired or changed, one line each.
    virtual const std::vector<std::string>& Repairs() const = 0;

    // Ends a checkpoint whose commits are done, so that the next checkpoint
    // can reuse the space this one freed instead of growing the file.
    virtual void FinishCheckpoint() = 0;
    // The named counter as the latest commit holds it, also for a read-only
    // store (whose other reads see the snapshot it opened).
    virtual std::optional<uint64> FindLatestCounter(std::string_view name) = 0;

    // Writes a copy of the store as of its latest commit into the existing
    // directory `dir`, replacing any of the store's own files a failed
    // earlier copy left there, synced. `compact` leaves out free space.
    // Runs beside the writer; the copy holds one commit.
    virtual DiskCopy CopyTo(const std::string& dir, bool compact, const CopyProgress& progress) = 0;
    // Writers: rewrites the file without its free space and puts it in place
    // of the old one, when no other process has the store open. False,
    // changing nothing, when another process has it open.
    virtual bool Compact() = 0;
    // Walks the whole file and throws RuntimeError (Damaged) at the first
    // damage; opening and lookups check only what they read.
    virtual void CheckFile() = 0;

    // The data file's size in bytes (0 when it cannot be read).
    virtual int64 FileBytes() = 0;
    // The share of the data file that a compaction would give back, 0..1.
    virtual double FreeShare() = 0;
};

struct DiskStoreOptions {
    OpenMode mode = OpenMode::CreateIfMissing;
    // Sync each commit to disk. Off: a crash of the process loses nothing,
    // a crash of the machine may lose the latest commits. Scratch stores only.
    bool syncOnCommit = true;
};

// Opens the on-disk store in `dir`.
std::unique_ptr<DiskStore> OpenDiskStore(const std::string& dir, const DiskStoreOptions& options);

}  // namespace tarn
