#pragma once

// A persistent B+tree map from field keys to per-site offset tables.
// The header and every node are persistent objects owned by the object space;
// references between them do not own. Use only on a thread that holds the
// space exclusively.
//
// Invariants between operations (checked by Validate and by the tests'
// checker):
//   1. m_height == -1 exactly when m_root is null; then m_firstLeaf and
//      m_lastLeaf are null and m_size is 0.
//   2. m_height == 0: the root is a leaf holding 0..100 entries, and m_root,
//      m_firstLeaf and m_lastLeaf all refer to it.
//   3. m_height == h >= 1: every root-to-leaf path passes exactly h internal
//      nodes.
//   4. An internal root holds 1..100 entries; every other node 50..100.
//   5. Keys inside a node strictly increase (CompareKeys). In an internal node
//      the subtree of m_ptr holds keys below entry 0's key, the subtree of
//      entry i keys in [entry i, entry i+1). A leaf split's separator is a copy
//      of the new right leaf's first key.
//   6. m_firstLeaf, m_next, ..., m_lastLeaf visit every key once in increasing
//      order; m_prev links the same chain backwards; the ends are null.
//   7. m_size is the total of the leaves' entry counts.

#include <iterator>
#include <utility>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodes.h"
#include "tnUtils/Assert.h"
#include "tnUtils/MakeIterator.h"

