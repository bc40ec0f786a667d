#pragma once

// The vector time of the replicated store over its sites: for each site S,
// a sequence number T within that site's history. Only declared here; its
// definition belongs to the store's reconciliation of sites, which is not
// part of this library.

namespace tarn {

template <typename S, typename T>
class TVectorTime;

}  // namespace tarn
