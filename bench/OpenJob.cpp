// Opening against the store's size: what a reader, a writer and the
// offsetops program pay to open a store of N fields, do one small thing and
// close it, against SQLite doing the same on a database with the same rows.
//
// For each size N (default 10^4, 10^5, 10^6; 10^7 with --max-fields 10M):
//   1. A child builds a store of N fields, each with one operation from each
//      of 4 sites, in key order: StoreOptions::sync off, a durable point
//      every 10,000 operations, then Close(), which checkpoints: the store
//      opens with an empty journal and nothing to replay. Above 10^6 fields
//      the builder keeps to a cache bound (--build-cache-objects), so that
//      10^7 fields build in about 2 GiB instead of 7.
//   2. A child builds the SQLite database with the same rows: one
//      WITHOUT ROWID table (oid, path, site, t, o) keyed by (oid, path, site),
//      journal_mode=WAL, synchronous=OFF (as MainJob's unsynced case), one
//      transaction per 10,000 rows.
//   3. Every case below runs in a child of its own, R times, interleaved; the
//      median wall time and the median peak RSS (ru_maxrss) are reported:
//        find      reader: Open(StoreMode::Read), Find of the middle field,
//                  Close
//        stats     reader: Open(StoreMode::Read), Stats(), Close
//        record    writer: Open (synced), Record of one operation on the
//                  middle field, Close (a durable point and a checkpoint)
//        sqlite    sqlite3_open_v2 read-only, SELECT of the middle field's
//                  rows, close
//        show      the offsetops program: show --store DIR --field F
//        stats     the offsetops program: stats --store DIR
//      plus a child that does nothing, for the floor under every peak RSS.
// Every case checks what it got (4 sites in the middle field's table, N
// fields in the statistics, exit status 0 of the program) and fails its row
// otherwise. The stores are removed once their size is done (unless --keep).
//
// The page cache holds the files when the cases run (they were just written
// and are read again at every repetition): these are warm opens, as for a
// program started again on a store it used a moment ago.

#include <fcntl.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/statvfs.h>
#include <sys/wait.h>

#include <algorithm>
#include <array>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/JobSupport.h"
#include "tnStore/OffsetOpsStore.h"

#ifdef TARN_BENCH_HAVE_SQLITE
#include <sqlite3.h>
#endif

extern char** environ;

