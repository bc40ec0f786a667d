#pragma once

// Which stored images no named root reaches.
//
// Starting from every named root, the walk follows the references each object
// reports through its VisitPrefs slot (for the offsets record: record -> map
// -> root -> children, down to the leaves), loading objects as it goes, and
// compares what it reached with the identities the store holds. It loads
// everything reachable, one object at a time, and keeps at most `bound` of
// them in memory (releasing clean ones down to half the bound); it holds the
// identities it has seen. Run it holding the space: exclusively when bounded,
// either lock otherwise.

#include <string>
#include <vector>

#include "tnRuntime/CSpace.h"

namespace tarn {

struct ReachabilityResult {
    int64 stored = 0;                 // images in the store
    int64 reached = 0;                // of those, reached from a root
    std::vector<uint64> unreachable;  // stored, not reached; increasing
    std::vector<std::string> errors;  // objects that could not be loaded
};

ReachabilityResult FindUnreachableImages(CSpace& space, ssize_t bound = 0);

}  // namespace tarn
