#include "tnStore/RegisterClasses.h"

#include <mutex>

#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsImageCheck.h"
#include "tnRuntime/ClassRegistry.h"

namespace tarn {

void RegisterOffsetOpsClasses() {
    static std::once_flag once;
    std::call_once(once, [] {
        _Register_OffsetOps();
        _Register_FieldIdToOffsetOpsOnInt64FieldMap();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode();
        RegisterImageCheck(&GetReflectedClass<OffsetOps>(), CheckOffsetOpsImage);
        RegisterImageCheck(&GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>(),
                           CheckFieldIdToOffsetOpsOnInt64FieldMapImage);
        RegisterImageCheck(&GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>(),
                           CheckFieldIdToOffsetOpsOnInt64FieldMapInternalNodeImage);
        RegisterImageCheck(&GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>(),
                           CheckFieldIdToOffsetOpsOnInt64FieldMapLeafNodeImage);
    });
}

}  // namespace tarn
