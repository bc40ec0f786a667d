// Growth: the time per insert of a new field as the map grows, before one
// commit at the end.
//
// A case inserts N new fields (N = 10^5, 10^6; 10^7 with --sizes), one
// operation each from one site, keys ascending or in random order (the keys
// and their order are those of BenchSupport.h: objects of 8 fields, 4-byte
// paths; random is a fixed shuffle). The time of every tenth of the inserts
// is taken separately; the table shows the first tenth, the last tenth and
// their ratio (1.0: no slowdown as the map grows), and the rate over all N.
// Each case runs in a child process of its own (peak RSS is the child's).
// With --repeat R the cases run R times, interleaved, and every figure is
// the best of the R (the least time): on a shared virtual machine other work
// and the host's lazy backing of fresh memory only ever add time.
//
// Subjects:
//   tarn    the API's in-memory store, OffsetOpsStore::OpenInMemory(); one
//           Record per field; one Sync after the last insert and the Close
//           after it are timed apart (columns "sync" and "close").
//   absl    absl::btree_map<FieldId, std::map<Guid, SiteOffset<int64>>>
//           (BenchSupport's AbslBtreePeer) doing the same per-operation work:
//           insert-or-find the field, then the site's record with the
//           time-stamp rule and the addition. Needs abseil.
//   record  (optional) the record object itself, OffsetOps::RecordOffset in
//           its own object space, without the API around it.

#include <malloc.h>

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <limits>
#include <string>
#include <vector>

#include "bench/JobSupport.h"
#include "bench/Subjects.h"
#include "tnStore/OffsetOpsStore.h"

namespace tarn::bench {
namespace {

struct GrowthResult {
    double tenth[10];  // seconds of each tenth of the inserts
    double total;      // seconds of all inserts
    double sync;       // seconds of the final Sync (tarn) or 0
    double close;      // seconds of the Close after it (tarn) or 0
    int64 size;        // fields in the map afterwards
    int64 rssKiB;      // resident set right after the last insert
    int64 peakRssKiB;  // of the whole child, Close included
};

template <typename Insert>
GrowthResult Run(uint64 n, bool random, Insert&& insert) {
    GrowthResult r{};
    const std::vector<uint64> order = MakeOrder(n, random);
    const Opid opid(MakeSite(1), 1);
    const double start = Now();
    double mark = start;
    for (int part = 0; part < 10; ++part) {
        const uint64 begin = n * static_cast<uint64>(part) / 10;
        const uint64 end = n * static_cast<uint64>(part + 1) / 10;
        for (uint64 i = begin; i < end; ++i) {
            insert(opid, MakeField(order[i]));
        }
        const double now = Now();
        r.tenth[part] = now - mark;
        mark = now;
    }
    r.total = mark - start;
    r.rssKiB = CurrentRssKiB();
    return r;
}

// Grows the heap by `bytes`, touches every page and frees it again, with
// trimming and mmap turned off, so that the inserts that follow take memory
// the process already has instead of faulting in fresh pages. On this kind
// of virtual machine a fresh page can cost several microseconds (the host
// backs guest memory lazily and takes freed memory back), which swamps the
// data structure's own cost and varies from run to run.
void WarmHeap(std::size_t bytes) {
    ::mallopt(M_MMAP_MAX, 0);
    ::mallopt(M_TRIM_THRESHOLD, std::numeric_limits<int>::max());
    void* block = std::malloc(bytes);
    // A small block after it keeps the freed block from merging into the top
    // of the heap, which is the only part glibc gives back to the system.
    void* fence = std::malloc(64);
    if (block == nullptr || fence == nullptr) {
        throw std::runtime_error("cannot warm a heap of " + std::to_string(bytes) + " bytes");
    }
    std::memset(block, 1, bytes);
    asm volatile("" : : "r"(block), "r"(fence) : "memory");  // the writes must stay
    std::free(block);
}

GrowthResult RunCase(const std::string& subject, uint64 n, bool random, uint64 warmBytesPerKey) {
    GrowthResult r{};
    if (warmBytesPerKey > 0) {
        WarmHeap(static_cast<std::size_t>(n * warmBytesPerKey));
    }
    if (subject == "tarn") {
        OffsetOpsStore store = OffsetOpsStore::OpenInMemory();
        r = Run(n, random,
                [&store](const Opid& opid, const FieldId& f) { store.Record(opid, f, 1); });
        const double start = Now();
        store.Sync();
        r.sync = Now() - start;
        r.size = store.Size();
        const double closeStart = Now();
        store.Close();
        r.close = Now() - closeStart;
    } else if (subject == "record") {
        TarnSubject record;
        r = Run(n, random,
                [&record](const Opid& opid, const FieldId& f) { record.Record(opid, f, 1); });
        r.size = static_cast<int64>(record.Map().size());
#ifdef TARN_BENCH_HAVE_ABSL
    } else if (subject == "absl") {
        AbslBtreePeer map;
        r = Run(n, random,
                [&map](const Opid& opid, const FieldId& f) { map[f].Insert(opid.s, opid.t, 1); });
        r.size = static_cast<int64>(map.size());
#endif
    } else {
        throw std::runtime_error("unknown or unavailable subject " + subject);
    }
    r.peakRssKiB = PeakRssKiB();
    return r;
}

struct Row {
    std::string subject;
    uint64 n;
    bool random;
    std::vector<GrowthResult> runs;
    std::string error;

