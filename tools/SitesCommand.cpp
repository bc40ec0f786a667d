// offsetops sites: what a replica has seen of each site.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

// Each site's newest stamp in site order:
//   text  SITE STAMP, a line each
//   json  [{"site":..,"t":..},...]
//   csv   site,t and a row each
int RunSites(const Arguments& args, Io& io) {
    const std::string dir = args.Store();
    const Format format = args.OutputFormat();
    OffsetOpsStore store = OpenAndReport(dir, StoreMode::Read, io.err);
    Listing listing(io.out, format, "site,t");
    for (const auto& [site, newest] : store.Sites()) {
        listing.Item(Json{{"site", ToString(site)}, {"t", newest}});
    }
    listing.End();
    return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
}

}  // namespace

CommandDecl SitesCommand() {
    return {
        "sites",
        "--store DIR [--format FORMAT]",
        "print each site's newest time stamp: what the store has seen of each site",
        {StoreOption(), FormatOption()},
        RunSites,
    };
}

}  // namespace tarn::tool
