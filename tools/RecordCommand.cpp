// offsetops record: operations from an ops file, standard input or the
// generator into a store, with a durable point every K of them.

#include <chrono>
#include <iomanip>
#include <sstream>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Interrupt.h"
#include "tools/OpsSource.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

using Clock = std::chrono::steady_clock;

// The largest values the numeric options take.
constexpr uint64 kMaxGenerate = 1'000'000'000'000;
constexpr uint64 kMaxFields = 1'000'000'000;
constexpr uint64 kMaxSites = 1'000'000;
constexpr uint64 kMaxCommitEvery = 1'000'000'000;
constexpr uint64 kMaxJournalMiB = uint64{1} << 20;
constexpr uint64 kMaxSkip = INT64_MAX;
constexpr int64 kDefaultCommitEvery = 10000;

struct RecordSettings {
    std::string store;
    int64 commitEvery = kDefaultCommitEvery;  // a durable point after this many, >= 1
    ssize_t cacheObjects = 0;                 // 0: no bound
    bool progress = false;                    // a progress line on standard error
};

// One run of record: takes the source's operations into the store until the
// source ends, refuses one, a stop signal comes or the store fails, and says
// how it ended: a summary, and for any other end than the source's, what of
// this run is durable and how to go on.
class RecordLoop {
public:
    RecordLoop(OffsetOpsStore& store, OpsSource& source, const RecordSettings& settings, Io& io)
        : m_store(store),
          m_source(source),
          m_settings(settings),
          m_io(io),
          m_progress(settings.progress, io.err, "record") {}

    int Run() {
        OffsetOperation op;
        std::string error;
        try {
            for (;;) {
                if (const int signal = StopSignal()) {
                    return Stopped(signal);
                }
                switch (m_source.Next(op, error)) {
                    case OpsSource::Status::Operation:
                        break;
                    case OpsSource::Status::End:
                        // A signal that came as the input ended still stops.
                        return StopSignal() != 0 ? Stopped(StopSignal()) : Finished();
                    case OpsSource::Status::Stopped:
                        return Stopped(StopSignal());
                    case OpsSource::Status::Error:
                        return Refused(error);
                }
                try {
                    m_store.Record(Opid(op.site, op.t), op.field, op.offset);
                } catch (const RecordRefused& e) {
                    return Refused(e.what());
                }
                m_lines = m_source.LinesRead();
                if (++m_recorded - m_durable >= m_settings.commitEvery) {
                    Sync();
                }
                if (m_progress.Enabled() && (m_recorded & 1023) == 0) {
                    const auto [done, total] = m_source.Share(m_recorded);
                    m_progress.Show(done, total,
                                    Counted(m_recorded, "operation", "operations") + ", " +
                                        std::to_string(m_durable) + " durable");
                }
            }
        } catch (const RuntimeError& e) {
            return StoreFailed(e.what());
        }
    }

private:
    // A durable point: everything recorded so far, and the lines read to it.
    void Sync() {
        m_store.Sync();
        m_durable = m_recorded;
        m_durableLines = m_lines;
        ++m_durablePoints;
    }

    // "the 3 operations of this run before it are durable".
    std::string DurableBefore() const {
        return m_durable == 1 ? "the 1 operation of this run before it is durable"
                              : "the " + std::to_string(m_durable) +
                                    " operations of this run before it are durable";
    }

    // How to go on from after `lines` lines of the source: "; to go on ...:
    // offsetops record --store S --ops F --skip N", or nothing for a
    // source that cannot be resumed.
    std::string GoOn(const std::string& when, int64 lines) const {
        const std::optional<std::string> ops = m_source.OpsArgument();
        if (!ops) {
            return "";
        }
        return "; to go on" + when + ": offsetops record --store " + ShellWord(m_settings.store) +
               " --ops " + ShellWord(*ops) + " --skip " + std::to_string(lines);
    }

    // The operations recorded since the last durable point made durable.
    void SyncPending() {
        if (m_recorded > m_durable) {
            Sync();
        }
    }

    // A durable point, a checkpoint, the summary of the run.
    void CloseWithSummary() {
        SyncPending();
        m_store.Checkpoint();
        const StoreStatistics stats = m_store.Stats();
        m_store.Close();
        m_progress.Finish();
        WriteSummary(stats);
    }

    int Finished() {
        CloseWithSummary();
        return 0;
    }

    // Refused input never reached the tree: everything before it is kept.
    int Refused(const std::string& why) {
        const std::string where = m_source.Position();
        // The refused operation's line, read last, is the one to fix.
        const int64 linesBefore = m_source.LinesRead() - 1;
        SyncPending();
        m_store.Close();
        m_progress.Finish();
        return Fail(m_io.err, where + ": " + why + "; stopped there: " + DurableBefore() +
                                  ", nothing from it on" + GoOn(" after fixing it", linesBefore));
    }

