// The module's image readers behind a record frame that is always correct:
// what an image with a valid checksum but inconsistent content (written by a
// faulty program, or edited and re-summed) does when it is loaded.
//
// Input: a sequence of objects, each
//   1 byte        class: the low two bits select one of the module's
//                 classes (fuzz/FuzzStore.h)
//   2 bytes       image length L, little-endian
//   L bytes       the image after its schema number (fewer if the input
//                 ends first)
// The n-th object is stored under identity n, framed with a correct
// checksum, its image preceded by schema number 1 (a wrong schema number
// stops the process by design, and would hide everything behind it).
// Identity 1 is resolved as its own class and exercised like in LoaderFuzz.
//
// The loader checks framing and exact consumption only; the readers check
// their counts by assertion and test no bounds. Findings here are reported
// to the owners of the readers and the loader, not fixed in the fuzzer.

#include <cstddef>
#include <cstdint>
#include <memory>

#include "fuzz/FuzzStore.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnStore/RegisterClasses.h"

// The classes are looked up by name before the first space exists.
extern "C" int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    tarn::RegisterOffsetOpsClasses();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace tarn;
    auto store = std::make_shared<fuzz::FuzzStore>();
    const ReflectedClass* first = nullptr;
    std::size_t pos = 0;
    for (uint64 oid = 1; pos + 3 <= size; ++oid) {
        const char* className = fuzz::kClassNames[data[pos] & 3];
        const std::size_t length = std::size_t{data[pos + 1]} | (std::size_t{data[pos + 2]} << 8);
        pos += 3;
        const std::size_t taken = std::min(length, size - pos);
        StoredImage image;
        image.className = className;
        image.bytes.push_back(1);
        image.bytes.insert(image.bytes.end(), data + pos, data + pos + taken);
        pos += taken;
        store->m_records[oid] = EncodeImageRecord(oid, image);
        if (oid == 1) {
            first = FindReflectedClass(className);
        }
    }
    if (first == nullptr) {
        return 0;
    }
    CSpace space(store);
    CSpaceGuard guard(space, LockMode::Exclusive);
    try {
        ptr<IPersistable> obj = space.Resolve(OID(Seid(uint64{1})), first);
        fuzz::Exercise(obj, 10000);
    } catch (const RuntimeError& e) {
        fuzz::Expected(e);
    }
    space.DropCleanResidents();
    return 0;
}
