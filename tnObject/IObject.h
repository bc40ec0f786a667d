#pragma once

// The object model: per-object system state, interface handles and their
// function tables, the base mixin of every class the runtime manages, and the
// reflection records through which the runtime knows classes by name.
//
// Classes managed by the runtime have no virtual functions. The runtime
// reaches an object through an interface handle, a pair (object address,
// function table of the object's class for that interface). Handles own and
// count nothing; they are two words, copied by value. Interfaces are told
// apart by the ADDRESS of their interface record (`GetReflectedInterface<I>()`),
// never by name.
//
// Thread rules: the tables and records are constants (records are built once,
// under guarded initialisation of a function-local static). An object's
// system state belongs to the runtime and changes only on a thread that holds
// the object's space exclusively.

#include <cstddef>
#include <type_traits>

#include "tnObject/RuntimeInterface.h"
#include "tnObject/TypeOps.h"
#include "tnUtils/Types.h"

namespace tarn {

class CSpace;
class IObjectVisitor;
class IPrefVisitor;
struct ReflectedClass;

using char8 = char;
using ConstStringZ = const char8*;

// The untyped element of a function table; a table is reached through a
// pointer to its first slot and read back as the interface's own FnTable.
using FunctionPointer = void (*)();

// ---------------------------------------------------------------------------
// System state

// Flag numbers of ObjSysState; flag n is bit n (value 2^n) of objflags_.
//   DBP_GC_NOT_REGISTERED_IN_EXTENT  the object has no image in the store yet
//                                    (set when it is registered, cleared once
//                                    a commit has written it)
//   DBP_PO_DIRTY                     changed since last written; queued for
//                                    the next commit
//   DBP_PO_MARKED_DURING_ASYNC_DELETION  queued for permanent deletion
//   DBP_PO_SYNC_DELETED              removed from the store by a commit and
//                                    about to be destroyed
//   DBP_PO_MARKED                    visited by the current runtime walk
enum {
    DBP_GC_NOT_REGISTERED_IN_EXTENT = 0,
    DBP_PO_DIRTY = 1,
    DBP_PO_MARKED_DURING_ASYNC_DELETION = 2,
    DBP_PO_SYNC_DELETED = 3,
    DBP_PO_MARKED = 4,
};

// Per-object state kept by the runtime. m_cspace is the space that owns the
// object (null while the object is not registered, e.g. a temporary made by
// copy construction). marked_, m_size and m_lastTouchedTime are the runtime's
// own bookkeeping (m_lastTouchedTime: the space's load/registration tick, the
// eviction order).
struct ObjSysState {
    CSpace* m_cspace = nullptr;
    bool marked_ = false;
    uint32 objflags_ = 0;
    ssize_t m_size = 0;
    int32 m_lastTouchedTime = 0;

    bool GetFlag(int n) const { return (objflags_ & (uint32{1} << n)) != 0; }
    void SetFlag(int n) { objflags_ |= uint32{1} << n; }
    void ClearFlag(int n) { objflags_ &= ~(uint32{1} << n); }
    void SetFlag(int n, bool v) {
        if (v) {
            SetFlag(n);
        } else {
            ClearFlag(n);
        }
    }
};

// The state as it sits in an object: a copy of an object is a new object, so
// copy construction yields the initial state and copy assignment keeps the
// target's own.
struct ObjSysState_2 : ObjSysState {
    ObjSysState_2() = default;
    ObjSysState_2(const ObjSysState_2&) : ObjSysState() {}
    ObjSysState_2& operator=(const ObjSysState_2&) { return *this; }
};

// ---------------------------------------------------------------------------
// Handles

// Untyped handles. A handle designates no object exactly when m_self is null,
// whatever m_table holds.
struct AnyInterface {
    void* m_self = nullptr;
    const FunctionPointer* m_table = nullptr;

    operator void*() const { return m_self; }
};

struct AnyConstInterface {
    const void* m_self = nullptr;
    const FunctionPointer* m_table = nullptr;

    operator const void*() const { return m_self; }
};

// The value `tarn::null` stands for "no object"; handles and references built
// from it are null.
class NullInterface {
public:
    constexpr NullInterface() {}
    operator const void*() const { return nullptr; }
};

extern const NullInterface null;

// The runtime's record of an interface. Only its address matters to
// QueryInterface; the name is for diagnostics.
struct ReflectedInterface {
    ConstStringZ m_name;
};

class IObject;

// The interface records, one per interface at a fixed address.
const ReflectedInterface& _GetReflected(const IObject*);

template <typename I>
const ReflectedInterface& GetReflectedInterface() {
    return _GetReflected(static_cast<const I*>(nullptr));
}

// The typed handle of the IObject interface.
class IObject {
public:
    // Slot order is part of the object model; do not reorder.
    struct FnTable {
        AnyInterface (*QueryInterface)(void*, const ReflectedInterface&);
        AnyInterface (*BindInterface)(void*, const ReflectedInterface&);
        const ReflectedClass* (*GetReflectedClass)(const void*);
        void (*VisitObjects)(const void*, IObjectVisitor&);
        void (*OnGarbageCollect)(void*);
        void (*Destroy)(void*);
        ObjSysState& (*GetSysState)(void*);
    };

