#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "tnOperation/FieldId.h"
#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnUtils/Guid.h"
#include "tnUtils/xostream.h"

namespace tarn {
namespace {

Path MakePath(const std::string& bytes) {
    return Path(bytes.data(), ssize_t(bytes.size()));
}

FieldId Key(uint64 oid, const std::string& path) {
    return FieldId(OID(Seid(oid)), MakePath(path));
}

const std::string kLong = "a path that is much longer than sixteen bytes";

TEST(SeidOrder, HighHalfDecidesFirstAndIsUnsigned) {
    EXPECT_LT(Seid(4294967295u, 0u), Seid(0u, 1u));
    EXPECT_LT(Seid(0u, 0x7fffffffu), Seid(0u, 0x80000000u));
    EXPECT_LT(Seid(), Seid(1u, 0u));
    EXPECT_EQ(Seid(5u, 7u).value_, (uint64{7} << 32) | 5);
    EXPECT_TRUE(Seid().IsNull());
    EXPECT_FALSE(static_cast<bool>(OID()));
}

TEST(PathOrder, LexicographicOverUnsignedBytesWithPrefixLess) {
    EXPECT_LT(MakePath(""), MakePath("a"));
    EXPECT_LT(MakePath("ab"), MakePath("abc"));
    EXPECT_LT(MakePath("\x7f"), MakePath("\x80"));
    EXPECT_FALSE(MakePath("abc") < MakePath("abc"));
    EXPECT_EQ(MakePath(kLong), MakePath(kLong));
    EXPECT_NE(MakePath(kLong), MakePath(kLong + "x"));
}

TEST(PathCopy, LongPathsSurviveCopyAssignmentAndSelfAssignment) {
    Path a = MakePath(kLong);
    Path b(a);
    EXPECT_EQ(a, b);
    EXPECT_NE(a.data(), b.data());
    Path c = MakePath("short");
    c = a;
    EXPECT_EQ(c, a);
    Path& alias = c;
    c = alias;
    EXPECT_EQ(c, a);
    c = MakePath("x");  // back to the local buffer
    EXPECT_TRUE(c.IsLocal());
    EXPECT_EQ(c, MakePath("x"));
}

TEST(PathEdit, AppendGrowsIntoTheHeapAndEraseTailShrinks) {
    Path p;
    for (int i = 0; i < 10; ++i) {
        p.AppendUint32(uint32(i));
    }
    EXPECT_EQ(p.size(), 40);
    EXPECT_FALSE(p.IsLocal());
    EXPECT_EQ(p.begin()[4], 1);
    p.EraseTail(36);
    EXPECT_EQ(p.size(), 4);
    p.clear();
    EXPECT_TRUE(p.empty());
}

TEST(PathEdit, ReservationMovesBetweenLocalAndHeapKeepingContent) {
    Path p = MakePath("abc");
    octet_t* at = p.BeginReserveHeap(2);
    EXPECT_FALSE(p.IsLocal());
    at[0] = 'd';
    at[1] = 'e';
    p.EndReserveHeap(at + 2);
    EXPECT_EQ(p, MakePath("abcde"));
    at = p.BeginReserveLocal();
    EXPECT_TRUE(p.IsLocal());
    *at++ = 'f';
    p.EndReserveLocal(at);
    EXPECT_EQ(p, MakePath("abcdef"));
    at = p.BeginReserve(40);
    std::memset(at, 'g', 40);
    p.EndReserve(at + 40);
    EXPECT_EQ(p, MakePath("abcdef" + std::string(40, 'g')));
}

TEST(FieldIdOrder, OidFirstThenPath) {
    EXPECT_LT(Key(1, "zzz"), Key(2, ""));
    EXPECT_LT(Key(2, "a"), Key(2, "b"));
    EXPECT_FALSE(FieldId() < FieldId());
    EXPECT_LT(FieldId(), Key(1, ""));
    EXPECT_EQ(CompareKeys(Key(3, kLong), Key(3, kLong)), 0);
    const FieldId keys[] = {FieldId(), Key(0, "a"), Key(1, ""), Key(1, kLong),
                            Key(0xffffffff00000000u, "")};
    for (const auto& a : keys) {
        for (const auto& b : keys) {
            EXPECT_EQ(CompareKeys(a, b), -CompareKeys(b, a));
        }
    }
}

TEST(FieldIdRelocation, RawByteCopyKeepsAHeapPath) {
    alignas(FieldId) unsigned char from[sizeof(FieldId)];
    alignas(FieldId) unsigned char to[sizeof(FieldId)];
    auto* original = new (from) FieldId(Key(9, kLong));
    std::memcpy(to, from, sizeof(FieldId));
    std::memset(from, 0xdd, sizeof from);  // the old bytes are dead storage
    (void)original;
    auto* moved = std::launder(reinterpret_cast<FieldId*>(to));
    EXPECT_EQ(*moved, Key(9, kLong));
    moved->~FieldId();
}

TEST(TextForms, GuidOidAndFieldId) {
    Guid g{0x0123abcd, 0x0001, 0xbeef, {0x80, 0, 0, 0, 0, 0, 0, 0x2a}};
    EXPECT_EQ(ToString(g), "0123abcd-0001-beef-8000-00000000002a");
    ASSERT_TRUE(ParseGuid(ToString(g)).has_value());
    EXPECT_EQ(*ParseGuid(ToString(g)), g);
    EXPECT_FALSE(ParseGuid("0123abcd-0001-beef-8000-00000000002").has_value());
    EXPECT_FALSE(ParseGuid("0123abcd+0001-beef-8000-00000000002a").has_value());
    // A dash where a digit belongs, including the very last one.
    EXPECT_FALSE(ParseGuid("0123abcd-0001-beef-8000-00000000002-").has_value());
    EXPECT_FALSE(ParseGuid("0123abcd-0001-beef-8000-0000000000-a").has_value());
    EXPECT_EQ(ParseGuid("0123ABCD-0001-BEEF-8000-00000000002A"), g);
    StringOutputStream out;
    {
        xostream os(out);
        os << Key(12, "\x0a\xff") << ' ' << FieldId();
    }
    EXPECT_EQ(out.str(), "#12/0aff #0/");
}

TEST(GuidOrder, FieldsAsNumbersThenBytes) {
    Guid a{1, 0, 0, {}};
    Guid b{0, 0xffff, 0xffff, {0xff}};
    EXPECT_LT(b, a);
    Guid c = a;
    c.Data4[7] = 1;
    EXPECT_LT(a, c);
    EXPECT_NE(a, c);
}

}  // namespace
}  // namespace tarn
