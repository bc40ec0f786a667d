// The lifecycle functions of the runtime's interface
// (tnObject/RuntimeInterface.h) that persistable code calls: each finds the
// object's space and hands the work to it, and counts the call in the
// thread's RuntimeCallLog.

#include "tnPersistStore/IPersistable.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/RuntimeCallLog.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

ptr<IPersistable> AsPersistable(ptr<IObject> obj) {
    return ptr<IPersistable>::FromAny(obj->QueryInterface(GetReflectedInterface<IPersistable>()));
}

ptr<IPersistable> NonConst(ptr<const IPersistable> obj) {
    ptr<IPersistable> p;
    p.m_self = const_cast<void*>(obj.m_self);
    p.m_table = obj.m_table;
    return p;
}

}  // namespace

void RegisterGcObject(ptr<IObject> obj) {
    ++GetThreadRuntimeCallLog().numRegisterGcObject;
    CSpace* space = GetThreadCSpace();
    TARN_ASSERT(space != nullptr);
    ptr<IPersistable> p = AsPersistable(obj);
    TARN_ASSERT(p.m_self != nullptr);
    space->AdoptNew(p);
}

void MarkPersistentAsDirtyWithoutTrace(ptr<const IPersistable> obj) {
    ++GetThreadRuntimeCallLog().numMarkPersistentAsDirty;
    if (obj.m_self == nullptr) {
        return;
    }
    ObjSysState& state = obj->GetSysState();
    if (state.m_cspace == nullptr) {
        return;  // never registered: not tracked
    }
    state.m_cspace->CountMarkCall();
    if (state.GetFlag(DBP_PO_DIRTY)) {
        return;
    }
    state.m_cspace->QueueDirty(NonConst(obj));
}

void OnGarbageCollectPersistable(ptr<IPersistable> obj) {
    RuntimeCallLog& log = GetThreadRuntimeCallLog();
    ++log.numOnGarbageCollectPersistable;
    log.lastGarbageCollected = obj;
    if (obj.m_self == nullptr) {
        return;
    }
    CSpace* space = obj->GetSysState().m_cspace;
    if (space != nullptr) {
        space->Detach(obj);
    }
}

void DeclareReachable(ptr<const IPersistable> from, ptr<const IPersistable> to, bool) {
    RuntimeCallLog& log = GetThreadRuntimeCallLog();
    ++log.numDeclareReachable;
    log.lastReachableFrom = from;
    log.lastReachableTo = to;
}

namespace {

void QueueDeletion(ptr<IPersistable> obj, bool subTree) {
    GetThreadRuntimeCallLog().lastDeleted = obj;
    if (obj.m_self == nullptr) {
        return;
    }
    CSpace* space = obj->GetSysState().m_cspace;
    TARN_ASSERT(space != nullptr);
    space->QueueDeletion(obj, subTree);
}

}  // namespace

void AsyncPermanentlyDeleteObject(ptr<IPersistable> obj) {
    ++GetThreadRuntimeCallLog().numAsyncDeleteObject;
    QueueDeletion(obj, false);
}

void AsyncPermanentlyDeleteSubTree(ptr<IPersistable> obj) {
    ++GetThreadRuntimeCallLog().numAsyncDeleteSubTree;
    QueueDeletion(obj, true);
}

}  // namespace tarn