    int Stopped(int signal) {
        CloseWithSummary();
        m_io.out.flush();
        Fail(m_io.err, "stopped by " + SignalName(signal) + " at a durable point: " +
                           (m_durable == 1 ? std::string("the 1 operation of this run is durable")
                                           : "the " + std::to_string(m_durable) +
                                                 " operations of this run are durable") +
                           GoOn("", m_durableLines));
        return StoppedStatus(signal);
    }

    int StoreFailed(const std::string& what) {
        m_progress.Finish();
        const std::string where = m_source.Position();
        const ssize_t bound = m_settings.cacheObjects;
        if (bound > 0) {
            // The store refuses, changing nothing, an operation that would
            // take the tree past the bound: like refused input, everything
            // before it is made durable. Say so in terms of the option.
            try {
                const ssize_t height = m_store.Height();
                if (bound < OffsetOpsStore::MinCacheObjects(height)) {
                    const int64 linesBefore = m_source.LinesRead() - 1;
                    Sync();
                    m_store.Close();
                    return Fail(m_io.err, where + ": " + CacheTooSmall(bound, height) +
                                              ", and the tree has grown to that height; stopped "
                                              "there: " +
                                              DurableBefore() + ", nothing from it on" +
                                              GoOn(" with a larger bound", linesBefore));
                }
            } catch (const RuntimeError&) {
            }
        }
        // Any other error broke the handle: nothing more becomes durable.
        return Fail(m_io.err,
                    where + ": " + what +
                        "; stopped there: the store keeps its last durable point, with the " +
                        Counted(m_durable, "operation", "operations") + " of this run before it; " +
                        Counted(m_recorded - m_durable, "operation", "operations") +
                        " recorded since " + (m_recorded - m_durable == 1 ? "is" : "are") +
                        " lost" + GoOn("", m_durableLines));
    }

    // What the run did, as "label   value" rows (record has no --format).
    void WriteSummary(const StoreStatistics& stats) {
        const double seconds = std::chrono::duration<double>(Clock::now() - m_start).count();
        std::ostringstream rate;
        rate << std::fixed << std::setprecision(0)
             << (seconds > 0 ? static_cast<double>(m_recorded) / seconds : 0.0);
        std::ostringstream elapsed;
        elapsed << std::fixed << std::setprecision(3) << seconds;
        const ssize_t bound = m_settings.cacheObjects;
        tool::Summary summary;
        summary.TextRow("operations", std::to_string(m_recorded))
            .TextRow("fields", std::to_string(stats.fields))
            .TextRow("nodes", NodesText(stats))
            .TextRow("height", std::to_string(stats.height))
            .TextRow("durable points", std::to_string(m_durablePoints))
            .TextRow("checkpoints", std::to_string(stats.checkpoints))
            .TextRow("images written", std::to_string(stats.imagesWritten))
            .TextRow("bytes written", std::to_string(stats.imageBytesWritten))
            .TextRow("peak residents",
                     std::to_string(stats.peakResidents) +
                         (bound > 0 ? " (bound " + std::to_string(bound) + ")" : std::string()))
            .TextRow("seconds", elapsed.str())
            .TextRow("operations/s", rate.str());
        summary.Write(m_io.out, Format::Text);
    }

    OffsetOpsStore& m_store;
    OpsSource& m_source;
    const RecordSettings& m_settings;
    Io& m_io;
    ProgressLine m_progress;
    const Clock::time_point m_start = Clock::now();
    int64 m_recorded = 0;       // operations of this run recorded
    int64 m_durable = 0;        // of those, durable
    int64 m_durablePoints = 0;  // reached by this run
    int64 m_lines = 0;          // of the source, read up to the operation recorded last
    int64 m_durableLines = 0;   // of the source, read up to the last durable point
};

GeneratorSettings GeneratorSettingsOf(const Arguments& args) {
    GeneratorSettings settings;
    settings.count = static_cast<int64>(args.Number("--generate", 0, kMaxGenerate, 0));
    settings.fields = static_cast<int64>(
        args.Number("--fields", 1, kMaxFields, static_cast<uint64>(settings.fields)));
    settings.sites = static_cast<int64>(
        args.Number("--sites", 1, kMaxSites, static_cast<uint64>(settings.sites)));
    settings.seed = args.Number("--seed", 0, UINT64_MAX, settings.seed);
    return settings;
}

