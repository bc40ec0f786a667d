// Recovery: how fast opening a store replays its journal after a crash.
//
// A child process opens a new store with a journal limit so large that no
// checkpoint runs, records N operations of the main job's stream (default
// 1,000,000 over 100,000 fields from 4 sites) with a durable point every K
// (default 10,000), and is killed with SIGKILL right after its last Sync:
// everything is in the journal, nothing in the tree's images. A second child
// then opens the store (OffsetOpsStore::Open, which replays the journal) and
// reports the time of the open, Stats().replayedOperations, and the time of
// the Close that follows (a checkpoint of everything replayed).
//
// Two conditions per repeat:
//   warm   the journal's pages are still in the page cache (the common case
//          after a process crash);
//   cold   the store's files were synced and dropped from the page cache
//          (posix_fadvise DONTNEED, file by file; nothing else on the
//          machine is evicted) before the open, as after a machine restart.

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "bench/JobSupport.h"
#include "tnStore/OffsetOpsStore.h"

namespace tarn::bench {
namespace {

struct Config {
    uint64 ops = 1000000;
    uint64 fields = 100000;
    uint32 sites = 4;
    uint64 every = 10000;
    uint64 seed = 1;
    int repeat = 1;
    std::string dir;
    std::string only;  // "record": make the killed store and keep it; "reopen": time the open
                       // of the kept store in this process (for profilers)
};

constexpr std::size_t kNoCheckpointLimit = std::size_t{1} << 40;

// Runs in the first child: never returns.
[[noreturn]] void RecordAndDie(const Config& config, const std::string& dir) {
    int status = 0;
    try {
        StoreOptions options;
        options.journalLimitBytes = kNoCheckpointLimit;
        OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
        const std::vector<Guid> sites = MakeSites(config.sites);
        OpStream stream(config.fields, config.sites, config.seed);
        for (uint64 i = 1; i <= config.ops; ++i) {
            const RawOp op = stream.Next();
            store.Record(Opid(sites[op.site], op.t), OpStream::Field(op), op.offset);
            if (i % config.every == 0) {
                store.Sync();
            }
        }
        store.Sync();
        if (store.Stats().checkpoints != 0) {
            std::fprintf(stderr, "RecoveryJob: a checkpoint ran while recording\n");
            status = 3;
        } else {
            // Dies with the store open: its destructor must not run (it
            // would checkpoint).
            std::fflush(nullptr);
            ::kill(::getpid(), SIGKILL);
        }
    } catch (const std::exception& e) {
        std::fprintf(stderr, "RecoveryJob: recording: %s\n", e.what());
        status = 1;
    }
    std::fflush(nullptr);
    ::_exit(status);
}

// Syncs every file of the store and drops its pages from the page cache.
void DropFromCache(const std::string& dir) {
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
        if (!entry.is_regular_file()) {
            continue;
        }
        const int fd = ::open(entry.path().c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) {
            continue;
        }
        ::fdatasync(fd);
        ::posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
        ::close(fd);
    }
}

struct RecoveryResult {
    double openSeconds;
    double openCpuSeconds;
    double closeSeconds;
    int64 replayed;
    int64 fields;
    int64 journalBytes;
    int64 repairs;
    int64 peakRssKiB;
};

RecoveryResult Reopen(const std::string& dir) {
    RecoveryResult r{};
    StoreOptions options;
    options.mode = StoreMode::WriteExisting;
    options.journalLimitBytes = kNoCheckpointLimit;
    const double cpuStart = CpuSeconds();
    const double start = Now();
    OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
    r.openSeconds = Now() - start;
    r.openCpuSeconds = CpuSeconds() - cpuStart;
    const StoreStatistics stats = store.Stats();
    r.replayed = stats.replayedOperations;
    r.fields = stats.fields;
    r.journalBytes = stats.journalBytes;
    r.repairs = static_cast<int64>(store.Repairs().size());
    const double closeStart = Now();
    store.Close();
    r.closeSeconds = Now() - closeStart;
    r.peakRssKiB = PeakRssKiB();
    return r;
}

const char* kUsage =
    "usage: RecoveryJob [--ops N] [--fields F] [--sites S] [--every K] [--seed X]\n"
    "                   [--repeat R] [--dir DIR] [--only record|reopen]\n"
    "--only record leaves the killed store in DIR/store; --only reopen then opens it\n"
    "in this process (no fork), so that a profiler sees only the replay.\n";

// One option and its value.
void ParseOption(Config& config, const std::string& arg, const std::string& value) {
    if (arg == "--dir") {
        config.dir = value;
        return;
    }
    if (arg == "--only") {
        if (value != "record" && value != "reopen") {
            Usage(kUsage);
        }
        config.only = value;
        return;
    }
    const std::optional<uint64> v = ParseCount(value);
    if (!v || *v == 0) {
        Usage(kUsage);
    }
    if (arg == "--ops") {
        config.ops = *v;
    } else if (arg == "--fields") {
        config.fields = *v;
    } else if (arg == "--sites") {
        config.sites = static_cast<uint32>(std::min<uint64>(*v, 1000));
    } else if (arg == "--every") {
        config.every = *v;
    } else if (arg == "--seed") {
        config.seed = *v;
    } else if (arg == "--repeat") {
        config.repeat = static_cast<int>(std::min<uint64>(*v, 99));
    } else {
        Usage(kUsage);
    }
}

Config ParseArgs(int argc, char** argv) {
    Config config;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (i + 1 >= argc) {
            Usage(kUsage);
        }
        ParseOption(config, arg, argv[++i]);
    }
    if (config.dir.empty()) {
        config.dir = DefaultStoreRoot("recoveryjob-stores");
    }
    return config;
}

