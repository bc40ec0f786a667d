// offsetops sites and merge: what a replica has seen of each site, and
// joining another replica into it.

#include <unistd.h>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

constexpr int kConflicts = 1;
constexpr int kTrouble = 2;

std::string RecordText(const SiteRecord& r) {
    return ToString(r);
}

}  // namespace

int RunSites(const std::string& store, std::ostream& out, std::ostream& err) {
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::Read, err);
    for (const auto& [site, newest] : opened.Sites()) {
        out << ToString(site) << ' ' << newest << '\n';
    }
    if (!out.flush()) {
        return Fail(err, "cannot write the output (a closed pipe or a full disk)");
    }
    return 0;
}

int RunMerge(const MergeCommand& cmd, std::ostream& out, std::ostream& err) {
    try {
        StoreOptions options;
        options.mode = cmd.dryRun ? StoreMode::Read : StoreMode::WriteExisting;
        options.sync = cmd.sync;
        options.cacheObjects = cmd.cacheObjects;
        OffsetOpsStore store = OpenAndReport(cmd.store, options, err);
        MergeOptions merge;
        merge.dryRun = cmd.dryRun;
        merge.cacheObjects = cmd.cacheObjects;
        merge.durableEvery = cmd.commitEvery;
        merge.onConflict = [&](const MergeConflict& c) {
            out << "! " << ToString(c.field) << ' ' << ToString(c.site) << ' ' << RecordText(c.ours)
                << ' ' << RecordText(c.theirs) << '\n';
        };
        const MergeResult result = store.Merge(cmd.from, merge);
        store.Close();
        if (!out.flush()) {
            Fail(err, "cannot write the conflicts (a closed pipe or a full disk)");
            return kTrouble;
        }
        err << "offsetops: " << (cmd.dryRun ? "would merge" : "merged") << " '" << cmd.from
            << "' into '" << cmd.store << "': " << result.fields << " fields read, " << result.taken
            << (result.taken == 1 ? " site record " : " site records ")
            << (cmd.dryRun ? "to take"
                           : "taken in " + std::to_string(result.operations) +
                                 (result.operations == 1 ? " operation" : " operations"))
            << ", " << result.conflicts << (result.conflicts == 1 ? " conflict" : " conflicts")
            << (result.conflicts > 0 ? " left as they were" : "") << '\n';
        return result.conflicts > 0 ? kConflicts : 0;
    } catch (const RuntimeError& e) {
        Fail(err, e.what());
    } catch (const std::bad_alloc&) {
        Fail(err, "out of memory");
    }
    return kTrouble;
}

}  // namespace tarn::tool