    // Per-class forwarders: each treats the object pointer as a T and calls
    // T's member of the same name.
    template <typename T>
    struct Stubs {
        static AnyInterface QueryInterface(void* self, const ReflectedInterface& ri) {
            return static_cast<T*>(self)->QueryInterface(ri);
        }
        static AnyInterface BindInterface(void* self, const ReflectedInterface& ri) {
            return static_cast<T*>(self)->BindInterface(ri);
        }
        static const ReflectedClass* GetReflectedClass(const void* self) {
            return static_cast<const T*>(self)->GetReflectedClass();
        }
        static void VisitObjects(const void* self, IObjectVisitor& v) {
            static_cast<const T*>(self)->VisitObjects(v);
        }
        static void OnGarbageCollect(void* self) { static_cast<T*>(self)->OnGarbageCollect(); }
        // Destroying through a null object pointer does nothing.
        static void Destroy(void* self) {
            if (self != nullptr) {
                static_cast<T*>(self)->Destroy();
            }
        }
        static ObjSysState& GetSysState(void* self) { return static_cast<T*>(self)->GetSysState(); }

        static constexpr FnTable s_table{&QueryInterface, &BindInterface,    &GetReflectedClass,
                                         &VisitObjects,   &OnGarbageCollect, &Destroy,
                                         &GetSysState};

        static const FnTable& GetTable() { return s_table; }
    };

    IObject() = default;
    IObject(void* self, const FnTable* table) : m_self(self), m_table(table) {}

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
    void AssignFrom(const IObject& rhs) {
        m_self = rhs.m_self;
        m_table = rhs.m_table;
    }

    operator void*() const { return m_self; }

    AnyInterface QueryInterface(const ReflectedInterface& ri) const {
        return m_table->QueryInterface(m_self, ri);
    }
    AnyInterface BindInterface(const ReflectedInterface& ri) const {
        return m_table->BindInterface(m_self, ri);
    }
    const ReflectedClass* GetReflectedClass() const { return m_table->GetReflectedClass(m_self); }
    void VisitObjects(IObjectVisitor& v) const { m_table->VisitObjects(m_self, v); }
    void OnGarbageCollect() const { m_table->OnGarbageCollect(m_self); }
    void Destroy() const { m_table->Destroy(m_self); }
    ObjSysState& GetSysState() const { return m_table->GetSysState(m_self); }

    void* m_self = nullptr;
    const FnTable* m_table = nullptr;
};

// The handle type code passes around: ptr<I> for a non-const I derives from
// AnyInterface, ptr<const I> from AnyConstInterface; neither adds a field.
// `->` and `*` give the handle as an I (whose forwarders call the slots).
template <typename I>
class ptr : public std::conditional_t<std::is_const_v<I>, AnyConstInterface, AnyInterface> {
public:
    using Iface = std::remove_const_t<I>;

    ptr() = default;
    ptr(const NullInterface&) {}
    ptr(std::nullptr_t) {}

    // The handle of `p` with its class's table for I; `p` is not tested, so a
    // null pointer gives a null handle that still carries the table.
    template <typename T>
    requires(!std::is_void_v<T> && (std::is_const_v<I> || !std::is_const_v<T>)) ptr(T* p) {
        Iface h;
        h.CoerceFrom(p);
        SetFrom(h);
    }

    // Interface and const conversions (IPersistable -> IObject, X -> const X).
    template <typename J>
    requires(!std::is_same_v<J, I> && std::is_convertible_v<std::remove_const_t<J>, Iface> &&
             (std::is_const_v<I> || !std::is_const_v<J>)) ptr(const ptr<J>& rhs) {
        Iface h;
        h.AssignFrom(static_cast<Iface>(rhs.get()));
        SetFrom(h);
    }

    explicit ptr(const Iface& h) { SetFrom(h); }

    // Reinterprets an untyped handle (a QueryInterface result) as this
    // interface; the caller knows which interface it asked for.
    static ptr FromAny(const AnyInterface& a) {
        ptr p;
        p.m_self = a.m_self;
        p.m_table = a.m_table;
        return p;
    }

    Iface get() const {
        return Iface(const_cast<void*>(static_cast<const void*>(this->m_self)),
                     reinterpret_cast<const typename Iface::FnTable*>(this->m_table));
    }

    struct Arrow {
        Iface h;
        const Iface* operator->() const { return &h; }
    };
    Arrow operator->() const { return Arrow{get()}; }
    Iface operator*() const { return get(); }

private:
    void SetFrom(const Iface& h) {
        this->m_self = h.m_self;
        this->m_table = reinterpret_cast<const FunctionPointer*>(h.m_table);
    }
};

// ---------------------------------------------------------------------------
// Base classes of managed objects

// The empty base of the mixin chain. Classes hide these with their own.
class EmptyBase {
public:
    void VisitObjects(IObjectVisitor&) const {}
    void VisitPrefs(IPrefVisitor&) const {}
    void EvictDgsNodes() {}
};

// Gives FinalClass its system state and the object-level hooks. Copying
// follows ObjSysState_2: a copy starts with the initial state.
template <typename FinalClass, typename EB = EmptyBase>
class IObjectBaseMixin : public EB {
public:
    using FinalClassType = FinalClass;

