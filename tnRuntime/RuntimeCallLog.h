#pragma once

// Counts of the runtime functions that persistable code calls, per thread.
// They make the calling protocol observable: tests check that marking a
// dirty object reaches no runtime function, that OnGarbageCollect reports
// once with the right handle, and which nodes an operation declared
// reachable or handed to deletion.

#include "tnPersistStore/IPersistable.h"

namespace tarn {

struct RuntimeCallLog {
    int64 numRegisterGcObject = 0;
    int64 numMarkPersistentAsDirty = 0;
    int64 numOnGarbageCollectPersistable = 0;
    int64 numDeclareReachable = 0;
    int64 numAsyncDeleteObject = 0;
    int64 numAsyncDeleteSubTree = 0;
    ptr<IPersistable> lastGarbageCollected;     // handle of the last OnGarbageCollectPersistable
    ptr<const IPersistable> lastReachableFrom;  // arguments of the last DeclareReachable
    ptr<const IPersistable> lastReachableTo;
    ptr<IPersistable> lastDeleted;  // argument of the last AsyncPermanentlyDelete…
};

// The calling thread's log; reset it by assigning RuntimeCallLog().
RuntimeCallLog& GetThreadRuntimeCallLog();

}  // namespace tarn
