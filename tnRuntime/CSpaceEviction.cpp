// Eviction: releasing clean residents, after unbinding every reference to
// them that the space can reach.

#include <algorithm>

#include "tnObject/IObjectVisitor.h"
#include "tnPersistStore/IPrefVisitor.h"
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

// Whether an object reports any edge of the persistent tree below it.
class HasChildren final : public IPrefVisitor {
public:
    void VisitPref(const prefbase& ref) override { m_any = m_any || static_cast<bool>(ref); }
    void VisitParentPref(const prefbase&) override {}

    static bool Of(const ptr<IPersistable>& obj) {
        HasChildren v;
        obj->VisitPrefs(v);
        return v.m_any;
    }

private:
    bool m_any = false;
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
        // Victims, in order: objects without children in the persistent tree
        // (the leaves of a B+tree, say) before inner ones, whose reload
        // would cost a load for every walk down through them; within each,
        // the earliest loaded or registered first.
        std::vector<std::pair<bool, const Resident*>> candidates;
        for (const auto& [oid, resident] : m_residents) {
            const ObjSysState& state = resident.obj->GetSysState();
            if (!state.GetFlag(DBP_PO_DIRTY) &&
                !state.GetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION)) {
                candidates.emplace_back(HasChildren::Of(resident.obj), &resident);
            }
        }
        // Ticks are unique, so the order is total and the chosen victims do
        // not depend on the residents' hash order. Only the chosen ones are
        // sorted.
        const auto before = [](const auto& a, const auto& b) {
            return a.first != b.first ? b.first : a.second->tick < b.second->tick;
        };
        if (static_cast<ssize_t>(candidates.size()) > excess) {
            std::nth_element(candidates.begin(), candidates.begin() + excess, candidates.end(),
                             before);
            candidates.resize(static_cast<std::size_t>(excess));
        }
        std::sort(candidates.begin(), candidates.end(), before);
        clean.reserve(candidates.size());
        for (const auto& candidate : candidates) {
            clean.push_back(candidate.second);
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
