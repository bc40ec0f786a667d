// The reference operations that reach into the thread's space (declared in
// tnPersistStore/pref.h): resolving an unbound reference, finding its
// resident object, and resolving without an exception.

#include "tnPersistStore/pref.h"
#include "tnRuntime/CSpace.h"
#include "tnUtils/Assert.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

ptr<IPersistable> prefbase::Resolve(const ReflectedClass* expected) const {
    if (m_ptr.m_self != nullptr) {
        return m_ptr;
    }
    if (m_oid.IsNull()) {
        return ptr<IPersistable>();
    }
    CSpace* space = GetThreadCSpace();
    TARN_ASSERT(space != nullptr);
    ptr<IPersistable> obj = space->Resolve(m_oid, expected);
    if (GetRecordedLockStatus(space) > 0) {
        m_ptr = obj;
    }
    return obj;
}

ptr<IPersistable> prefbase::GetInMemory() const {
    if (m_ptr.m_self != nullptr || m_oid.IsNull()) {
        return m_ptr;
    }
    CSpace* space = GetThreadCSpace();
    return space != nullptr ? space->FindResident(m_oid) : ptr<IPersistable>();
}

void* TryResolvePref(const prefbase& r, const ReflectedClass* expected) {
    try {
        return r.Resolve(expected).m_self;
    } catch (const RuntimeError&) {
        return nullptr;
    }
}

}  // namespace tarn