namespace tarn::bench {
namespace {

constexpr uint32 kSites = 4;
constexpr uint64 kEvery = 10000;

struct Config {
    std::vector<uint64> sizes = {10000, 100000, 1000000, 10000000};
    uint64 maxFields = 1000000;
    int repeat = 5;
    std::string dir;
    std::string tool;  // the offsetops program; "" leaves its rows out
    // The builder's StoreOptions::cacheObjects (0: no bound; -1: none up to
    // 10^6 fields, kLargeBuildCacheObjects above).
    ssize_t buildCacheObjects = -1;
    bool keep = false;  // leave the stores in place, for a profiler
};

// ---- The fields ----------------------------------------------------------------

// Field i of a store: as in OpStream, objects of five fields, object j with
// oid 1 + j, its field k with a path of 1 + k%3 bytes, each k+1.
struct FieldKey {
    uint64 oid;
    uint8 pathLen;
    octet_t path[3];
};

FieldKey KeyOf(uint64 i) {
    FieldKey key{};
    key.oid = 1 + i / OpStream::kFieldsPerObject;
    const uint64 k = i % OpStream::kFieldsPerObject;
    key.pathLen = static_cast<uint8>(1 + k % 3);
    for (int b = 0; b < key.pathLen; ++b) {
        key.path[b] = static_cast<octet_t>(k + 1);
    }
    return key;
}

FieldId FieldOf(const FieldKey& key) {
    return FieldId(OID(Seid(key.oid)), Path(key.path, key.pathLen));
}

// The field as the offsetops program takes it: #OID/PATH in hex.
std::string FieldText(const FieldKey& key) {
    std::string text = "#" + std::to_string(key.oid) + "/";
    for (int b = 0; b < key.pathLen; ++b) {
        char buf[4];
        std::snprintf(buf, sizeof buf, "%02x", static_cast<unsigned>(key.path[b]));
        text += buf;
    }
    return text;
}

uint64 Middle(uint64 n) {
    return n / 2;
}

int64 OffsetOf(uint64 i, uint32 site) {
    return static_cast<int64>((i * 7 + site * 3) % 17) - 8;
}

// ---- Building ----------------------------------------------------------------------

struct BuildResult {
    double seconds;
    int64 bytes;
    int64 peakRssKiB;
};

// A store of 10^6 fields takes some 750 MiB to build in memory; above that,
// the builder keeps to this many tree objects (some 2 GiB).
constexpr ssize_t kLargeBuildCacheObjects = 100000;
constexpr uint64 kUnboundedBuildFields = 1000000;

BuildResult BuildTarn(uint64 n, ssize_t cacheObjects, const std::string& dir) {
    if (cacheObjects < 0) {
        cacheObjects = n <= kUnboundedBuildFields ? 0 : kLargeBuildCacheObjects;
    }
    RemoveDir(dir);
    BuildResult r{};
    const double start = Now();
    StoreOptions options;
    options.sync = false;
    options.cacheObjects = cacheObjects;
    OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
    const std::vector<Guid> sites = MakeSites(kSites);
    uint64 ops = 0;
    for (uint64 i = 0; i < n; ++i) {
        const FieldId field = FieldOf(KeyOf(i));
        for (uint32 s = 0; s < kSites; ++s) {
            store.Record(Opid(sites[s], static_cast<int64>(i + 1)), field, OffsetOf(i, s));
            if (++ops % kEvery == 0) {
                store.Sync();
            }
        }
    }
    store.Close();
    r.seconds = Now() - start;
    r.bytes = DirBytes(dir);
    r.peakRssKiB = PeakRssKiB();
    return r;
}

#ifdef TARN_BENCH_HAVE_SQLITE
// The 16 bytes of a site, in an order that sorts like the Guid.
void SiteBytes(const Guid& g, octet_t* out) {
    for (int i = 0; i < 4; ++i) {
        out[i] = static_cast<octet_t>(g.Data1 >> (24 - 8 * i));
    }
    out[4] = static_cast<octet_t>(g.Data2 >> 8);
    out[5] = static_cast<octet_t>(g.Data2);
    out[6] = static_cast<octet_t>(g.Data3 >> 8);
    out[7] = static_cast<octet_t>(g.Data3);
    for (int i = 0; i < 8; ++i) {
        out[8 + i] = static_cast<octet_t>(g.Data4[i]);
    }
}

std::string SqlitePath(const std::string& dir) {
    return dir + "/ops.sqlite";
}

void SqliteCheck(sqlite3* db, int rc, const char* what) {
    if (rc != SQLITE_OK && rc != SQLITE_DONE && rc != SQLITE_ROW) {
        throw std::runtime_error(std::string("sqlite ") + what + ": " +
                                 (db != nullptr ? sqlite3_errmsg(db) : sqlite3_errstr(rc)));
    }
}

void SqliteExec(sqlite3* db, const char* sql) {
    SqliteCheck(db, sqlite3_exec(db, sql, nullptr, nullptr, nullptr), sql);
}

BuildResult BuildSqlite(uint64 n, const std::string& dir) {
    RemoveDir(dir);
    std::filesystem::create_directories(dir);
    BuildResult r{};
    const double start = Now();
    sqlite3* db = nullptr;
    SqliteCheck(db,
                sqlite3_open_v2(SqlitePath(dir).c_str(), &db,
                                SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
                "open");
    SqliteExec(db, "PRAGMA journal_mode=WAL");
    SqliteExec(db, "PRAGMA synchronous=OFF");
    SqliteExec(db,
               "CREATE TABLE ops (oid INTEGER NOT NULL, path BLOB NOT NULL, "
               "site BLOB NOT NULL, t INTEGER NOT NULL, o INTEGER NOT NULL, "
               "PRIMARY KEY (oid, path, site)) WITHOUT ROWID");
    sqlite3_stmt* insert = nullptr;
    SqliteCheck(db,
                sqlite3_prepare_v2(db,
                                   "INSERT INTO ops (oid, path, site, t, o) VALUES (?1, ?2, "
                                   "?3, ?4, ?5)",
                                   -1, &insert, nullptr),
                "prepare");
    std::vector<std::array<octet_t, 16>> sites;
    for (const Guid& g : MakeSites(kSites)) {
        std::array<octet_t, 16> bytes{};
        SiteBytes(g, bytes.data());
        sites.push_back(bytes);
    }
    SqliteExec(db, "BEGIN");
    uint64 rows = 0;
    for (uint64 i = 0; i < n; ++i) {
        const FieldKey key = KeyOf(i);
        for (uint32 s = 0; s < kSites; ++s) {
            sqlite3_bind_int64(insert, 1, static_cast<sqlite3_int64>(key.oid));
            sqlite3_bind_blob(insert, 2, key.path, key.pathLen, SQLITE_STATIC);
            sqlite3_bind_blob(insert, 3, sites[s].data(), 16, SQLITE_STATIC);
            sqlite3_bind_int64(insert, 4, static_cast<sqlite3_int64>(i + 1));
            sqlite3_bind_int64(insert, 5, OffsetOf(i, s));
            SqliteCheck(db, sqlite3_step(insert), "insert");
            sqlite3_reset(insert);
            if (++rows % kEvery == 0) {
                SqliteExec(db, "COMMIT");
                SqliteExec(db, "BEGIN");
            }
        }
    }
    SqliteExec(db, "COMMIT");
    sqlite3_finalize(insert);
    SqliteCheck(db, sqlite3_close(db), "close");
    r.seconds = Now() - start;
    r.bytes = DirBytes(dir);
    r.peakRssKiB = PeakRssKiB();
    return r;
}
#endif

// ---- The cases -------------------------------------------------------------------------

enum class Op { Nothing, Find, Stats, Record, Sqlite, ToolShow, ToolStats };

const char* OpName(Op op) {
    switch (op) {
        case Op::Nothing:
            return "nothing";
        case Op::Find:
            return "find";
        case Op::Stats:
            return "stats";
        case Op::Record:
            return "record";
        case Op::Sqlite:
            return "sqlite";
        case Op::ToolShow:
            return "offsetops show";
        case Op::ToolStats:
            return "offsetops stats";
    }
    return "?";
}

struct CaseResult {
    double seconds;      // the whole case: open, the operation, close
    double openSeconds;  // of which opening (the library's cases)
    int64 peakRssKiB;
};

void Require(bool ok, const std::string& what) {
    if (!ok) {
        throw std::runtime_error(what);
    }
}

// Runs in the child.
CaseResult RunLibraryCase(Op op, uint64 n, int rep, const std::string& tarnDir,
                          const std::string& sqliteDir) {
    CaseResult r{};
    const FieldKey key = KeyOf(Middle(n));
    const double start = Now();
    switch (op) {
        case Op::Nothing:
            break;
        case Op::Find: {
            StoreOptions options;
            options.mode = StoreMode::Read;
            OffsetOpsStore store = OffsetOpsStore::Open(tarnDir, options);
            r.openSeconds = Now() - start;
            const std::optional<FieldTable> table = store.Find(FieldOf(key));
            store.Close();
            Require(table && table->size() == kSites,
                    "the middle field's table is missing or has the wrong sites");
            break;
        }
        case Op::Stats: {
            StoreOptions options;
            options.mode = StoreMode::Read;
            OffsetOpsStore store = OffsetOpsStore::Open(tarnDir, options);
            r.openSeconds = Now() - start;
            const StoreStatistics stats = store.Stats();
            store.Close();
            Require(stats.fields == static_cast<int64>(n),
                    "Stats counted " + std::to_string(stats.fields) + " fields");
            break;
        }
        case Op::Record: {
            StoreOptions options;
            options.mode = StoreMode::WriteExisting;
            OffsetOpsStore store = OffsetOpsStore::Open(tarnDir, options);
            r.openSeconds = Now() - start;
            // Later than every stamp the build gave, and rising with each
            // repetition.
            store.Record(Opid(MakeSite(1), static_cast<int64>(n + 1 + static_cast<uint64>(rep))),
                         FieldOf(key), 1);
            store.Close();
            break;
        }
        case Op::Sqlite: {
#ifdef TARN_BENCH_HAVE_SQLITE
            sqlite3* db = nullptr;
            SqliteCheck(
                db,
                sqlite3_open_v2(SqlitePath(sqliteDir).c_str(), &db, SQLITE_OPEN_READONLY, nullptr),
                "open");
            r.openSeconds = Now() - start;
            sqlite3_stmt* select = nullptr;
            SqliteCheck(
                db,
                sqlite3_prepare_v2(db, "SELECT site, t, o FROM ops WHERE oid = ?1 AND path = ?2",
                                   -1, &select, nullptr),
                "prepare");
            sqlite3_bind_int64(select, 1, static_cast<sqlite3_int64>(key.oid));
            sqlite3_bind_blob(select, 2, key.path, key.pathLen, SQLITE_STATIC);
            uint32 rows = 0;
            int rc = 0;
            while ((rc = sqlite3_step(select)) == SQLITE_ROW) {
                ++rows;
            }
            SqliteCheck(db, rc, "select");
            sqlite3_finalize(select);
            SqliteCheck(db, sqlite3_close(db), "close");
            Require(rows == kSites, "SELECT found " + std::to_string(rows) + " rows");
#else
            (void)sqliteDir;
            throw std::runtime_error("built without SQLite");
#endif
            break;
        }
        case Op::ToolShow:
        case Op::ToolStats:
            throw std::runtime_error("not a library case");
    }
    r.seconds = Now() - start;
    r.peakRssKiB = PeakRssKiB();
    return r;
}

// The offsetops program, its output to /dev/null: wall time from spawning it
// to its end, and its own ru_maxrss (wait4).
CaseResult RunTool(const std::string& tool, const std::vector<std::string>& args) {
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(tool.c_str()));
    for (const std::string& a : args) {
        argv.push_back(const_cast<char*>(a.c_str()));
    }
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    CaseResult r{};
    std::fflush(nullptr);
    const double start = Now();
    pid_t pid = 0;
    const int rc = ::posix_spawn(&pid, tool.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (rc != 0) {
        throw std::runtime_error("cannot start " + tool + ": " + std::strerror(rc));
    }
    int status = 0;
    rusage usage{};
    ::wait4(pid, &status, 0, &usage);
    r.seconds = Now() - start;
    r.peakRssKiB = usage.ru_maxrss;
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        throw std::runtime_error(tool + " " + args[0] + " failed (status " +
                                 std::to_string(status) + ")");
    }
    return r;
}

// ---- Results -----------------------------------------------------------------------------

struct Row {
    Op op;
    uint64 n;
    std::vector<CaseResult> runs;
    std::string error;
};

struct Size {
    uint64 n = 0;
    BuildResult tarn{};
    BuildResult sqlite{};
    bool haveSqlite = false;
    std::string error;
};

double MedianOf(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v.empty() ? 0.0 : v[v.size() / 2];
}

struct Summary {
    bool ok = false;
    double seconds = 0;
    double openSeconds = 0;
    double rssKiB = 0;
};

Summary Summarise(const std::vector<Row>& rows, Op op, uint64 n) {
    Summary s;
    for (const Row& row : rows) {
        if (row.op != op || row.n != n || row.runs.empty() || !row.error.empty()) {
            continue;
        }
        std::vector<double> seconds, open, rss;
        for (const CaseResult& r : row.runs) {
            seconds.push_back(r.seconds);
            open.push_back(r.openSeconds);
            rss.push_back(static_cast<double>(r.peakRssKiB));
        }
        s.ok = true;
        s.seconds = MedianOf(seconds);
        s.openSeconds = MedianOf(open);
        s.rssKiB = MedianOf(rss);
    }
    return s;
}

std::string Millis(double seconds) {
    char buf[32];
    const double ms = seconds * 1000.0;
    std::snprintf(buf, sizeof buf, ms < 10 ? "%.2f ms" : ms < 100 ? "%.1f ms" : "%.0f ms", ms);
    return buf;
}

std::string Seconds(double seconds) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.1f s", seconds);
    return buf;
}

std::string Ratio(double a, double b) {
    if (b <= 0) {
        return "-";
    }
    char buf[32];
    const double x = a / b;
    std::snprintf(buf, sizeof buf, x < 10 ? "%.2fx" : x < 100 ? "%.1fx" : "%.0fx", x);
    return buf;
}

void PrintTable(const std::vector<Row>& rows, const std::vector<Size>& sizes, Op op,
                const char* title, bool withOpen) {
    std::printf("\n### %s\n\n", title);
    const bool peer = op != Op::Sqlite;
    std::printf("| fields | time | %speak RSS | time / 10^4 row | RSS / 10^4 row |%s\n",
                withOpen ? "of which open | " : "", peer ? " time / sqlite | RSS / sqlite |" : "");
    std::printf("| ---: | ---: | %s---: | ---: | ---: |%s\n", withOpen ? "---: | " : "",
                peer ? " ---: | ---: |" : "");
    const Summary first = sizes.empty() ? Summary{} : Summarise(rows, op, sizes.front().n);
    for (const Size& size : sizes) {
        const Summary s = Summarise(rows, op, size.n);
        if (!s.ok) {
            std::string error = size.error;
            for (const Row& row : rows) {
                if (row.op == op && row.n == size.n && !row.error.empty()) {
                    error = row.error;
                }
            }
            std::printf("| %s | failed: %s |\n", Thousands(size.n).c_str(),
                        error.empty() ? "not run" : error.c_str());
            continue;
        }
        std::printf("| %s | %s | ", Thousands(size.n).c_str(), Millis(s.seconds).c_str());
        if (withOpen) {
            std::printf("%s | ", Millis(s.openSeconds).c_str());
        }
        std::printf("%s | %s | %s |", MiB(s.rssKiB * 1024).c_str(),
                    first.ok ? Ratio(s.seconds, first.seconds).c_str() : "-",
                    first.ok ? Ratio(s.rssKiB, first.rssKiB).c_str() : "-");
        if (peer) {
            const Summary q = Summarise(rows, Op::Sqlite, size.n);
            std::printf(" %s | %s |", q.ok ? Ratio(s.seconds, q.seconds).c_str() : "-",
                        q.ok ? Ratio(s.rssKiB, q.rssKiB).c_str() : "-");
        }
        std::printf("\n");
    }
}

// ---- Arguments -----------------------------------------------------------------------------

const char* kUsage =
    "usage: OpenJob [--max-fields N] [--sizes 10k,100k,1M,10M] [--repeat R] [--dir DIR]\n"
    "               [--tool PATH | --no-tool] [--build-cache-objects C] [--keep]\n"
    "Sizes above --max-fields (default 1M) are left out; 10M needs --max-fields 10M.\n"
    "Counts take k/M suffixes (1M, 10k).\n";

Config ParseArgs(int argc, char** argv) {
    Config config;
    config.dir = DefaultStoreRoot("openjob-stores");
    {
        std::error_code ec;
        const std::filesystem::path exe = std::filesystem::read_symlink("/proc/self/exe", ec);
        if (!ec) {
            config.tool = (exe.parent_path().parent_path() / "tools" / "offsetops").string();
        }
    }
    auto count = [&](int& i) { return NextCountArgument(argc, argv, i, kUsage); };
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--max-fields") {
            config.maxFields = count(i);
        } else if (arg == "--repeat") {
            config.repeat = static_cast<int>(std::min<uint64>(count(i), 99));
        } else if (arg == "--sizes" && i + 1 < argc) {
            config.sizes.clear();
            for (const std::string& s : SplitList(argv[++i])) {
                const std::optional<uint64> v = ParseCount(s);
                if (!v || *v < 2) {
                    Usage(kUsage);
                }
                config.sizes.push_back(*v);
            }
        } else if (arg == "--dir" && i + 1 < argc) {
            config.dir = argv[++i];
        } else if (arg == "--tool" && i + 1 < argc) {
            config.tool = argv[++i];
        } else if (arg == "--build-cache-objects") {
            config.buildCacheObjects = static_cast<ssize_t>(count(i));
        } else if (arg == "--keep") {
            config.keep = true;
        } else if (arg == "--no-tool") {
            config.tool.clear();
        } else {
            Usage(kUsage);
        }
    }
    std::vector<uint64> kept;
    for (uint64 n : config.sizes) {
        if (n <= config.maxFields) {
            kept.push_back(n);
        }
    }
    config.sizes = kept;
    if (!config.tool.empty() && ::access(config.tool.c_str(), X_OK) != 0) {
        std::fprintf(stderr,
                     "OpenJob: no program %s: its rows are left out (build the target "
                     "offsetops, or pass --tool)\n",
                     config.tool.c_str());
        config.tool.clear();
    }
    return config;
}

