#include "tools/CommandSupport.h"

#include <algorithm>
#include <filesystem>

#include "tools/Output.h"

namespace tarn::tool {

int Fail(std::ostream& err, const std::string& message) {
    err << "offsetops: " << message << '\n';
    return 1;
}

std::string NodesText(const StoreStatistics& stats) {
    return std::to_string(stats.Nodes()) + " (" + std::to_string(stats.leaves) + " leaves, " +
           std::to_string(stats.internalNodes) + " internal)";
}

void RequireStore(const std::string& dir) {
    std::error_code ec;
    if (!std::filesystem::exists(dir, ec) && !ec) {
        throw RuntimeError(RuntimeError::Category::NotFound,
                           "store '" + dir + "' does not exist; 'offsetops record' creates stores");
    }
}

OffsetOpsStore OpenAndReport(const std::string& dir, const StoreOptions& options,
                             std::ostream& err) {
    if (options.mode != StoreMode::Write) {
        RequireStore(dir);
    }
    OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
    for (const std::string& repair : store.Repairs()) {
        err << "offsetops: store '" << dir << "': repaired: " << repair << '\n';
    }
    return store;
}

OffsetOpsStore OpenAndReport(const std::string& dir, StoreMode mode, std::ostream& err) {
    StoreOptions options;
    options.mode = mode;
    return OpenAndReport(dir, options, err);
}

void RequireTreeCheckPasses(OffsetOpsStore& store) {
    const StoreCheck check = store.Check();
    if (!check.Ok()) {
        throw RuntimeError(
            RuntimeError::Category::Damaged,
            "the stored tree is damaged (" + Counted(check.numProblems, "problem", "problems") +
                "; the first: " + (check.problems.empty() ? "?" : check.problems.front()) +
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

std::string ShellWord(const std::string& text) {
    const bool plain = !text.empty() && std::all_of(text.begin(), text.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
               std::string_view("_./-+,=:@%").find(c) != std::string_view::npos;
    });
    if (plain) {
        return text;
    }
    std::string quoted = "'";
    for (const char c : text) {
        quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return quoted + "'";
}

int OutputFailed(std::ostream& err, int status) {
    if (!StandardOutputClosed()) {
        Fail(err, "cannot write the output (a full disk?)");
    }
    return status;
}

}  // namespace tarn::tool
