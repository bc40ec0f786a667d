// offsetops clear: every field's table removed.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

int RunClear(const Arguments& args, Io& io) {
    OffsetOpsStore store = OpenAndReport(args.Store(), StoreMode::WriteExisting, io.err);
    // Clearing hands the whole tree to deletion, which walks it: refuse a
    // damaged tree first.
    RequireTreeCheckPasses(store);
    const int64 fields = store.Size();
    const int64 imagesBefore = store.Stats().images;
    store.Clear();
    store.Checkpoint();
    const int64 imagesAfter = store.Stats().images;
    store.Close();
    io.out << "cleared " << Counted(fields, "field", "fields") << "; "
           << Counted(imagesBefore - imagesAfter, "image", "images") << " removed\n";
    return 0;
}

}  // namespace

CommandDecl ClearCommand() {
    return {"clear", "--store DIR", "remove every field's table", {StoreOption()}, RunClear};
}

}  // namespace tarn::tool
