// The reference operations that reach into the thread's space (the runtime's
// interface, tnObject/RuntimeInterface.h): resolving an unbound reference,
// finding its resident object, and resolving without an exception.

#include "tnPersistStore/pref.h"
#include "tnRuntime/CSpace.h"
#include "tnUtils/Assert.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

ptr<IPersistable> ResolvePref(const prefbase& r, const ReflectedClass* expected) {
    if (r.m_ptr.m_self != nullptr) {
        return r.m_ptr;
    }
    if (r.m_oid.IsNull()) {
        return ptr<IPersistable>();
    }
    CSpace* space = GetThreadCSpace();
    TARN_ASSERT(space != nullptr);
    ptr<IPersistable> obj = space->Resolve(r.m_oid, expected);
    if (GetRecordedLockStatus(space) > 0) {
        r.m_ptr = obj;
    }
    return obj;
}

ptr<IPersistable> FindResidentPref(const prefbase& r) {
    if (r.m_ptr.m_self != nullptr || r.m_oid.IsNull()) {
        return r.m_ptr;
    }
    CSpace* space = GetThreadCSpace();
    return space != nullptr ? space->FindResident(r.m_oid) : ptr<IPersistable>();
}

void* TryResolvePref(const prefbase& r, const ReflectedClass* expected) {
    try {
        return ResolvePref(r, expected).m_self;
    } catch (const RuntimeError&) {
        return nullptr;
    }
}

}  // namespace tarn
