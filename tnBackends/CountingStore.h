#pragma once

// A store that forwards everything to another store and counts what commits
// write: images and their bytes (the bytes the classes' Serialise slots
// produced, without the store's own framing). The record command reports these
// counts. Owns the store it forwards to; thread-safety is that store's.

#include <memory>

#include "tnBackends/IStore.h"

namespace tarn {

class CountingStore final : public IStore {
public:
    explicit CountingStore(std::unique_ptr<IStore> inner) : m_inner(std::move(inner)) {}

    std::optional<StoredImage> Load(uint64 oid) override { return m_inner->Load(oid); }
    std::optional<uint64> FindRoot(std::string_view name) override {
        return m_inner->FindRoot(name);
    }
    std::map<std::string, uint64> Roots() override { return m_inner->Roots(); }
    std::optional<uint64> FindCounter(std::string_view name) override {
        return m_inner->FindCounter(name);
    }
    std::map<std::string, uint64> Counters() override { return m_inner->Counters(); }
    uint64 NextIdentity() override { return m_inner->NextIdentity(); }
    void Commit(const CommitBatch& batch) override {
        int64 images = 0;
        int64 bytes = 0;
        const auto count = [&](const StoredImage& image) {
            ++images;
            bytes += static_cast<int64>(image.bytes.size());
        };
        if (!batch.streamedWrites) {
            m_inner->Commit(batch);
        } else {
            // Counted as they pass; a store that retries streams them again.
            CommitBatch counted = batch;
            counted.streamedWrites = [&](const CommitBatch::ImageSink& sink) {
                images = 0;
                bytes = 0;
                batch.streamedWrites([&](uint64 oid, const StoredImage& image) {
                    count(image);
                    sink(oid, image);
                });
            };
            m_inner->Commit(counted);
        }
        for (const auto& [oid, image] : batch.writes) {
            count(image);
        }
        m_imagesWritten += images;
        m_bytesWritten += bytes;
        ++m_commits;
    }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        m_inner->ForEachIdentity(fn);
    }
    std::optional<uint64> LargestIdentity() override { return m_inner->LargestIdentity(); }
    StoreStats Stats() override { return m_inner->Stats(); }

    int64 ImagesWritten() const { return m_imagesWritten; }
    int64 BytesWritten() const { return m_bytesWritten; }
    int64 Commits() const { return m_commits; }

private:
    std::unique_ptr<IStore> m_inner;
    int64 m_imagesWritten = 0;
    int64 m_bytesWritten = 0;
    int64 m_commits = 0;
};

}  // namespace tarn
