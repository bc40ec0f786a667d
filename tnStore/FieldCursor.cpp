#include "tnStore/FieldCursor.h"

#include <algorithm>

#include "tnStore/OffsetOpsStoreImpl.h"

namespace tarn {

FieldCursor::FieldCursor(OffsetOpsStore& store, const FieldId& from, std::optional<FieldId> to)
    : m_store(&store), m_from(from), m_to(std::move(to)) {
    Seek(from);
}

bool FieldCursor::InRange(const FieldId& key) const {
    return !(key < m_from) && (!m_to || !(*m_to < key));
}

void FieldCursor::Fill(BatchFrom from, const FieldId& key) {
    std::vector<FieldEntry> read = ReadBatch(m_store->State(), from, key, kBatch);
    const bool backward = from != BatchFrom::AtOrAfter && from != BatchFrom::After;
    // The nearest entries come first: keep them while they are in range.
    std::size_t keep = 0;
    while (keep < read.size() && InRange(read[keep].first)) {
        ++keep;
    }
    read.resize(keep);
    if (backward) {
        std::reverse(read.begin(), read.end());
    }
    m_batch = std::move(read);
    m_at = m_batch.empty() ? 0 : backward ? m_batch.size() - 1 : 0;
}

void FieldCursor::Next() {
    if (AtEnd()) {
        return;
    }
    if (m_at + 1 < m_batch.size()) {
        ++m_at;
        return;
    }
    const FieldId last = Key();
    Fill(BatchFrom::After, last);
}

void FieldCursor::Prev() {
    if (AtEnd()) {
        SeekToLast();
        return;
    }
    if (m_at > 0) {
        --m_at;
        return;
    }
    const FieldId first = Key();
    Fill(BatchFrom::Before, first);
}

void FieldCursor::Seek(const FieldId& key) {
    Fill(BatchFrom::AtOrAfter, key < m_from ? m_from : key);
}

void FieldCursor::SeekToLast() {
    if (m_to) {
        Fill(BatchFrom::AtOrBefore, *m_to);
    } else {
        Fill(BatchFrom::End, FieldId());
    }
}

}  // namespace tarn
