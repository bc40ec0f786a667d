#include "tnPersistStore/pref.h"

#include "tnUtils/Archive.h"
#include "tnUtils/xostream.h"

namespace tarn {

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
