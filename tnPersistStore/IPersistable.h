#pragma once

// Persistable objects: the persistence state every stored object carries, the
// IPersistable interface with its function table, the mixin that gives a
// class all of this, and DollarNew. The runtime functions that persistable
// code calls are declared in tnObject/RuntimeInterface.h.
//
// A persistable class is written as
//
//   class Foo : public PersistableMixin<IObjectBaseMixin<Foo, EmptyBase>> {
//   public:
//       void VisitObjects(IObjectVisitor& v) const;   // every reference held
//       void VisitPrefs(IPrefVisitor& v) const;       // tree edges only
//       void Serialise(Archive& ar) const;            // schema number first
//       void Deserialise(InputArchive& ar);
//       // optional: void OnCreate(bool local);       // runtime-created objects
//   };
//   const ReflectedClass& _GetReflected(const Foo*);  // see PersistableReflection.h
//
// and gets from the mixins every other slot of both function tables:
// QueryInterface (answers exactly the IObject and IPersistable records, by
// address), BindInterface, GetReflectedClass (via `_GetReflected(const Foo*)`),
// OnGarbageCollect, Destroy, GetSysState, RepresentsSubTree (true), OnCreate
// (no-op), GetPersistObjState, and the creation function sfnCreateInstance.
//
// Persistable objects are owned by their space (tnRuntime/CSpace.h), never by
// the objects that refer to them. Create them with `DollarNew(new Foo())`
// while holding the space exclusively.

#include "tnObject/IObject.h"
#include "tnPersistStore/OID.h"
#include "tnUtils/Assert.h"

namespace tarn {

class Archive;
class InputArchive;
class IPersistable;

// ---------------------------------------------------------------------------
// Persistence state

// The object's identity in the store; null until the runtime registers the
// object (or loads it). Only the runtime sets it.
struct PersistObjState {
    OID m_oid;
};

// As it sits in an object: a copy is a new object without identity, and
// assignment keeps the target's identity.
struct PersistObjState_2 : PersistObjState {
    PersistObjState_2() = default;
    PersistObjState_2(const PersistObjState_2&) : PersistObjState() {}
    PersistObjState_2& operator=(const PersistObjState_2&) { return *this; }
};

const ReflectedInterface& _GetReflected(const IPersistable*);

// ---------------------------------------------------------------------------
// The IPersistable handle

class IPersistable {
public:
    // The IObject table is the prefix, so an IPersistable table pointer is
    // also a pointer to the class's IObject slots. Slot order is fixed.
    struct FnTable {
        IObject::FnTable _IObject;
        void (*VisitPrefs)(const void*, IPrefVisitor&);
        bool (*RepresentsSubTree)(const void*);
        void (*Serialise)(const void*, Archive&);
        void (*Deserialise)(void*, InputArchive&);
        void (*OnCreate)(void*, bool);
        PersistObjState& (*GetPersistObjState)(const void*);
    };

    template <typename T>
    struct Stubs {
        static void VisitPrefs(const void* self, IPrefVisitor& v) {
            static_cast<const T*>(self)->VisitPrefs(v);
        }
        static bool RepresentsSubTree(const void* self) {
            return static_cast<const T*>(self)->RepresentsSubTree();
        }
        static void Serialise(const void* self, Archive& ar) {
            static_cast<const T*>(self)->Serialise(ar);
        }
        static void Deserialise(void* self, InputArchive& ar) {
            static_cast<T*>(self)->Deserialise(ar);
        }
        static void OnCreate(void* self, bool local) { static_cast<T*>(self)->OnCreate(local); }
        static PersistObjState& GetPersistObjState(const void* self) {
            return static_cast<const T*>(self)->GetPersistObjState();
        }

        static constexpr FnTable s_table{IObject::Stubs<T>::s_table,
                                         &VisitPrefs,
                                         &RepresentsSubTree,
                                         &Serialise,
                                         &Deserialise,
                                         &OnCreate,
                                         &GetPersistObjState};

        static const FnTable& GetTable() { return s_table; }
    };

    IPersistable() = default;
    IPersistable(void* self, const FnTable* table) : m_self(self), m_table(table) {}

    template <typename T>
    void CoerceFrom(T* p) {
        m_self = p;
        m_table = &Stubs<T>::GetTable();
    }
    template <typename T>
    void CoerceFrom(const T* p) {
        m_self = const_cast<T*>(p);
        m_table = &Stubs<T>::GetTable();
    }
    void AssignFrom(const IPersistable& rhs) {
        m_self = rhs.m_self;
        m_table = rhs.m_table;
    }

