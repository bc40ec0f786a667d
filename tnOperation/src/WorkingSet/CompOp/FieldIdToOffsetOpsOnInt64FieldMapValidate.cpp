// Read-only diagnostics of the map: structural validation, node counting and
// the indented tree dump. Each walks the whole tree depth-first, left to
// right, loading every node; none changes or marks anything.

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnUtils/xostream.h"

namespace tarn {

void FieldIdToOffsetOpsOnInt64FieldMap::Validate() const {
    if (m_height >= 0) {
        ValidateNode(m_height, m_root.Get(), true, nullptr, nullptr);
    }
}

// Checks node fill, key order inside the node and the separator bounds
// [k1, k2) handed down by the parent (null for no bound). The leaf chain,
// m_firstLeaf/m_lastLeaf and m_size are not looked at here.
// clang-format off
void FieldIdToOffsetOpsOnInt64FieldMap::ValidateNode(ssize_t height, void* node, bool isRoot,
                                                     const FieldId* k1, const FieldId* k2) const {
    TARN_ASSERT(node);
    TARN_ASSERT(height >= 0);
    if (height >= 1) {
        InternalNode* inode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(node);
        ssize_t nk = inode->m_numKeyEntrys;
        TARN_ASSERT(1 <= nk && nk <= 100);
        if (!isRoot) {
            TARN_ASSERT(50 <= nk);
        }
        for (ssize_t i = 1; i < nk; ++i) {
            TARN_ASSERT(CompareKeys(inode->GetEntry(i-1).m_key, inode->GetEntry(i).m_key) < 0);
        }
        if (k1) {
            TARN_ASSERT(CompareKeys(*k1,inode->GetEntry(0).m_key) <= 0);
        }
        if (k2) {
            TARN_ASSERT(CompareKeys(inode->GetEntry(nk-1).m_key, *k2) < 0);
        }
        ValidateNode(height - 1, inode->m_ptr.Get(), false, nullptr, &inode->GetEntry(0).m_key);
        for (ssize_t i = 0; i < nk; ++i) {
            const FieldId* upper = i + 1 < nk ? &inode->GetEntry(i + 1).m_key : nullptr;
            ValidateNode(height - 1, inode->GetEntry(i).m_ptr.Get(), false,
                         &inode->GetEntry(i).m_key, upper);
        }
    } else {
        LeafNode* leaf = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node);
        ssize_t nk = leaf->m_numKeyEntrys;
        TARN_ASSERT(0 <= nk && nk <= 100);
        if (!isRoot) {
            TARN_ASSERT(50 <= nk);
        }
        for (ssize_t i = 1; i < nk; ++i) {
            TARN_ASSERT(CompareKeys(leaf->GetEntry(i-1).first, leaf->GetEntry(i).first) < 0);
        }
        if (nk >= 1) {
            if (k1) {
                TARN_ASSERT(CompareKeys(*k1, leaf->GetEntry(0).first) <= 0);
            }
            if (k2) {
                TARN_ASSERT(CompareKeys(leaf->GetEntry(nk-1).first, *k2) < 0);
            }
        }
    }
}
// clang-format on

ssize_t FieldIdToOffsetOpsOnInt64FieldMap::GetNumNodes() const {
    return m_height < 0 ? 0 : GetNumNodes(m_height, m_root.Get());
}

ssize_t FieldIdToOffsetOpsOnInt64FieldMap::GetNumNodes(ssize_t height, void* node) const {
    TARN_ASSERT(node);
    if (height < 1) {
        return 1;
    }
    InternalNode* inode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(node);
    ssize_t c = 1 + GetNumNodes(height - 1, inode->m_ptr.Get());
    ssize_t nk = inode->m_numKeyEntrys;
    TARN_ASSERT(1 <= nk && nk <= 100);
    for (ssize_t i = 0; i < nk; ++i) {
        c += GetNumNodes(height - 1, inode->GetEntry(i).m_ptr.Get());
    }
    return c;
}

// Layout:
//   Height = <m_height>
//   {                      a node block; content 4 columns deeper
//       <leaf entry>       key --> payload, one line each
//   }
// An internal block holds its leftmost child's block, then for each
// separator the separator's line and its right child's block.
void FieldIdToOffsetOpsOnInt64FieldMap::Write(xostream& os) const {
    os << "Height = " << static_cast<long>(m_height) << '\n';
    if (m_height >= 0) {
        WriteNode(os, m_height, m_root.Get());
    }
}

void FieldIdToOffsetOpsOnInt64FieldMap::WriteNode(xostream& os, ssize_t height, void* node) const {
    TARN_ASSERT(node);
    os << "{" << '\n';
    {
        Indenter indent(os, 4);
        if (height >= 1) {
            InternalNode* inode = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(node);
            WriteNode(os, height - 1, inode->m_ptr.Get());
            ssize_t nk = inode->m_numKeyEntrys;
            TARN_ASSERT(1 <= nk && nk <= 100);
            for (ssize_t i = 0; i < nk; ++i) {
                os << inode->GetEntry(i).m_key << '\n';
                WriteNode(os, height - 1, inode->GetEntry(i).m_ptr.Get());
            }
        } else {
            LeafNode* leaf = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node);
            ssize_t nk = leaf->m_numKeyEntrys;
            TARN_ASSERT(0 <= nk && nk <= 100);
            for (ssize_t i = 0; i < nk; ++i) {
                os << leaf->GetEntry(i).first << " --> " << leaf->GetEntry(i).second << '\n';
            }
        }
    }
    os << "}" << '\n';
}

}  // namespace tarn
