// The offset operations record end to end: recording under the lock check,
// clearing, its image, printing, the map dump and validation, reflection and
// registration, and a round trip through commit and reload.

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnOperation/RegisterClasses.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/SpaceRef.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/xostream.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakeSite;
using Bytes = std::vector<octet_t>;

template <typename T>
Bytes ImageOf(const T& obj) {
    MemoryOutputStream out;
    Archive ar(&out);
    obj.Serialise(ar);
    ar.Flush();
    return out.bytes();
}

template <typename T>
std::string TextOf(const T& x) {
    StringOutputStream out;
    {
        xostream os(out);
        os << x;
    }
    return out.str();
}

std::string DumpOf(const FieldIdToOffsetOpsOnInt64FieldMap& m) {
    StringOutputStream out;
    {
        xostream os(out);
        m.Write(os);
    }
    return out.str();
}

Bytes Le64(uint64 v) {
    Bytes b;
    for (int i = 0; i < 8; ++i) {
        b.push_back(static_cast<octet_t>(v >> (8 * i)));
    }
    return b;
}

Bytes Cat(std::initializer_list<Bytes> parts) {
    Bytes all;
    for (const Bytes& p : parts) {
        all.insert(all.end(), p.begin(), p.end());
    }
    return all;
}

Opid Op(uint32 site, int64 t) {
    return Opid(MakeSite(site), t);
}

class OffsetOpsTest : public ::testing::Test {
protected:
    CSpace space;
};

TEST_F(OffsetOpsTest, NewRecordRefersToAnEmptyMapAndPrintsItsReference) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    ASSERT_TRUE(static_cast<bool>(rec->m_map));
    FieldIdToOffsetOpsOnInt64FieldMap* map = rec->m_map.Get();
    uint64 mapId = map->GetPersistObjState().m_oid.value_;
    EXPECT_EQ(ImageOf(*rec), Cat({{0x01}, Le64(mapId)}));
    EXPECT_EQ(ImageOf(*map), Cat({{0x01, 0x00}, Le64(0), Le64(0), Le64(0), {0x00}}));
    EXPECT_EQ(TextOf(*rec), "#" + std::to_string(mapId));

    rec->RecordOffset(Op(1, 5), MakeKey(1), 12);
    EXPECT_EQ(TextOf(*rec), "#" + std::to_string(mapId));  // never the tables
    space.Commit();
}

TEST_F(OffsetOpsTest, RecordsSumPerSiteAndFieldAndClearStartsAfresh) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    rec->RecordOffset(Op(1, 5), MakeKey(1), 2);
    rec->RecordOffset(Op(1, 5), MakeKey(1), 4);   // equal time stamps add up
    rec->RecordOffset(Op(2, 3), MakeKey(1), -7);  // a second site, same field
    rec->RecordOffset(Op(1, 9), MakeKey(2), 0);   // a second field; 0 still records
    FieldIdToOffsetOpsOnInt64FieldMap& map = *rec->m_map;
    ASSERT_EQ(map.size(), 2);
    const OffsetOpsOnField<int64>* first = map.rFind(MakeKey(1));
    ASSERT_NE(first, nullptr);
    EXPECT_EQ(first->m_map.size(), 2u);
    EXPECT_EQ(first->m_map.getmap().at(MakeSite(1)), SiteOffset<int64>(5, 6));
    EXPECT_EQ(first->m_map.getmap().at(MakeSite(2)), SiteOffset<int64>(3, -7));
    EXPECT_EQ(map.rFind(MakeKey(2))->m_map.getmap().at(MakeSite(1)), SiteOffset<int64>(9, 0));

    rec->Clear();
    EXPECT_EQ(map.size(), 0);
    EXPECT_EQ(map.m_height, -1);
    rec->RecordOffset(Op(1, 1), MakeKey(1), 3);  // an earlier time stamp is fine again
    EXPECT_EQ(map.rFind(MakeKey(1))->m_map.getmap().at(MakeSite(1)), SiteOffset<int64>(1, 3));
    space.Commit();
}

