#include "tools/CommandSupport.h"

#include <iomanip>

namespace tarn::tool {

int Fail(std::ostream& err, const std::string& message) {
    err << "offsetops: " << message << '\n';
    return 1;
}

void Row(std::ostream& out, const char* label, const std::string& value) {
    out << std::left << std::setw(22) << label << value << '\n';
}

OffsetOpsStore OpenAndReport(const std::string& dir, const StoreOptions& options,
                             std::ostream& err) {
    OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
    for (const std::string& repair : store.Repairs()) {
        err << "offsetops: " << dir << ": repaired: " << repair << '\n';
    }
    return store;
}

OffsetOpsStore OpenAndReport(const std::string& dir, StoreMode mode, std::ostream& err) {
    StoreOptions options;
    options.mode = mode;
    return OpenAndReport(dir, options, err);
}

void RequireSoundTree(OffsetOpsStore& store) {
    const StoreCheck check = store.Check();
    if (!check.Ok()) {
        throw RuntimeError(
            "the stored tree is damaged (" + std::to_string(check.numProblems) +
            " problems; the first: " + (check.problems.empty() ? "?" : check.problems.front()) +
            "); run 'offsetops validate' for all");
    }
}

std::string CacheTooSmall(ssize_t bound, ssize_t height) {
    return "--cache-nodes " + std::to_string(bound) + " is too small: a tree of height " +
           std::to_string(height) + " needs at least " +
           std::to_string(OffsetOpsStore::MinCacheObjects(height)) + " objects in memory";
}

std::optional<OffsetOpsStore> OpenForWalk(const std::string& dir, ssize_t cacheObjects,
                                          std::ostream& err) {
    StoreOptions options;
    options.mode = StoreMode::Read;
    options.cacheObjects = cacheObjects;
    if (cacheObjects > 0 && cacheObjects < OffsetOpsStore::MinCacheObjects(0)) {
        err << "offsetops: " << CacheTooSmall(cacheObjects, 0) << '\n';
        return std::nullopt;
    }
    OffsetOpsStore store = OpenAndReport(dir, options, err);
    const ssize_t height = std::max<ssize_t>(store.Height(), 0);
    if (cacheObjects > 0 && cacheObjects < OffsetOpsStore::MinCacheObjects(height)) {
        err << "offsetops: " << CacheTooSmall(cacheObjects, height) << '\n';
        return std::nullopt;
    }
    // A walk that stops at once loads the path to the first leaf: damage on
    // it is reported before anything is written.
    store.ForEach([](const FieldId&, const FieldTable&) { return false; });
    return store;
}

}  // namespace tarn::tool
