// The offset operations record end to end: recording under the lock check,
// clearing, its image, printing, a round trip through commit and reload, the
// reflection records and registration of the module's four classes, and the
// map's dump and validation.

#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <string>

#include "tests/AssertDeath.h"
#include "tests/BTreeCheck.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/SpaceRef.h"
#include "tnStore/RegisterClasses.h"
#include "tnUtils/xostream.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakeSite;
using testing::operator+;
using testing::Bytes;
using testing::ImageOf;
using testing::Le64;
using Map = FieldIdToOffsetOpsOnInt64FieldMap;

// What `write` prints on a fresh stream.
template <typename F>
std::string TextOf(F write) {
    StringOutputStream out;
    {
        xostream os(out);
        write(os);
    }
    return out.str();
}

Opid Op(uint32 site, int64 t) {
    return Opid(MakeSite(site), t);
}

class OffsetOpsTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() { RegisterOffsetOpsClasses(); }

    CSpace space;
};

TEST_F(OffsetOpsTest, NewRecordRefersToAnEmptyMapAndPrintsOnlyItsReference) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    Map* map = rec->m_map.Get();
    ASSERT_NE(map, nullptr);
    const uint64 mapId = map->GetPersistObjState().m_oid.value_;
    EXPECT_EQ(ImageOf(*rec), Bytes{0x01} + Le64(mapId));
    EXPECT_TRUE(map->empty());  // its image: see the map's persistence tests
    rec->RecordOffset(Op(1, 5), MakeKey(1), 12);
    EXPECT_EQ(TextOf([&](xostream& os) { os << *rec; }), "#" + std::to_string(mapId));

    // Another record read from this image refers to the same map object.
    const Bytes image = ImageOf(*rec);
    OffsetOps copy;
    InputArchive in(image.data());
    copy.Deserialise(in);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
    EXPECT_EQ(copy.m_map.Get(), map);
    space.Commit();
}

