// Records three offset operations into a store directory, makes them
// durable, and prints the table of one field and every field in key order.
//
//   embed-example STORE_DIR

#include <iostream>

#include "tnStore/OffsetOpsStore.h"

int main(int argc, char** argv) {
    using namespace tarn;
    if (argc != 2) {
        std::cerr << "usage: embed-example STORE_DIR\n";
        return 2;
    }
    try {
        OffsetOpsStore store = OffsetOpsStore::Open(argv[1]);
        const Guid site = *ParseGuid("0123abcd-0001-beef-8000-00000000002a");
        const FieldId field(OID(Seid(uint64{42})), Path("\x01", 1));
        store.Record(Opid(site, 7), field, 12);
        store.Record(Opid(site, 8), field, -5);
        store.Record(Opid(site, 8), FieldId(OID(Seid(uint64{43})), Path()), 1);
        store.Sync();  // durable from here on

        if (auto table = store.Find(field)) {
            for (const auto& [s, so] : table->m_map.getmap()) {
                std::cout << ToString(field) << " " << ToString(s) << " t=" << so.t << " o=" << so.o
                          << '\n';
            }
        }
        store.ForEach([](const FieldId& f, const OffsetOpsOnField<int64>& table) {
            std::cout << ToString(f) << ": " << table.m_map.getmap().size() << " sites\n";
            return true;
        });
        store.Close();
    } catch (const RecordRefused& e) {
        std::cerr << "refused: " << e.what() << '\n';
        return 1;
    } catch (const RuntimeError& e) {
        std::cerr << "error: " << e.what() << '\n';
        return 1;
    }
    return 0;
}
