#pragma once

// Holding a space: an RAII guard that takes the space's lock, shared or
// exclusive, makes the space the calling thread's space (GetThreadCSpace) and
// records the thread's lock status on it (GetRecordedLockStatus: the number
// of nested exclusive guards, minus the number of nested shared guards, 0
// when none).
//
// A thread works in at most one space at a time. Guards nest on the same
// space: any guard inside an exclusive one keeps the exclusive lock (the
// status grows by one); a shared guard inside a shared one adds depth (the
// status falls by one). Asking for exclusive access inside a shared guard
// (an upgrade, which could deadlock) or for a second space stops the process.

#include "tnObject/IObject.h"

namespace tarn {

class CSpace;

enum class LockMode { Shared, Exclusive };

class CSpaceGuard {
public:
    CSpaceGuard(CSpace& space, LockMode mode);
    ~CSpaceGuard();
    CSpaceGuard(const CSpaceGuard&) = delete;
    CSpaceGuard& operator=(const CSpaceGuard&) = delete;

private:
    CSpace& m_space;
    int32 m_previousStatus;  // the thread's status before this guard
};

}  // namespace tarn
