#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <map>
#include <new>
#include <ostream>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tnOperation/FieldId.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/RelocatableMap.h"
#include "tnUtils/xostream.h"

namespace tarn {

// Readable failure messages for records.
void PrintTo(const SiteOffset<int64>& r, std::ostream* os) {
    *os << "(" << r.t << "," << r.o << ")";
}

namespace {

using Table = OffsetOpsOnField<int64>;
using Record = SiteOffset<int64>;
using Bytes = std::vector<octet_t>;

const Guid S1{0x11, 0, 0, {0, 0, 0, 0, 0, 0, 0, 1}};
const Guid S2{0x22, 0, 0, {0, 0, 0, 0, 0, 0, 0, 2}};
const Guid S3{0x33, 0, 0, {}};

Record At(const Table& table, const Guid& s) {
    auto i = table.m_map.find(s);
    return i == table.m_map.end() ? Record() : i->second;
}

template <typename X>
std::string Text(const X& x) {
    StringOutputStream out;
    {
        xostream os(out);
        os << x;
    }
    return out.str();
}

template <typename X>
Bytes Written(const X& x) {
    MemoryOutputStream os;
    Archive ar(&os);
    ar << x;
    ar.Flush();
    return os.bytes();
}

void Append(Bytes& out, const Bytes& more) {
    out.insert(out.end(), more.begin(), more.end());
}

Bytes GuidBytes(const Guid& g) {
    const auto* p = reinterpret_cast<const octet_t*>(&g);
    return Bytes(p, p + sizeof g);
}

// ---- Recording offsets.

TEST(TableInsert, TimeStampsMayRepeatButNotDecrease) {
    EXPECT_EQ(Record(), Record(-1, 0));
    EXPECT_NE(Record(), Record(-1, 1));
    Table a;
    EXPECT_TRUE(a.m_map.empty());
    EXPECT_EQ(a, Table());

    a.Insert(S1, 5, 3);
    EXPECT_EQ(a.m_map.size(), 1u);
    EXPECT_EQ(At(a, S1), Record(5, 3));

    Table b;
    b.Insert(S1, 5, 2);
    b.Insert(S1, 5, 4);
    EXPECT_EQ(At(b, S1), Record(5, 6));

    Table c;
    c.Insert(S2, 9, 0);  // an offset of 0 still creates the record
    EXPECT_EQ(c.m_map.size(), 1u);
    EXPECT_EQ(At(c, S2), Record(9, 0));

    Table d;
    d.Insert(S1, 7, 1);
    EXPECT_TARN_ASSERT(d.Insert(S1, 6, 1), "so.t <= t");
    d.Insert(S2, 6, 1);  // another site has its own time stamps
    EXPECT_EQ(At(d, S2), Record(6, 1));
}

TEST(TableInsert, SumWrapsAroundWithoutUndefinedBehaviour) {
    Table a;
    a.Insert(S1, 1, std::numeric_limits<int64>::max());
    a.Insert(S1, 1, 1);
    EXPECT_EQ(At(a, S1).o, std::numeric_limits<int64>::min());
}

TEST(TableEquality, SameRecordsInAnyOrder) {
    Table a, b, c;
    a.Insert(S1, 5, 12);
    a.Insert(S2, 7, -3);
    b.Insert(S2, 7, -3);
    b.Insert(S1, 5, 12);
    c.Insert(S1, 5, 12);
    c.Insert(S2, 7, -4);
    EXPECT_EQ(a, b);
    EXPECT_FALSE(a == c);  // same sites and stamps, different sums
    Table d;
    d.Insert(S1, 5, 12);
    EXPECT_FALSE(a == d);
    EXPECT_FALSE(d == a);
    d.Insert(S3, 7, -3);
    EXPECT_FALSE(a == d);  // same size and records, different site
}

TEST(TableCopy, CopiesShareNothing) {
    Table a, b;
    b.Insert(S1, 5, 12);
    a.Insert(S2, 1, 1);
    a = b;
    EXPECT_EQ(a, b);
    a.Insert(S1, 6, 1);
    EXPECT_EQ(At(b, S1), Record(5, 12));
    EXPECT_NE(a.m_map.m_map, b.m_map.m_map);

    Table& alias = a;
    a = alias;
    EXPECT_EQ(At(a, S1), Record(6, 13));

    Table c(a);
    c.Insert(S3, 0, 0);
    EXPECT_EQ(a.m_map.size(), 1u);
    EXPECT_EQ(c.m_map.size(), 2u);
}

// ---- Relocation by raw byte copy, as a B+tree leaf moves its entries.

struct Entry {
    FieldId key;
    Table payload;
};

TEST(TableRelocation, ByteCopiedTableKeepsWorkingAndFreesOnce) {
    alignas(Table) unsigned char from[sizeof(Table)];
    alignas(Table) unsigned char to[sizeof(Table)];
    auto* original = new (from) Table;
    original->Insert(S1, 5, 12);
    std::memcpy(to, from, sizeof(Table));  // the bytes in `from` are now abandoned
    auto* moved = std::launder(reinterpret_cast<Table*>(to));
    moved->Insert(S2, 1, 2);
    EXPECT_EQ(At(*moved, S1), Record(5, 12));
    EXPECT_EQ(moved->m_map.size(), 2u);
    moved->~Table();
}

TEST(TableRelocation, LeafLikeShiftOfKeysWithHeapPathsAndTables) {
    // Raw storage for six entries; entries are shifted right by memmove to
    // open slot 0, then the last one is moved out to another "node".
    constexpr int kSlots = 6;
    alignas(Entry) unsigned char slots[kSlots * sizeof(Entry)];
    alignas(Entry) unsigned char other[sizeof(Entry)];
    auto slot = [&](int i) { return std::launder(reinterpret_cast<Entry*>(slots) + i); };
    const std::string longPath(40, 'x');
    for (int i = 0; i < kSlots - 1; ++i) {
        auto* e = new (slots + i * sizeof(Entry)) Entry;
        e->key = FieldId(OID(Seid(uint64(i + 1))), Path(longPath.data(), 40));
        e->payload.Insert(S1, i, i * 10);
    }
    std::memmove(slots + sizeof(Entry), slots, (kSlots - 1) * sizeof(Entry));
    auto* first = new (slots) Entry;
    first->payload.Insert(S2, 0, -1);
    std::memcpy(other, slots + (kSlots - 1) * sizeof(Entry), sizeof(Entry));
    auto* outside = std::launder(reinterpret_cast<Entry*>(other));

    EXPECT_EQ(At(first->payload, S2), Record(0, -1));
    for (int i = 1; i < kSlots - 1; ++i) {
        EXPECT_EQ(slot(i)->key.oid, OID(Seid(uint64(i))));
        EXPECT_EQ(slot(i)->key.path, Path(longPath.data(), 40));
        EXPECT_EQ(At(slot(i)->payload, S1), Record(i - 1, (i - 1) * 10));
    }
    EXPECT_EQ(At(outside->payload, S1), Record(4, 40));
    outside->payload.Insert(S1, 4, 1);
    EXPECT_EQ(At(outside->payload, S1), Record(4, 41));
    for (int i = 0; i < kSlots - 1; ++i) {
        slot(i)->~Entry();
    }
    outside->~Entry();
}

// ---- Byte image: count, then (site, t, o) in ascending site order.

TEST(TableImage, ExactBytesOfTwoSitesRecordedOutOfOrder) {
    Table a;
    a.Insert(S2, 300, -3);
    a.Insert(S1, 5, 12);
    Bytes expected = {0x02};
    Append(expected, GuidBytes(S1));
    Append(expected, {0x05, 12, 0, 0, 0, 0, 0, 0, 0});
    Append(expected, GuidBytes(S2));
    Append(expected, {0xac, 0x02, 0xfd, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff});
    Bytes image = Written(a);
    EXPECT_EQ(image, expected);
    EXPECT_EQ(GuidBytes(S1)[0], 0x11);  // Data1 little-endian first

    InputArchive in(image.data());
    Table b;
    in >> b;
    EXPECT_EQ(a, b);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
}

TEST(TableImage, EmptyTableIsTheCountAlone) {
    EXPECT_EQ(Written(Table()), Bytes{0x00});
}

TEST(TableImage, ExtremeSumsSurviveAndTimeStampsKeep32Bits) {
    Table a;
    a.Insert(S1, 4294967295, std::numeric_limits<int64>::min());
    a.Insert(S2, 0, std::numeric_limits<int64>::max());
    Bytes image = Written(a);
    InputArchive in(image.data());
    Table b;
    in >> b;
    EXPECT_EQ(a, b);

    // An unrecorded stamp (-1) is written as its low 32 bits.
    Table c;
    c.m_map[S3];
    image = Written(c);
    InputArchive in2(image.data());
    in2 >> b;
    EXPECT_EQ(At(b, S3), Record(4294967295, 0));
}

TEST(TableImage, ReadingReplacesContentAndKeepsTheFirstOfDuplicateSites) {
    Table target;
    target.Insert(S3, 1, 1);
    target.Insert(S1, 2, 2);
    Bytes empty = Written(Table());
    InputArchive in(empty.data());
    in >> target;
    EXPECT_TRUE(target.m_map.empty());

    target.Insert(S3, 1, 1);
    Bytes dup = {0x02};
    Append(dup, GuidBytes(S1));
    Append(dup, {0x07, 1, 0, 0, 0, 0, 0, 0, 0});
    Append(dup, GuidBytes(S1));
    Append(dup, {0x08, 2, 0, 0, 0, 0, 0, 0, 0});
    InputArchive in2(dup.data());
    in2 >> target;
    EXPECT_EQ(target.m_map.size(), 1u);
    EXPECT_EQ(At(target, S1), Record(7, 1));
    EXPECT_EQ(in2.ptr(), dup.data() + dup.size());
}

// ---- Text forms.

TEST(TableText, RecordsEntriesAndTables) {
    const std::string s1 = ToString(S1);
    const std::string s2 = ToString(S2);
    EXPECT_EQ(Text(Record()), "(-1,0)");
    EXPECT_EQ(Text(Table()), "{}");
    Table a;
    a.Insert(S1, 5, 12);
    EXPECT_EQ(Text(a), "{(" + s1 + ",(5,12))}");
    EXPECT_EQ(Text(*a.m_map.begin()), "(" + s1 + ",(5,12))");
    a.Insert(S2, 7, -3);
    Table b;
    b.Insert(S2, 7, -3);
    b.Insert(S1, 5, 12);
    const std::string both = "{(" + s1 + ",(5,12)),(" + s2 + ",(7,-3))}";
    EXPECT_EQ(Text(a), both);
    EXPECT_EQ(Text(b), both);
    EXPECT_EQ(Text(a.m_map), both);
    EXPECT_EQ(Text(a.m_map.getmap()), both);
}

// ---- The relocatable map wrapper's own interface.

using M = std::map<int, std::string>;
using RM = RelocatableMap<M>;

TEST(RelocatableMapInterface, ActsOnTheOwnedMap) {
    RM r;
    EXPECT_EQ(r[0], "");  // operator[] inserts a default value
    EXPECT_TRUE(r.insert({3, "three"}).second);
    EXPECT_FALSE(r.insert({3, "drei"}).second);
    r.insert(r.end(), {5, "five"});
    EXPECT_EQ(r.getmap(), (M{{0, ""}, {3, "three"}, {5, "five"}}));
    EXPECT_EQ(r.lower_bound(1)->first, 3);
    EXPECT_EQ(r.upper_bound(3)->first, 5);
    EXPECT_EQ(r.equal_range(3).first->second, "three");
    EXPECT_EQ(r.rbegin()->first, 5);
    const RM& c = r;
    EXPECT_EQ(c.find(5)->second, "five");
    EXPECT_EQ(r.erase(3), 1u);
    r.erase(r.begin());
    r.erase(c.begin(), c.end());
    EXPECT_TRUE(r.empty());
}

TEST(RelocatableMapInterface, CopiesAssignmentsAndSwaps) {
    M plain = {{1, "a"}, {2, "b"}};
    RM a(plain);
    plain[3] = "c";
    EXPECT_EQ(a.size(), 2u);  // a copy, not a view

    RM b(a);
    b[1] = "changed";
    EXPECT_EQ(a[1], "a");

    RM c;
    c = plain;
    EXPECT_EQ(c.getmap(), plain);
    c = a;
    EXPECT_EQ(c, a);
    RM& alias = c;
    c = alias;
    EXPECT_EQ(c, a);

    M* ownedByA = a.m_map;
    M* ownedByB = b.m_map;
    a.swap(b);
    EXPECT_EQ(a.m_map, ownedByB);
    EXPECT_EQ(b.m_map, ownedByA);
    swap(a, b);
    EXPECT_EQ(a.m_map, ownedByA);

    M other = {{9, "z"}};
    a.swap(other);
    EXPECT_EQ(a.size(), 1u);
    EXPECT_EQ(other.size(), 2u);
    EXPECT_EQ(a.m_map, ownedByA);  // the map object stays in place
}

TEST(RelocatableMapInterface, EqualityComparesSizeThenEntriesInOrder) {
    RM a(M{{1, "a"}, {2, "b"}});
    EXPECT_EQ(a, RM(M{{1, "a"}, {2, "b"}}));
    EXPECT_FALSE(a == RM(M{{1, "a"}}));
    EXPECT_FALSE(RM(M{{1, "a"}}) == a);
    EXPECT_FALSE(a == RM(M{{1, "a"}, {3, "b"}}));
    EXPECT_FALSE(a == RM(M{{1, "a"}, {2, "c"}}));
    EXPECT_EQ(RM(), RM());
}

TEST(RelocatableMapInterface, DestructorToleratesNull) {
    alignas(RM) unsigned char raw[sizeof(RM)];
    auto* r = new (raw) RM;
    delete r->m_map;
    r->m_map = nullptr;
    r->~RM();
    static_assert(sizeof(RM) == sizeof(void*));
}

// An allocator that fails on demand, to check that a failed assignment
// leaves the target as it was.
bool g_failAllocation = false;

template <typename T>
struct FailingAllocator {
    using value_type = T;
    FailingAllocator() = default;
    template <typename U>
    FailingAllocator(const FailingAllocator<U>&) {}
    T* allocate(std::size_t n) {
        if (g_failAllocation) {
            throw std::bad_alloc();
        }
        return std::allocator<T>().allocate(n);
    }
    void deallocate(T* p, std::size_t n) { std::allocator<T>().deallocate(p, n); }
    template <typename U>
    bool operator==(const FailingAllocator<U>&) const {
        return true;
    }
};

TEST(RelocatableMapInterface, FailedAssignmentLeavesTargetIntact) {
    using FM = std::map<int, int, std::less<int>, FailingAllocator<std::pair<const int, int>>>;
    RelocatableMap<FM> target;
    target[1] = 10;
    RelocatableMap<FM> source;
    source[2] = 20;
    FM* before = target.m_map;
    g_failAllocation = true;
    EXPECT_THROW(target = source, std::bad_alloc);
    g_failAllocation = false;
    EXPECT_EQ(target.m_map, before);
    EXPECT_EQ(target.size(), 1u);
    EXPECT_EQ(target[1], 10);
}

}  // namespace
}  // namespace tarn
