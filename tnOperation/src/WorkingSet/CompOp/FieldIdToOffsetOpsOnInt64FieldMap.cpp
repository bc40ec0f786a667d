// Search, iteration, insertion with node splitting, and the whole-map
// operations of the persistent B+tree map. See
// FieldIdToOffsetOpsOnInt64FieldMap.h for the invariants.

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"

#include <cstring>

#include "tnObject/RuntimeInterface.h"
#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using LeafNode = FieldIdToOffsetOpsOnInt64FieldMapLeafNode;
using InternalNode = FieldIdToOffsetOpsOnInt64FieldMapInternalNode;
using InternalKeyEntry = FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry;

inline LeafNode* AsLeaf(void* n) {
    return FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(n);
}
inline InternalNode* AsInternal(void* n) {
    return FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(n);
}

// Constructs a new entry for `key` (copied key, empty table) in raw slot `pos`.
inline void ConstructLeafEntry(LeafNode* leaf, ssize_t pos, const FieldId& key) {
    FieldIdToOffsetOpsOnInt64FieldMapLeafKeyEntry& e = leaf->GetEntry(pos);
    FieldIdToOffsetOpsOnInt64FieldMapCopyConstructKey(e.first, key);
    FieldIdToOffsetOpsOnInt64FieldMapConstructPayload(e.second);
}

// Exchanges two values as raw bytes, without running their copy operations.
template <typename T>
inline void SwapRaw(T& a, T& b) {
    memswap(static_cast<void*>(&a), static_cast<void*>(&b), sizeof(T));
}

}  // namespace

// ---- Construction -------------------------------------------------------------

Map::FieldIdToOffsetOpsOnInt64FieldMap()
    : m_size(0), m_firstLeaf(), m_lastLeaf(), m_root(), m_height(-1) {}

Map::FieldIdToOffsetOpsOnInt64FieldMap(const Map& rhs)
    : PersistableMixin(), m_size(0), m_firstLeaf(), m_lastLeaf(), m_root(), m_height(-1) {
    for (const_iterator i = rhs.begin(); i != rhs.end(); ++i) {
        insert(*i);
    }
}

Map& Map::operator=(const Map& rhs) {
    Map temp(rhs);
    temp.swap(*this);
    return *this;
}

// Members release m_root, m_lastLeaf, m_firstLeaf in that order; no node is
// touched.
Map::~FieldIdToOffsetOpsOnInt64FieldMap() = default;

// ---- Search -------------------------------------------------------------------

ssize_t Map::SearchLeaf(const FieldId& key, LeafNode* leaf) const {
    TARN_ASSERT(leaf);
    ssize_t nk = leaf->m_numKeyEntrys;
    TARN_ASSERT(0 <= nk && nk <= 100);
    ssize_t lo = 0;
    ssize_t hi = nk - 1;
    while (lo <= hi) {
        ssize_t mid = (lo + hi) / 2;
        int c = CompareKeys(key, leaf->GetEntry(mid).first);
        if (c > 0) {
            lo = mid + 1;
        } else if (c < 0) {
            hi = mid - 1;
        } else {
            return mid;
        }
    }
    return -1;
}

ssize_t Map::LowerBoundInLeaf(const FieldId& key, LeafNode* leaf) const {
    TARN_ASSERT(leaf);
    ssize_t nk = leaf->m_numKeyEntrys;
    TARN_ASSERT(0 <= nk && nk <= 100);
    ssize_t lo = 0;
    ssize_t hi = nk;
    while (lo < hi) {
        ssize_t mid = (lo + hi) / 2;
        TARN_ASSERT(0 <= mid && mid < nk);
        if (CompareKeys(key, leaf->GetEntry(mid).first) <= 0) {
            hi = mid;
        } else {
            lo = mid + 1;
        }
    }
    TARN_ASSERT(lo == hi);
    TARN_ASSERT(0 <= hi && hi <= nk);
    return hi;
}

ssize_t Map::UpperBoundInLeaf(const FieldId& key, LeafNode* leaf) const {
    TARN_ASSERT(leaf);
    ssize_t nk = leaf->m_numKeyEntrys;
    TARN_ASSERT(0 <= nk && nk <= 100);
    ssize_t lo = 0;
    ssize_t hi = nk;
    while (lo < hi) {
        ssize_t mid = (lo + hi) / 2;
        TARN_ASSERT(0 <= mid && mid < nk);
        if (CompareKeys(key, leaf->GetEntry(mid).first) < 0) {
            hi = mid;
        } else {
            lo = mid + 1;
        }
    }
    TARN_ASSERT(lo == hi);
    TARN_ASSERT(0 <= hi && hi <= nk);
    return hi;
}

