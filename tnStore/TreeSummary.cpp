#include "tnStore/TreeSummary.h"

#include <string>

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapWalk.h"

namespace tarn {

namespace {

constexpr const char* kVersion = "summary:version";
constexpr const char* kLargestSum = "summary:largest-sum";
constexpr const char* kSitePrefix = "summary:site:";

}  // namespace

bool LoadTreeSummary(const CSpace& space, RefusalBounds& bounds) {
    if (!space.GetCounter(kVersion).has_value()) {
        return false;
    }
    bounds.Clear();
    bounds.SetSumBound(space.GetCounter(kLargestSum).value_or(0));
    const std::string_view prefix(kSitePrefix);
    for (const auto& [name, value] : space.CountersWithPrefix(prefix)) {
        std::optional<Guid> site = ParseGuid(std::string_view(name).substr(prefix.size()));
        if (!site) {
            throw RuntimeError("the store's summary names an unreadable site '" + name + "'");
        }
        if (value > 0) {
            bounds.NoteStamp(*site, static_cast<int64>(value - 1));
        }
    }
    return true;
}

void SetTreeSummary(CSpace& space, const RefusalBounds& bounds) {
    space.SetCounter(kVersion, 1);
    space.SetCounter(kLargestSum, bounds.SumBound());
    for (const auto& [name, value] : space.CountersWithPrefix(kSitePrefix)) {
        if (value > 0) {
            space.SetCounter(name, 0);  // set again below unless Clear removed the site
        }
    }
    for (const auto& [site, t] : bounds.Newest()) {
        space.SetCounter(kSitePrefix + ToString(site), static_cast<uint64>(t) + 1);
    }
}

namespace {

// Counts the nodes and notes every table's records in the bounds; a node
// that cannot be loaded as its place needs ends the walk.
class SummaryWalk final : public FieldIdToOffsetOpsOnInt64FieldMapVisitor {
public:
    SummaryWalk(MemoryBound& memory, RefusalBounds& bounds) : m_memory(memory), m_bounds(bounds) {}

    bool Internal(const Place&, const InternalNode&) override {
        ++internalNodes;
        return true;
    }
    void Leaf(const Place&, const LeafNode& leaf) override {
        ++leaves;
        for (ssize_t i = 0; i < leaf.m_numKeyEntrys; ++i) {
            for (const auto& [site, so] : leaf.GetEntry(i).second.m_map.getmap()) {
                m_bounds.NoteStored(site, so);
            }
        }
    }
    void Unloadable(const Place& place, const std::string& error) override {
        throw RuntimeError(
            RuntimeError::Category::Damaged,
            "damaged tree: " + (error.empty() ? "a missing reference to a node at level " +
                                                    std::to_string(place.level)
                                              : error));
    }
    void ReachedTwice(const Place& place) override {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "damaged tree: node " + ToString(place.ref.m_oid) + " is reached twice");
    }
    void BetweenNodes() override { m_memory.KeepUnder(); }

    int64 leaves = 0;
    int64 internalNodes = 0;

private:
    MemoryBound& m_memory;
    RefusalBounds& m_bounds;
};

}  // namespace

void RebuildTreeSummary(TreeSpace& tree, MemoryBound& memory, RefusalBounds& bounds) {
    bounds.Clear();
    SummaryWalk walk(memory, bounds);
    WalkFieldIdToOffsetOpsOnInt64FieldMap(tree.Map(), walk);
    CSpace& space = tree.Space();
    const auto set = [&](const ReflectedClass& rc, int64 n) {
        space.SetCounter(CSpace::PopulationCounter(rc.m_name), static_cast<uint64>(n));
    };
    set(GetReflectedClass<OffsetOps>(), 1);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>(), 1);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>(), walk.leaves);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>(), walk.internalNodes);
    SetTreeSummary(space, bounds);
}

}  // namespace tarn