struct Row {
    const char* name;
    bool cold;
    std::vector<RecoveryResult> runs;
};

// Records in a child that is killed, then reopens the store in another
// child (after dropping it from the page cache for a cold row). Returns the
// status to end with: -1 to go on.
int RunRow(const Config& config, const std::string& dir, Row& row) {
    RemoveDir(dir);
    ::sync();
    std::fflush(nullptr);
    const pid_t pid = ::fork();
    if (pid < 0) {
        std::fprintf(stderr, "RecoveryJob: fork failed\n");
        return 1;
    }
    if (pid == 0) {
        RecordAndDie(config, dir);
    }
    int status = 0;
    ::waitpid(pid, &status, 0);
    if (!WIFSIGNALED(status) || WTERMSIG(status) != SIGKILL) {
        std::fprintf(stderr, "RecoveryJob: the recording child did not die as planned\n");
        return 1;
    }
    if (config.only == "record") {
        std::printf("killed store left in %s\n", dir.c_str());
        return 0;
    }
    if (row.cold) {
        DropFromCache(dir);
    }
    ChildOutcome<RecoveryResult> outcome =
        RunInChild<RecoveryResult>([&dir] { return Reopen(dir); });
    if (!outcome.result) {
        std::fprintf(stderr, "RecoveryJob: reopening: %s\n", outcome.error.c_str());
        return 1;
    }
    const RecoveryResult& r = *outcome.result;
    row.runs.push_back(r);
    std::fprintf(
        stderr, "%s: open %.3f s (cpu %.3f s), replayed %" PRId64 " (%.2f M ops/s), close %.3f s\n",
        row.name, r.openSeconds, r.openCpuSeconds, r.replayed,
        static_cast<double>(r.replayed) / r.openSeconds / 1e6, r.closeSeconds);
    return -1;
}

void PrintTable(const Config& config, std::vector<Row>& rows) {
    std::printf(
        "| page cache | journal | replayed ops | fields | open (median) | open CPU | "
        "replayed ops/s, median | best | close (checkpoint) | peak RSS |\n");
    std::printf("| --- | ---: | ---: | ---: | ---: | ---: | ---: | ---: | ---: | ---: |\n");
    double warmMedian = 0;
    double warmBest = 0;
    for (Row& row : rows) {
        std::sort(row.runs.begin(), row.runs.end(),
                  [](const RecoveryResult& a, const RecoveryResult& b) {
                      return a.openSeconds < b.openSeconds;
                  });
        const RecoveryResult& r = row.runs[row.runs.size() / 2];
        const RecoveryResult& best = row.runs.front();
        const double median = static_cast<double>(r.replayed) / r.openSeconds;
        const double bestRate = static_cast<double>(best.replayed) / best.openSeconds;
        if (!row.cold) {
            warmMedian = median;
            warmBest = bestRate;
        }
        std::printf("| %s | %.1f MiB | %" PRId64 " | %" PRId64
                    " | %.3f s | %.3f s | %.2f M | %.2f M | %.3f s | %.0f MiB |\n",
                    row.name, static_cast<double>(r.journalBytes) / (1024.0 * 1024.0), r.replayed,
                    r.fields, r.openSeconds, r.openCpuSeconds, median / 1e6, bestRate / 1e6,
                    r.closeSeconds, static_cast<double>(r.peakRssKiB) / 1024.0);
        if (static_cast<uint64>(r.replayed) != config.ops) {
            std::printf("WARNING: %" PRId64 " operations replayed, %" PRIu64 " recorded\n",
                        r.replayed, config.ops);
        }
    }
    std::printf(
        "\nTarget: at least 1,000,000 operations/s replayed (warm, median of %d): "
        "%.2f M -> %s (best %.2f M)\n",
        config.repeat, warmMedian / 1e6, warmMedian >= 1e6 ? "met" : "MISSED", warmBest / 1e6);
}

int Main(int argc, char** argv) {
    const Config config = ParseArgs(argc, argv);
    std::filesystem::create_directories(config.dir);
    const std::string dir = config.dir + "/store";
    if (config.only == "reopen") {
        const RecoveryResult r = Reopen(dir);
        std::printf("open %.3f s, replayed %" PRId64 " (%.2f M ops/s), close %.3f s\n",
                    r.openSeconds, r.replayed,
                    static_cast<double>(r.replayed) / r.openSeconds / 1e6, r.closeSeconds);
        return 0;
    }
    std::printf("RecoveryJob: %" PRIu64 " operations over %" PRIu64
                " fields from %u sites, durable every %" PRIu64 ", then SIGKILL\n",
                config.ops, config.fields, config.sites, config.every);
    std::printf("stores under %s (%s)\n", config.dir.c_str(), FileSystemKind(config.dir).c_str());
    std::printf("machine at start: %s\n\n", MachineLine().c_str());
    std::fflush(stdout);
    std::vector<Row> rows = {{"warm", false, {}}, {"cold", true, {}}};
    for (int rep = 0; rep < config.repeat; ++rep) {
        for (Row& row : rows) {
            if (const int status = RunRow(config, dir, row); status >= 0) {
                return status;
            }
        }
    }
    RemoveDir(dir);
    std::printf("machine at end: %s\n\n", MachineLine().c_str());
    PrintTable(config, rows);
    return 0;
}

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    return tarn::bench::RunJob("RecoveryJob", tarn::bench::Main, argc, argv);
}
