#pragma once

// Helpers that build the reflection record of a persistable class.
//
// A class Foo registered as "tarn::Foo" writes
//
//   const ReflectedClass& _GetReflected(const Foo*) {
//       static const ReflectedClass record =
//           MakePersistableReflectedClass<Foo>("tarn::Foo", CopyableTypeOps<Foo>());
//       return record;
//   }
//   const TypeOps* _GetTypeOps(const Foo*) { return &_GetReflected((Foo*) 0).m_ops; }
//   void _Register_Foo() {    // asserts that RegisterReflectedClass(&record,
//                              // Tarn_tnOperation_GetXTarget()) returns NSE_OK
//   }
//
// The record lists the interfaces "tarn::IObject" (indirect, it comes with
// IPersistable) and "tarn::IPersistable" (direct), carries flag bit 0
// (CLASS_FLAG_PERSISTABLE), the class's IObject table and its
// sfnCreateInstance; metadata, fields and methods are null.

#include "tnObject/IObject.h"
#include "tnObject/TypeOps.h"
#include "tnPersistStore/IPersistable.h"

namespace tarn {

// The interface names of every persistable class: indirect, then direct.
inline constexpr ConstStringZ kPersistableInterfaceNames[2] = {"tarn::IObject",
                                                               "tarn::IPersistable"};

// Type operations of a class that can be constructed, copied, assigned and
// destroyed in place but not printed.
template <typename T>
TypeOps CopyableTypeOps() {
    TypeOps ops{};
    ops.m_size = static_cast<ssize_t>(sizeof(T));
    ops.m_ConstructArrayFn = ConstructArray<T>;
    ops.m_CopyConstructArrayFn = CopyConstructArray<T>;
    ops.m_AssignArrayFn = AssignArray<T>;
    ops.m_DestructArrayFn = DestructArray<T>;
    return ops;
}

// Type operations of a class that can be constructed, destroyed and printed
// (`os << obj`) but not copied or assigned.
template <typename T>
TypeOps PrintableTypeOps() {
    TypeOps ops{};
    ops.m_size = static_cast<ssize_t>(sizeof(T));
    ops.m_PrintVariableFn = PrintVariable<T>;
    ops.m_ConstructArrayFn = ConstructArray<T>;
    ops.m_DestructArrayFn = DestructArray<T>;
    return ops;
}

template <typename T>
ReflectedClass MakePersistableReflectedClass(ConstStringZ name, const TypeOps& ops) {
    ReflectedClass rc{};
    rc.m_flags = CLASS_FLAG_PERSISTABLE;
    rc.m_name = name;
    rc.m_size = static_cast<ssize_t>(sizeof(T));
    rc.m_metaData = nullptr;
    rc.m_fields = nullptr;
    rc.m_numFields = 0;
    rc.m_modelFields = nullptr;
    rc.m_numModelFields = 0;
    rc.m_depFields = nullptr;
    rc.m_numDepFields = 0;
    rc.m_methods = nullptr;
    rc.m_numMethods = 0;
    rc.m_stringTable = nullptr;
    rc.m_interfaces = kPersistableInterfaceNames;
    rc.m_numIndirectInterfaces = 1;
    rc.m_numDirectInterfaces = 1;
    rc.m_IObjectFnTable = &IObject::Stubs<T>::GetTable();
    rc.m_createFn = &T::sfnCreateInstance;
    rc.m_ops = ops;
    return rc;
}

}  // namespace tarn
