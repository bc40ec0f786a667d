// offsetops backup: a consistent copy of a store, beside its writer.

#include <unistd.h>

#include <filesystem>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Interrupt.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

namespace fs = std::filesystem;

constexpr const char* kPartialSuffix = ".backup-";

int RunBackup(const Arguments& args, Io& io) {
    CatchStopSignals();
    const std::string dir = args.Store();
    const std::string to = args.Required("--to", "the copy's directory");
    const bool compact = args.Flag("--compact");
    RequireStore(dir);
    ProgressLine line(args.Progress(), io.err, "backup");
    BackupOptions options;
    options.compact = compact;
    if (line.Enabled()) {
        // Called from the copying thread; this one waits meanwhile.
        options.progress = [&line](uint64 copied, uint64 total) {
            line.Show(copied, total, BytesText(copied) + " of " + BytesText(total));
        };
    }
    // The copy is made in .NAME.backup-PID beside the target (the store's
    // own naming). Copies of runs that were killed go first; a stop signal
    // removes this run's and ends it at once.
    fs::path target = fs::path(to).lexically_normal();
    if (target.filename().empty() && target.has_parent_path()) {
        target = target.parent_path();
    }
    RemoveStalePartials(target, ".", kPartialSuffix);
    const fs::path partial =
        (target.has_parent_path() ? target.parent_path() : fs::path(".")) /
        ("." + target.filename().string() + kPartialSuffix + std::to_string(::getpid()));
    std::error_code ec;
    const bool targetExisted = fs::exists(target, ec);  // an empty directory
    auto stopped = [&] {
        const int signal = StopSignal();
        io.err << (line.Enabled() ? "\n" : "") << "offsetops: backup stopped by "
               << SignalName(signal) << "; nothing was written to '" << to << "'" << std::endl;
        return StoppedStatus(signal);
    };
    BackupResult result;
    {
        StopWatch watch([&] {
            // The copying thread may add a file as the directory goes: try
            // again until it is gone.
            std::error_code ignored;
            for (int i = 0; i < 100 && fs::exists(partial, ignored); ++i) {
                fs::remove_all(partial, ignored);
            }
            stopped();
        });
        result = OffsetOpsStore::Backup(dir, to, options);
    }
    if (StopSignal() != 0) {
        // Stopped as the copy was renamed into place: this run leaves nothing
        // behind either way.
        fs::remove_all(target, ec);
        if (targetExisted) {
            fs::create_directory(target, ec);
        }
        return stopped();
    }
    line.Finish();
    Summary summary;
    summary.TextLine("backed up '" + dir + "' to '" + to + "'" + (compact ? " (compacted)" : ""))
        .TextRow("durable operations", std::to_string(result.durableOperations))
        .TextRow("in the data file", std::to_string(result.checkpointedOperations))
        .TextRow("data file", BytesText(static_cast<uint64>(result.dataBytes)))
        .TextRow("journal", BytesText(static_cast<uint64>(result.journalBytes)));
    summary.Write(io.out, Format::Text);
    return 0;
}

}  // namespace

CommandDecl BackupCommand() {
    return {
        "backup",
        "--store DIR --to COPY [--compact] [--no-progress]",
        "copy a store, consistent as of its latest durable point, beside a running record",
        {
            StoreOption("the store to copy"),
            {"--to", "COPY", "the copy's directory: must not exist, or be empty"},
            {"--compact", "", "leave out free pages: the copy is as small as its contents"},
            NoProgressOption(),
        },
        RunBackup,
    };
}

}  // namespace tarn::tool