    operator void*() const { return m_self; }
    operator IObject() const {
        return IObject(m_self, m_table != nullptr ? &m_table->_IObject : nullptr);
    }

    AnyInterface QueryInterface(const ReflectedInterface& ri) const {
        return m_table->_IObject.QueryInterface(m_self, ri);
    }
    AnyInterface BindInterface(const ReflectedInterface& ri) const {
        return m_table->_IObject.BindInterface(m_self, ri);
    }
    const ReflectedClass* GetReflectedClass() const {
        return m_table->_IObject.GetReflectedClass(m_self);
    }
    void VisitObjects(IObjectVisitor& v) const { m_table->_IObject.VisitObjects(m_self, v); }
    void OnGarbageCollect() const { m_table->_IObject.OnGarbageCollect(m_self); }
    void Destroy() const { m_table->_IObject.Destroy(m_self); }
    ObjSysState& GetSysState() const { return m_table->_IObject.GetSysState(m_self); }
    void VisitPrefs(IPrefVisitor& v) const { m_table->VisitPrefs(m_self, v); }
    bool RepresentsSubTree() const { return m_table->RepresentsSubTree(m_self); }
    void Serialise(Archive& ar) const { m_table->Serialise(m_self, ar); }
    void Deserialise(InputArchive& ar) const { m_table->Deserialise(m_self, ar); }
    void OnCreate(bool local) const { m_table->OnCreate(m_self, local); }
    PersistObjState& GetPersistObjState() const { return m_table->GetPersistObjState(m_self); }

    void* m_self = nullptr;
    const FnTable* m_table = nullptr;
};

// ---------------------------------------------------------------------------
// Creation (RegisterGcObject and the other lifecycle functions that
// persistable code calls are the runtime's: tnObject/RuntimeInterface.h)

// Registers a newly constructed object and returns it. If registration
// fails the object is deleted and the exception passes on.
template <typename T>
T* DollarNew(T* p) {
    try {
        RegisterGcObject(ptr<IObject>(p));
    } catch (...) {
        delete p;
        throw;
    }
    return p;
}

// ---------------------------------------------------------------------------
// The mixin of every persistable class

// Answers the two interfaces of a persistable class, by record address.
template <typename T>
AnyInterface PersistableQueryInterface(T* obj, const ReflectedInterface& ri) {
    if (&ri == &GetReflectedInterface<IObject>()) {
        return ptr<IObject>(obj);
    }
    if (&ri == &GetReflectedInterface<IPersistable>()) {
        return ptr<IPersistable>(obj);
    }
    return AnyInterface();
}

template <typename BC>
class PersistableMixin : public BC {
public:
    using Final = typename BC::FinalClassType;

    PersistableMixin() = default;
    PersistableMixin(const PersistableMixin&) = default;
    PersistableMixin& operator=(const PersistableMixin&) = default;
    ~PersistableMixin() { TARN_ASSERT(!IsDirty()); }

    PersistObjState& GetPersistObjState() const {
        return const_cast<PersistObjState_2&>(m_persistObjState);
    }

    bool IsDirty() const { return this->GetSysState().GetFlag(DBP_PO_DIRTY); }

    // The common case, an object already dirty, is the flag test alone.
    void MarkAsDirtyWithoutTrace() const {
        if (IsDirty()) {
            return;
        }
        MarkPersistentAsDirtyWithoutTrace(ptr<const IPersistable>(this->GetThisAsFinalClass()));
    }

    void OnCreate(bool) {}
    bool RepresentsSubTree() const { return true; }

    void OnGarbageCollect() {
        OnGarbageCollectPersistable(ptr<IPersistable>(this->GetThisAsFinalClass()));
        BC::OnGarbageCollect();
    }

    AnyInterface QueryInterface(const ReflectedInterface& ri) {
        return PersistableQueryInterface(this->GetThisAsFinalClass(), ri);
    }

    // The address of the class's record, from `_GetReflected(const Final*)`.
    const ReflectedClass* GetReflectedClass() const {
        return &_GetReflected(static_cast<const Final*>(nullptr));
    }

    // A default instance, not registered; its IObject handle comes through
    // its IPersistable handle.
    static ptr<IObject> sfnCreateInstance() { return ptr<IObject>(ptr<IPersistable>(new Final())); }

    PersistObjState_2 m_persistObjState;
};

}  // namespace tarn
