#include "tnStore/Reachability.h"

#include <deque>
#include <unordered_set>

#include "tnPersistStore/IPrefVisitor.h"
#include "tnPersistStore/pref.h"
#include "tnStore/MemoryBound.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

namespace {

// Queues every identity it is shown that was not seen before.
class Collector final : public IPrefVisitor {
public:
    Collector(std::unordered_set<uint64>& seen, std::deque<uint64>& queue)
        : m_seen(seen), m_queue(queue) {}

    void VisitPref(const prefbase& ref) override { Add(ref.m_oid.value_); }
    void VisitParentPref(const prefbase& ref) override { Add(ref.m_oid.value_); }

    void Add(uint64 oid) {
        if (oid != 0 && m_seen.insert(oid).second) {
            m_queue.push_back(oid);
        }
    }

private:
    std::unordered_set<uint64>& m_seen;
    std::deque<uint64>& m_queue;
};

}  // namespace

ReachabilityResult FindUnreachableImages(CSpace& space, ssize_t bound) {
    ReachabilityResult result;
    std::unordered_set<uint64> seen;
    std::deque<uint64> queue;
    Collector collector(seen, queue);
    for (const auto& [name, oid] : space.Roots()) {
        collector.Add(oid.value_);
    }
    while (!queue.empty()) {
        const uint64 oid = queue.front();
        queue.pop_front();
        try {
            space.Resolve(OID(Seid(oid)), nullptr)->VisitPrefs(collector);
            MemoryBound::KeepUnder(space, bound);
        } catch (const RuntimeError& e) {
            result.errors.push_back(e.what());
        }
    }
    space.GetStore().ForEachIdentity([&](uint64 oid) {
        ++result.stored;
        if (seen.count(oid) != 0) {
            ++result.reached;
        } else {
            result.unreachable.push_back(oid);
        }
    });
    return result;
}

}  // namespace tarn
