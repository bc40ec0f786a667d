// Persistence of the B+tree map: the exact byte images of the header and both
// node kinds, built here by hand, read back and written again; the bound on
// a node image's count; and the two reference visits. (Whole trees written
// by commits and read back node by node are covered by the differential test.)

#include <gtest/gtest.h>

#include <initializer_list>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakeSite;
using testing::Oid;
using testing::operator+;
using testing::Bytes;
using testing::ImageOf;
using testing::Le64;

// Pieces of expected images, joined with +.
Bytes U8(std::initializer_list<int> v) {
    return Bytes(v.begin(), v.end());
}
Bytes KeyBytes(const FieldId& k) {  // identity, path length, path bytes
    return Le64(k.oid.value_) + U8({int(k.path.size())}) + Bytes(k.path.begin(), k.path.end());
}

// Read into `into`, `image` is consumed to its end and written back unchanged.
template <typename T>
void ExpectReadBack(const Bytes& image, T* into) {
    InputArchive in(image.data());
    into->Deserialise(in);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
    EXPECT_EQ(ImageOf(*into), image);
}

template <typename T>
void ExpectImage(const T& obj, const Bytes& expected, T* into) {
    EXPECT_EQ(ImageOf(obj), expected);
    ExpectReadBack(expected, into);
}

class BTreePersist : public testing::BTreeSpaceTest {
protected:
    template <typename T>
    T* New() {
        return DollarNew(new T());
    }
};

TEST_F(BTreePersist, HeaderImages) {
    // schema, size, first leaf, last leaf, root, height
    Map* read = New<Map>();
    (*read)[K(1)];  // not empty before reading
    ExpectImage(map(), U8({1, 0}) + Le64(0) + Le64(0) + Le64(0) + U8({0}), read);

    map()[K(1)];
    map()[K(2)];
    const uint64 leaf = Oid(LeafAt(0));
    ExpectImage(map(), U8({1, 2}) + Le64(leaf) + Le64(leaf) + Le64(leaf) + U8({1}), New<Map>());
}

TEST_F(BTreePersist, LeafImages) {
    // schema, previous, next, count, entries (key, per-site table)
    ExpectImage(*New<Leaf>(), U8({1}) + Le64(0) + Le64(0) + U8({0}), New<Leaf>());

    // The first entry with two sites recorded in descending order (written
    // ascending), the second with an empty table and a long path.
    map()[MakeKey(300)].Insert(MakeSite(0x0302), 200, -2);
    map()[MakeKey(300)].Insert(MakeSite(0x0101), 5, 0x0102030405060708);
    map()[MakeKey(301, true)];
    Leaf* leaf = LeafAt(0);
    Leaf* prev = New<Leaf>();
    Leaf* next = New<Leaf>();
    leaf->m_prev = prev;
    leaf->m_next = next;
    const Bytes expected =
        U8({1}) + Le64(Oid(prev)) + Le64(Oid(next)) + U8({2}) + KeyBytes(MakeKey(300)) +
        U8({2}) +  // sites, each as Guid bytes, t, o
        U8({1, 1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 5}) + Le64(0x0102030405060708) +
        U8({2, 3, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xc8, 1}) + Le64(uint64(int64{-2})) +
        KeyBytes(MakeKey(301, true)) + U8({0});  // an empty table

    // Read into a leaf that holds three entries: exactly the image's two.
    Map* other = New<Map>();
    for (uint64 i : {900u, 901u, 902u}) {
        (*other)[MakeKey(i, true)];
    }
    Leaf* read = other->m_firstLeaf.Get();
    ExpectImage(*leaf, expected, read);
    ASSERT_EQ(read->m_numKeyEntrys, 2);
    EXPECT_EQ(read->GetEntry(0).second, leaf->GetEntry(0).second);
}

TEST_F(BTreePersist, InternalNodeImage) {
    // schema, leftmost child, count, entries (key, child)
    Internal* node = New<Internal>();
    Leaf* child[3] = {New<Leaf>(), New<Leaf>(), New<Leaf>()};
    node->m_ptr = child[0];
    FieldIdToOffsetOpsOnInt64FieldMapInternalKeyEntry e;
    for (ssize_t i : {0, 1}) {
        e.m_key = MakeKey(40 * uint64(i + 1), i == 1);
        e.m_ptr = child[i + 1];
        CopyConstructInternalEntry(node, i, e);
    }
    node->m_numKeyEntrys = 2;
    Internal* read = New<Internal>();
    ExpectImage(*node,
                U8({1}) + Le64(Oid(child[0])) + U8({2}) + KeyBytes(MakeKey(40)) +
                    Le64(Oid(child[1])) + KeyBytes(MakeKey(80, true)) + Le64(Oid(child[2])),
                read);
    EXPECT_EQ(read->GetEntry(1).m_ptr.Get(), static_cast<void*>(child[2]));
}

// A node image with `n` entries, each key oid i and an empty path; internal
// children and leaf tables are empty.
Bytes NodeImage(bool leaf, uint64 n) {
    Bytes b = U8({1}) + Le64(0) + (leaf ? Le64(0) : Bytes()) + U8({int(n)});
    for (uint64 i = 0; i < n; ++i) {
        b = b + Le64(i + 1) + U8({0}) + (leaf ? U8({0}) : Le64(0));
    }
    return b;
}

TEST_F(BTreePersist, NodeImagesHoldAtMostHundredEntries) {
    Leaf* leaf = New<Leaf>();
    Internal* node = New<Internal>();
    ExpectReadBack(NodeImage(true, 100), leaf);
    ExpectReadBack(NodeImage(false, 100), node);
    EXPECT_EQ(leaf->m_numKeyEntrys + node->m_numKeyEntrys, 200);
    const Bytes leaf101 = NodeImage(true, 101);
    const Bytes internal101 = NodeImage(false, 101);
    InputArchive badLeaf(leaf101.data());
    InputArchive badInternal(internal101.data());
    EXPECT_TARN_ASSERT(leaf->Deserialise(badLeaf), "0 <= n && n <= 100");
    EXPECT_TARN_ASSERT(node->Deserialise(badInternal), "0 <= n && n <= 100");
}

class CountingVisitor final : public IObjectVisitor, public IPrefVisitor {
public:
    void VisitObject(ptr<const IObject> obj) override { objects.push_back(obj.m_self); }
    void VisitEvictableObject(ptr<const IObject>& obj) override { objects.push_back(obj.m_self); }
    void VisitPref(const prefbase& ref) override { prefs.push_back(ref.m_oid.value_); }
    void VisitParentPref(const prefbase&) override {}

    std::vector<const void*> objects;
    std::vector<uint64> prefs;
};

// VisitObjects reports every reference; VisitPrefs only the tree's edges.
TEST_F(BTreePersist, VisitsReportTreeEdgesAndLinks) {
    Fill(1, 160);
    ASSERT_EQ(Root()->m_numKeyEntrys, 2);
    Leaf* l[3] = {LeafAt(0), LeafAt(1), LeafAt(2)};
    auto visit = [](const auto& obj, std::vector<const void*> objects, std::vector<uint64> prefs) {
        CountingVisitor v;
        obj.VisitObjects(v);
        obj.VisitPrefs(v);
        EXPECT_EQ(v.objects, objects);
        EXPECT_EQ(v.prefs, prefs);
    };
    visit(map(), {l[0], l[2], Root()}, {Oid(Root())});
    visit(*Root(), {l[0], l[1], l[2]}, {Oid(l[0]), Oid(l[1]), Oid(l[2])});
    visit(*l[1], {l[0], l[2]}, {});
}

}  // namespace
}  // namespace tarn
