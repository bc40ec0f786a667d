#pragma once

// The two node classes of the persistent B+tree map from field keys to
// per-site offset tables (see FieldIdToOffsetOpsOnInt64FieldMap.h for the
// tree's invariants), their entry types and the raw slot operations on which
// search, insertion, deletion and persistence are built.
//
// Every node is a persistent object of its own, owned by the object space;
// the references it holds (children, leaf neighbours) do not own. Use only on
// a thread that holds the space exclusively.
//
// Entry storage. A node keeps room for MAX_ENTRIES entries in one raw,
// suitably aligned byte array. Only slots 0 .. m_numKeyEntrys-1 hold
// constructed entries; the slots behind them are raw and never destroyed.
// Entries are relocated between slots and nodes by raw byte copies, never by
// copy-and-destroy, which is sound because none of the stored types points
// into itself: a Path keeps its heap pointer or its local bytes in one union,
// a per-site table is one owning pointer (RelocatableMap), and a persistent
// reference is a plain value. A slot whose bytes have been relocated away is
// dead storage: nobody destroys it.
//
// Nodes carry no kind tag. A child reached through a `cref<void>` is a leaf
// at height 0 and an internal node above; the traversal knows the height.

#include <cstring>
#include <new>
#include <utility>

#include "tnObject/IObject.h"
#include "tnObject/RuntimeInterface.h"
#include "tnOperation/FieldId.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnPersistStore/IPersistable.h"
#include "tnPersistStore/pref.h"
#include "tnUtils/Types.h"

namespace tarn {

class Archive;
class InputArchive;
class IObjectVisitor;
class IPrefVisitor;
class FieldIdToOffsetOpsOnInt64FieldMap;
class FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
class FieldIdToOffsetOpsOnInt64FieldMapLeafNode;

// Reflection records, type operations and registration of the three classes
// (FieldIdToOffsetOpsOnInt64FieldMapReflection.cpp). Declared ahead of the
// classes so that every typed reference to them checks the class of what it
// loads. QueryInterface, GetReflectedClass and sfnCreateInstance come with
// the persistable mixin.
const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMap*);
const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMapInternalNode*);
const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode*);
const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMap*);
const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMapInternalNode*);
const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode*);
void _Register_FieldIdToOffsetOpsOnInt64FieldMap();
void _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode();
void _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode();

// Capacity and minimum fill of both node kinds. A node with MAX_ENTRIES is
// full and splits on the next insertion that lands in it; a non-root node
// with fewer than MIN_ENTRIES is under-full and is rebalanced or merged.
constexpr ssize_t FieldIdToOffsetOpsOnInt64FieldMapMaxEntries = 100;
constexpr ssize_t FieldIdToOffsetOpsOnInt64FieldMapMinEntries = 50;

// Schema numbers of the three persistent classes of the tree.
constexpr schema_t FieldIdToOffsetOpsOnInt64FieldMap_SCHEMA = 1;
constexpr schema_t FieldIdToOffsetOpsOnInt64FieldMapInternalNode_SCHEMA = 1;
constexpr schema_t FieldIdToOffsetOpsOnInt64FieldMapLeafNode_SCHEMA = 1;

// A leaf entry: the key and its per-site table. The map's value_type is the
// same pair with a constant key; iterators hand out leaf entries under it.
using FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry = std::pair<FieldId, OffsetOpsOnField<int64>>;

// An internal entry: a separator key and the child to its right. Every key in
// that child's subtree is at least m_key.
struct FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry {
    FieldId m_key;
    cref<void> m_ptr;

    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry() : m_key(), m_ptr() {}
    // Copies the key; the reference is copied byte for byte.
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry(
        const FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry& rhs)
        : m_key(rhs.m_key), m_ptr() {
        std::memcpy(static_cast<void*>(&m_ptr), static_cast<const void*>(&rhs.m_ptr),
                    sizeof(m_ptr));
    }
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry& operator=(
        const FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry& rhs) {
        m_key = rhs.m_key;
        std::memcpy(static_cast<void*>(&m_ptr), static_cast<const void*>(&rhs.m_ptr),
                    sizeof(m_ptr));
        return *this;
    }
    // Members go in reverse order: m_ptr, then m_key.
    ~FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry() = default;

    // Exchanges the two entries' contents as raw bytes: each key and
    // reference changes its place, not its owner count.
    void swap(FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry& other) {
        memswap(this, &other, sizeof(*this));
    }
};

