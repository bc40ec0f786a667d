#pragma once

// The things the benchmarks measure, behind one small interface:
//   Record(opid, field, offset)   the recording operation
//   Map()                         the container, for lookups and erasure
//
// TarnSubject is the offset operations record in its own object space (a
// new in-memory store by default), held exclusively by the constructing
// thread for the subject's lifetime; it registers the module's classes with
// the runtime first. PeerSubject<M> is an ordinary
// in-memory container M from field key to per-site table.

#include <memory>
#include <utility>
#include <vector>

#include "bench/BenchSupport.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnStore/RegisterClasses.h"

namespace tarn::bench {

class TarnSubject {
public:
    using MapType = FieldIdToOffsetOpsOnInt64FieldMap;

    explicit TarnSubject(std::shared_ptr<IStore> store = nullptr)
        : m_space(Registered(std::move(store))),
          m_guard(m_space, LockMode::Exclusive),
          m_record(CreatePersistent<OffsetOps>()) {}

    void Record(const Opid& opid, const FieldId& f, int64 offset) {
        m_record->RecordOffset(opid, f, offset);
    }

    MapType& Map() { return *m_record->m_map; }
    OffsetOps& RecordObject() { return *m_record; }
    CSpace& Space() { return m_space; }

private:
    static std::shared_ptr<IStore> Registered(std::shared_ptr<IStore> store) {
        RegisterOffsetOpsClasses();
        return store;
    }

    CSpace m_space;  // destroyed last: after the guard has released it
    CSpaceGuard m_guard;
    OffsetOps* m_record;
};

template <typename M>
class PeerSubject {
public:
    using MapType = M;

    void Record(const Opid& opid, const FieldId& f, int64 offset) {
        m_map[f].Insert(opid.s, opid.t, offset);
    }

    MapType& Map() { return m_map; }

private:
    M m_map;
};

// Records one offset for every key in `order` from each of `numSites`
// sites: site 0 over all keys, then site 1, and so on; round r uses time
// stamp r + 1.
template <typename Subject>
void Fill(Subject& subject, const std::vector<FieldId>& keys, const std::vector<uint64>& order,
          int numSites) {
    for (int s = 0; s < numSites; ++s) {
        const Opid opid(MakeSite(static_cast<uint32>(s + 1)), s + 1);
        for (uint64 i : order) {
            subject.Record(opid, keys[i], 1);
        }
    }
}

}  // namespace tarn::bench
