// Identities, paths and field keys: their orders, copies, edits and text forms.
// Raw byte copies of keys are tested with the per-site tables, as leaves move
// both together (OffsetOpsOnFieldTest).

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnUtils/Guid.h"
#include "tnUtils/xostream.h"

namespace tarn {
namespace {

Path P(const std::string& bytes) {
    return Path(bytes.data(), ssize_t(bytes.size()));
}
FieldId Key(uint64 oid, const std::string& path) {
    return FieldId(OID(Seid(oid)), P(path));
}
const std::string kLong(40, 'a');  // beyond the 16-byte local buffer

// `ascending` is strictly ascending: every pair, and every pair with a copy,
// compares by position.
template <typename T>
void ExpectAscending(const std::vector<T>& ascending) {
    const std::vector<T> copies(ascending);
    for (std::size_t i = 0; i < ascending.size(); ++i) {
        for (std::size_t j = 0; j < ascending.size(); ++j) {
            EXPECT_EQ(ascending[i] < copies[j], i < j) << i << " " << j;
            EXPECT_EQ(ascending[i] == copies[j], i == j) << i << " " << j;
            if constexpr (std::is_same_v<T, FieldId>) {
                EXPECT_EQ(CompareKeys(ascending[i], copies[j]), i < j ? -1 : i > j ? 1 : 0);
            }
        }
    }
}

TEST(Orders, SeidIsUnsignedWithTheHighHalfFirst) {
    ExpectAscending<Seid>({Seid(), Seid(1u, 0u), Seid(0x7fffffffu, 0u), Seid(0x80000000u, 0u),
                           Seid(0xffffffffu, 0u), Seid(0u, 1u), Seid(0u, 0x80000000u)});
    EXPECT_EQ(Seid(5u, 7u).value_, (uint64{7} << 32) | 5);
}

TEST(Orders, PathIsLexicographicOverUnsignedBytesWithPrefixesFirst) {
    ExpectAscending<Path>({P(""), P(std::string(1, '\0')), P("a"), P(kLong), P(kLong + "\x01"),
                           P("ab"), P("abc"), P("\x7f"), P("\x80"), P("\xff")});
}

TEST(Orders, GuidComparesFieldsAsNumbersThenDataBytes) {
    auto g = [](uint32 d1, uint16 d2, uint16 d3, octet_t first, octet_t last) {
        return Guid{d1, d2, d3, {first, 0, 0, 0, 0, 0, 0, last}};
    };
    ExpectAscending<Guid>({g(0, 0, 0, 0, 0), g(0, 0, 0, 0, 1), g(0, 0, 0, 0x7f, 0),
                           g(0, 0, 0, 0x80, 0), g(0, 0, 0xff, 0, 0), g(0, 0, 0x100, 0, 0),
                           g(0, 0xff, 0xffff, 0xff, 0xff), g(0, 0x100, 0, 0, 0),
                           g(0xff, 0xffff, 0xffff, 0xff, 0xff), g(0x100, 0, 0, 0, 0)});
}

TEST(Orders, FieldIdComparesOidThenPath) {
    ExpectAscending<FieldId>({FieldId(), Key(0, "a"), Key(1, ""), Key(1, "a"), Key(1, kLong),
                              Key(1, "b"), Key(2, ""), Key(0xffffffff00000000u, "")});
}

TEST(PathStorage, CopiesOwnTheirBytesAndMoveBetweenLocalAndHeap) {
    const Path longPath = P(kLong);
    Path p = P("short");
    p = longPath;
    Path& alias = p;
    p = alias;
    EXPECT_EQ(p, longPath);
    EXPECT_NE(p.data(), longPath.data());
    p = P("x");
    EXPECT_TRUE(p.IsLocal());

    // Appending grows into the heap; erasing the tail keeps the head.
    for (uint32 i = 0; i < 10; ++i) {
        p.AppendUint32(i);
    }
    EXPECT_FALSE(p.IsLocal());
    EXPECT_EQ(p.size(), 41);
    EXPECT_EQ(p.begin()[5], 1);
    p.EraseTail(36);
    EXPECT_EQ(p, P(std::string("x\0\0\0\0", 5)));
}

TEST(TextForms, GuidReadsBackAndFieldIdIsOidSlashHexPath) {
    const Guid g{0x0123abcd, 0x0001, 0xbeef, {0x80, 0, 0, 0, 0, 0, 0, 0x2a}};
    EXPECT_EQ(ToString(g), "0123abcd-0001-beef-8000-00000000002a");
    EXPECT_EQ(ParseGuid(ToString(g)), g);
    EXPECT_EQ(ParseGuid("0123ABCD-0001-BEEF-8000-00000000002A"), g);
    for (const char* bad :
         {"0123abcd-0001-beef-8000-00000000002", "0123abcd+0001-beef-8000-00000000002a",
          "0123abcd-0001-beef-8000-00000000002-",  // a dash for the last digit
          "0123abcd-0001-beef-8000-0000000000-a"}) {
        EXPECT_FALSE(ParseGuid(bad).has_value()) << bad;
    }
    StringOutputStream out;  // a field key: the oid, "/", the path in hex
    {
        xostream os(out);
        os << Key(12, "\x0a\xff") << ' ' << FieldId();
    }
    EXPECT_EQ(out.str(), "#12/0aff #0/");
}

}  // namespace
}  // namespace tarn
