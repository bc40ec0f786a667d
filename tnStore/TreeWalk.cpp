#include "tnStore/TreeWalk.h"

#include <string>
#include <vector>

#include "tnUtils/RuntimeError.h"

namespace tarn {

namespace {

using Map = FieldIdToOffsetOpsOnInt64FieldMap;
using LeafNode = Map::LeafNode;
using InternalNode = Map::InternalNode;

uint64 Child(const prefbase& ref, uint64 parent) {
    if (ref.m_oid.IsNull()) {
        throw RuntimeError(RuntimeError::Category::Damaged, "damaged tree: internal node #" +
                                                                std::to_string(parent) +
                                                                " has a missing child reference");
    }
    return ref.m_oid.value_;
}

}  // namespace

void KeepResidentsUnder(CSpace& space, ssize_t bound) {
    if (bound > 0 && space.NumResidents() >= bound) {
        space.EvictCleanResidents(bound / 2);
    }
}

TreeShape WalkTree(CSpace& space, OID mapOid, ssize_t bound, const LeafVisitor& onLeaf) {
    TreeShape shape;
    std::vector<uint64> level;
    {
        const Map* map =
            static_cast<const Map*>(space.Resolve(mapOid, &GetReflectedClass<Map>()).m_self);
        shape.height = map->m_height;
        if (map->m_height < 0 || map->m_root.m_oid.IsNull()) {
            return shape;
        }
        level.push_back(map->m_root.m_oid.value_);
    }
    for (ssize_t h = shape.height; h >= 1; --h) {
        std::vector<uint64> below;
        for (uint64 oid : level) {
            const auto* node = static_cast<const InternalNode*>(
                space.Resolve(OID(Seid(oid)), &GetReflectedClass<InternalNode>()).m_self);
            ++shape.internalNodes;
            below.push_back(Child(node->m_ptr, oid));
            for (ssize_t i = 0; i < node->m_numKeyEntrys; ++i) {
                below.push_back(Child(node->GetEntry(i).m_ptr, oid));
            }
            KeepResidentsUnder(space, bound);
        }
        level.swap(below);
    }
    for (uint64 oid : level) {
        const auto* leaf = static_cast<const LeafNode*>(
            space.Resolve(OID(Seid(oid)), &GetReflectedClass<LeafNode>()).m_self);
        ++shape.leaves;
        shape.entries += leaf->m_numKeyEntrys;
        if (onLeaf) {
            onLeaf(*leaf);
        }
        KeepResidentsUnder(space, bound);
    }
    return shape;
}

}  // namespace tarn