    // Best of the repeats, figure by figure: the least time of each tenth,
    // of the total, of sync and close, and the largest peak RSS. Other work
    // on a shared machine only ever adds time.
    GrowthResult Best() const {
        GrowthResult best = runs.front();
        for (const GrowthResult& r : runs) {
            for (int i = 0; i < 10; ++i) {
                best.tenth[i] = std::min(best.tenth[i], r.tenth[i]);
            }
            best.total = std::min(best.total, r.total);
            best.sync = std::min(best.sync, r.sync);
            best.close = std::min(best.close, r.close);
            best.rssKiB = std::max(best.rssKiB, r.rssKiB);
            best.peakRssKiB = std::max(best.peakRssKiB, r.peakRssKiB);
        }
        return best;
    }
    double NsFirst() const { return Best().tenth[0] * 1e9 / static_cast<double>(n / 10); }
    double NsLast() const { return Best().tenth[9] * 1e9 / static_cast<double>(n / 10); }
    double Rate() const { return static_cast<double>(n) / Best().total; }
};

const Row* FindRow(const std::vector<Row>& rows, const std::string& subject, uint64 n,
                   bool random) {
    for (const Row& row : rows) {
        if (row.subject == subject && row.n == n && row.random == random && !row.runs.empty()) {
            return &row;
        }
    }
    return nullptr;
}

const char* kUsage =
    "usage: GrowthJob [--sizes 100k,1M[,10M]] [--order ascending,random]\n"
    "                 [--subjects tarn,absl[,record]] [--repeat R] [--warm-heap B]\n"
    "--warm-heap B: before timing, each child grows its heap by B bytes per key,\n"
    "touches it and frees it (peak RSS then includes it).\n";

struct Config {
    std::vector<uint64> sizes = {100000, 1000000};
    std::vector<bool> orders = {false, true};  // random?
    std::vector<std::string> subjects = {"tarn"};
    int repeat = 1;
    uint64 warmBytesPerKey = 0;
};

// One option and its value; false for one GrowthJob does not take.
bool ParseOption(Config& config, const std::string& arg, const std::string& value) {
    if (arg == "--sizes") {
        config.sizes.clear();
        for (const std::string& s : SplitList(value)) {
            const std::optional<uint64> v = ParseCount(s);
            if (!v || *v < 10) {
                Usage(kUsage);
            }
            config.sizes.push_back(*v);
        }
    } else if (arg == "--order") {
        config.orders.clear();
        for (const std::string& s : SplitList(value)) {
            if (s != "ascending" && s != "random") {
                Usage(kUsage);
            }
            config.orders.push_back(s == "random");
        }
    } else if (arg == "--subjects") {
        config.subjects = SplitList(value);
    } else if (arg == "--warm-heap") {
        const std::optional<uint64> v = ParseCount(value);
        if (!v || *v > 4096) {
            Usage(kUsage);
        }
        config.warmBytesPerKey = *v;
    } else if (arg == "--repeat") {
        const std::optional<uint64> v = ParseCount(value);
        if (!v || *v == 0 || *v > 99) {
            Usage(kUsage);
        }
        config.repeat = static_cast<int>(*v);
    } else {
        return false;
    }
    return true;
}

Config ParseArgs(int argc, char** argv) {
    Config config;
#ifdef TARN_BENCH_HAVE_ABSL
    config.subjects.push_back("absl");
#endif
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (i + 1 >= argc || !ParseOption(config, arg, argv[++i])) {
            Usage(kUsage);
        }
    }
    if (config.sizes.empty() || config.orders.empty() || config.subjects.empty()) {
        Usage(kUsage);
    }
    return config;
}

void PrintHeader(const Config& config) {
    std::printf(
        "GrowthJob: new fields inserted one Record each, one site, no commit until the end\n");
    std::printf("machine at start: %s\n", MachineLine().c_str());
    std::printf("repeats %d (each figure is the best of the repeats)\n", config.repeat);
    if (config.warmBytesPerKey > 0) {
        std::printf("heap warmed with %" PRIu64
                    " bytes per key before timing (peak RSS includes it)\n",
                    config.warmBytesPerKey);
    }
    std::printf("\n");
    std::fflush(stdout);
}

void RunRow(const Config& config, Row& row) {
    const uint64 warm = config.warmBytesPerKey;
    ChildOutcome<GrowthResult> outcome = RunInChild<GrowthResult>(
        [&row, warm] { return RunCase(row.subject, row.n, row.random, warm); });
    if (!outcome.result) {
        row.error = outcome.error;
        std::fprintf(stderr, "%s %" PRIu64 " %s: FAILED: %s\n", row.subject.c_str(), row.n,
                     row.random ? "random" : "ascending", outcome.error.c_str());
        return;
    }
    const GrowthResult& r = *outcome.result;
    if (r.size != static_cast<int64>(row.n)) {
        row.error = "wrong size " + std::to_string(r.size);
        std::fprintf(stderr, "%s: %s\n", row.subject.c_str(), row.error.c_str());
        return;
    }
    row.runs.push_back(r);
    std::fprintf(stderr, "%-7s %9" PRIu64 " %-9s first %7.1f ns  last %7.1f ns  %.2fs\n",
                 row.subject.c_str(), row.n, row.random ? "random" : "ascending",
                 r.tenth[0] * 1e9 / static_cast<double>(row.n / 10),
                 r.tenth[9] * 1e9 / static_cast<double>(row.n / 10), r.total);
}

void PrintTable(const std::vector<Row>& rows) {
    std::printf(
        "| subject | keys | order | first tenth ns/insert | last tenth ns/insert | "
        "last / first | inserts/s (all) | sync | close | RSS after inserts | peak RSS |\n");
    std::printf("| --- | ---: | --- | ---: | ---: | ---: | ---: | ---: | ---: | ---: | ---: |\n");
    for (const Row& row : rows) {
        if (row.runs.empty()) {
            std::printf("| %s | %" PRIu64 " | %s | failed: %s | | | | | | | |\n",
                        row.subject.c_str(), row.n, row.random ? "random" : "ascending",
                        row.error.c_str());
            continue;
        }
        const GrowthResult r = row.Best();
        std::printf(
            "| %s | %" PRIu64
            " | %s | %.1f | %.1f | %.2f | %.2f M | %.1f ms | %.0f ms | %.0f MiB | %.0f MiB |\n",
            row.subject.c_str(), row.n, row.random ? "random" : "ascending", row.NsFirst(),
            row.NsLast(), row.NsLast() / row.NsFirst(), row.Rate() / 1e6, r.sync * 1e3,
            r.close * 1e3, static_cast<double>(r.rssKiB) / 1024.0,
            static_cast<double>(r.peakRssKiB) / 1024.0);
    }
}

void PrintRatiosAndTargets(const Config& config, const std::vector<Row>& rows) {
    std::printf("\nRatios, tarn / absl (rate: higher is better for tarn)\n\n");
    std::printf("| keys | order | rate (all) | rate, first tenth | rate, last tenth |\n");
    std::printf("| ---: | --- | ---: | ---: | ---: |\n");
    for (uint64 n : config.sizes) {
        for (bool random : config.orders) {
            const Row* t = FindRow(rows, "tarn", n, random);
            const Row* a = FindRow(rows, "absl", n, random);
            if (t != nullptr && a != nullptr) {
                std::printf("| %" PRIu64 " | %s | %.2fx | %.2fx | %.2fx |\n", n,
                            random ? "random" : "ascending", t->Rate() / a->Rate(),
                            a->NsFirst() / t->NsFirst(), a->NsLast() / t->NsLast());
            }
        }
    }
    std::printf("\nTargets:\n");
    if (const Row* t = FindRow(rows, "tarn", 1000000, false)) {
        const double ratio = t->NsLast() / t->NsFirst();
        std::printf("  10^6 ascending, last tenth within 2x the first: %.2fx -> %s\n", ratio,
                    ratio <= 2.0 ? "met" : "MISSED");
    }
    const Row* t = FindRow(rows, "tarn", 1000000, true);
    const Row* a = FindRow(rows, "absl", 1000000, true);
    if (t != nullptr && a != nullptr) {
        const double ratio = t->Rate() / a->Rate();
        std::printf("  10^6 random, at least 1.5x absl::btree_map's rate: %.2fx -> %s\n", ratio,
                    ratio >= 1.5 ? "met" : "MISSED");
    }
}

int Main(int argc, char** argv) {
    const Config config = ParseArgs(argc, argv);
    PrintHeader(config);
    std::vector<Row> rows;
    for (uint64 n : config.sizes) {
        for (bool random : config.orders) {
            for (const std::string& subject : config.subjects) {
                rows.push_back(Row{subject, n, random, {}, ""});
            }
        }
    }
    for (int rep = 0; rep < config.repeat; ++rep) {
        for (Row& row : rows) {
            RunRow(config, row);
        }
    }
    std::printf("machine at end: %s\n\n", MachineLine().c_str());
    PrintTable(rows);
    PrintRatiosAndTargets(config, rows);
    return 0;
}

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    return tarn::bench::RunJob("GrowthJob", tarn::bench::Main, argc, argv);
}