uint64 FreeBytes(const std::string& dir) {
    struct statvfs fs {};
    if (::statvfs(dir.c_str(), &fs) != 0) {
        return 0;
    }
    return static_cast<uint64>(fs.f_bavail) * fs.f_frsize;
}

std::string Today() {
    char buf[64];
    const std::time_t now = std::time(nullptr);
    std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M UTC", std::gmtime(&now));
    return buf;
}

// A generous bound on the disk one size needs: both stores, and the free
// pages a writer's checkpoint leaves.
constexpr uint64 kBytesPerFieldBound = 1024;

#ifdef TARN_BENCH_HAVE_SQLITE
constexpr bool kHaveSqlite = true;
#else
constexpr bool kHaveSqlite = false;
#endif

void PrintHeader(const Config& config) {
    const std::string fsKind = FileSystemKind(config.dir);
    std::printf("OpenJob: opening stores of");
    for (uint64 n : config.sizes) {
        std::printf(" %s", Thousands(n).c_str());
    }
    std::printf(" fields (%u sites, one operation per field and site), %s\n", kSites,
                Today().c_str());
    std::printf("stores under %s (%s)%s, %s free\n", config.dir.c_str(), fsKind.c_str(),
                fsKind == "tmpfs" ? ": WARNING, memory, not a disk" : "",
                MiB(static_cast<double>(FreeBytes(config.dir))).c_str());
    std::printf("machine at start: %s\n", MachineLine().c_str());
    std::printf("repeats %d (medians of time and of peak RSS); SQLite %s; offsetops %s\n",
                config.repeat, kHaveSqlite ? "in" : "left out (not built)",
                config.tool.empty() ? "left out" : config.tool.c_str());
    std::fflush(stdout);
}

