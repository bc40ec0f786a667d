// Node construction, copying and destruction, and the choice of a child by
// key. See FieldIdToOffsetOpsOnInt64FieldMapNodes.h.

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodes.h"

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

using InternalNode = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
using LeafNode = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using LeafEntry = FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry;

// Copy-constructs rhs's live entries into the raw slots of `node`, counting
// each one as soon as it is whole, so that a failure part-way leaves exactly
// the counted entries to destroy.
void CopyInternalEntries(InternalNode* node, const InternalNode& rhs) {
    for (ssize_t i = 0; i < rhs.m_numKeyEntrys; ++i) {
        CopyConstructInternalEntry(node, i, rhs.GetEntry(i));
        node->m_numKeyEntrys = i + 1;
    }
}

void CopyLeafEntries(LeafNode* node, const LeafNode& rhs) {
    for (ssize_t i = 0; i < rhs.m_numKeyEntrys; ++i) {
        LeafEntry& e = node->GetEntry(i);
        const LeafEntry& src = rhs.GetEntry(i);
        FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(e.first, src.first);
        FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(e.second);
        node->m_numKeyEntrys = i + 1;
        e.second = src.second;
    }
}

}  // namespace

// ---- Internal node -----------------------------------------------------------

InternalNode::FieldIdToOffsetOpsOnInt64FieldMapInternalNode(const InternalNode& rhs)
    : PersistableMixin(rhs), m_ptr(rhs.m_ptr), m_numKeyEntrys(0) {
    try {
        CopyInternalEntries(this, rhs);
    } catch (...) {
        DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
        throw;
    }
}

InternalNode& InternalNode::operator=(const InternalNode& rhs) {
    if (this != &rhs) {
        DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
        m_numKeyEntrys = 0;
        m_ptr = rhs.m_ptr;
        CopyInternalEntries(this, rhs);
    }
    return *this;
}

InternalNode::~FieldIdToOffsetOpsOnInt64FieldMapInternalNode() {
    DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
}

std::pair<void*, ssize_t> InternalNode::FindChildGivenKey2(const FieldId& key) const {
    ssize_t nk = m_numKeyEntrys;
    TARN_ASSERT(1 <= nk && nk <= 100);
    if (CompareKeys(key, GetEntry(0).m_key) < 0) {
        return {m_ptr.Get(), -1};
    }
    ssize_t lo = 1;
    ssize_t hi = nk;
    while (lo < hi) {
        ssize_t mid = (lo + hi) / 2;
        TARN_ASSERT(1 <= mid && mid < nk);
        if (CompareKeys(key, GetEntry(mid).m_key) < 0) {
            hi = mid;
        } else {
            lo = mid + 1;
        }
    }
    TARN_ASSERT(lo == hi);
    TARN_ASSERT(1 <= lo && lo <= nk);
    return {GetEntry(lo - 1).m_ptr.Get(), lo - 1};
}

// ---- Leaf node ---------------------------------------------------------------

LeafNode::FieldIdToOffsetOpsOnInt64FieldMapLeafNode(const LeafNode& rhs)
    : PersistableMixin(rhs), m_prev(rhs.m_prev), m_next(rhs.m_next), m_numKeyEntrys(0) {
    try {
        CopyLeafEntries(this, rhs);
    } catch (...) {
        DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
        throw;
    }
}

LeafNode& LeafNode::operator=(const LeafNode& rhs) {
    if (this != &rhs) {
        DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
        m_numKeyEntrys = 0;
        m_prev = rhs.m_prev;
        m_next = rhs.m_next;
        CopyLeafEntries(this, rhs);
    }
    return *this;
}

LeafNode::~FieldIdToOffsetOpsOnInt64FieldMapLeafNode() {
    DestructArrayElements(&GetEntry(0), m_numKeyEntrys);
}

}  // namespace tarn
