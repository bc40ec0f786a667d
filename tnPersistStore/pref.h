#pragma once

// Persistent references.
//
// A prefbase designates a stored object by its identity (m_oid) and, while
// the reference is bound, also holds the object's IPersistable handle
// (m_ptr). It is a plain value: copying it, by its copy operations or as raw
// bytes, involves the runtime in no way, and the runtime keeps nothing per
// reference. A reference does not own its object; objects belong to their
// space (tnRuntime/CSpace.h).
//
// Resolving (Get): a bound reference returns its handle at once (inline, a
// load and a test). Otherwise the calling thread's space finds the object
// among its residents by identity or loads its image from the store; a
// thread holding the space exclusively then binds the reference (a shared
// holder does not write into objects, so it resolves without binding).
// Loading failures (missing image, unknown class, image of another class than
// the reference's type, image not consumed exactly) throw RuntimeError.
//
// Binding lasts until the space evicts the object: eviction walks the
// residents' VisitObjects, where each reference presents its bound handle
// through VisitEvictableObject and forgets it when the evictor nulls it. A
// reference held anywhere else (a local variable, a temporary) must not be
// kept across eviction or commit; user code keeps identities, root names or
// a space-tracked SpaceRef (tnRuntime/SpaceRef.h) instead.
//
// The operations that reach into the space (ResolvePref, FindResidentPref,
// TryResolvePref) are the runtime's (tnObject/RuntimeInterface.h).
//
// Byte image (Serialise / Deserialise; the flag argument is ignored):
//   identity   8 bytes   m_oid.value_, little-endian; 0 for an empty reference
// Text form (WriteToStream): "#" and the identity in decimal ("#0" if empty).

#include <cstddef>

#include "tnObject/IObject.h"
#include "tnObject/IObjectVisitor.h"
#include "tnPersistStore/IPersistable.h"
#include "tnPersistStore/IPrefVisitor.h"
#include "tnPersistStore/OID.h"
#include "tnUtils/Assert.h"

namespace tarn {

class Archive;
class InputArchive;
class xostream;

class prefbase {
public:
    prefbase() = default;
    // A reference to the stored object `oid`, not yet bound.
    explicit prefbase(OID oid) : m_oid(oid) {}

    // The object's handle (null for an empty reference), loading it if needed.
    ptr<IPersistable> Get() const {
        if (m_ptr.m_self != nullptr) {
            return m_ptr;
        }
        return Resolve(nullptr);
    }

    // As Get, for a reference that must not be empty.
    ptr<IPersistable> GetNotNull() const {
        if (m_ptr.m_self != nullptr) {
            return m_ptr;
        }
        TARN_ASSERT(!m_oid.IsNull());
        return Resolve(nullptr);
    }

    // Designates the handle's object (its identity and handle); a handle with
    // a null m_self empties the reference, whatever its table.
    void Set(ptr<IPersistable> p) {
        if (p.m_self == nullptr) {
            Clear();
            return;
        }
        m_oid = p->GetPersistObjState().m_oid;
        m_ptr = p;
    }

    void Clear() {
        m_oid.SetNull();
        m_ptr = nullptr;
    }

    // True when the reference designates an object: it has an identity, or
    // it is bound to an object that has none yet (never registered).
    explicit operator bool() const { return !m_oid.IsNull() || m_ptr.m_self != nullptr; }

    bool IsBound() const { return m_ptr.m_self != nullptr; }
    void Unbind() const { m_ptr = nullptr; }

    // The bound handle, or the resident object of that identity in the
    // thread's space; never loads, never binds. Null otherwise.
    ptr<IPersistable> GetInMemory() const { return FindResidentPref(*this); }

    void Serialise(Archive& ar, bool flag) const;
    void Deserialise(InputArchive& ar, bool flag);
    void WriteToStream(xostream& os) const;

    // Presents the bound object to `v` through VisitEvictableObject and
    // unbinds if the visitor nulls the handle. An empty or unbound reference
    // presents nothing: only objects in memory take part in a walk over
    // objects.
    void VisitObjects(IObjectVisitor& v) const {
        if (m_ptr.m_self == nullptr) {
            return;
        }
        ptr<const IObject> h(m_ptr);
        v.VisitEvictableObject(h);
        if (h.m_self == nullptr) {
            m_ptr = nullptr;
        }
    }

    // The slow path of Get: resolves m_oid in the thread's space. `expected`
    // (null: any class) is the class the object must have. Empty -> null.
    ptr<IPersistable> Resolve(const ReflectedClass* expected) const {
        return ResolvePref(*this, expected);
    }

