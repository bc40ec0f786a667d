#pragma once

// The in-memory store, the default store of a space: images, named roots,
// named counters and the identity counter in ordinary containers.
// Thread-safe; Commit applies a batch entirely or (when it throws, e.g. for
// lack of memory) not at all.

#include <map>
#include <shared_mutex>

#include "tnBackends/IStore.h"

namespace tarn {

class MemoryStore final : public IStore {
public:
    std::optional<StoredImage> Load(uint64 oid) override;
    std::optional<uint64> FindRoot(std::string_view name) override;
    std::map<std::string, uint64> Roots() override;
    std::optional<uint64> FindCounter(std::string_view name) override;
    std::map<std::string, uint64> Counters() override;
    uint64 NextIdentity() override;
    void Commit(const CommitBatch& batch) override;
    void ForEachIdentity(const std::function<void(uint64)>& fn) override;
    ImageCounts Stats() override;

    // Number of Commit calls that succeeded.
    ssize_t NumCommits();

private:
    std::shared_mutex m_mutex;
    std::map<uint64, StoredImage> m_images;
    std::map<std::string, uint64, std::less<>> m_roots;
    std::map<std::string, uint64, std::less<>> m_counters;
    uint64 m_nextIdentity = 1;
    ssize_t m_numCommits = 0;
};

}  // namespace tarn
