// Eviction: releasing clean residents, after unbinding every reference to
// them that the space can reach.

#include <algorithm>

#include "tnObject/IObjectVisitor.h"
#include "tnPersistStore/pref.h"
#include "tnRuntime/CSpace.h"

namespace tarn {

namespace {

// Nulls every presented handle to one of `objects`, which makes the
// presenting reference forget its binding.
class Unbinder final : public IObjectVisitor {
public:
    explicit Unbinder(const std::unordered_set<const void*>& objects) : m_objects(objects) {}

    void VisitObject(ptr<const IObject>) override {}
    void VisitEvictableObject(ptr<const IObject>& obj) override {
        if (m_objects.count(obj.m_self) != 0) {
            obj = nullptr;
        }
    }

private:
    const std::unordered_set<const void*>& m_objects;
};

}  // namespace

void CSpace::UnbindReferencesTo(const ObjectSet& objects) {
    Unbinder unbinder(objects);
    {
        std::lock_guard<std::mutex> lock(m_residentsMutex);
        for (auto& [oid, resident] : m_residents) {
            if (objects.count(resident.obj.m_self) == 0) {
                resident.obj->VisitObjects(unbinder);
            }
        }
    }
    std::lock_guard<std::mutex> lock(m_externalRefsMutex);
    for (SpaceRefLink* link : m_externalRefs) {
        link->ref->VisitObjects(unbinder);
    }
}

ssize_t CSpace::EvictCleanResidents(ssize_t maxResidents) {
    RequireExclusive();
    std::vector<const Resident*> clean;
    {
        std::lock_guard<std::mutex> lock(m_residentsMutex);
        const auto excess = static_cast<ssize_t>(m_residents.size()) - maxResidents;
        if (excess <= 0) {
            return 0;
        }
        for (const auto& [oid, resident] : m_residents) {
            const ObjSysState& state = resident.obj->GetSysState();
            if (!state.GetFlag(DBP_PO_DIRTY) &&
                !state.GetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION)) {
                clean.push_back(&resident);
            }
        }
        std::sort(clean.begin(), clean.end(),
                  [](const Resident* a, const Resident* b) { return a->tick < b->tick; });
        if (static_cast<ssize_t>(clean.size()) > excess) {
            clean.resize(static_cast<std::size_t>(excess));
        }
    }
    std::vector<ptr<IPersistable>> victims;
    ObjectSet victimSet;
    victims.reserve(clean.size());
    for (const Resident* r : clean) {
        victims.push_back(r->obj);
        victimSet.insert(r->obj.m_self);
    }
    UnbindReferencesTo(victimSet);
    {
        std::lock_guard<std::mutex> lock(m_residentsMutex);
        for (const ptr<IPersistable>& obj : victims) {
            m_residents.erase(obj->GetPersistObjState().m_oid.value_);
            obj->GetSysState().m_cspace = nullptr;
        }
    }
    for (const ptr<IPersistable>& obj : victims) {
        obj->Destroy();
    }
    m_stats.numEvicted += static_cast<int64>(victims.size());
    return static_cast<ssize_t>(victims.size());
}

}  // namespace tarn