std::vector<Op> OpsOf(const Config& config) {
    std::vector<Op> ops = {Op::Nothing, Op::Find, Op::Stats, Op::Record};
    if (kHaveSqlite) {
        ops.push_back(Op::Sqlite);
    }
    if (!config.tool.empty()) {
        ops.push_back(Op::ToolShow);
        ops.push_back(Op::ToolStats);
    }
    return ops;
}

// Builds the store and the SQLite database of `n` fields; false (with the
// size's error) when there is no room or the store cannot be built.
bool BuildSize(const Config& config, Size& size, const std::string& tarnDir,
               const std::string& sqliteDir) {
    const uint64 n = size.n;
    const uint64 free = FreeBytes(config.dir);
    if (free < n * kBytesPerFieldBound) {
        size.error = "skipped: " + MiB(static_cast<double>(free)) + " free, " +
                     MiB(static_cast<double>(n * kBytesPerFieldBound)) + " wanted";
        std::fprintf(stderr, "%s fields: %s\n", Thousands(n).c_str(), size.error.c_str());
        return false;
    }
    ChildOutcome<BuildResult> built = RunInChild<BuildResult>(
        [n, &config, &tarnDir] { return BuildTarn(n, config.buildCacheObjects, tarnDir); });
    if (!built.result) {
        size.error = "building: " + built.error;
        std::fprintf(stderr, "%s fields: %s\n", Thousands(n).c_str(), size.error.c_str());
        RemoveDir(tarnDir);
        return false;
    }
    size.tarn = *built.result;
#ifdef TARN_BENCH_HAVE_SQLITE
    ChildOutcome<BuildResult> builtSqlite =
        RunInChild<BuildResult>([n, &sqliteDir] { return BuildSqlite(n, sqliteDir); });
    if (builtSqlite.result) {
        size.sqlite = *builtSqlite.result;
        size.haveSqlite = true;
    } else {
        std::fprintf(stderr, "%s fields: building the SQLite database: %s\n", Thousands(n).c_str(),
                     builtSqlite.error.c_str());
    }
#else
    (void)sqliteDir;
#endif
    ::sync();
    std::fprintf(stderr,
                 "%s fields: built the store in %.1f s (%s, peak RSS %s), the SQLite "
                 "database in %.1f s (%s)\n",
                 Thousands(n).c_str(), size.tarn.seconds,
                 MiB(static_cast<double>(size.tarn.bytes)).c_str(),
                 MiB(static_cast<double>(size.tarn.peakRssKiB) * 1024).c_str(), size.sqlite.seconds,
                 MiB(static_cast<double>(size.sqlite.bytes)).c_str());
    return true;
}

