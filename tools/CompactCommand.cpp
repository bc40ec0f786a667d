// offsetops compact: the data file rewritten without its free pages.

#include <cstdio>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

std::string MiBText(int64 bytes) {
    char text[32];
    std::snprintf(text, sizeof text, "%.1f MiB", static_cast<double>(bytes) / (1024.0 * 1024.0));
    return text;
}

int RunCompact(const Arguments& args, Io& io) {
    const std::string store = args.Store();
    OffsetOpsStore opened = OpenAndReport(store, StoreMode::WriteExisting, io.err);
    const CompactResult result = opened.Compact();
    opened.Close();
    if (!result.compacted) {
        return Fail(io.err, "store '" + store +
                                "' was not compacted: another process has it open (a reader); "
                                "try again when it has closed");
    }
    io.out << "compacted '" << store << "': " << MiBText(result.bytesBefore) << " -> "
           << MiBText(result.bytesAfter) << '\n';
    return 0;
}

}  // namespace

CommandDecl CompactCommand() {
    return {
        "compact",
        "--store DIR",
        "rewrite the data file without its free pages (no other process may have the store "
        "open)",
        {StoreOption()},
        RunCompact,
    };
}

}  // namespace tarn::tool