TEST_F(OffsetOpsTest, ReadingAnotherRecordsImageRefersToTheSameMap) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    Bytes image = ImageOf(*rec);
    OffsetOps copy;
    InputArchive in(image.data());
    copy.Deserialise(in);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
    EXPECT_EQ(copy.m_map.Get(), rec->m_map.Get());
    space.Commit();
}

// Enough ascending keys for more than 100 leaves, so the root sits two
// levels above them.
constexpr int kKeysForHeight2 = 5200;

TEST_F(OffsetOpsTest, TablesSurviveCommitAndReloadFromTheStore) {
    std::map<FieldId, std::map<uint32, SiteOffset<int64>>> model;
    {
        CSpaceGuard g(space, LockMode::Exclusive);
        OffsetOps* rec = CreatePersistent<OffsetOps>();
        space.SetRoot("offsets", rec->GetPersistObjState().m_oid);
        for (int i = 0; i < kKeysForHeight2; ++i) {
            for (uint32 site = 1; site <= uint32(1 + i % 3); ++site) {
                FieldId key = MakeKey(uint64(i), i % 5 == 0);
                rec->RecordOffset(Op(site, i), key, i - 100 * int64(site));
                SiteOffset<int64>& so = model[key][site];
                so.t = i;
                so.o += i - 100 * int64(site);
            }
        }
        EXPECT_EQ(rec->m_map->m_height, 2);
        space.Commit();
        EXPECT_EQ(space.DropCleanResidents(), space.Stats().numRegistered);
        EXPECT_EQ(space.NumResidents(), 0);
    }
    CSpaceGuard g(space, LockMode::Shared);
    SpaceRef<OffsetOps> rec(space, space.GetRoot("offsets"));
    const FieldIdToOffsetOpsOnInt64FieldMap& map = *rec->m_map;
    EXPECT_EQ(testing::CheckBTree(map), "");
    map.Validate();
    ASSERT_EQ(map.size(), ssize_t(model.size()));
    auto expected = model.begin();
    for (auto it = map.begin(); it != map.end(); ++it, ++expected) {
        const auto& [key, table] = *it;
        EXPECT_EQ(key, expected->first);
        ASSERT_EQ(table.m_map.size(), expected->second.size());
        for (const auto& [site, so] : expected->second) {
            EXPECT_EQ(table.m_map.getmap().at(MakeSite(site)), so);
        }
    }
}

TEST_F(OffsetOpsTest, ClearThenCommitLeavesNoNodeImageBehind) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    for (int i = 0; i < 1000; ++i) {
        rec->RecordOffset(Op(1, i), MakeKey(uint64(i)), 1);
    }
    space.Commit();
    EXPECT_GT(space.GetStore().Stats().numImages, 10);
    rec->Clear();
    space.Commit();
    EXPECT_EQ(space.GetStore().Stats().numImages, 2);  // the record and the map header
    EXPECT_EQ(space.NumResidents(), 2);
}

TEST_F(OffsetOpsTest, ChangesNeedTheExclusiveLockAndACreatedRecordIsLocal) {
    OffsetOps* rec;
    {
        CSpaceGuard g(space, LockMode::Exclusive);
        rec = CreatePersistent<OffsetOps>();
        space.Commit();
    }
    EXPECT_TARN_ASSERT(rec->RecordOffset(Op(1, 1), MakeKey(1), 1), "HaveExclusiveLockedCSpace()");
    EXPECT_TARN_ASSERT(rec->Clear(), "HaveExclusiveLockedCSpace()");
    {
        CSpaceGuard g(space, LockMode::Shared);
        EXPECT_TARN_ASSERT(rec->RecordOffset(Op(1, 1), MakeKey(1), 1),
                           "HaveExclusiveLockedCSpace()");
    }
    OffsetOps fresh;
    EXPECT_TARN_ASSERT(fresh.OnCreate(false), "local");
    CSpaceGuard g(space, LockMode::Exclusive);
    rec->RecordOffset(Op(1, 7), MakeKey(1), 1);
    EXPECT_TARN_ASSERT(rec->RecordOffset(Op(1, 6), MakeKey(1), 1), "so.t <= t");
    space.Commit();
}

