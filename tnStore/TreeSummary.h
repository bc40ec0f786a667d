#pragma once

// What a store keeps about its tree with every checkpoint, so that opening
// reads it instead of walking the tree: the refusal bounds (each site's
// newest time stamp, the bound on every sum's magnitude) and, through the
// space's population counters, the numbers of leaves and internal nodes.
// The field count and the height are in the map's header.
//
// Kept as named counters, committed with the checkpoint's images:
//   "summary:version"      1 (absent: a store from before summaries)
//   "summary:largest-sum"  the sum bound
//   "summary:site:<guid>"  the site's newest stamp + 1 (0: the site has no
//                          table any more, after Clear)

#include "tnRuntime/CSpace.h"
#include "tnStore/MemoryBound.h"
#include "tnStore/RefusalBounds.h"
#include "tnStore/TreeSpace.h"

namespace tarn {

// Reads the summary into `bounds`; false when the store has none.
bool LoadTreeSummary(const CSpace& space, RefusalBounds& bounds);
// Sets the summary's counters for the next commit. Exclusive.
void SetTreeSummary(CSpace& space, const RefusalBounds& bounds);
// For a store from before summaries: walks the stored tree (within the
// memory bound) for the bounds and the node counts, and sets the counters
// for the next commit. Exclusive.
void RebuildTreeSummary(TreeSpace& tree, MemoryBound& memory, RefusalBounds& bounds);

}  // namespace tarn