// One run of a row: the program in a process, or a library case in a child.
CaseResult RunOnce(const Config& config, const Row& row, uint64 n, int rep,
                   const std::string& tarnDir, const std::string& sqliteDir) {
    if (row.op == Op::ToolShow) {
        const std::string field = FieldText(KeyOf(Middle(n)));
        return RunTool(config.tool, {"show", "--store", tarnDir, "--field", field});
    }
    if (row.op == Op::ToolStats) {
        return RunTool(config.tool, {"stats", "--store", tarnDir});
    }
    const Op op = row.op;
    ChildOutcome<CaseResult> outcome = RunInChild<CaseResult>([op, n, rep, &tarnDir, &sqliteDir] {
        return RunLibraryCase(op, n, rep, tarnDir, sqliteDir);
    });
    if (!outcome.result) {
        throw std::runtime_error(outcome.error);
    }
    return *outcome.result;
}

// The rows of one size, each run `repeat` times.
void RunSize(const Config& config, const Size& size, const std::vector<Op>& ops,
             std::vector<Row>& rows, const std::string& tarnDir, const std::string& sqliteDir) {
    const uint64 n = size.n;
    const std::size_t firstRow = rows.size();
    for (Op op : ops) {
        if (op != Op::Sqlite || size.haveSqlite) {
            rows.push_back(Row{op, n, {}, ""});
        }
    }
    for (int rep = 0; rep < config.repeat; ++rep) {
        for (std::size_t i = firstRow; i < rows.size(); ++i) {
            Row& row = rows[i];
            if (!row.error.empty()) {
                continue;
            }
            try {
                row.runs.push_back(RunOnce(config, row, n, rep, tarnDir, sqliteDir));
                const CaseResult& r = row.runs.back();
                std::fprintf(stderr, "%s fields, %-16s %10s  rss %s\n", Thousands(n).c_str(),
                             OpName(row.op), Millis(r.seconds).c_str(),
                             MiB(static_cast<double>(r.peakRssKiB) * 1024).c_str());
            } catch (const std::exception& e) {
                row.error = e.what();
                std::fprintf(stderr, "%s fields, %s: FAILED: %s\n", Thousands(n).c_str(),
                             OpName(row.op), row.error.c_str());
            }
        }
    }
}

