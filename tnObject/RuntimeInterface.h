#pragma once

// The runtime's interface: every function that the layers below the object
// runtime call and the runtime provides.
//
// The value types, the object model and the module are built before the
// runtime and know nothing of it; where they need one of its services (a new
// object's identity, a dirty mark, a reference to resolve, the thread's lock)
// they call a function declared here, and only these: the runtime's own
// headers are out of their sight. The library target tarn_runtime
// (tnRuntime/) defines every one of them; a lower layer that needs a further
// service declares it here first. Programs link the runtime through the
// embedding API's target, which joins the module and the runtime.
//
// Which file of tnRuntime/ defines what:
//   memswap                                         MemSwap.cpp
//   RegisterReflectedClass, Tarn_tnOperation_GetXTarget   ClassRegistry.cpp
//   GetThreadCSpace, GetRecordedLockStatus          CSpaceGuard.cpp
//   RegisterGcObject, MarkPersistentAsDirtyWithoutTrace,
//   OnGarbageCollectPersistable, DeclareReachable,
//   AsyncPermanentlyDeleteObject, AsyncPermanentlyDeleteSubTree
//                                                   ObjectLifecycle.cpp
//   ResolvePref, FindResidentPref, TryResolvePref   PrefResolution.cpp
//
// The declarations need only the names of the object model's types, so this
// header includes nothing of it: tnObject/IObject.h and the headers above it
// include this one.

#include <cstddef>

#include "tnUtils/Types.h"

namespace tarn {

class CSpace;
class IObject;
class IPersistable;
class prefbase;
class XTarget;
struct ReflectedClass;
template <typename I>
class ptr;

// ---------------------------------------------------------------------------
// Values

// Exchanges the `n` bytes at `a` with the `n` bytes at `b`; the two ranges
// must not overlap. No constructor, assignment or destructor runs, so only
// values that never point into themselves may be exchanged this way (a Path,
// a FieldId, a persistent reference, a per-site table).
void memswap(void* a, void* b, std::size_t n);

// ---------------------------------------------------------------------------
// Reflection

// Results of entering names into the registry.
enum ENameSpaceError {
    NSE_OK = 0,
    NSE_COLON_EXPECTED = 1,
    NSE_IDENTIFIER_EXPECTED = 2,
    NSE_NAME_ALREADY_IN_USE = 3,
    NSE_NAME_NOT_FOUND = 4,
    NSE_NOT_A_NAMESPACE = 5,
};

// Enters `rc` under rc->m_name into `target`, the registry's part for one
// library (opaque outside the runtime). Class names are unique across all
// targets: a second registration of a name returns NSE_NAME_ALREADY_IN_USE
// and changes nothing. A malformed name (not identifiers joined by "::")
// returns NSE_COLON_EXPECTED or NSE_IDENTIFIER_EXPECTED.
ENameSpaceError RegisterReflectedClass(const ReflectedClass* rc, XTarget* target);

// The registration target of the library that holds the offset operations
// record and its B+tree ("tnOperation").
XTarget* Tarn_tnOperation_GetXTarget();

// ---------------------------------------------------------------------------
// The calling thread's space and lock

// The space the calling thread works in, null when it holds none.
CSpace* GetThreadCSpace();

// The lock the calling thread holds on `space`: > 0 exclusive (the nesting
// depth of its guards), < 0 shared (minus the depth), 0 none.
int32 GetRecordedLockStatus(const CSpace* space);

// ---------------------------------------------------------------------------
// Object lifecycle

// Takes a newly constructed object under the management of the calling
// thread's space: gives it its identity at once, makes it resident and
// queues it for the next commit. The thread must hold a space exclusively.
void RegisterGcObject(ptr<IObject> obj);

// Sets the object's dirty flag and queues it for the next commit. Harmless on
// a dirty object. An object that was never registered (no space, no
// identity: a temporary made by copy construction) is not tracked, and this
// does nothing for it.
void MarkPersistentAsDirtyWithoutTrace(ptr<const IPersistable> obj);

// The persistence side of collecting `obj`: the object leaves its space
// (no longer resident, no longer queued; pending changes are discarded and
// its dirty flag cleared) so that it may be destroyed. Nothing for an
// object that was never registered.
void OnGarbageCollectPersistable(ptr<IPersistable> obj);

// Records that `to` is reachable from `from`. The runtime deletes only what
// it is told to delete (AsyncPermanentlyDelete…) and writes what is marked,
// so reachability needs no bookkeeping: the call is counted in the thread's
// RuntimeCallLog and otherwise does nothing. The flag is accepted and
// ignored.
void DeclareReachable(ptr<const IPersistable> from, ptr<const IPersistable> to, bool flag);

// Queue `obj` (alone, following none of its references) / `obj` and every
// object below it along VisitPrefs, for permanent deletion. The next commit
// removes their images and destroys them; nothing is destroyed before. A
// null handle is ignored.
void AsyncPermanentlyDeleteObject(ptr<IPersistable> obj);
void AsyncPermanentlyDeleteSubTree(ptr<IPersistable> obj);

// ---------------------------------------------------------------------------
// Persistent references

// The slow path of prefbase::Get: finds the object of `r` among the thread's
// residents or loads it, and binds `r` when the thread holds the space
// exclusively. `expected` (null: any class) is the class the object must
// have. An empty reference gives a null handle; a failed load throws
// RuntimeError.
ptr<IPersistable> ResolvePref(const prefbase& r, const ReflectedClass* expected);

// The bound handle of `r`, or the resident object of its identity in the
// thread's space; never loads, never binds. Null otherwise.
ptr<IPersistable> FindResidentPref(const prefbase& r);

// The object of `r` as ResolvePref would return it, but null instead of an
// exception when it cannot be loaded.
void* TryResolvePref(const prefbase& r, const ReflectedClass* expected);

}  // namespace tarn
