// The runtime's loader on arbitrary stored records: what a damaged or
// foreign store file can make of a space.
//
// Input:
//   byte 0        the class the first object is resolved as: 0..3 the
//                 module's classes (fuzz/FuzzStore.h), 4..255 any class
//   the rest      records, each starting at an occurrence of the record
//                 magic "TNIM"; the n-th record is stored under identity n
// The space resolves identity 1 through its loader (record check, class
// check, the class's reader, the exact-consumption check), then uses the
// object: writes its image again and, for a record or a map, walks its
// entries, loading further nodes from the store. Finally it drops every
// resident, which walks their references.
// Property: every fault surfaces as a RuntimeError; nothing crashes, asserts
// or leaks.

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>

#include "fuzz/FuzzStore.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnStore/RegisterClasses.h"

namespace {

using namespace tarn;

// Splits `data` into records at each occurrence of the magic; bytes before
// the first magic form a record of their own.
std::map<uint64, std::vector<octet_t>> SplitRecords(const octet_t* data, std::size_t size) {
    static constexpr octet_t kMagic[4] = {'T', 'N', 'I', 'M'};
    std::map<uint64, std::vector<octet_t>> records;
    std::size_t start = 0;
    uint64 oid = 1;
    for (std::size_t i = 1; i + sizeof kMagic <= size; ++i) {
        if (std::memcmp(data + i, kMagic, sizeof kMagic) == 0) {
            records[oid++].assign(data + start, data + i);
            start = i;
        }
    }
    if (start < size) {
        records[oid].assign(data + start, data + size);
    }
    return records;
}

}  // namespace

// The classes are looked up by name before the first space exists.
extern "C" int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    tarn::RegisterOffsetOpsClasses();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size < 1) {
        return 0;
    }
    auto store = std::make_shared<fuzz::FuzzStore>();
    store->m_records = SplitRecords(data + 1, size - 1);
    const ReflectedClass* expected =
        data[0] < 4 ? FindReflectedClass(fuzz::kClassNames[data[0]]) : nullptr;

    CSpace space(store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    try {
        ptr<IPersistable> obj = space.Resolve(OID(Seid(uint64{1})), expected);
        fuzz::Exercise(obj, 10000);
    } catch (const RuntimeError& e) {
        fuzz::Expected(e);
    }
    space.DropCleanResidents();
    return 0;
}
