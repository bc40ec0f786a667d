#pragma once

// A store that reads through to another store and keeps every commit to
// itself: the base store is never written. A space over it can commit the
// objects it changed and then release them, which a space over a read-only
// store cannot: a reader that replays operations on top of a snapshot keeps
// a bound on the objects in memory this way.
//
// Committed images go to an unlinked temporary file (in TMPDIR, or /tmp),
// so only their index (an identity, an offset and a length each) stays in
// memory; the file goes away with the store, also when the process dies. A
// newer image of an identity is appended, the older one left where it was;
// once the file is more than twice what its live images take (and more than
// the compaction floor), it is rewritten with those alone, so that it stays
// within a few times the size of what the space changed.
// Deletions, roots, counters and the identity counter are kept in memory and
// answered before the base's. Stats() is the base's: the overlay holds no
// stored images of its own.
//
// Thread-safe (one mutex). A write that fails (a full disk) throws
// RuntimeError and leaves the overlay as it was.

#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "tnBackends/IStore.h"

namespace tarn {

class OverlayStore final : public IStore {
public:
    static constexpr uint64 kDefaultCompactionFloor = uint64{64} << 20;

    // Throws RuntimeError when no temporary file can be made.
    explicit OverlayStore(std::shared_ptr<IStore> base,
                          uint64 compactionFloor = kDefaultCompactionFloor);
    ~OverlayStore() override;
    OverlayStore(const OverlayStore&) = delete;
    OverlayStore& operator=(const OverlayStore&) = delete;

    std::optional<StoredImage> Load(uint64 oid) override;
    std::optional<uint64> FindRoot(std::string_view name) override;
    std::map<std::string, uint64> Roots() override;
    std::optional<uint64> FindCounter(std::string_view name) override;
    std::map<std::string, uint64> Counters() override;
    uint64 NextIdentity() override;
    void Commit(const CommitBatch& batch) override;
    void ForEachIdentity(const std::function<void(uint64)>& fn) override;
    ImageCounts Stats() override;

    // The bytes of the temporary file.
    uint64 FileBytes();

    // Commits everything the overlay holds (its images, streamed from the
    // file in identity order, its deletions, roots, counters and identity
    // counter) to the base as one commit, and empties the overlay. When the
    // base's commit throws, the overlay is as it was.
    void FlushIntoBase();

private:
    struct Extent {
        uint64 offset;
        uint64 size;
        std::size_t className;  // index into m_classNames
    };

    std::size_t ClassIndex(const std::string& name);
    void Compact();

    std::shared_ptr<IStore> m_base;
    uint64 m_compactionFloor;
    std::mutex m_mutex;
    int m_fd = -1;
    uint64 m_end = 0;
    uint64 m_liveBytes = 0;  // of the images the index points to
    std::unordered_map<uint64, Extent> m_images;
    std::set<uint64> m_deleted;
    std::map<std::string, uint64, std::less<>> m_roots;
    std::map<std::string, uint64, std::less<>> m_counters;
    std::optional<uint64> m_nextIdentity;
    std::vector<std::string> m_classNames;
};

}  // namespace tarn
