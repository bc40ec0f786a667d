// The per-site offset table of one field: the time-stamp rule, equality and
// copies, relocation by raw byte copy together with field keys (as a leaf
// moves its entries), the byte image and the text form.

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <map>
#include <new>
#include <ostream>
#include <string>
#include <tuple>
#include <vector>

#include "tests/AssertDeath.h"
#include "tnOperation/FieldId.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/RelocatableMap.h"
#include "tnUtils/xostream.h"

namespace tarn {

void PrintTo(const SiteOffset<int64>& r, std::ostream* os) {
    *os << "(" << r.t << "," << r.o << ")";
}

namespace {

using Table = OffsetOpsOnField<int64>;
using Record = SiteOffset<int64>;
using Bytes = std::vector<octet_t>;

constexpr int64 kMin = std::numeric_limits<int64>::min();
constexpr int64 kMax = std::numeric_limits<int64>::max();
const Guid S1{0x11, 0, 0, {0, 0, 0, 0, 0, 0, 0, 1}};
const Guid S2{0x22, 0, 0, {0, 0, 0, 0, 0, 0, 0, 2}};
const Guid S3{0x33, 0, 0, {}};

// The table that these insertions (site, time stamp, offset) make, in order.
// Tables have no copy constructor, so it is a type of its own, filled by its
// constructor, that is read and assigned from like any table.
struct Made : Table {
    Made(std::initializer_list<std::tuple<Guid, ssize_t, int64>> inserts) {
        for (const auto& [s, t, o] : inserts) {
            Insert(s, t, o);
        }
    }
};

Made Make(std::initializer_list<std::tuple<Guid, ssize_t, int64>> inserts) {
    return Made(inserts);
}

Record At(const Table& table, const Guid& s) {
    auto i = table.m_map.find(s);
    return i == table.m_map.end() ? Record() : i->second;
}

TEST(TableInsert, StampsMayRepeatButNotDecreaseAndOffsetsAddUp) {
    EXPECT_EQ(Record(), Record(-1, 0));
    Made a = Make({{S1, 5, 2}, {S1, 5, 4}, {S2, 9, 0}, {S3, 1, kMax}, {S3, 1, 1}});
    EXPECT_EQ(a.m_map.size(), 3u);
    EXPECT_EQ(At(a, S1), Record(5, 6));
    EXPECT_EQ(At(a, S2), Record(9, 0));     // an offset of 0 still makes a record
    EXPECT_EQ(At(a, S3), Record(1, kMin));  // the sum wraps around
    EXPECT_TARN_ASSERT(a.Insert(S2, 8, 1), "so.t <= t");
    a.Insert(S1, 8, 1);  // each site has its own stamps
    EXPECT_EQ(At(a, S1), Record(8, 7));
}

TEST(TableEquality, SameRecordsWhateverTheInsertionOrder) {
    const Made tables[] = {
        Make({{S1, 5, 12}, {S2, 7, -3}}),
        Make({{S1, 5, 12}, {S2, 7, -4}}),
        Make({{S1, 5, 12}, {S2, 8, -3}}),
        Make({{S1, 5, 12}, {S3, 7, -3}}),
        Make({{S1, 5, 12}}),
        Make({}),
    };
    for (std::size_t i = 0; i < std::size(tables); ++i) {
        for (std::size_t j = 0; j < std::size(tables); ++j) {
            EXPECT_EQ(tables[i] == tables[j], i == j) << i << " " << j;
        }
    }
    EXPECT_EQ(Make({{S2, 7, -3}, {S1, 5, 12}}), tables[0]);
}

TEST(TableCopy, CopiesShareNothing) {
    const Made b = Make({{S1, 5, 12}});
    Table a;
    a = Make({{S2, 1, 1}});
    a = b;
    Table& alias = a;
    a = alias;
    a.Insert(S1, 6, 1);
    Table c;
    c = a;
    c.Insert(S3, 0, 0);
    EXPECT_EQ(b, Make({{S1, 5, 12}}));
    EXPECT_EQ(a, Make({{S1, 6, 13}}));
    EXPECT_EQ(c, Make({{S1, 6, 13}, {S3, 0, 0}}));
}

// An allocator that fails on demand.
bool g_failAllocation = false;

template <typename T>
struct FailingAllocator {
    using value_type = T;
    FailingAllocator() = default;
    template <typename U>
    FailingAllocator(const FailingAllocator<U>&) {}
    T* allocate(std::size_t n) {
        return g_failAllocation ? throw std::bad_alloc() : std::allocator<T>().allocate(n);
    }
    void deallocate(T* p, std::size_t n) { std::allocator<T>().deallocate(p, n); }
    bool operator==(const FailingAllocator&) const { return true; }
};

TEST(TableCopy, FailedAssignmentLeavesTheTargetIntact) {
    using FM = std::map<int, int, std::less<int>, FailingAllocator<std::pair<const int, int>>>;
    RelocatableMap<FM> target;
    target[1] = 10;
    RelocatableMap<FM> source;
    source[2] = 20;
    g_failAllocation = true;
    EXPECT_THROW(target = source, std::bad_alloc);
    g_failAllocation = false;
    EXPECT_EQ(target.getmap(), (FM{{1, 10}}));
}

// Leaf entries move by raw byte copies, without constructors or destructors;
// the vacated bytes are dead storage.
TEST(TableRelocation, EntriesWithShortAndHeapPathsSurviveARawByteCopy) {
    struct Entry {
        FieldId key;
        Table payload;
    };
    auto key = [](int i) {
        const std::string path(i == 0 ? 3 : 40, 'p');
        return FieldId(OID(Seid(uint64(i))), Path(path.data(), ssize_t(path.size())));
    };
    alignas(Entry) unsigned char from[2 * sizeof(Entry)];
    alignas(Entry) unsigned char to[2 * sizeof(Entry)];
    for (int i = 0; i < 2; ++i) {
        Entry* e = new (from + i * sizeof(Entry)) Entry{key(i), {}};
        e->payload = Make({{S1, i, i * 10}});
    }
    std::memcpy(to, from, sizeof to);
    std::memset(from, 0xdd, sizeof from);
    for (int i = 0; i < 2; ++i) {
        Entry* e = std::launder(reinterpret_cast<Entry*>(to) + i);
        EXPECT_EQ(e->key, key(i));
        EXPECT_EQ(e->payload, Make({{S1, i, i * 10}}));
        e->payload.Insert(S2, 0, 1);  // the moved map still works
        e->~Entry();
    }
}

Bytes Written(const Table& table) {
    MemoryOutputStream os;
    Archive ar(&os);
    ar << table;
    ar.Flush();
    return os.bytes();
}

void Append(Bytes& out, const Guid& s, const Bytes& record) {
    const auto* p = reinterpret_cast<const octet_t*>(&s);
    out.insert(out.end(), p, p + sizeof s);
    out.insert(out.end(), record.begin(), record.end());
}

// Image: count, then (site, t as a varint, o as 8 bytes) in ascending site order.
TEST(TableImage, ExactBytesAndWhatReadingThemGives) {
    const Made a = Make({{S2, 300, -3}, {S1, 5, 12}});
    Bytes exact = {0x02};
    Append(exact, S1, {0x05, 12, 0, 0, 0, 0, 0, 0, 0});
    Append(exact, S2, {0xac, 0x02, 0xfd, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff});
    EXPECT_EQ(Written(a), exact);
    EXPECT_EQ(exact[1], 0x11);  // Data1, little-endian
    EXPECT_EQ(Written(Table()), Bytes{0x00});

    const Made extremes = Make({{S1, 4294967295, kMin}, {S2, 0, kMax}});
    Table unrecorded;
    unrecorded.m_map[S3];
    Bytes duplicates = {0x02};
    Append(duplicates, S1, {0x07, 1, 0, 0, 0, 0, 0, 0, 0});
    Append(duplicates, S1, {0x08, 2, 0, 0, 0, 0, 0, 0, 0});
    const struct {
        Bytes image;
        const Table& expected;
    } cases[] = {
        {exact, a},
        {Written(extremes), extremes},
        {Written(unrecorded), Make({{S3, 4294967295, 0}})},  // a stamp keeps 32 bits
        {Written(Table()), Table()},
        {duplicates, Make({{S1, 7, 1}})},  // the first of two records of a site
    };
    for (const auto& c : cases) {
        Made target = Make({{S3, 1, 1}, {S1, 2, 2}});  // replaced by reading
        InputArchive in(c.image.data());
        in >> target;
        EXPECT_EQ(target, c.expected);
        EXPECT_EQ(in.ptr(), c.image.data() + c.image.size());
    }
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

TEST(TableText, RecordsEntriesAndTables) {
    const std::string s1 = ToString(S1);
    const std::string s2 = ToString(S2);
    EXPECT_EQ(Text(Record()), "(-1,0)");
    EXPECT_EQ(Text(Table()), "{}");
    const Made a = Make({{S2, 7, -3}, {S1, 5, 12}});
    EXPECT_EQ(Text(*a.m_map.begin()), "(" + s1 + ",(5,12))");
    EXPECT_EQ(Text(a), "{(" + s1 + ",(5,12)),(" + s2 + ",(7,-3))}");
}

}  // namespace
}  // namespace tarn