TEST(OffsetOpsReflection, RecordsHoldTheirClassesAndRegisterOnce) {
    const ReflectedClass& rc = _GetReflected(static_cast<OffsetOps*>(nullptr));
    EXPECT_EQ(&rc, &GetReflectedClass<OffsetOps>());
    EXPECT_EQ(rc.m_flags, 1u);
    EXPECT_STREQ(rc.m_name, "tarn::OffsetOps");
    EXPECT_EQ(rc.m_size, ssize_t(sizeof(OffsetOps)));
    EXPECT_EQ(rc.m_ops.m_size, rc.m_size);
    EXPECT_EQ(rc.m_numIndirectInterfaces, 1);
    EXPECT_EQ(rc.m_numDirectInterfaces, 1);
    EXPECT_STREQ(rc.m_interfaces[0], "tarn::IObject");
    EXPECT_STREQ(rc.m_interfaces[1], "tarn::IPersistable");
    EXPECT_EQ(rc.m_IObjectFnTable, &IObject::Stubs<OffsetOps>::GetTable());
    EXPECT_NE(rc.m_ops.m_PrintVariableFn, nullptr);
    EXPECT_NE(rc.m_ops.m_ConstructArrayFn, nullptr);
    EXPECT_NE(rc.m_ops.m_DestructArrayFn, nullptr);
    EXPECT_EQ(rc.m_ops.m_CopyConstructArrayFn, nullptr);
    EXPECT_EQ(rc.m_ops.m_AssignArrayFn, nullptr);
    EXPECT_EQ(rc.m_ops.m_equalsFn, nullptr);
    EXPECT_EQ(_GetTypeOps(static_cast<OffsetOps*>(nullptr)), &rc.m_ops);

    OffsetOps rec;
    ptr<IObject> handle(&rec);
    EXPECT_EQ(handle->GetReflectedClass(), &rc);

    RegisterOffsetOpsClasses();
    RegisterOffsetOpsClasses();  // idempotent
    EXPECT_DEATH(
        _Register_OffsetOps(),
        testing::RegexQuote("void tarn::_Register_OffsetOps(): Assertion "
                            "\"tarn::RegisterReflectedClass(&_GetReflected( (OffsetOps*) "
                            "0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK\" failed."));
}

TEST(OffsetOpsReflection, PrintThroughTypeOperations) {
    OffsetOps rec;
    StringOutputStream out;
    {
        xostream os(out);
        GetReflectedClass<OffsetOps>().m_ops.m_PrintVariableFn(os, &rec);
    }
    EXPECT_EQ(out.str(), "#0");
}

// ---- The dump, validation and node counts of the map ----

class MapDiagnosticsTest : public ::testing::Test {
protected:
    MapDiagnosticsTest() : guard(space, LockMode::Exclusive) {
        map = DollarNew(new FieldIdToOffsetOpsOnInt64FieldMap());
    }
    ~MapDiagnosticsTest() override { space.Commit(); }

    CSpace space;
    CSpaceGuard guard;
    FieldIdToOffsetOpsOnInt64FieldMap* map;
};

TEST_F(MapDiagnosticsTest, EmptyMapsPrintTheirHeightAndCountTheirNodes) {
    EXPECT_EQ(DumpOf(*map), "Height = -1\n");
    EXPECT_EQ(map->GetNumNodes(), 0);
    map->Validate();

    FieldIdToOffsetOpsOnInt64FieldMap::wFindRet ret;
    map->wFind(ret, MakeKey(1), false);  // leaves an empty root leaf
    EXPECT_EQ(DumpOf(*map), "Height = 0\n{\n}\n");
    EXPECT_EQ(map->GetNumNodes(), 1);
    map->Validate();
}