void PrintStores(const std::vector<Size>& sizes) {
    std::printf("\n### The stores\n\n");
    std::printf(
        "| fields | store | built in | build peak RSS | SQLite database | built in | "
        "store / database |\n");
    std::printf("| ---: | ---: | ---: | ---: | ---: | ---: | ---: |\n");
    for (const Size& size : sizes) {
        if (size.tarn.bytes == 0) {
            std::printf("| %s | %s |\n", Thousands(size.n).c_str(), size.error.c_str());
            continue;
        }
        std::printf("| %s | %s | %s | %s | %s | %s | %s |\n", Thousands(size.n).c_str(),
                    MiB(static_cast<double>(size.tarn.bytes)).c_str(),
                    Seconds(size.tarn.seconds).c_str(),
                    MiB(static_cast<double>(size.tarn.peakRssKiB) * 1024).c_str(),
                    size.haveSqlite ? MiB(static_cast<double>(size.sqlite.bytes)).c_str() : "-",
                    size.haveSqlite ? Seconds(size.sqlite.seconds).c_str() : "-",
                    size.haveSqlite ? Ratio(static_cast<double>(size.tarn.bytes),
                                            static_cast<double>(size.sqlite.bytes))
                                          .c_str()
                                    : "-");
    }
}

void PrintResults(const Config& config, const std::vector<Row>& rows,
                  const std::vector<Size>& sizes) {
    PrintStores(sizes);
    PrintTable(rows, sizes, Op::Find, "Reader: open, Find one field, close", true);
    PrintTable(rows, sizes, Op::Stats, "Reader: open, Stats(), close", true);
    PrintTable(rows, sizes, Op::Record, "Writer: open, Record one operation, close", true);
    if (kHaveSqlite) {
        PrintTable(rows, sizes, Op::Sqlite, "SQLite: open, SELECT one field's rows, close", true);
    }
    if (!config.tool.empty()) {
        PrintTable(rows, sizes, Op::ToolShow, "offsetops show --store DIR --field F", false);
        PrintTable(rows, sizes, Op::ToolStats, "offsetops stats --store DIR", false);
    }
    std::printf("\nThe floor: a child that does nothing peaks at");
    for (const Size& size : sizes) {
        const Summary s = Summarise(rows, Op::Nothing, size.n);
        if (s.ok) {
            std::printf(" %s (%s fields)", MiB(s.rssKiB * 1024).c_str(), Thousands(size.n).c_str());
        }
    }
    std::printf(".\n");
}

int Main(int argc, char** argv) {
    const Config config = ParseArgs(argc, argv);
    std::filesystem::create_directories(config.dir);
    PrintHeader(config);
    const std::vector<Op> ops = OpsOf(config);
    std::vector<Size> sizes;
    std::vector<Row> rows;
    for (uint64 n : config.sizes) {
        Size size;
        size.n = n;
        const std::string tarnDir = config.dir + "/tarn-" + std::to_string(n);
        const std::string sqliteDir = config.dir + "/sqlite-" + std::to_string(n);
        if (BuildSize(config, size, tarnDir, sqliteDir)) {
            RunSize(config, size, ops, rows, tarnDir, sqliteDir);
            if (config.keep) {
                std::fprintf(stderr, "kept %s and %s\n", tarnDir.c_str(), sqliteDir.c_str());
            } else {
                RemoveDir(tarnDir);
                RemoveDir(sqliteDir);
            }
        }
        sizes.push_back(size);
    }
    std::printf("machine at end: %s\n", MachineLine().c_str());
    PrintResults(config, rows, sizes);
    return 0;
}

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    return tarn::bench::RunJob("OpenJob", tarn::bench::Main, argc, argv);
}
