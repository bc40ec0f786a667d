#pragma once

// Batches of fields and their tables, as walks and cursors read them from a
// store: a few hundred entries copied at a time with the store held, used
// without it.

#include <cstddef>
#include <utility>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnStore/FieldTable.h"

namespace tarn {

class OffsetOpsStoreImpl;

// Where a batch is read: from the first field not less than the key, after
// it, before it, from it back, or from the end back (the key unused).
enum class BatchFrom { AtOrAfter, After, Before, AtOrBefore, End };

using FieldEntry = std::pair<FieldId, FieldTable>;

// Up to `max` entries of those `from` says, the nearest to the key (or the
// end) first: ascending after the key, descending before it.
std::vector<FieldEntry> ReadBatch(OffsetOpsStoreImpl& store, BatchFrom from, const FieldId& key,
                                  std::size_t max);

}  // namespace tarn
