#include "tnOperation/RegisterClasses.h"

#include <mutex>

#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"

namespace tarn {

void RegisterOffsetOpsClasses() {
    static std::once_flag once;
    std::call_once(once, [] {
        _Register_OffsetOps();
        _Register_FieldIdToOffsetOpsOnInt64FieldMap();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapInternalNode();
        _Register_FieldIdToOffsetOpsOnInt64FieldMapLeafNode();
    });
}

}  // namespace tarn
