#pragma once

// A reference held outside the space's objects that survives eviction: the
// space tracks it and unbinds it, like its residents' references, when it
// releases or deletes the object. Use it to keep, for example, the offset
// operations record between operations:
//
//   SpaceRef<OffsetOps> record(space, space.GetRoot("offsets"));
//   { CSpaceGuard g(space, LockMode::Exclusive); record->RecordOffset(...); }
//
// Resolve it, like any reference, while holding the space. A SpaceRef must
// not be shared between threads without synchronisation; the space may be
// destroyed first (the SpaceRef then keeps only the identity).

#include "tnPersistStore/pref.h"
#include "tnRuntime/CSpace.h"

namespace tarn {

template <typename T>
class SpaceRef : public cref<T> {
public:
    SpaceRef(CSpace& space, OID oid) : cref<T>(oid) { Attach(space); }
    SpaceRef(CSpace& space, T* obj) : cref<T>(obj) { Attach(space); }
    SpaceRef(const SpaceRef& rhs) : cref<T>(rhs) {
        if (rhs.m_link.space != nullptr) {
            Attach(*rhs.m_link.space);
        }
    }
    SpaceRef& operator=(const SpaceRef& rhs) {
        static_cast<cref<T>&>(*this) = rhs;
        return *this;
    }
    ~SpaceRef() {
        if (m_link.space != nullptr) {
            m_link.space->DetachExternalRef(&m_link);
        }
    }

    using cref<T>::operator=;

private:
    void Attach(CSpace& space) {
        m_link.ref = this;
        space.AttachExternalRef(&m_link);
    }

    SpaceRefLink m_link;
};

}  // namespace tarn
