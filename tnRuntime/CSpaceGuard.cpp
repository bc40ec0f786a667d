#include "tnRuntime/CSpaceGuard.h"

#include "tnRuntime/CSpace.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

// The calling thread's space and its lock status on it.
struct ThreadSpace {
    CSpace* space = nullptr;
    int32 status = 0;
};

thread_local ThreadSpace t_threadSpace;

}  // namespace

CSpace* GetThreadCSpace() {
    return t_threadSpace.space;
}

int32 GetRecordedLockStatus(const CSpace* space) {
    if (space == nullptr || space != t_threadSpace.space) {
        return 0;
    }
    return t_threadSpace.status;
}

CSpaceGuard::CSpaceGuard(CSpace& space, LockMode mode)
    : m_space(space), m_previousStatus(t_threadSpace.status) {
    ThreadSpace& t = t_threadSpace;
    TARN_ASSERT(t.space == nullptr || t.space == &space);
    if (t.space == nullptr) {
        if (mode == LockMode::Exclusive) {
            space.m_lock.lock();
            t.status = 1;
        } else {
            space.m_lock.lock_shared();
            t.status = -1;
        }
        t.space = &space;
        return;
    }
    // Nested on the thread's own space.
    TARN_ASSERT(!(mode == LockMode::Exclusive && t.status < 0));
    t.status += t.status > 0 ? 1 : -1;
}

CSpaceGuard::~CSpaceGuard() {
    ThreadSpace& t = t_threadSpace;
    const int32 status = t.status;
    t.status = m_previousStatus;
    if (m_previousStatus != 0) {
        return;
    }
    t.space = nullptr;
    if (status > 0) {
        m_space.m_lock.unlock();
    } else {
        m_space.m_lock.unlock_shared();
    }
}

}  // namespace tarn