// Read through the record's map handle, which forwards to the map.
TEST_F(OffsetOpsTest, RecordsSumPerSiteAndFieldAndClearStartsAfresh) {
    CSpaceGuard g(space, LockMode::Exclusive);
    OffsetOps* rec = CreatePersistent<OffsetOps>();
    rec->RecordOffset(Op(1, 5), MakeKey(1), 2);
    rec->RecordOffset(Op(1, 5), MakeKey(1), 4);   // equal time stamps add up
    rec->RecordOffset(Op(2, 3), MakeKey(1), -7);  // a second site, same field
    rec->RecordOffset(Op(1, 9), MakeKey(2), 0);   // a second field; 0 still records
    const auto& handle = rec->m_map;
    ASSERT_EQ(handle.size(), 2);
    EXPECT_EQ(handle.count(MakeKey(2)), 1);
    EXPECT_TRUE(handle.find(MakeKey(3)) == handle.end());
    testing::TestPayload first = testing::MakePayload(6, 1, 5);  // offset, site, time
    first.Insert(MakeSite(2), 3, -7);
    EXPECT_EQ(*handle.find_2(MakeKey(1)), first);
    EXPECT_EQ(*handle.find_2(MakeKey(2)), testing::MakePayload(0, 1, 9));

    rec->Clear();
    EXPECT_TRUE(handle.empty());
    EXPECT_EQ(handle->m_height, -1);
    rec->RecordOffset(Op(1, 1), MakeKey(1), 3);  // an earlier time stamp is fine again
    EXPECT_EQ(*handle.find_2(MakeKey(1)), testing::MakePayload(3, 1, 1));
    space.Commit();
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

// Enough keys for more than 100 leaves, so that the root sits two levels
// above them; every fifth key is long, and up to three sites record per key.
TEST_F(OffsetOpsTest, TablesSurviveCommitAndReloadFromTheStore) {
    std::map<FieldId, OffsetOpsOnField<int64>> model;
    {
        CSpaceGuard g(space, LockMode::Exclusive);
        OffsetOps* rec = CreatePersistent<OffsetOps>();
        space.SetRoot("offsets", rec->GetPersistObjState().m_oid);
        for (int i = 0; i < 5200; ++i) {
            for (uint32 site = 1; site <= uint32(1 + i % 3); ++site) {
                const FieldId key = MakeKey(uint64(i), i % 5 == 0);
                rec->RecordOffset(Op(site, i), key, i - 100 * int64(site));
                model[key].Insert(MakeSite(site), i, i - 100 * int64(site));
            }
        }
        EXPECT_EQ(rec->m_map->m_height, 2);
        space.Commit();
        EXPECT_EQ(space.DropCleanResidents(), space.Stats().numRegistered);
    }
    CSpaceGuard g(space, LockMode::Shared);
    SpaceRef<OffsetOps> rec(space, space.GetRoot("offsets"));
    const Map& map = *rec->m_map;
    EXPECT_BTREE_OK(map);
    map.Validate();
    ASSERT_EQ(map.size(), ssize_t(model.size()));
    auto expected = model.begin();
    for (auto it = map.begin(); it != map.end(); ++it, ++expected) {
        EXPECT_EQ(it->first, expected->first);
        EXPECT_EQ(it->second, expected->second);
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

// ---- Reflection records and registration of the four classes ----

template <typename T>
void ExpectRecord(const std::string& name, void (*registration)(), bool isRecord = false) {
    SCOPED_TRACE(name);
    const ReflectedClass& rc = _GetReflected(static_cast<const T*>(nullptr));
    EXPECT_EQ(FindReflectedClass(name), &rc);
    EXPECT_EQ(&GetReflectedClass<T>(), &rc);
    EXPECT_EQ(_GetTypeOps(static_cast<const T*>(nullptr)), &rc.m_ops);
    EXPECT_EQ(rc.m_name, name);
    EXPECT_EQ(rc.m_flags, 1u);
    EXPECT_EQ(rc.m_size, ssize_t(sizeof(T)));
    EXPECT_EQ(rc.m_ops.m_size, rc.m_size);
    ASSERT_EQ(rc.m_numIndirectInterfaces, 1);
    ASSERT_EQ(rc.m_numDirectInterfaces, 1);
    EXPECT_EQ(std::string(rc.m_interfaces[0]) + "," + rc.m_interfaces[1],
              "tarn::IObject,tarn::IPersistable");
    EXPECT_EQ(rc.m_IObjectFnTable, &IObject::Stubs<T>::GetTable());
    EXPECT_EQ(rc.m_createFn, &T::sfnCreateInstance);
    EXPECT_TRUE(rc.m_ops.m_ConstructArrayFn && rc.m_ops.m_DestructArrayFn);
    // The record prints but is not copied; the tree's classes copy but do not print.
    EXPECT_EQ(rc.m_ops.m_PrintVariableFn != nullptr, isRecord);
    EXPECT_EQ(rc.m_ops.m_CopyConstructArrayFn && rc.m_ops.m_AssignArrayFn, !isRecord);
    EXPECT_TRUE(!rc.m_ops.m_equalsFn && !rc.m_ops.m_SerialiseArrayFn && !rc.m_metaData);

    T obj;
    EXPECT_EQ(ptr<IObject>(&obj)->GetReflectedClass(), &rc);

    std::string text =
        "void tarn::_Register_@(): Assertion \"tarn::RegisterReflectedClass(&"
        "_GetReflected( (@*) 0),tarn::Tarn_tnOperation_GetXTarget()) == "
        "tarn::NSE_OK\" failed.";
    for (auto at = text.find('@'); at != std::string::npos; at = text.find('@')) {
        text.replace(at, 1, name.substr(6));
    }
    EXPECT_DEATH(registration(), testing::RegexQuote(text));
}

TEST(ModuleReflection, RecordsOfTheFourClassesRegisterOnce) {
    RegisterOffsetOpsClasses();
    RegisterOffsetOpsClasses();  // idempotent
    ExpectRecord<OffsetOps>("tarn::OffsetOps", _Register_OffsetOps, true);
    ExpectRecord<Map>("tarn::FieldIdToOffsetOpsOnInt64FieldMap",
                      _Register_FieldIdToOffsetOpsOnInt64FieldMap);
    ExpectRecord<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>(
        "tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode",
        _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode);
    ExpectRecord<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>(
        "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode",
        _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode);

    OffsetOps rec;
    EXPECT_EQ(TextOf([&](xostream& os) {
                  GetReflectedClass<OffsetOps>().m_ops.m_PrintVariableFn(os, &rec);
              }),
              "#0");
}

// ---- The dump, validation and node counts of the map ----

class MapDiagnosticsTest : public testing::BTreeSpaceTest {
protected:
    std::string Dump() {
        return TextOf([&](xostream& os) { map().Write(os); });
    }
};

TEST_F(MapDiagnosticsTest, EmptyMapsPrintTheirHeightAndCountTheirNodes) {
    EXPECT_EQ(Dump(), "Height = -1\n");
    EXPECT_EQ(map().GetNumNodes(), 0);
    map().Validate();

    Map::wFindRet ret;
    map().wFind(ret, MakeKey(1), false);  // finds nothing, leaves an empty root leaf
    EXPECT_TRUE(!ret.m_containingNode.m_self && !ret.m_payload && !ret.m_leaf);
    EXPECT_TRUE(ret.m_index == -1 && !ret.m_created && map().m_size == 0);
    EXPECT_EQ(Dump(), "Height = 0\n{\n}\n");
    EXPECT_EQ(map().GetNumNodes(), 1);
    map().Validate();
}

TEST_F(MapDiagnosticsTest, DumpIndentsChildBlocksAndPlacesSeparatorsBetweenThem) {
    for (int i = 0; i < 101; ++i) {
        map()[MakeKey(0, std::string(1, char(i)))].Insert(MakeSite(0xabc), 5, i - 1);
    }
    ASSERT_EQ(map().m_height, 1);
    std::string expected = "Height = 1\n{\n    {\n";
    for (int i = 0; i < 101; ++i) {
        expected += "        " + testing::KeyText(MakeKey(0, std::string(1, char(i)))) +
                    " --> {(00000abc-0000-0000-0000-000000000000,(5," + std::to_string(i - 1) +
                    "))}\n" + (i == 49 ? "    }\n    #0/32\n    {\n" : "");
    }
    EXPECT_EQ(Dump(), expected + "    }\n}\n");
    EXPECT_EQ(map().GetNumNodes(), 3);
}

TEST_F(MapDiagnosticsTest, ValidationStopsAtTheFirstBrokenInvariant) {
    Fill(1, 201);  // leaves of 50, 50, 50 and 51 under a root with 3 keys
    EXPECT_EQ(map().GetNumNodes(), 5);
    Internal* root = Root();
    Leaf* left = LeafAt(0);
    Leaf* right = LeafAt(1);
    // A separator equal to the first key of its right leaf is fine; one that
    // no leaf holds any more (the last leaf keeps 50) is fine too.
    ASSERT_TRUE(map().Delete(K(151)));
    map().Validate();
    const std::pair<std::function<void()>, const char*> damages[] = {
        {[&] { left->m_numKeyEntrys = 49; }, "50 <= nk"},
        {[&] { right->GetEntry(1).first = right->GetEntry(0).first; },
         "CompareKeys(leaf->GetEntry(i-1).first, leaf->GetEntry(i).first) < 0"},
        {[&] { left->GetEntry(49).first = root->GetEntry(0).m_key; },
         "CompareKeys(leaf->GetEntry(nk-1).first, *k2) < 0"},
        {[&] { right->GetEntry(0).first = left->GetEntry(0).first; },
         "CompareKeys(*k1, leaf->GetEntry(0).first) <= 0"},
    };
    for (const auto& [damage, text] : damages) {
        EXPECT_TARN_ASSERT(
            {
                damage();
                map().Validate();
            },
            text);
    }
    // Broken leaf links and a wrong size are not the validator's business.
    map().m_size = 7;
    left->m_next.Clear();
    map().Validate();
    left->m_next = right;
    map().m_size = 200;
}

}  // namespace
}  // namespace tarn
