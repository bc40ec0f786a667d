#pragma once

// Collections in archives: a count, then the items, nothing after them.
//
//   count   varint   number of items (low 32 bits)
//   items   count x (item as its own operator<< writes it)
//
// Items are written in the collection's own iteration order, so a reader
// that appends at the end of an ordered collection places each item next to
// the previous one.

#include "tnUtils/Archive.h"
#include "tnUtils/Assert.h"
#include "tnUtils/Types.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {

template <typename ArchiveT, typename C>
void SerialiseCollection(ArchiveT& ar, const C& c) {
    ar << AsCompressedInt<uint64>(c.size());
    for (const auto& e : c) {
        ar << e;
    }
}

// Replaces the content of `c` with the items read, each read into a fresh,
// default-constructed V and inserted with the end as the position hint. A
// collection with unique keys keeps the first of two items with one key.
template <typename V, typename ArchiveT, typename C>
void DeserialiseCollectionWithAppend(ArchiveT& ar, C& c) {
    CompressedInt<int64> n(0);
    ar >> n;
    TARN_ASSERT(0 <= n.val);
    c.clear();
    for (int64 i = 0; i < n.val; ++i) {
        V v{};
        ar >> v;
        c.insert(c.end(), v);
    }
}

}  // namespace tarn