TEST_F(MapDiagnosticsTest, DumpIndentsChildBlocksAndPlacesSeparatorsBetweenThem) {
    Guid site = MakeSite(0xabc);
    for (uint64 i = 0; i < 101; ++i) {
        (*map)[MakeKey(0, std::string(1, char(i)))].Insert(site, 5, int64(i) - 1);
    }
    ASSERT_EQ(map->m_height, 1);
    std::string s = "(00000abc-0000-0000-0000-000000000000,(5,";
    std::string expected = "Height = 1\n{\n    {\n";
    for (int i = 0; i < 50; ++i) {
        char hex[3];
        std::snprintf(hex, sizeof hex, "%02x", i);
        expected +=
            "        #0/" + std::string(hex) + " --> {" + s + std::to_string(i - 1) + "))}\n";
    }
    expected += "    }\n    #0/32\n    {\n";
    for (int i = 50; i < 101; ++i) {
        char hex[3];
        std::snprintf(hex, sizeof hex, "%02x", i);
        expected +=
            "        #0/" + std::string(hex) + " --> {" + s + std::to_string(i - 1) + "))}\n";
    }
    expected += "    }\n}\n";
    EXPECT_EQ(DumpOf(*map), expected);
    EXPECT_EQ(map->GetNumNodes(), 3);
}

TEST_F(MapDiagnosticsTest, NodeCountsFollowTheSeparators) {
    for (uint64 i = 0; i < 201; ++i) {  // ascending: leaves of 50, 50, 50, 51
        (*map)[MakeKey(i)];
    }
    ASSERT_EQ(map->m_height, 1);
    auto* root = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(map->m_root.Get());
    EXPECT_EQ(map->GetNumNodes(), root->m_numKeyEntrys + 2);
    EXPECT_EQ(root->m_numKeyEntrys, 3);
    map->Validate();
}

TEST_F(MapDiagnosticsTest, ValidationStopsAtTheFirstBrokenInvariant) {
    for (uint64 i = 0; i < 150; ++i) {
        (*map)[MakeKey(i)];
    }
    auto* root = FieldIdToOffsetOpsOnInt64FieldMapAsInternalNode(map->m_root.Get());
    auto* left = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(root->m_ptr.Get());
    auto* right = FieldIdToOffsetOpsOnInt64FieldMapAsLeafNode(root->GetEntry(0).m_ptr.Get());

    // A separator equal to the first key of its right leaf is fine; one that
    // no leaf holds any more is fine too.
    map->Validate();
    EXPECT_TARN_ASSERT(
        {
            left->m_numKeyEntrys = 49;
            map->Validate();
        },
        "50 <= nk");
    EXPECT_TARN_ASSERT(
        {
            right->GetEntry(1).first = right->GetEntry(0).first;
            map->Validate();
        },
        "CompareKeys(leaf->GetEntry(i-1).first, leaf->GetEntry(i).first) < 0");
    EXPECT_TARN_ASSERT(
        {
            left->GetEntry(49).first = root->GetEntry(0).m_key;
            map->Validate();
        },
        "CompareKeys(leaf->GetEntry(nk-1).first, *k2) < 0");
    EXPECT_TARN_ASSERT(
        {
            right->GetEntry(0).first = left->GetEntry(0).first;
            map->Validate();
        },
        "CompareKeys(*k1, leaf->GetEntry(0).first) <= 0");
    // Broken leaf links and a wrong size are not the validator's business.
    map->m_size = 7;
    left->m_next.Clear();
    map->Validate();
    left->m_next = right;
    map->m_size = 150;
}

}  // namespace
}  // namespace tarn