// An internal node: m_ptr is the leftmost child (keys below entry 0's key),
// entry i's m_ptr the child holding keys in [entry i, entry i+1).
// Holds 1..100 entries (50..100 below the root) between operations.
class FieldIdToOffsetOpsOnInt64FieldMapInternalNode
    : public PersistableMixin<
          IObjectBaseMixin<FieldIdToOffsetOpsOnInt64FieldMapInternalNode, EmptyBase>> {
public:
    using Entry = FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry;
    static constexpr ssize_t MAX_ENTRIES = FieldIdToOffsetOpsOnInt64FieldMapMaxEntries;

    FieldIdToOffsetOpsOnInt64FieldMapInternalNode() : m_ptr(), m_numKeyEntrys(0) {}
    // Deep copies: the copy's entries own keys of their own. The references
    // are copied as values; the children are shared, not copied.
    FieldIdToOffsetOpsOnInt64FieldMapInternalNode(
        const FieldIdToOffsetOpsOnInt64FieldMapInternalNode& rhs);
    FieldIdToOffsetOpsOnInt64FieldMapInternalNode& operator=(
        const FieldIdToOffsetOpsOnInt64FieldMapInternalNode& rhs);
    // Destroys the live entries in increasing slot order, then m_ptr.
    ~FieldIdToOffsetOpsOnInt64FieldMapInternalNode();

    Entry& GetEntry(ssize_t i) { return reinterpret_cast<Entry*>(m_entrys)[i]; }
    const Entry& GetEntry(ssize_t i) const { return reinterpret_cast<const Entry*>(m_entrys)[i]; }

    // The child whose key range holds `key`, fetched through its reference,
    // and its index: -1 for m_ptr, else the slot whose m_ptr it is.
    std::pair<void*, ssize_t> FindChildGivenKey2(const FieldId& key) const;
    void* FindChildGivenKey(const FieldId& key) const { return FindChildGivenKey2(key).first; }
    // The index of FindChildGivenKey2; the child is fetched all the same.
    ssize_t FindChildIndexGivenKey(const FieldId& key) const {
        return FindChildGivenKey2(key).second;
    }

    // Persistence (image layout in FieldIdToOffsetOpsOnInt64FieldMapPersist.cpp).
    void Serialise(Archive& ar) const;
    void Deserialise(InputArchive& ar);
    void VisitObjects(IObjectVisitor& v) const;
    void VisitPrefs(IPrefVisitor& v) const;

    cref<void> m_ptr;
    ssize_t m_numKeyEntrys;
    alignas(Entry) octet_t m_entrys[MAX_ENTRIES * sizeof(Entry)];
};

// A leaf: entries in increasing key order, linked to its neighbours on the
// leaf level. Holds 0..100 entries as the root, 50..100 otherwise.
class FieldIdToOffsetOpsOnInt64FieldMapLeafNode
    : public PersistableMixin<
          IObjectBaseMixin<FieldIdToOffsetOpsOnInt64FieldMapLeafNode, EmptyBase>> {
public:
    using Entry = FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry;
    static constexpr ssize_t MAX_ENTRIES = FieldIdToOffsetOpsOnInt64FieldMapMaxEntries;

    FieldIdToOffsetOpsOnInt64FieldMapLeafNode() : m_prev(), m_next(), m_numKeyEntrys(0) {}
    // Deep copies of keys and tables; the neighbour links are copied as values.
    FieldIdToOffsetOpsOnInt64FieldMapLeafNode(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode& rhs);
    FieldIdToOffsetOpsOnInt64FieldMapLeafNode& operator=(
        const FieldIdToOffsetOpsOnInt64FieldMapLeafNode& rhs);
    // Destroys the live entries in increasing slot order, then m_next, m_prev.
    ~FieldIdToOffsetOpsOnInt64FieldMapLeafNode();

    Entry& GetEntry(ssize_t i) { return reinterpret_cast<Entry*>(m_entrys)[i]; }
    const Entry& GetEntry(ssize_t i) const { return reinterpret_cast<const Entry*>(m_entrys)[i]; }

    void Serialise(Archive& ar) const;
    void Deserialise(InputArchive& ar);
    void VisitObjects(IObjectVisitor& v) const;
    void VisitPrefs(IPrefVisitor& v) const;

    cref<FieldIdToOffsetOpsOnInt64FieldMapLeafNode> m_prev;
    cref<FieldIdToOffsetOpsOnInt64FieldMapLeafNode> m_next;
    ssize_t m_numKeyEntrys;
    alignas(Entry) octet_t m_entrys[MAX_ENTRIES * sizeof(Entry)];
};

// Views of a child obtained from a `cref<void>`; the caller knows the kind
// from the height.
inline FieldIdToOffsetOpsOnInt64FieldMapLeafNode* FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(
    void* n) {
    return static_cast<FieldIdToOffsetOpsOnInt64FieldMapLeafNode*>(n);
}
inline FieldIdToOffsetOpsOnInt64FieldMapInternalNode*
FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(void* n) {
    return static_cast<FieldIdToOffsetOpsOnInt64FieldMapInternalNode*>(n);
}

// ---- Key and payload slots ------------------------------------------------

