#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"

#include "tnObject/IObjectVisitor.h"
#include "tnPersistStore/IPrefVisitor.h"
#include "tnPersistStore/PersistableReflection.h"
#include "tnUtils/Archive.h"
#include "tnUtils/xostream.h"

namespace tarn {

// The record itself is not marked dirty: its reference does not change, the
// leaf that holds the table does (operator[] marks it).
void OffsetOps::RecordOffset(const Opid& opid, const FieldId& fid, int64 offset) {
    TARN_ASSERT(HaveExclusiveLockedCSpace());
    m_map[fid].Insert(opid.s, opid.t, offset);
}

void OffsetOps::Clear() {
    TARN_ASSERT(HaveExclusiveLockedCSpace());
    m_map.clear();
}

// A record is only ever created locally; the map object is created with it.
void OffsetOps::OnCreate(bool local) {
    TARN_ASSERT(local);
    m_map.OnCreate(local);
}

void OffsetOps::Serialise(Archive& ar) const {
    SerialiseSchema(ar, OffsetOps_SCHEMA);
    ar << m_map;
}

void OffsetOps::Deserialise(InputArchive& ar) {
    schema_t schema;
    DeserialiseSchema(ar, OffsetOps_SCHEMA, schema);
    ar >> m_map;
}

void OffsetOps::VisitObjects(IObjectVisitor& v) const {
    v << m_map;
}

void OffsetOps::VisitPrefs(IPrefVisitor& v) const {
    v << m_map;
}

void OffsetOps::Write(xostream& os) const {
    os << static_cast<const prefbase&>(m_map);
}

xostream& operator<<(xostream& os, const OffsetOps& x) {
    x.Write(os);
    return os;
}

template <>
void PrintVariable<OffsetOps>(xostream& os, const OffsetOps* p) {
    os << *p;
}

// Printable but neither copyable nor assignable through its type operations.
const ReflectedClass& _GetReflected(const OffsetOps*) {
    static const ReflectedClass record =
        MakePersistableReflectedClass<OffsetOps>("tarn::OffsetOps", PrintableTypeOps<OffsetOps>());
    return record;
}

const TypeOps* _GetTypeOps(const OffsetOps*) {
    return &GetReflectedClass<OffsetOps>().m_ops;
}

// clang-format off
void _Register_OffsetOps() {
    TARN_ASSERT(tarn::RegisterReflectedClass(&_GetReflected( (OffsetOps*) 0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK);
}
// clang-format on

}  // namespace tarn
