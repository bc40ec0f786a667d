// offsetops dump: the map's tree, node by node.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

int RunDump(const Arguments& args, Io& io) {
    OffsetOpsStore store = OpenAndReport(args.Store(), StoreMode::Read, io.err);
    store.Dump(io.out);
    return io.out.flush() ? 0 : OutputFailed(io.err, kFailed);
}

}  // namespace

CommandDecl DumpCommand() {
    return {"dump", "--store DIR", "print the map's tree, node by node", {StoreOption()}, RunDump};
}

}  // namespace tarn::tool
