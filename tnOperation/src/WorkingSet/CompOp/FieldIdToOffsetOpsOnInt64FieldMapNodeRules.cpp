#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"

namespace tarn {

namespace {

constexpr ssize_t kMax = FieldIdToOffsetOpsOnInt64FieldMapMaxEntries;
constexpr ssize_t kMin = FieldIdToOffsetOpsOnInt64FieldMapMinEntries;

}  // namespace

std::string FieldIdToOffsetOpsOnInt64FieldMapNodeRule::CountProblem(ssize_t n) const {
    if (AllowsCount(n)) {
        return {};
    }
    return std::to_string(n) + " entries, not " + std::to_string(minEntries) + ".." +
           std::to_string(maxEntries);
}

FieldIdToOffsetOpsOnInt64FieldMapNodeRule FieldIdToOffsetOpsOnInt64FieldMapRuleAt(ssize_t level,
                                                                                  bool isRoot) {
    const ssize_t least = !isRoot ? kMin : level == 0 ? 0 : 1;
    return {&FieldIdToOffsetOpsOnInt64FieldMapClassAt(level), least, kMax};
}

FieldIdToOffsetOpsOnInt64FieldMapNodeRule FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(
    bool internal) {
    return {nullptr, internal ? 1 : 0, kMax};
}

const ReflectedClass& FieldIdToOffsetOpsOnInt64FieldMapClassAt(ssize_t level) {
    return level == 0 ? GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapLeafNode>()
                      : GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMapInternalNode>();
}

}  // namespace tarn
