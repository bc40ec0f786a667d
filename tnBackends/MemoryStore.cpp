#include "tnBackends/MemoryStore.h"

#include <mutex>
#include <vector>

namespace tarn {

std::optional<StoredImage> MemoryStore::Load(uint64 oid) {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    auto it = m_images.find(oid);
    if (it == m_images.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::optional<uint64> MemoryStore::FindRoot(std::string_view name) {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    auto it = m_roots.find(name);
    if (it == m_roots.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::map<std::string, uint64> MemoryStore::Roots() {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    return std::map<std::string, uint64>(m_roots.begin(), m_roots.end());
}

std::optional<uint64> MemoryStore::FindCounter(std::string_view name) {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    auto it = m_counters.find(name);
    if (it == m_counters.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::map<std::string, uint64> MemoryStore::Counters() {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    return std::map<std::string, uint64>(m_counters.begin(), m_counters.end());
}

uint64 MemoryStore::NextIdentity() {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    return m_nextIdentity;
}

void MemoryStore::Commit(const CommitBatch& batch) {
    // 1. Build everything that allocates: new image nodes, the new roots and
    //    counters.
    std::vector<std::map<uint64, StoredImage>::node_type> nodes;
    nodes.reserve(batch.writes.size());
    const auto add = [&](uint64 oid, const StoredImage& image) {
        std::map<uint64, StoredImage> one;
        one.emplace(oid, image);
        nodes.push_back(one.extract(one.begin()));
    };
    for (const auto& [oid, image] : batch.writes) {
        add(oid, image);
    }
    if (batch.streamedWrites) {
        batch.streamedWrites(add);
    }
    std::unique_lock<std::shared_mutex> lock(m_mutex);
    std::map<std::string, uint64, std::less<>> roots = m_roots;
    for (const auto& [name, oid] : batch.roots) {
        roots[name] = oid;
    }
    std::map<std::string, uint64, std::less<>> counters;
    if (!batch.counters.empty()) {
        counters = m_counters;
        for (const auto& [name, value] : batch.counters) {
            counters[name] = value;
        }
    }
    // 2. Apply without allocating: relinking nodes and erasing cannot throw.
    //    Writes go first, then deletions, as in every store: an identity both
    //    written and deleted in one batch ends up without an image.
    for (auto& node : nodes) {
        m_images.erase(node.key());
        m_images.insert(std::move(node));
    }
    for (uint64 oid : batch.deletes) {
        m_images.erase(oid);
    }
    m_roots.swap(roots);
    if (!batch.counters.empty()) {
        m_counters.swap(counters);
    }
    m_nextIdentity = batch.nextIdentity;
    ++m_numCommits;
}

void MemoryStore::ForEachIdentity(const std::function<void(uint64)>& fn) {
    std::vector<uint64> oids;
    {
        std::shared_lock<std::shared_mutex> lock(m_mutex);
        oids.reserve(m_images.size());
        for (const auto& entry : m_images) {
            oids.push_back(entry.first);
        }
    }
    for (uint64 oid : oids) {
        fn(oid);
    }
}

ImageCounts MemoryStore::Stats() {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    ImageCounts stats;
    stats.numImages = static_cast<ssize_t>(m_images.size());
    for (const auto& [oid, image] : m_images) {
        stats.numImageBytes += static_cast<ssize_t>(image.className.size() + image.bytes.size());
    }
    return stats;
}

ssize_t MemoryStore::NumCommits() {
    std::shared_lock<std::shared_mutex> lock(m_mutex);
    return m_numCommits;
}

}  // namespace tarn