    ObjSysState& GetSysState() { return m_objSysState; }
    const ObjSysState& GetSysState() const { return m_objSysState; }

    FinalClass* GetThisAsFinalClass() { return static_cast<FinalClass*>(this); }
    const FinalClass* GetThisAsFinalClass() const { return static_cast<const FinalClass*>(this); }

    AnyInterface BindInterface(const ReflectedInterface& ri) {
        return GetThisAsFinalClass()->QueryInterface(ri);
    }

    void OnGarbageCollect() {}

    // Deletes the object as its final class (the destructors are not virtual).
    void Destroy() { delete GetThisAsFinalClass(); }

    ObjSysState_2 m_objSysState;
};

// ---------------------------------------------------------------------------
// Reflection records

struct ReflectedField;
struct ReflectedModelField;
struct ReflectedDepField;
struct ReflectedClassMethod;

using CreateClassVariableFn = ptr<IObject> (*)();

// Bits of ReflectedClass::m_flags.
//   bit 0  CLASS_FLAG_PERSISTABLE        instances are persistable objects with an
//                                        identity, loaded and written by the runtime
//   bit 1  CLASS_FLAG_STRUCT             a plain value type without identity
//   bit 2  CLASS_FLAG_PURE_MODEL         a model type with no state of its own
//   bit 3  CLASS_FLAG_EMBEDDED_MODEL     embeds a model
//   bit 4  CLASS_FLAG_REFERENCES_MODEL   refers to a model
//   bit 5  CLASS_FLAG_ADT                an abstract data type
//   bit 6  CLASS_FLAG_REPLICATE_ON_DEMAND  replicated to a site only when used there
enum : uint32 {
    CLASS_FLAG_PERSISTABLE = 1u << 0,
    CLASS_FLAG_STRUCT = 1u << 1,
    CLASS_FLAG_PURE_MODEL = 1u << 2,
    CLASS_FLAG_EMBEDDED_MODEL = 1u << 3,
    CLASS_FLAG_REFERENCES_MODEL = 1u << 4,
    CLASS_FLAG_ADT = 1u << 5,
    CLASS_FLAG_REPLICATE_ON_DEMAND = 1u << 6,
};

// Describes a class to the runtime. Field order is fixed.
struct ReflectedClass {
    uint32 m_flags;
    ConstStringZ m_name;
    ssize_t m_size;
    const octet_t* m_metaData;
    const ReflectedField* m_fields;
    ssize_t m_numFields;
    const ReflectedModelField* m_modelFields;
    ssize_t m_numModelFields;
    const ReflectedDepField* m_depFields;
    ssize_t m_numDepFields;
    const ReflectedClassMethod* m_methods;
    ssize_t m_numMethods;
    const ConstStringZ* m_stringTable;
    // Indirect interfaces first, then the direct ones.
    const ConstStringZ* m_interfaces;
    ssize_t m_numIndirectInterfaces;
    ssize_t m_numDirectInterfaces;
    const IObject::FnTable* m_IObjectFnTable;
    CreateClassVariableFn m_createFn;
    TypeOps m_ops;

    uint32 GetFlags() const { return m_flags; }
    bool IsPersistable() const { return (m_flags & CLASS_FLAG_PERSISTABLE) != 0; }
    bool IsStruct() const { return (m_flags & CLASS_FLAG_STRUCT) != 0; }
    bool IsPureModel() const { return (m_flags & CLASS_FLAG_PURE_MODEL) != 0; }
    bool HasEmbeddedModel() const { return (m_flags & CLASS_FLAG_EMBEDDED_MODEL) != 0; }
    bool ReferencesModel() const { return (m_flags & CLASS_FLAG_REFERENCES_MODEL) != 0; }
    bool IsAdt() const { return (m_flags & CLASS_FLAG_ADT) != 0; }
    bool ReplicateOnDemand() const { return (m_flags & CLASS_FLAG_REPLICATE_ON_DEMAND) != 0; }
    ssize_t NumInterfaces() const { return m_numIndirectInterfaces + m_numDirectInterfaces; }
};

// A class's record, found by argument-dependent lookup of the class's own
// `_GetReflected(const T*)`.
template <typename T>
const ReflectedClass& GetReflectedClass() {
    return _GetReflected(static_cast<T*>(nullptr));
}

// ---------------------------------------------------------------------------
// The calling thread's space and lock, asked of the runtime through
// GetThreadCSpace and GetRecordedLockStatus (tnObject/RuntimeInterface.h)

template <typename T>
T* GetThreadPtr();

template <>
inline CSpace* GetThreadPtr<CSpace>() {
    return GetThreadCSpace();
}

inline bool HaveExclusiveLockedCSpace() {
    return static_cast<int32>(GetRecordedLockStatus(GetThreadPtr<CSpace>())) > 0;
}

}  // namespace tarn
