#pragma once

// A store that forwards everything to another store and counts what commits
// write: images and their bytes (the bytes the classes' Serialise slots
// produced, without the store's own framing). The record command reports these
// counts.

#include <memory>

#include "tnBackends/ForwardingStore.h"

namespace tarn {

class CountingStore final : public ForwardingStore {
public:
    explicit CountingStore(std::unique_ptr<IStore> inner) : ForwardingStore(std::move(inner)) {}

    void Commit(const CommitBatch& batch) override {
        int64 images = 0;
        int64 bytes = 0;
        const auto count = [&](const StoredImage& image) {
            ++images;
            bytes += static_cast<int64>(image.bytes.size());
        };
        if (!batch.streamedWrites) {
            Inner().Commit(batch);
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
            Inner().Commit(counted);
        }
        for (const auto& [oid, image] : batch.writes) {
            count(image);
        }
        m_imagesWritten += images;
        m_bytesWritten += bytes;
        ++m_commits;
    }
    int64 ImagesWritten() const { return m_imagesWritten; }
    int64 BytesWritten() const { return m_bytesWritten; }
    int64 Commits() const { return m_commits; }

private:
    int64 m_imagesWritten = 0;
    int64 m_bytesWritten = 0;
    int64 m_commits = 0;
};

}  // namespace tarn
