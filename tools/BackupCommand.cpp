// offsetops backup: a consistent copy of a store, beside its writer.

#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Progress.h"

namespace tarn::tool {

int RunBackup(const std::string& store, const std::string& to, bool compact, bool progress,
              std::ostream& out, std::ostream& err) {
    ProgressLine line(progress, err, "backup");
    BackupOptions options;
    options.compact = compact;
    if (progress) {
        // Called from the copying thread; this one waits meanwhile.
        options.progress = [&line](uint64 copied, uint64 total) {
            line.Show(copied, total, BytesText(copied) + " of " + BytesText(total));
        };
    }
    const BackupResult result = OffsetOpsStore::Backup(store, to, options);
    line.Finish();
    out << "backed up '" << store << "' to '" << to << "'" << (compact ? " (compacted)" : "")
        << '\n';
    Row(out, "durable operations", std::to_string(result.durableOperations));
    Row(out, "in the data file", std::to_string(result.checkpointedOperations));
    Row(out, "data file", BytesText(static_cast<uint64>(result.dataBytes)));
    Row(out, "journal", BytesText(static_cast<uint64>(result.journalBytes)));
    return 0;
}

}  // namespace tarn::tool