    OID m_oid;
    mutable ptr<IPersistable> m_ptr;
};

// The class record a cref<T> expects of its object, when T has one.
template <typename T>
const ReflectedClass* ExpectedReflectedClass() {
    if constexpr (requires { _GetReflected(static_cast<const T*>(nullptr)); }) {
        return &_GetReflected(static_cast<const T*>(nullptr));
    } else {
        return nullptr;
    }
}

// A reference to an object of class T. Adds no field.
template <typename T>
class cref : public prefbase {
public:
    cref() = default;
    cref(T* p) { Set(p); }
    explicit cref(OID oid) : prefbase(oid) {}

    T* Get() const {
        if (m_ptr.m_self != nullptr) {
            return static_cast<T*>(m_ptr.m_self);
        }
        return static_cast<T*>(Resolve(ExpectedReflectedClass<T>()).m_self);
    }

    T* GetNotNull() const {
        if (m_ptr.m_self != nullptr) {
            return static_cast<T*>(m_ptr.m_self);
        }
        TARN_ASSERT(!m_oid.IsNull());
        return static_cast<T*>(Resolve(ExpectedReflectedClass<T>()).m_self);
    }

    T* operator->() const { return GetNotNull(); }
    T& operator*() const { return *GetNotNull(); }

    void Set(T* p) { prefbase::Set(ptr<IPersistable>(p)); }
    cref& operator=(T* p) {
        Set(p);
        return *this;
    }
    cref& operator=(const NullInterface&) {
        Clear();
        return *this;
    }
    cref& operator=(std::nullptr_t) {
        Clear();
        return *this;
    }

    T* GetBoundPtr() const { return static_cast<T*>(m_ptr.m_self); }
    T* GetInMemory() const { return static_cast<T*>(prefbase::GetInMemory().m_self); }
    // As Get, but null instead of an exception when the object cannot be
    // loaded.
    T* TryGet() const {
        return static_cast<T*>(TryResolvePref(*this, ExpectedReflectedClass<T>()));
    }
    // Loading is synchronous in this runtime: the same as Get.
    T* AsyncGet() const { return Get(); }
};

// A reference whose class is not fixed (a B+tree child: an internal node or a
// leaf). Set only through the typed template, which knows the class's table;
// emptied by assigning null.
template <>
class cref<void> : public prefbase {
public:
    cref() = default;

    void* Get() const { return prefbase::Get().m_self; }
    void* GetNotNull() const { return prefbase::GetNotNull().m_self; }

    template <typename T>
    void Set(T* p) {
        prefbase::Set(ptr<IPersistable>(p));
    }
    template <typename T>
    cref& operator=(T* p) {
        Set(p);
        return *this;
    }
    cref& operator=(void* p) {
        TARN_ASSERT(!p);
        Clear();
        return *this;
    }

    void* GetBoundPtr() const { return m_ptr.m_self; }
    void* GetInMemory() const { return prefbase::GetInMemory().m_self; }
    void* TryGet() const;
    void* AsyncGet() const { return Get(); }
};

inline void* cref<void>::TryGet() const {
    return TryResolvePref(*this, nullptr);
}

// ---------------------------------------------------------------------------
// Operators

inline void Serialise(Archive& ar, const prefbase& r) {
    r.Serialise(ar, false);
}
inline void Deserialise(InputArchive& ar, prefbase& r) {
    r.Deserialise(ar, false);
}

template <typename T>
Archive& operator<<(Archive& ar, const cref<T>& r) {
    Serialise(ar, static_cast<const prefbase&>(r));
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, cref<T>& r) {
    Deserialise(ar, static_cast<prefbase&>(r));
    return ar;
}

xostream& operator<<(xostream& os, const prefbase& r);

inline IObjectVisitor& operator<<(IObjectVisitor& v, const prefbase& r) {
    r.VisitObjects(v);
    return v;
}

inline IPrefVisitor& operator<<(IPrefVisitor& v, const prefbase& r) {
    v.VisitPref(r);
    return v;
}

// True exactly when `r` designates the object of `obj` (an empty reference
// equals a null handle). The unbound case compares identities.
bool RefersToUnbound(const prefbase& r, ptr<const IObject> obj);

inline bool operator==(const prefbase& r, ptr<const IObject> obj) {
    if (r.m_ptr.m_self != nullptr) {
        return r.m_ptr.m_self == obj.m_self;
    }
    return RefersToUnbound(r, obj);
}

inline bool operator!=(const prefbase& r, ptr<const IObject> obj) {
    return !(r == obj);
}

}  // namespace tarn
