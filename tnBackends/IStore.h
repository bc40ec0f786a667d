#pragma once

// Where object images live between processes.
//
// A store keeps, per object identity, the object's image: the registered name
// of its class and the bytes its Serialise slot wrote. It also keeps named
// roots (name -> identity), named counters (name -> 64-bit value, e.g. the
// journal position a commit covers) and the identity counter. All changes of one
// commit are applied by Commit as a single atomic step: after a crash the
// store holds the previous commit or the new one, never a mix.
//
// Stores report unreadable or corrupt contents by throwing RuntimeError.

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tnUtils/RuntimeError.h"
#include "tnUtils/Types.h"

namespace tarn {

struct StoredImage {
    std::string className;
    std::vector<octet_t> bytes;
};

// Everything one commit changes. A store applies the writes, then the
// deletions (deleting an identity without an image is no error), then the
// roots, the named counters and the identity counter. A space hands over its
// writes and deletions in increasing identity order, each identity once; a
// store accepts any order.
struct CommitBatch {
    using ImageSink = std::function<void(uint64 oid, const StoredImage& image)>;

    std::vector<std::pair<uint64, StoredImage>> writes;  // identity -> new image
    // More writes, handed to the sink one at a time while the store applies
    // the batch, after `writes`: for batches too large to hold in memory at
    // once. It may be called more than once (a store that retries its
    // transaction calls it again) and must give the same images each time;
    // each identity at most once, and none also in `writes`.
    std::function<void(const ImageSink&)> streamedWrites;
    std::vector<uint64> deletes;             // identities to remove
    std::map<std::string, uint64> roots;     // named roots to set
    std::map<std::string, uint64> counters;  // named counters to set
    uint64 nextIdentity = 1;                 // the identity counter
};

// How many images a store holds and their bytes.
struct ImageCounts {
    ssize_t numImages = 0;
    ssize_t numImageBytes = 0;  // bytes of all images as stored, framing included
};

class IStore {
public:
    virtual ~IStore() = default;

    // The image of `oid`, or nothing when the store has none.
    virtual std::optional<StoredImage> Load(uint64 oid) = 0;
    virtual std::optional<uint64> FindRoot(std::string_view name) = 0;
    virtual std::map<std::string, uint64> Roots() = 0;
    // The named counter's value, or nothing when no commit has set it.
    virtual std::optional<uint64> FindCounter(std::string_view name) = 0;
    // Every named counter the store holds.
    virtual std::map<std::string, uint64> Counters() = 0;
    // The next identity to hand out (1 in a new store).
    virtual uint64 NextIdentity() = 0;
    virtual void Commit(const CommitBatch& batch) = 0;
    // Calls `fn` for every stored identity, in increasing order.
    virtual void ForEachIdentity(const std::function<void(uint64)>& fn) = 0;
    // The largest stored identity, nothing when the store holds no image.
    // Stores that keep identities in order answer without a walk.
    virtual std::optional<uint64> LargestIdentity() {
        std::optional<uint64> largest;
        ForEachIdentity([&](uint64 oid) { largest = oid; });
        return largest;
    }
    virtual ImageCounts Stats() = 0;
};

}  // namespace tarn
