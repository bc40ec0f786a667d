#pragma once

// A position in a store's map that moves field by field in key order, either
// way, beside the store's ForEach walks:
//
//   for (FieldCursor c(store, from, to); !c.AtEnd(); c.Next()) {
//       use(c.Key(), c.Table());
//   }
//
// A cursor holds a batch of entries (copies of a few hundred fields and their
// tables) and reads the next batch from the store when it moves past either
// end of the one it holds; in between it does not touch the store, and the
// store's cache bound holds between batches as in any walk.
//
// What a cursor sees when the store changes while it is open (through this
// handle: Record, Clear, a merge): each batch is one consistent view of the
// store as of its reading. The entries a cursor holds stay as they were read;
// a batch read later shows the store as it is then, from the key next to the
// cursor's on. So a field added or changed beyond the batch at hand is seen,
// one within it or behind the cursor is not, and no field is seen twice
// while the cursor moves one way. A reader's handle sees what it saw when
// it opened (tnStore/OffsetOpsStore.h), so its cursors see no change at all.
//
// A cursor refers to its store, which must outlive it; it reads through the
// handle as any call does, so cursors of one handle may move on several
// threads beside the handle's other calls. One cursor is for one thread at a
// time. It is movable, not copyable.

#include <cstddef>
#include <optional>
#include <vector>

#include "tnStore/FieldBatch.h"
#include "tnStore/OffsetOpsStore.h"
#include "tnUtils/Assert.h"

namespace tarn {

class FieldCursor {
public:
    // At the first field not less than `from` (the default key: the first
    // field of all). Fields before `from` and after `to` (when given, an
    // inclusive bound) are out of the cursor's range.
    explicit FieldCursor(OffsetOpsStore& store, const FieldId& from = FieldId(),
                         std::optional<FieldId> to = std::nullopt);

    // Past either end of the range: no field is there.
    bool AtEnd() const { return m_at >= m_batch.size(); }
    // The field at the cursor and its table. At the end there is none: asking
    // stops the process, as any misuse does.
    const FieldId& Key() const {
        TARN_ASSERT(!AtEnd());
        return m_batch[m_at].first;
    }
    const FieldTable& Table() const {
        TARN_ASSERT(!AtEnd());
        return m_batch[m_at].second;
    }

    // To the next field in key order; past the last, to the end.
    void Next();
    // To the previous field; before the first, to the end. From the end, to
    // the last field of the range.
    void Prev();
    // To the first field not less than `key` (and not before the range).
    void Seek(const FieldId& key);
    // To the last field of the range.
    void SeekToLast();

private:
    // Reads the batch `from` says around `key`, keeps what is in range in
    // ascending order, and stands on its first (forward) or last entry.
    void Fill(BatchFrom from, const FieldId& key);
    bool InRange(const FieldId& key) const;

    static constexpr std::size_t kBatch = 256;

    OffsetOpsStore* m_store;
    FieldId m_from;
    std::optional<FieldId> m_to;
    std::vector<FieldEntry> m_batch;
    std::size_t m_at = 0;  // m_batch.size(): at the end
};

}  // namespace tarn
