// Images that passed the store's checksum but are malformed are refused by
// the loader with a clear error before any reader sees them.

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "tnBackends/MemoryStore.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnStore/RegisterClasses.h"

namespace tarn {
namespace {

using Bytes = std::vector<octet_t>;

const Bytes kRef = {5, 0, 0, 0, 0, 0, 0, 0};
const Bytes kKey = {7, 0, 0, 0, 0, 0, 0, 0, 2, 0xaa, 0xbb};  // #7/aabb
const Bytes kTable = {1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
                      0, 0, 0, 0, 3, 0, 0, 0, 0, 0, 0, 0, 0};  // one site, t 3, o 0

Bytes Cat(std::initializer_list<Bytes> parts) {
    Bytes all;
    for (const Bytes& p : parts) {
        all.insert(all.end(), p.begin(), p.end());
    }
    return all;
}

// Stores `image` as object 1 of class `className` and loads it.
std::string LoadError(const char* className, const Bytes& image) {
    auto store = std::make_shared<MemoryStore>();
    CommitBatch batch;
    batch.writes.emplace_back(1, StoredImage{className, image});
    batch.nextIdentity = 2;
    store->Commit(batch);
    RegisterOffsetOpsClasses();
    CSpace space(store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    try {
        space.Resolve(OID(Seid(uint64{1})), nullptr);
    } catch (const RuntimeError& e) {
        return e.what();
    }
    return "";
}

struct Case {
    const char* className;
    Bytes image;
    const char* problem;  // "" for a well-formed image
};

TEST(ImageCheck, MalformedImagesAreRefusedWithWhatIsWrong) {
    const char* kLeaf = "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode";
    const char* kInternal = "tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode";
    const char* kMap = "tarn::FieldIdToOffsetOpsOnInt64FieldMap";
    const Case cases[] = {
        {"tarn::OffsetOps", Cat({{1}, kRef}), ""},
        {"tarn::OffsetOps", Cat({{2}, kRef}), "schema number 2 (this program reads up to 1)"},
        {"tarn::OffsetOps", Cat({{0}, kRef}), "schema number 0"},
        {"tarn::OffsetOps", {1, 5, 0, 0}, "truncated map reference"},
        {"tarn::OffsetOps", Cat({{1}, kRef, {9}}), "1 bytes left over after the last item"},
        {kMap, Cat({{1, 0}, kRef, kRef, kRef, {0}}), ""},
        {kMap, Cat({{1, 0}, kRef, kRef, kRef, {0x80}}), "truncated height"},
        {kLeaf, Cat({{1}, kRef, kRef, {1}, kKey, kTable}), ""},
        {kLeaf, Cat({{1}, kRef, kRef, {101}}), "entry count 101 exceeds 100"},
        {kLeaf, Cat({{1}, kRef, kRef, {2}, kKey, kTable}), "truncated key identity"},
        {kLeaf, Cat({{1}, kRef, kRef, {1}, {7, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff, 0xff, 0xff, 0x0f}}),
         "truncated key path"},
        {kLeaf, Cat({{1}, kRef, kRef, {1}, kKey, {0xff, 0xff, 0xff, 0xff, 0x0f}}),
         "truncated site"},
        {kInternal, Cat({{1}, kRef, {1}, kKey, kRef}), ""},
        {kInternal, Cat({{1}, kRef, {0xe5, 0x00}}), "entry count 101 exceeds 100"},
        {kInternal, Cat({{1}, kRef, {1}, kKey}), "truncated child reference"},
    };
    for (const Case& c : cases) {
        std::string error = LoadError(c.className, c.image);
        if (*c.problem == '\0') {
            EXPECT_EQ(error.find("malformed"), std::string::npos) << c.className << ": " << error;
        } else {
            EXPECT_NE(error.find(std::string("malformed image of class '") + c.className +
                                 "': " + c.problem),
                      std::string::npos)
                << error;
        }
    }
}

}  // namespace
}  // namespace tarn
