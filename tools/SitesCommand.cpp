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
    JsonWriter json(io.out);
    if (format == Format::Json) {
        json.BeginArray();
    } else if (format == Format::Csv) {
        io.out << "site,t\n";
    }
    for (const auto& [site, newest] : store.Sites()) {
        if (format == Format::Json) {
            json.BeginObject();
            json.Member("site", ToString(site));
            json.Member("t", newest);
            json.EndObject();
        } else {
            io.out << ToString(site) << (format == Format::Csv ? ',' : ' ') << newest << '\n';
        }
    }
    if (format == Format::Json) {
        json.EndArray();
    }
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
