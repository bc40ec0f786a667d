// Records three offset operations into a store directory, makes them
// durable, and prints the table of one field, then every field in key order
// with a cursor, then the same backwards.
//
//   embed-example STORE_DIR

#include <filesystem>
#include <iostream>

#include "tnStore/FieldCursor.h"
#include "tnStore/OffsetOpsStore.h"

int main(int argc, char** argv) {
    using namespace tarn;
    if (argc != 2) {
        std::cerr << "usage: embed-example STORE_DIR\n";
        return 2;
    }
    try {
        OffsetOpsStore store = OffsetOpsStore::Open(std::filesystem::path(argv[1]));
        const Guid site = *ParseGuid("0123abcd-0001-beef-8000-00000000002a");
        const FieldId field = *ParseFieldId("#42/01");
        store.Record(Opid(site, 7), field, 12);
        store.Record(Opid(site, 8), field, -5);
        store.Record(Opid(site, 8), *ParseFieldId("#43/"), 1);
        store.Sync();  // durable from here on

        if (std::optional<FieldTable> table = store.Find(field)) {
            for (const SiteRecord& r : *table) {
                std::cout << ToString(field) << " " << ToString(r.site) << " t=" << r.t
                          << " o=" << r.o << '\n';
            }
        }
        for (FieldCursor c(store); !c.AtEnd(); c.Next()) {
            std::cout << ToString(c.Key()) << " --> " << ToString(c.Table()) << '\n';
        }
        FieldCursor back(store);
        for (back.SeekToLast(); !back.AtEnd(); back.Prev()) {
            std::cout << "back: " << ToString(back.Key()) << '\n';
        }
        store.Close();
    } catch (const RecordRefused& e) {
        std::cerr << "refused: " << e.what() << '\n';
        return 1;
    } catch (const RuntimeError& e) {
        // A second writer is InUse, a damaged file Damaged, a full disk NoSpace.
        std::cerr << "error (" << CategoryName(e.GetCategory()) << "): " << e.what() << '\n';
        return e.GetCategory() == RuntimeError::Category::InUse ? 3 : 1;
    }
    return 0;
}