namespace tarn {

class xostream;

class FieldIdToOffsetOpsOnInt64FieldMap
    : public PersistableMixin<IObjectBaseMixin<FieldIdToOffsetOpsOnInt64FieldMap, EmptyBase>> {
public:
    using LeafNode = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
    using InternalNode = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
    using InternalKeyEntry = FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry;

    using key_type = FieldId;
    using mapped_type = OffsetOpsOnField<int64>;
    using value_type = std::pair<const FieldId, OffsetOpsOnField<int64>>;
    using size_type = ssize_t;

    // What a write-find found or made. All fields but m_containingNode are
    // left unset by the constructor; wFind sets all five on every path.
    struct wFindRet {
        ptr<IPersistable> m_containingNode;  // the leaf holding the entry; null if none
        OffsetOpsOnField<int64>* m_payload;  // the entry's payload; null if none
        LeafNode* m_leaf;                    // the same leaf; null if none
        ssize_t m_index;                     // the entry's slot; -1 if none
        bool m_created;                      // inserted by this write-find

        wFindRet() : m_containingNode() {}
        ~wFindRet() = default;
    };

    // An iterator position: slot m_offset of leaf m_leaf. Positions in use:
    //   (L, i), 0 <= i < L.count       an entry
    //   (m_lastLeaf, its count)        end() of a map with a root
    //   (null, 0)                      begin() == end() of a map without root
    //   (m_firstLeaf, -1)              one before the first entry
    // (L, L.count) for any leaf but the last is never produced.
    class IteratorPolicy {
    public:
        using value_type = FieldIdToOffsetOpsOnInt64FieldMap::value_type;

        IteratorPolicy(LeafNode* leaf = nullptr, ssize_t offset = 0)
            : m_leaf(leaf), m_offset(offset) {}

        void next() {
            TARN_ASSERT(m_leaf);
            TARN_ASSERT(-1 <= m_offset && m_offset < m_leaf->m_numKeyEntrys);
            ++m_offset;
            if (m_offset == m_leaf->m_numKeyEntrys && m_leaf->m_next) {
                m_leaf = m_leaf->m_next.Get();
                m_offset = 0;
            }
        }

        void prev() {
            TARN_ASSERT(m_leaf);
            TARN_ASSERT(0 <= m_offset && m_offset <= m_leaf->m_numKeyEntrys);
            --m_offset;
            if (m_offset < 0 && m_leaf->m_prev) {
                m_leaf = m_leaf->m_prev.Get();
                m_offset = m_leaf->m_numKeyEntrys - 1;
            }
        }

        // The entry, for change: marks its leaf dirty.
        value_type& deref() const {
            TARN_ASSERT(m_leaf);
            TARN_ASSERT(0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys);
            m_leaf->MarkAsDirtyWithoutTrace();
            return reinterpret_cast<value_type&>(m_leaf->GetEntry(m_offset));
        }

        const value_type& const_deref() const {
            TARN_ASSERT(m_leaf);
            TARN_ASSERT(0 <= m_offset && m_offset < m_leaf->m_numKeyEntrys);
            return reinterpret_cast<const value_type&>(m_leaf->GetEntry(m_offset));
        }

        bool operator==(const IteratorPolicy& rhs) const {
            return m_offset == rhs.m_offset && m_leaf == rhs.m_leaf;
        }

        LeafNode* m_leaf;
        ssize_t m_offset;
    };

    using iterator = make_iterator<IteratorPolicy>;
    using const_iterator = make_const_iterator<IteratorPolicy>;
    using reverse_iterator = std::reverse_iterator<iterator>;
    using const_reverse_iterator = std::reverse_iterator<const_iterator>;

    // An empty map at height -1; no node exists until the first write-find.
    FieldIdToOffsetOpsOnInt64FieldMap();
    // A new, separate tree holding equal entries, built by insertion.
    FieldIdToOffsetOpsOnInt64FieldMap(const FieldIdToOffsetOpsOnInt64FieldMap& rhs);
    // Copy, then exchange; the previous tree is left unreferenced.
    FieldIdToOffsetOpsOnInt64FieldMap& operator=(const FieldIdToOffsetOpsOnInt64FieldMap& rhs);
    // Releases the header's references only; no node is touched.
    ~FieldIdToOffsetOpsOnInt64FieldMap();

    // ---- Search and iteration ----
    ssize_t SearchLeaf(const FieldId& key, LeafNode* leaf) const;
    ssize_t LowerBoundInLeaf(const FieldId& key, LeafNode* leaf) const;
    ssize_t UpperBoundInLeaf(const FieldId& key, LeafNode* leaf) const;

    const_iterator find(const FieldId& key) const;
    const_iterator lower_bound(const FieldId& key) const;
    const_iterator upper_bound(const FieldId& key) const;
    iterator find(const FieldId& key);
    iterator lower_bound(const FieldId& key);
    iterator upper_bound(const FieldId& key);
    const OffsetOpsOnField<int64>* rFind(const FieldId& key) const;

    iterator begin();
    iterator end();
    const_iterator begin() const;
    const_iterator end() const;
    const_iterator cbegin() const { return begin(); }
    const_iterator cend() const { return end(); }
    reverse_iterator rbegin() { return reverse_iterator(end()); }
    reverse_iterator rend() { return reverse_iterator(begin()); }
    const_reverse_iterator rbegin() const { return const_reverse_iterator(end()); }
    const_reverse_iterator rend() const { return const_reverse_iterator(begin()); }

    size_type size() const { return m_size; }
    bool empty() const { return m_size == 0; }
    size_type count(const FieldId& key) const { return rFind(key) ? 1 : 0; }

    // ---- Insertion ----
    // Finds `key`, creating it with an empty table when absent and allowed.
    // On an empty map it always leaves a root leaf behind.
    void wFind(wFindRet& ret, const FieldId& key, bool allowCreate);
    // Inserts x if its key is absent; never overwrites.
    std::pair<iterator, bool> insert(const value_type& x);
    // True when the key was new; a present payload is replaced only if allowed.
    bool Insert(const FieldId& key, const OffsetOpsOnField<int64>& payload, bool allowReplace);
    // The payload of `key`, created empty when absent; its leaf is marked dirty.
    OffsetOpsOnField<int64>& operator[](const FieldId& key);

    // ---- Deletion (FieldIdToOffsetOpsOnInt64FieldMapDelete.cpp) ----
    bool Delete(const FieldId& key);
    size_type erase(const FieldId& key);
    void erase(iterator pos);
    bool RecursiveDelete(ssize_t height, void* thisNode, void* lNode, void* rNode,
                         InternalNode* lAnchor, InternalNode* rAnchor, InternalNode* parent,
                         void*& deleteNode, const FieldId& key);
    void BalanceLeafRightToLeft(LeafNode* left, LeafNode* right, InternalNode* anchor);
    void BalanceLeafLeftToRight(LeafNode* left, LeafNode* right, InternalNode* anchor);
    void MergeLeafRightToLeft(LeafNode* left, LeafNode* right);
    void BalanceInternalLeftToRight(InternalNode* left, InternalNode* right, InternalNode* anchor);
    void BalanceInternalRightToLeft(InternalNode* left, InternalNode* right, InternalNode* anchor);
    void MergeInternalRightToLeft(InternalNode* left, InternalNode* right, InternalNode* anchor);
    void ReplaceKeyInAnchor(InternalNode* node, const FieldId& oldKey, const FieldId& newKey);

    // ---- Whole-map operations ----
    // Hands the whole tree to asynchronous deletion; back to height -1.
    void clear();
    // Exchanges the five header fields; marks both maps dirty.
    void swap(FieldIdToOffsetOpsOnInt64FieldMap& rhs);
    // Equal sizes and equal entries in key order, whatever the node layout.
    bool operator==(const FieldIdToOffsetOpsOnInt64FieldMap& rhs) const;
    bool operator!=(const FieldIdToOffsetOpsOnInt64FieldMap& rhs) const { return !(*this == rhs); }

    // ---- Diagnostics (FieldIdToOffsetOpsOnInt64FieldMapValidate.cpp) ----
    void Validate() const;
    void ValidateNode(ssize_t height, void* node, bool isRoot, const FieldId* k1,
                      const FieldId* k2) const;
    ssize_t GetNumNodes() const;
    ssize_t GetNumNodes(ssize_t height, void* node) const;
    void Write(xostream& os) const;
    void WriteNode(xostream& os, ssize_t height, void* node) const;

    // ---- Persistence (FieldIdToOffsetOpsOnInt64FieldMapPersist.cpp) ----
    void Serialise(Archive& ar) const;
    void Deserialise(InputArchive& ar);
    void VisitObjects(IObjectVisitor& v) const;
    void VisitPrefs(IPrefVisitor& v) const;

    // ---- Reflection and interfaces ----

    ssize_t m_size;
    cref<LeafNode> m_firstLeaf;
    cref<LeafNode> m_lastLeaf;
    cref<void> m_root;
    ssize_t m_height;

private:
    void wFindInNode(wFindRet& ret, void* left, ssize_t height, const FieldId& key,
                     InternalKeyEntry& rightEntry, bool allowCreate);
    void wRecursiveFind(wFindRet& ret, InternalNode* left, ssize_t height, const FieldId& key,
                        InternalKeyEntry& rightEntry, bool allowCreate);
    LeafNode* wFindInLeaf(wFindRet& ret, LeafNode* left, const FieldId& key, bool allowCreate);
    void InsertIntoInternalNode(InternalNode* left, const InternalKeyEntry& e,
                                InternalKeyEntry& overflow);
};

// Entries are equal when their keys are equal and, only then, their tables.
bool operator==(const std::pair<const FieldId, OffsetOpsOnField<int64>>& a,
                const std::pair<const FieldId, OffsetOpsOnField<int64>>& b);
bool operator!=(const std::pair<const FieldId, OffsetOpsOnField<int64>>& a,
                const std::pair<const FieldId, OffsetOpsOnField<int64>>& b);

}  // namespace tarn
