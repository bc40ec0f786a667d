#include "tnStore/TreeSummary.h"

#include <string>

#include "tnStore/TreeWalk.h"

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

void RebuildTreeSummary(TreeSpace& tree, ssize_t bound, RefusalBounds& bounds) {
    bounds.Clear();
    const TreeShape shape =
        WalkTree(tree.Space(), tree.Record().m_map.m_oid, bound,
                 [&](const FieldIdToOffsetOpsOnInt64FieldMapLeafNode& leaf) {
                     for (ssize_t i = 0; i < leaf.m_numKeyEntrys; ++i) {
                         for (const auto& [site, so] : leaf.GetEntry(i).second.m_map.getmap()) {
                             bounds.NoteStored(site, so);
                         }
                     }
                 });
    CSpace& space = tree.Space();
    const auto set = [&](const ReflectedClass& rc, int64 n) {
        space.SetCounter(CSpace::PopulationCounter(rc.m_name), static_cast<uint64>(n));
    };
    set(GetReflectedClass<OffsetOps>(), 1);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>(), 1);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>(), shape.leaves);
    set(GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>(), shape.internalNodes);
    SetTreeSummary(space, bounds);
}

}  // namespace tarn