// Copy-constructs a key in the raw slot `dst`.
inline void FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(FieldId& dst, const FieldId& src) {
    ::new (static_cast<void*>(&dst)) FieldId(src);
}

// Value-initialises a payload in the raw slot: zero bytes, then an empty table.
inline void FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(OffsetOpsOnField<int64>& payload) {
    std::memset(static_cast<void*>(&payload), 0, sizeof(payload));
    ::new (static_cast<void*>(&payload)) OffsetOpsOnField<int64>();
}

// Relocates the key `src` into the raw slot `dst`; `src` becomes dead storage.
inline void FieldIdToOffsetOpsOnInt64FieldMapMoveKey(FieldId& dst, FieldId& src) {
    std::memcpy(static_cast<void*>(&dst), static_cast<const void*>(&src), sizeof(FieldId));
}

// ---- Entry slots ------------------------------------------------------------

inline void CopyConstructInternalEntry(FieldIdToOffsetOpsOnInt64FieldMapInternalNode* node,
                                       ssize_t pos,
                                       const FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry& e) {
    ::new (static_cast<void*>(&node->GetEntry(pos)))
        FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry(e);
}

// Destroys the entry in slot `pos` (reference, then key); the slot is raw after.
inline void DestructInternalEntry(FieldIdToOffsetOpsOnInt64FieldMapInternalNode* node,
                                  ssize_t pos) {
    node->GetEntry(pos).~FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry();
}

// Destroys the entry in slot `pos` (payload, then key); the slot is raw after.
inline void DestructLeafEntry(FieldIdToOffsetOpsOnInt64FieldMapLeafNode* node, ssize_t pos) {
    using Entry = FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry;
    node->GetEntry(pos).~Entry();
}

// Relocates `count` entries from slots s.. of `src` to slots d.. of another
// node `dst` in one block copy. Constructs, destroys and counts nothing.
inline void MoveLeafEntries(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode* src, ssize_t s,
                            FieldIdToOffsetOpsOnInt64FieldMapLeafNode* dst, ssize_t d,
                            ssize_t count) {
    if (count > 0) {
        std::memcpy(static_cast<void*>(&dst->GetEntry(d)),
                    static_cast<const void*>(&src->GetEntry(s)),
                    static_cast<std::size_t>(count) *
                        sizeof(FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry));
    }
}

// Relocates `count` entries inside one leaf from slots s.. to slots d..;
// the ranges may overlap.
inline void ShiftLeafEntries(FieldIdToOffsetOpsOnInt64FieldMapLeafNode* node, ssize_t s, ssize_t d,
                             ssize_t count) {
    if (count > 0) {
        std::memmove(static_cast<void*>(&node->GetEntry(d)),
                     static_cast<const void*>(&node->GetEntry(s)),
                     static_cast<std::size_t>(count) *
                         sizeof(FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry));
    }
}

inline void MoveInternalEntries(const FieldIdToOffsetOpsOnInt64FieldMapInternalNode* src, ssize_t s,
                                FieldIdToOffsetOpsOnInt64FieldMapInternalNode* dst, ssize_t d,
                                ssize_t count) {
    if (count > 0) {
        std::memcpy(static_cast<void*>(&dst->GetEntry(d)),
                    static_cast<const void*>(&src->GetEntry(s)),
                    static_cast<std::size_t>(count) *
                        sizeof(FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry));
    }
}

inline void ShiftInternalEntries(FieldIdToOffsetOpsOnInt64FieldMapInternalNode* node, ssize_t s,
                                 ssize_t d, ssize_t count) {
    if (count > 0) {
        std::memmove(static_cast<void*>(&node->GetEntry(d)),
                     static_cast<const void*>(&node->GetEntry(s)),
                     static_cast<std::size_t>(count) *
                         sizeof(FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry));
    }
}

// ---- Runs of raw slots ------------------------------------------------------

// Value-initialises elements 0..n-1 in increasing order.
template <typename T>
void ConstructArrayElements(T* p, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        std::memset(static_cast<void*>(p + i), 0, sizeof(T));
        ::new (static_cast<void*>(p + i)) T();
    }
}

// Destroys elements 0..n-1 in increasing order.
template <typename T>
void DestructArrayElements(T* p, ssize_t n) {
    for (ssize_t i = 0; i < n; ++i) {
        p[i].~T();
    }
}

// Grows a run of oldNum live elements to newNum (constructing the new tail) or
// shrinks it (destroying the old tail).
template <typename T>
void ResizeArrayElements(T* p, ssize_t oldNum, ssize_t newNum) {
    if (newNum > oldNum) {
        ConstructArrayElements(p + oldNum, newNum - oldNum);
    } else {
        DestructArrayElements(p + newNum, oldNum - newNum);
    }
}

}  // namespace tarn
