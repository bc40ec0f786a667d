// Reflection records, type operations and registration of the three
// persistent classes of the B+tree map.
//
// Each record is built once, on first use, as a function-local constant
// (guarded initialisation makes concurrent first calls wait for one build)
// and is read-only afterwards. The records do not refer to one another.
//
// Record contents, the same for the three classes but for name, size, table
// and creation function: flag bit 0; metadata, fields, methods and string
// table null; interfaces "tarn::IObject" (indirect) then "tarn::IPersistable"
// (direct); type operations construct, copy-construct, assign and destruct
// arrays, with no equality, order or printing.

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnPersistStore/PersistableReflection.h"
#include "tnUtils/Assert.h"

namespace tarn {

// ---- Map header ---------------------------------------------------------------

const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMap*) {
    static const ReflectedClass record =
        MakePersistableReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>(
            "tarn::FieldIdToOffsetOpsOnInt64FieldMap",
            CopyableTypeOps<FieldIdToOffsetOpsOnInt64FieldMap>());
    return record;
}

const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMap*) {
    return &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>().m_ops;
}

void _Register_FieldIdToOffsetOpsOnInt64FieldMap() {
    TARN_ASSERT(tarn::RegisterReflectedClass(&_GetReflected( (FieldIdToOffsetOpsOnInt64FieldMap*) 0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK);
}

// ---- Internal node -------------------------------------------------------------

const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMapInternalNode*) {
    static const ReflectedClass record =
        MakePersistableReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>(
            "tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode",
            CopyableTypeOps<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>());
    return record;
}

const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMapInternalNode*) {
    return &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>().m_ops;
}

void _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode() {
    TARN_ASSERT(tarn::RegisterReflectedClass(&_GetReflected( (FieldIdToOffsetOpsOnInt64FieldMapInternalNode*) 0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK);
}

// ---- Leaf ------------------------------------------------------------------------

const ReflectedClass& _GetReflected(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode*) {
    static const ReflectedClass record =
        MakePersistableReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>(
            "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode",
            CopyableTypeOps<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>());
    return record;
}

const TypeOps* _GetTypeOps(const FieldIdToOffsetOpsOnInt64FieldMapLeafNode*) {
    return &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>().m_ops;
}

void _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode() {
    TARN_ASSERT(tarn::RegisterReflectedClass(&_GetReflected( (FieldIdToOffsetOpsOnInt64FieldMapLeafNode*) 0),tarn::Tarn_tnOperation_GetXTarget()) == tarn::NSE_OK);
}

}  // namespace tarn
