#pragma once

// Opening and recovery: a handle's parts built over a store directory or
// memory, the record found (or made), the tree's summary read and the
// journal's operations after the last checkpoint replayed.
//
// A writer replays the journal into its tree and appends after its last
// complete record (a torn tail is cut and reported). A reader takes one
// snapshot of the last checkpoint and replays the journal's complete records
// after it into its own memory; when the writer has started a newer journal
// since the snapshot, the reader takes a new snapshot, a few times at most.
// Opening reads the store's meta values and the journal, and no tree node
// beyond the record and the map's header (except once, for a store from
// before summaries: see TreeSummary.h).

#include <filesystem>
#include <memory>

#include "tnStore/OffsetOpsStoreImpl.h"

namespace tarn {

std::unique_ptr<OffsetOpsStoreImpl> OpenStoreDirectory(const std::filesystem::path& dir,
                                                       const StoreOptions& options);
std::unique_ptr<OffsetOpsStoreImpl> OpenStoreInMemory(const StoreOptions& options);

}  // namespace tarn
