#pragma once

// The offset operations record of a working set.
//
// For every field that received offset operations, OffsetOps keeps a per-site
// table (OffsetOpsOnField<int64>) of the latest time stamp and the sum of the
// offsets each site contributed. The tables live in a persistent B+tree map
// whose header and nodes are persistent objects of their own; OffsetOps holds
// only the reference to the map object.
//
// Owned by its object space. RecordOffset and Clear must run on a thread that
// holds that space exclusively, and they check it.
//
// Image:
//   schema   varint      always 1
//   m_map    8 bytes     identity of the map object, little-endian

#include "tnObject/TypeOps.h"
#include "tnOperation/FieldId.h"
#include "tnOperation/src/Util/Opid.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnPersistStore/btreemap.h"

namespace tarn {

constexpr schema_t OffsetOps_SCHEMA = 1;

class OffsetOps : public PersistableMixin<IObjectBaseMixin<OffsetOps, EmptyBase>> {
public:
    using MAP = btreemap<FieldIdToOffsetOpsOnInt64FieldMap>;

    OffsetOps() : m_map() {}
    // Releases the reference only; the map object belongs to the space.
    ~OffsetOps() = default;

    // Adds `offset` to the table of `fid` under the site and time stamp of
    // `opid`. A site's time stamps for one field must not decrease.
    void RecordOffset(const Opid& opid, const FieldId& fid, int64 offset);
    // Removes every field's table.
    void Clear();

    // Called once by the runtime for a new record: creates the empty map.
    void OnCreate(bool local);

    void Serialise(Archive& ar) const;
    void Deserialise(InputArchive& ar);
    void VisitObjects(IObjectVisitor& v) const;
    void VisitPrefs(IPrefVisitor& v) const;
    // Prints the reference to the map, not the tables.
    void Write(xostream& os) const;

    // sfnCreateInstance, QueryInterface and GetReflectedClass come from
    // PersistableMixin.

    MAP m_map;
};

xostream& operator<<(xostream& os, const OffsetOps& x);

const ReflectedClass& _GetReflected(const OffsetOps*);
const TypeOps* _GetTypeOps(const OffsetOps*);
template <>
void PrintVariable<OffsetOps>(xostream& os, const OffsetOps* p);
void _Register_OffsetOps();

}  // namespace tarn