int RunRecord(const Arguments& args, Io& io) {
    CatchStopSignals();
    RecordSettings settings;
    settings.store = args.Store();
    const bool generate = args.Has("--generate");
    if (generate == args.Has("--ops")) {
        throw UsageError{generate ? "record takes --ops FILE or --generate N, not both"
                                  : "record needs --ops FILE or --generate N",
                         "record"};
    }
    const std::vector<const char*> elsewhere =
        generate ? std::vector<const char*>{"--skip"}
                 : std::vector<const char*>{"--fields", "--sites", "--seed"};
    for (const char* option : elsewhere) {
        if (args.Has(option)) {
            throw UsageError{std::string(option) + " goes with " +
                             (generate ? "--ops: it skips lines of the file"
                                       : "--generate: it shapes generated operations")};
        }
    }
    std::optional<GeneratorSettings> generated;
    if (generate) {
        generated = GeneratorSettingsOf(args);
    } else if (args.Text("--ops")->empty()) {
        throw UsageError{"--ops needs a file name, or '-' for standard input"};
    }
    const int64 skip = static_cast<int64>(args.Number("--skip", 0, kMaxSkip, 0));
    settings.commitEvery = static_cast<int64>(args.Number(
        "--commit-every", 1, kMaxCommitEvery, static_cast<uint64>(kDefaultCommitEvery)));
    settings.cacheObjects = args.CacheNodes(0);
    StoreOptions options;
    options.mode = StoreMode::Write;
    options.sync = !args.Flag("--no-sync");
    options.cacheObjects = settings.cacheObjects;
    options.journalLimitBytes =
        static_cast<std::size_t>(args.Number("--journal-limit", 0, kMaxJournalMiB,
                                             StoreOptions{}.journalLimitBytes >> 20))
        << 20;
    settings.progress = args.Progress();

    // The source and the cache bound are checked before the store opens, so
    // that a run refused for them creates no store.
    std::unique_ptr<OpsSource> source;
    if (!generate) {
        source = OpenOpsSource(*args.Text("--ops"), skip);
    }
    const ssize_t bound = settings.cacheObjects;
    if (bound > 0 && bound < OffsetOpsStore::MinCacheObjects(0)) {
        Fail(io.err, CacheTooSmall(bound, 0));
        return kUsageStatus;
    }
    OffsetOpsStore store = OpenAndReport(settings.store, options, io.err);
    if (bound > 0) {
        const ssize_t height = std::max<ssize_t>(store.Height(), 0);
        if (bound < OffsetOpsStore::MinCacheObjects(height)) {
            store.Close();
            Fail(io.err, CacheTooSmall(bound, height));
            return kUsageStatus;
        }
    }
    if (generate) {
        // Each site's newest stamp, as the store keeps it: no walk.
        source = GeneratedOps(*generated, store.Sites());
    }
    return RecordLoop(store, *source, settings, io).Run();
}

}  // namespace

CommandDecl RecordCommand() {
    const std::string walkBound = std::to_string(kMaxCacheNodes);
    return {
        "record",
        "--store DIR (--ops FILE [--skip N] | --generate N [--fields F] [--sites S] [--seed X]) "
        "[--commit-every K] [--cache-nodes C] [--journal-limit MIB] [--no-sync] [--no-progress]",
        "record operations from an ops file, standard input or the generator; creates the store "
        "if needed",
        {
            StoreOption(),
            {"--ops", "FILE",
             "operations to record, one a line: site,t,oid,path,offset (site a Guid "
             "8-4-4-4-12, t 0..4294967295, oid decimal, path hex, offset signed decimal; '#' "
             "comments); '-' reads standard input"},
            {"--skip", "N",
             "with --ops: go on after the first N lines of the file (every line counts, as in "
             "the line numbers of messages)"},
            {"--generate", "N",
             "generate N operations instead (0 to " + std::to_string(kMaxGenerate) + ")"},
            {"--fields", "F",
             "generated: over F fields (1 to " + std::to_string(kMaxFields) + ", default " +
                 std::to_string(GeneratorSettings{}.fields) + ")"},
            {"--sites", "S",
             "generated: from S sites (1 to " + std::to_string(kMaxSites) + ", default " +
                 std::to_string(GeneratorSettings{}.sites) + ")"},
            {"--seed", "X",
             "generated: random seed (0 to " + std::to_string(UINT64_MAX) + ", default " +
                 std::to_string(GeneratorSettings{}.seed) + ")"},
            {"--commit-every", "K",
             "a durable point after every K operations (1 to " + std::to_string(kMaxCommitEvery) +
                 ", default " + std::to_string(kDefaultCommitEvery) + ")"},
            {"--cache-nodes", "C",
             "keep at most C tree objects in memory at any time (0: no bound, the "
             "default; at most " +
                 walkBound + ")"},
            {"--journal-limit", "MIB",
             "checkpoint once the journal has grown past MIB mebibytes (0: at every durable "
             "point; at most " +
                 std::to_string(kMaxJournalMiB) + ", default " +
                 std::to_string(StoreOptions{}.journalLimitBytes >> 20) + ")"},
            {"--no-sync", "",
             "do not sync durable points to disk (scratch stores: a machine crash may lose the "
             "latest ones)"},
            NoProgressOption(),
        },
        RunRecord,
    };
}

}  // namespace tarn::tool
