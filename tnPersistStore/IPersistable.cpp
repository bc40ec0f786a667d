#include "tnPersistStore/IPersistable.h"

namespace tarn {

const ReflectedInterface& _GetReflected(const IPersistable*) {
    static const ReflectedInterface record{"tarn::IPersistable"};
    return record;
}

}  // namespace tarn
