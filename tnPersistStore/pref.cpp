#include "tnPersistStore/pref.h"

#include "tnRuntime/CSpace.h"
#include "tnUtils/Archive.h"
#include "tnUtils/xostream.h"

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

void prefbase::Serialise(Archive& ar, bool) const {
    // An object without identity (never registered) cannot be referred to
    // from a stored image.
    TARN_ASSERT(!IsBound() || !m_oid.IsNull());
    ar.SerialisePod<uint64>(m_oid.value_);
}

void prefbase::Deserialise(InputArchive& ar, bool) {
    uint64 value;
    ar.DeserialisePod<uint64>(value);
    m_oid = OID(Seid(value));
    m_ptr = nullptr;
}

void prefbase::WriteToStream(xostream& os) const {
    os << m_oid;
}

xostream& operator<<(xostream& os, const prefbase& r) {
    r.WriteToStream(os);
    return os;
}

bool RefersToUnbound(const prefbase& r, ptr<const IObject> obj) {
    if (obj.m_self == nullptr) {
        return !r;
    }
    if (r.m_oid.IsNull()) {
        return false;
    }
    AnyInterface p = obj->QueryInterface(GetReflectedInterface<IPersistable>());
    if (p.m_self == nullptr) {
        return false;
    }
    return ptr<IPersistable>::FromAny(p)->GetPersistObjState().m_oid == r.m_oid;
}

}  // namespace tarn