// The descent shared by the lookups: from the root to the leaf whose key
// range holds `key`, leaving that leaf in `node`. A map without a root
// returns `emptyAnswer` at once. It is a macro, expanded into each lookup, so
// that a failed check names the lookup that was called.
#define FIELD_ID_MAP_DESCEND_TO_LEAF(emptyAnswer)        \
    void* node = m_root.Get();                           \
    if (!node) {                                         \
        TARN_ASSERT(m_height == -1);                     \
        return emptyAnswer;                              \
    }                                                    \
    TARN_ASSERT(m_height >= 0);                          \
    for (ssize_t h = m_height; h > 0; --h) {             \
        node = AsInternal(node)->FindChildGivenKey(key); \
        TARN_ASSERT(node);                               \
    }

namespace {

// The position of slot `j` of `leaf` as a bound. Slot j == count of a leaf
// other than the last is not a position: the bound is the next leaf's first
// entry.
Map::IteratorPolicy BoundPosition(LeafNode* leaf, ssize_t j) {
    if (j == leaf->m_numKeyEntrys && leaf->m_next) {
        return Map::IteratorPolicy(leaf->m_next.Get(), 0);
    }
    return Map::IteratorPolicy(leaf, j);
}

}  // namespace

Map::const_iterator Map::find(const FieldId& key) const {
    FIELD_ID_MAP_DESCEND_TO_LEAF(const_iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = SearchLeaf(key, AsLeaf(node));
    return j != -1 ? const_iterator(IteratorPolicy(AsLeaf(node), j)) : end();
}

Map::iterator Map::find(const FieldId& key) {
    FIELD_ID_MAP_DESCEND_TO_LEAF(iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = SearchLeaf(key, AsLeaf(node));
    return j != -1 ? iterator(IteratorPolicy(AsLeaf(node), j)) : end();
}

const OffsetOpsOnField<int64>* Map::rFind(const FieldId& key) const {
    FIELD_ID_MAP_DESCEND_TO_LEAF(nullptr);
    ssize_t j = SearchLeaf(key, AsLeaf(node));
    return j != -1 ? &AsLeaf(node)->GetEntry(j).second : nullptr;
}

Map::const_iterator Map::lower_bound(const FieldId& key) const {
    FIELD_ID_MAP_DESCEND_TO_LEAF(const_iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = LowerBoundInLeaf(key, AsLeaf(node));
    TARN_ASSERT(0 <= j && j <= FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node)->m_numKeyEntrys);
    return const_iterator(BoundPosition(AsLeaf(node), j));
}

Map::iterator Map::lower_bound(const FieldId& key) {
    FIELD_ID_MAP_DESCEND_TO_LEAF(iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = LowerBoundInLeaf(key, AsLeaf(node));
    TARN_ASSERT(0 <= j && j <= FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node)->m_numKeyEntrys);
    return iterator(BoundPosition(AsLeaf(node), j));
}

Map::const_iterator Map::upper_bound(const FieldId& key) const {
    FIELD_ID_MAP_DESCEND_TO_LEAF(const_iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = UpperBoundInLeaf(key, AsLeaf(node));
    TARN_ASSERT(0 <= j && j <= FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node)->m_numKeyEntrys);
    return const_iterator(BoundPosition(AsLeaf(node), j));
}

Map::iterator Map::upper_bound(const FieldId& key) {
    FIELD_ID_MAP_DESCEND_TO_LEAF(iterator(IteratorPolicy(nullptr, 0)));
    ssize_t j = UpperBoundInLeaf(key, AsLeaf(node));
    TARN_ASSERT(0 <= j && j <= FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(node)->m_numKeyEntrys);
    return iterator(BoundPosition(AsLeaf(node), j));
}

#undef FIELD_ID_MAP_DESCEND_TO_LEAF

// ---- Iteration ------------------------------------------------------------------

Map::const_iterator Map::begin() const {
    return const_iterator(IteratorPolicy(m_firstLeaf.Get(), 0));
}

Map::iterator Map::begin() {
    return iterator(IteratorPolicy(m_firstLeaf.Get(), 0));
}

Map::const_iterator Map::end() const {
    if (m_height >= 0) {
        TARN_ASSERT(m_lastLeaf);
        LeafNode* last = m_lastLeaf.Get();
        return const_iterator(IteratorPolicy(last, last->m_numKeyEntrys));
    }
    return const_iterator(IteratorPolicy(nullptr, 0));
}

Map::iterator Map::end() {
    if (m_height >= 0) {
        TARN_ASSERT(m_lastLeaf);
        LeafNode* last = m_lastLeaf.Get();
        return iterator(IteratorPolicy(last, last->m_numKeyEntrys));
    }
    return iterator(IteratorPolicy(nullptr, 0));
}

// ---- Write-find -------------------------------------------------------------------

void Map::wFind(wFindRet& ret, const FieldId& key, bool allowCreate) {
    // 1. A map without root gets an empty root leaf, whatever allowCreate says.
    if (m_height == -1) {
        TARN_ASSERT(!m_root);
        LeafNode* leaf = DollarNew(new LeafNode());
        m_firstLeaf = leaf;
        m_lastLeaf = leaf;
        m_root = leaf;
        m_height = 0;
        MarkAsDirtyWithoutTrace();
        DeclareReachable(ptr<const IPersistable>(this), ptr<const IPersistable>(leaf), true);
    }
    TARN_ASSERT(m_height >= 0);
    TARN_ASSERT(m_root);

    // 2. One descent; a split of the root comes back through `right`.
    InternalKeyEntry right;
    wFindInNode(ret, m_root.Get(), m_height, key, right, allowCreate);

    // 3. Grow a new root over the old root and its new right sibling. The
    //    separator moves into the new root by a raw swap, uncopied.
    if (right.m_ptr) {
        InternalNode* newRoot = DollarNew(new InternalNode());
        newRoot->m_ptr = m_root;
        ::new (static_cast<void*>(&newRoot->GetEntry(0))) InternalKeyEntry();
        newRoot->GetEntry(0).swap(right);
        newRoot->m_numKeyEntrys = 1;
        m_root = newRoot;
        ++m_height;
        MarkAsDirtyWithoutTrace();
        DeclareReachable(ptr<const IPersistable>(this), ptr<const IPersistable>(newRoot), true);
    }
}

void Map::wFindInNode(wFindRet& ret, void* left, ssize_t height, const FieldId& key,
                      InternalKeyEntry& rightEntry, bool allowCreate) {
    if (height <= 0) {
        LeafNode* right = wFindInLeaf(ret, AsLeaf(left), key, allowCreate);
        if (right) {
            rightEntry.m_key = right->GetEntry(0).first;
            rightEntry.m_ptr = right;
        }
    } else {
        wRecursiveFind(ret, AsInternal(left), height, key, rightEntry, allowCreate);
    }
}

void Map::wRecursiveFind(wFindRet& ret, InternalNode* left, ssize_t height, const FieldId& key,
                         InternalKeyEntry& rightEntry, bool allowCreate) {
    TARN_ASSERT(height >= 0);
    TARN_ASSERT(left);
    void* childLeft = left->FindChildGivenKey(key);
    TARN_ASSERT(childLeft);
    InternalKeyEntry childRight;
    wFindInNode(ret, childLeft, height - 1, key, childRight, allowCreate);
    if (childRight.m_ptr) {
        InsertIntoInternalNode(left, childRight, rightEntry);
    }
}

// Finds `key` in `left`, or inserts it there when allowed. A full leaf splits
// 50 / 51 around the new entry; the new right leaf is returned so that the
// caller can insert its first key as the separator.
LeafNode* Map::wFindInLeaf(wFindRet& ret, LeafNode* left, const FieldId& key, bool allowCreate) {
    TARN_ASSERT(left);
    ssize_t nk = left->m_numKeyEntrys;
    TARN_ASSERT(0 <= nk && nk <= 100);

    // 1. Binary search; a present key is reported whatever allowCreate says.
    ssize_t lo = 0;
    ssize_t hi = nk - 1;
    while (lo <= hi) {
        ssize_t mid = (lo + hi) / 2;
        TARN_ASSERT(0 <= mid && mid < nk);
        int c = CompareKeys(key, left->GetEntry(mid).first);
        if (c > 0) {
            lo = mid + 1;
        } else if (c < 0) {
            hi = mid - 1;
        } else {
            ret.m_containingNode = ptr<IPersistable>(left);
            ret.m_payload = &left->GetEntry(mid).second;
            ret.m_leaf = left;
            ret.m_index = mid;
            ret.m_created = false;
            return nullptr;
        }
    }

    // 2. Absent. Without permission to create, report nothing found.
    ssize_t insertPos = lo;
    if (!allowCreate) {
        ret.m_containingNode = ptr<IPersistable>();
        ret.m_payload = nullptr;
        ret.m_leaf = nullptr;
        ret.m_index = -1;
        ret.m_created = false;
        return nullptr;
    }

    // 3. Count the new key before any node changes.
    ret.m_created = true;
    ++m_size;
    MarkAsDirtyWithoutTrace();
    TARN_ASSERT(0 <= insertPos && insertPos <= nk);

    // 4. Room in the leaf: open the slot.
    if (nk != 100) {
        ShiftLeafEntries(left, insertPos, insertPos + 1, nk - insertPos);
        ConstructLeafEntry(left, insertPos, key);
        ret.m_containingNode = ptr<IPersistable>(left);
        ret.m_payload = &left->GetEntry(insertPos).second;
        ret.m_leaf = left;
        ret.m_index = insertPos;
        ++left->m_numKeyEntrys;
        left->MarkAsDirtyWithoutTrace();
        return nullptr;
    }

    // 5. Full: split. Link the new right leaf into the chain first.
    LeafNode* next = left->m_next.Get();
    LeafNode* right = DollarNew(new LeafNode());
    right->m_prev = left;
    right->m_next = next;
    if (next) {
        TARN_ASSERT(next->m_prev == left);
        next->m_prev = right;
        next->MarkAsDirtyWithoutTrace();
    } else {
        TARN_ASSERT(m_lastLeaf == left);
        m_lastLeaf = right;
    }
    left->m_next = right;
    left->MarkAsDirtyWithoutTrace();
    DeclareReachable(ptr<const IPersistable>(left), ptr<const IPersistable>(right), true);

    // 6. Distribute the 101 entries: the first 50 stay, the last 51 move.
    if (insertPos <= 49) {
        MoveLeafEntries(left, 49, right, 0, 51);
        ShiftLeafEntries(left, insertPos, insertPos + 1, 49 - insertPos);
        ConstructLeafEntry(left, insertPos, key);
        ret.m_containingNode = ptr<IPersistable>(left);
        ret.m_payload = &left->GetEntry(insertPos).second;
        ret.m_leaf = left;
        ret.m_index = insertPos;
    } else {
        ssize_t rightInsertPos = insertPos - 50;
        TARN_ASSERT(rightInsertPos >= 0);
        MoveLeafEntries(left, 50, right, 0, rightInsertPos);
        ConstructLeafEntry(right, rightInsertPos, key);
        ret.m_containingNode = ptr<IPersistable>(right);
        ret.m_payload = &right->GetEntry(rightInsertPos).second;
        ret.m_leaf = right;
        ret.m_index = rightInsertPos;
        MoveLeafEntries(left, insertPos, right, rightInsertPos + 1, 100 - insertPos);
    }
    left->m_numKeyEntrys = 50;
    right->m_numKeyEntrys = 51;
    return right;
}

// Inserts the entry `e` that a child split produced. A full node splits
// 50 / 1 / 50: the 51st of the 101 entries goes up through `overflow`, its
// child becoming the new right node's leftmost child.
void Map::InsertIntoInternalNode(InternalNode* left, const InternalKeyEntry& e,
                                 InternalKeyEntry& overflow) {
    TARN_ASSERT(left);
    ssize_t nk = left->m_numKeyEntrys;
    TARN_ASSERT(1 <= nk && nk <= 100);

    // 1. Position of the new separator.
    ssize_t lo = 0;
    ssize_t hi = nk - 1;
    while (lo <= hi) {
        ssize_t mid = (lo + hi) / 2;
        TARN_ASSERT(0 <= mid && mid < nk);
        int c = CompareKeys(e.m_key, left->GetEntry(mid).m_key);
        TARN_ASSERT(c != 0);
        if (c < 0) {
            hi = mid - 1;
        } else {
            lo = mid + 1;
        }
    }
    TARN_ASSERT(lo == hi+1);
    ssize_t insertPos = lo;
    TARN_ASSERT(0 <= insertPos && insertPos <= nk);

    if (nk != 100) {
        // 2. Room: open the slot.
        ShiftInternalEntries(left, insertPos, insertPos + 1, nk - insertPos);
        CopyConstructInternalEntry(left, insertPos, e);
        ++left->m_numKeyEntrys;
        overflow.m_ptr.Clear();
    } else {
        // 3. Full: split.
        InternalNode* right = DollarNew(new InternalNode());
        left->MarkAsDirtyWithoutTrace();
        DeclareReachable(ptr<const IPersistable>(left), ptr<const IPersistable>(right), true);
        overflow.m_ptr = right;
        if (insertPos <= 50) {
            MoveInternalEntries(left, 50, right, 0, 50);
            ShiftInternalEntries(left, insertPos, insertPos + 1, 50 - insertPos);
            CopyConstructInternalEntry(left, insertPos, e);
        } else {
            ssize_t rightInsertPos = insertPos - 51;
            TARN_ASSERT(rightInsertPos >= 0);
            MoveInternalEntries(left, 51, right, 0, rightInsertPos);
            CopyConstructInternalEntry(right, rightInsertPos, e);
            MoveInternalEntries(left, insertPos, right, rightInsertPos + 1, 100 - insertPos);
        }
        // 4. Promote slot 50: its child becomes right's leftmost child, its key
        //    moves into `overflow`; the slot is dead storage afterwards.
        InternalKeyEntry& promoted = left->GetEntry(50);
        std::memcpy(static_cast<void*>(&right->m_ptr), static_cast<const void*>(&promoted.m_ptr),
                    sizeof(right->m_ptr));
        overflow.m_key.~FieldId();
        FieldIdToOffsetOpsOnInt64FieldMapMoveKey(overflow.m_key, promoted.m_key);
        left->m_numKeyEntrys = 50;
        right->m_numKeyEntrys = 50;
    }
    left->MarkAsDirtyWithoutTrace();
}

std::pair<Map::iterator, bool> Map::insert(const value_type& x) {
    wFindRet ret;
    wFind(ret, x.first, true);
    TARN_ASSERT(ret.m_leaf);
    if (ret.m_created) {
        TARN_ASSERT(ret.m_payload);
        *ret.m_payload = x.second;
        TARN_ASSERT(ret.m_containingNode);
        MarkPersistentAsDirtyWithoutTrace(ret.m_containingNode);
    }
    return {iterator(IteratorPolicy(ret.m_leaf, ret.m_index)), ret.m_created};
}

bool Map::Insert(const FieldId& key, const OffsetOpsOnField<int64>& payload, bool allowReplace) {
    wFindRet ret;
    wFind(ret, key, true);
    TARN_ASSERT(ret.m_payload);
    if (!allowReplace && !ret.m_created) {
        return false;
    }
    *ret.m_payload = payload;
    TARN_ASSERT(ret.m_containingNode);
    MarkPersistentAsDirtyWithoutTrace(ret.m_containingNode);
    return ret.m_created;
}

OffsetOpsOnField<int64>& Map::operator[](const FieldId& key) {
    wFindRet ret;
    wFind(ret, key, true);
    TARN_ASSERT(ret.m_payload);
    TARN_ASSERT(ret.m_containingNode);
    MarkPersistentAsDirtyWithoutTrace(ret.m_containingNode);
    return *ret.m_payload;
}

// ---- Whole-map operations -----------------------------------------------------------

void Map::clear() {
    // 1. The whole tree goes to deferred deletion through its root.
    if (m_height == 0) {
        AsyncPermanentlyDeleteSubTree(ptr<IPersistable>(AsLeaf(m_root.Get())));
    } else if (m_height >= 1) {
        AsyncPermanentlyDeleteSubTree(ptr<IPersistable>(AsInternal(m_root.Get())));
    }
    // 2. Forget it.
    m_root.Clear();
    m_firstLeaf.Clear();
    m_lastLeaf.Clear();
    // 3. Mark, 4. reset.
    MarkAsDirtyWithoutTrace();
    m_size = 0;
    m_height = -1;
}

void Map::swap(Map& rhs) {
    std::swap(m_size, rhs.m_size);
    std::swap(m_height, rhs.m_height);
    SwapRaw(m_root, rhs.m_root);
    SwapRaw(m_firstLeaf, rhs.m_firstLeaf);
    SwapRaw(m_lastLeaf, rhs.m_lastLeaf);
    MarkAsDirtyWithoutTrace();
    rhs.MarkAsDirtyWithoutTrace();
}

bool Map::operator==(const Map& rhs) const {
    if (m_size != rhs.m_size) {
        return false;
    }
    const_iterator i = begin();
    const_iterator j = rhs.begin();
    while (i != end()) {
        TARN_ASSERT(j != rhs.end());
        if (*i != *j) {
            return false;
        }
        ++i;
        ++j;
    }
    TARN_ASSERT(j == rhs.end());
    return true;
}

bool operator==(const std::pair<const FieldId, OffsetOpsOnField<int64>>& a,
                const std::pair<const FieldId, OffsetOpsOnField<int64>>& b) {
    return a.first == b.first && a.second == b.second;
}

bool operator!=(const std::pair<const FieldId, OffsetOpsOnField<int64>>& a,
                const std::pair<const FieldId, OffsetOpsOnField<int64>>& b) {
    return !(a == b);
}

}  // namespace tarn
