// Replicas: what a store has seen of each site, and joining another replica.
//
// Each site's operations reach every replica in that site's order, so a
// replica's record of a field and a site is (the newest stamp it saw, the sum
// of that site's offsets up to it): the later stamp covers the earlier, and
// a merge needs the records only, not the operations.

#include <filesystem>
#include <limits>

#include "tnStore/OffsetOpsStore.h"
#include "tnStore/OffsetOpsStoreImpl.h"

namespace tarn {

namespace {

// The record of `site` in `table`, or stamp -1 and sum 0 when it has none.
SiteRecord RecordOf(const std::optional<FieldTable>& table, const Guid& site) {
    const SiteRecord* found = table ? FindSite(*table, site) : nullptr;
    return found != nullptr ? *found : SiteRecord{site, -1, 0};
}

// The next offset that moves `sum` toward `target` without overflow.
int64 StepToward(int64 sum, int64 target) {
    const __int128 diff = static_cast<__int128>(target) - sum;
    if (diff > std::numeric_limits<int64>::max()) {
        return std::numeric_limits<int64>::max();
    }
    if (diff < std::numeric_limits<int64>::min()) {
        return std::numeric_limits<int64>::min();
    }
    return static_cast<int64>(diff);
}

}  // namespace

MergeResult OffsetOpsStore::Merge(const std::filesystem::path& fromDir,
                                  const MergeOptions& options) {
    const std::string from = fromDir.string();
    OffsetOpsStoreImpl& handle = State();
    auto life = handle.ShareLife();
    std::unique_lock<std::mutex> writer;
    if (!options.dryRun) {
        writer = handle.LockWriter();  // one write at a time: the whole merge
    }
    if (options.dryRun) {
        handle.RequireOpen();
    } else {
        handle.RequireWritable();
    }
    std::error_code ec;
    if (!handle.Dir().empty() && std::filesystem::equivalent(handle.Dir(), from, ec)) {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "store '" + from + "' cannot be merged into itself");
    }
    StoreOptions reading;
    reading.mode = StoreMode::Read;
    reading.cacheObjects = options.cacheObjects;
    OffsetOpsStore source = Open(from, reading);

    MergeResult result;
    int64 sinceDurable = 0;
    source.ForEach([&](const FieldId& field, const FieldTable& theirs) {
        ++result.fields;
        const std::optional<FieldTable> ours = FindTable(handle, field);
        for (const SiteRecord& their : theirs) {
            const Guid& site = their.site;
            const SiteRecord our = RecordOf(ours, site);
            if (their.t < our.t) {
                continue;  // ours covers theirs
            }
            if (their.t == our.t) {
                if (their.o != our.o) {
                    ++result.conflicts;
                    if (options.onConflict) {
                        options.onConflict(MergeConflict{field, site, our, their});
                    }
                }
                continue;
            }
            ++result.taken;
            if (options.dryRun) {
                continue;
            }
            for (int64 sum = our.o; sum != their.o;) {
                const int64 step = StepToward(sum, their.o);
                handle.RecordOperation(Opid(site, their.t), field, step);
                sum += step;
                ++result.operations;
                ++sinceDurable;
            }
            if (our.o == their.o) {
                // Equal sums under a later stamp: the stamp moves alone.
                handle.RecordOperation(Opid(site, their.t), field, 0);
                ++result.operations;
                ++sinceDurable;
            }
        }
        if (sinceDurable >= options.durableEvery) {
            handle.MakeDurable();
            sinceDurable = 0;
        }
        return true;
    });
    if (!options.dryRun) {
        handle.MakeDurable();
    }
    return result;
}

}  // namespace tarn
