// The main job, end to end, against the stores a user would pick instead.
//
// One generated stream of offset operations (see OpStream in JobSupport.h;
// default 1,000,000 operations over 100,000 fields from 4 sites) is recorded
// into a new store on disk, with a durable point every K operations
// (K = 1,000, 10,000, 100,000), synced or not. Every case runs in a child
// process of its own and reports:
//   ops/s          operations / wall-clock seconds from opening the new store
//                  to its close, both included
//   written/op     /proc/self/io write_bytes of the child over that span,
//                  per operation (pages it dirtied, background threads
//                  included)
//   store          the bytes of the files in the store's directory after close
//   peak RSS       ru_maxrss of the child
//
// Subjects:
//   tarn     OffsetOpsStore::Open(dir, {sync}); Record per operation; Sync()
//            every K; Close() at the end.
//   sqlite   one WITHOUT ROWID table keyed by (oid, path, site) with columns
//            t and o; journal_mode=WAL, synchronous=FULL when synced (OFF
//            when not); one prepared UPSERT per operation that keeps the
//            time-stamp rule; one transaction per durable point.
//   rocksdb  a key per (field, site): oid big-endian, path, site (16 bytes);
//            value (t, o) as two 8-byte little-endian integers; a merge
//            operator applies the time-stamp rule and adds offsets; one
//            WriteBatch per durable point, written with WriteOptions::sync
//            = synced.
// A baseline case ("generator") only generates the stream: its time and
// peak RSS are the floor under every subject. After the measurements, each
// child reads its store back and the parent checks that it holds the
// expected number of (field, site) records and sum of sums.

#include <algorithm>
#include <array>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/JobSupport.h"
#include "tnStore/OffsetOpsStore.h"

#ifdef TARN_BENCH_HAVE_SQLITE
#include <sqlite3.h>
#endif
#ifdef TARN_BENCH_HAVE_ROCKSDB
#include <rocksdb/db.h>
#include <rocksdb/merge_operator.h>
#include <rocksdb/options.h>
#include <rocksdb/write_batch.h>
#endif

namespace tarn::bench {
namespace {

struct Config {
    uint64 ops = 1000000;
    uint64 fields = 100000;
    uint32 sites = 4;
    uint64 seed = 1;
    std::vector<std::string> subjects;
    std::vector<uint64> every = {1000, 10000, 100000};
    std::vector<bool> synced = {true, false};
    int repeat = 1;
    std::string dir;
    bool baseline = true;
    int64 sqliteCacheMiB = 256;
    // The bounded subject, "tarn-bounded": a fixed bound, or the unbounded
    // run's node count divided by cacheShare.
    int64 cacheNodes = 0;
    int64 cacheShare = 0;
};

// What a subject does per operation, at a durable point and at the end.
class Subject {
public:
    virtual ~Subject() = default;
    virtual void Record(const RawOp& op) = 0;
    virtual void Durable() = 0;
    virtual void Close() = 0;
    // The subject's own figures, taken before Close (outside the timing).
    virtual std::string Notes() { return ""; }
};

// ---- tarn ----------------------------------------------------------------------

class TarnStoreSubject final : public Subject {
public:
    TarnStoreSubject(const std::string& dir, bool synced, uint32 sites, int64 cacheObjects = 0)
        : m_sites(MakeSites(sites)), m_store(Open(dir, synced, cacheObjects)) {}

    void Record(const RawOp& op) override {
        m_store.Record(Opid(m_sites[op.site], op.t), OpStream::Field(op), op.offset);
    }
    void Durable() override { m_store.Sync(); }
    void Close() override { m_store.Close(); }
    std::string Notes() override {
        const StoreStatistics s = m_store.Stats();
        char buf[256];
        std::snprintf(buf, sizeof buf,
                      "checkpoints %" PRId64 ", images written %" PRId64 " (%" PRId64
                      " bytes), journal %" PRId64 " bytes, nodes %" PRId64 ", peak residents %zd",
                      s.checkpoints, s.imagesWritten, s.imageBytesWritten, s.journalBytes,
                      s.Nodes(), s.peakResidents);
        return buf;
    }

private:
    static OffsetOpsStore Open(const std::string& dir, bool synced, int64 cacheObjects) {
        StoreOptions options;
        options.sync = synced;
        options.cacheObjects = cacheObjects;
        return OffsetOpsStore::Open(dir, options);
    }

    std::vector<Guid> m_sites;
    OffsetOpsStore m_store;
};

// The 16 bytes of a site, in an order that sorts like the Guid.
inline void SiteBytes(const Guid& g, octet_t* out) {
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

// ---- SQLite ------------------------------------------------------------------------

#ifdef TARN_BENCH_HAVE_SQLITE
class SqliteSubject final : public Subject {
public:
    SqliteSubject(const std::string& dir, bool synced, uint32 sites, int64 cacheMiB) {
        std::filesystem::create_directories(dir);
        for (const Guid& g : MakeSites(sites)) {
            std::array<octet_t, 16> bytes{};
            SiteBytes(g, bytes.data());
            m_sites.push_back(bytes);
        }
        Check(sqlite3_open_v2((dir + "/ops.sqlite").c_str(), &m_db,
                              SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
              "open");
        Exec("PRAGMA journal_mode=WAL");
        Exec(synced ? "PRAGMA synchronous=FULL" : "PRAGMA synchronous=OFF");
        Exec(("PRAGMA cache_size=-" + std::to_string(cacheMiB * 1024)).c_str());
        Exec(
            "CREATE TABLE IF NOT EXISTS ops (oid INTEGER NOT NULL, path BLOB NOT NULL, "
            "site BLOB NOT NULL, t INTEGER NOT NULL, o INTEGER NOT NULL, "
            "PRIMARY KEY (oid, path, site)) WITHOUT ROWID");
        Check(sqlite3_prepare_v2(m_db,
                                 "INSERT INTO ops (oid, path, site, t, o) VALUES (?1, ?2, ?3, ?4, "
                                 "?5) ON CONFLICT (oid, path, site) DO UPDATE SET t = excluded.t, "
                                 "o = o + excluded.o WHERE excluded.t >= t",
                                 -1, &m_upsert, nullptr),
              "prepare");
        Check(sqlite3_prepare_v2(m_db, "BEGIN", -1, &m_begin, nullptr), "prepare");
        Check(sqlite3_prepare_v2(m_db, "COMMIT", -1, &m_commit, nullptr), "prepare");
        Step(m_begin);
    }
    ~SqliteSubject() override {
        sqlite3_finalize(m_upsert);
        sqlite3_finalize(m_begin);
        sqlite3_finalize(m_commit);
        sqlite3_close(m_db);
    }

    void Record(const RawOp& op) override {
        sqlite3_bind_int64(m_upsert, 1, static_cast<sqlite3_int64>(op.oid));
        sqlite3_bind_blob(m_upsert, 2, op.path, op.pathLen, SQLITE_STATIC);
        sqlite3_bind_blob(m_upsert, 3, m_sites[op.site].data(), 16, SQLITE_STATIC);
        sqlite3_bind_int64(m_upsert, 4, op.t);
        sqlite3_bind_int64(m_upsert, 5, op.offset);
        Step(m_upsert);
    }
    void Durable() override {
        Step(m_commit);
        Step(m_begin);
    }
    void Close() override {
        Step(m_commit);
        sqlite3_finalize(m_upsert);
        sqlite3_finalize(m_begin);
        sqlite3_finalize(m_commit);
        m_upsert = m_begin = m_commit = nullptr;
        Check(sqlite3_close(m_db), "close");
        m_db = nullptr;
    }

private:
    void Check(int rc, const char* what) {
        if (rc != SQLITE_OK) {
            throw std::runtime_error(std::string("sqlite ") + what + ": " +
                                     (m_db != nullptr ? sqlite3_errmsg(m_db) : sqlite3_errstr(rc)));
        }
    }
    void Exec(const char* sql) { Check(sqlite3_exec(m_db, sql, nullptr, nullptr, nullptr), sql); }
    void Step(sqlite3_stmt* stmt) {
        const int rc = sqlite3_step(stmt);
        if (rc != SQLITE_DONE) {
            throw std::runtime_error(std::string("sqlite step: ") + sqlite3_errmsg(m_db));
        }
        sqlite3_reset(stmt);
    }

    std::vector<std::array<octet_t, 16>> m_sites;
    sqlite3* m_db = nullptr;
    sqlite3_stmt* m_upsert = nullptr;
    sqlite3_stmt* m_begin = nullptr;
    sqlite3_stmt* m_commit = nullptr;
};
#endif

// ---- RocksDB -----------------------------------------------------------------------

#ifdef TARN_BENCH_HAVE_ROCKSDB
// Values and operands are (t, o), two 8-byte little-endian integers. An
// operand whose t is not older than the value's replaces t and adds o; an
// older one leaves the value as it is. Merging two operands the same way
// is exact for streams whose time stamps never decrease per key (ours).
class TimeStampMerge final : public rocksdb::AssociativeMergeOperator {
public:
    static void Encode(int64 t, int64 o, char* out) {
        for (int i = 0; i < 8; ++i) {
            out[i] = static_cast<char>(static_cast<uint64>(t) >> (8 * i));
            out[8 + i] = static_cast<char>(static_cast<uint64>(o) >> (8 * i));
        }
    }
    static int64 Decode(const char* in) {
        uint64 v = 0;
        for (int i = 0; i < 8; ++i) {
            v |= static_cast<uint64>(static_cast<unsigned char>(in[i])) << (8 * i);
        }
        return static_cast<int64>(v);
    }

    bool Merge(const rocksdb::Slice& /*key*/, const rocksdb::Slice* existing,
               const rocksdb::Slice& value, std::string* newValue,
               rocksdb::Logger* /*logger*/) const override {
        if (value.size() != 16 || (existing != nullptr && existing->size() != 16)) {
            return false;
        }
        const int64 t = Decode(value.data());
        const int64 o = Decode(value.data() + 8);
        newValue->resize(16);
        if (existing == nullptr) {
            Encode(t, o, newValue->data());
            return true;
        }
        const int64 oldT = Decode(existing->data());
        const int64 oldO = Decode(existing->data() + 8);
        if (t >= oldT) {
            Encode(t, static_cast<int64>(static_cast<uint64>(oldO) + static_cast<uint64>(o)),
                   newValue->data());
        } else {
            Encode(oldT, oldO, newValue->data());
        }
        return true;
    }
    const char* Name() const override { return "TimeStampMerge"; }
};

class RocksdbSubject final : public Subject {
public:
    RocksdbSubject(const std::string& dir, bool synced, uint32 sites) {
        for (const Guid& g : MakeSites(sites)) {
            std::array<octet_t, 16> bytes{};
            SiteBytes(g, bytes.data());
            m_sites.push_back(bytes);
        }
        rocksdb::Options options;
        options.create_if_missing = true;
        options.merge_operator = std::make_shared<TimeStampMerge>();
        rocksdb::DB* db = nullptr;
        const rocksdb::Status s = rocksdb::DB::Open(options, dir, &db);
        if (!s.ok()) {
            throw std::runtime_error("rocksdb open: " + s.ToString());
        }
        m_db.reset(db);
        m_write.sync = synced;
    }

    void Record(const RawOp& op) override {
        char key[8 + 3 + 16];
        for (int i = 0; i < 8; ++i) {
            key[i] = static_cast<char>(op.oid >> (56 - 8 * i));
        }
        std::memcpy(key + 8, op.path, op.pathLen);
        std::memcpy(key + 8 + op.pathLen, m_sites[op.site].data(), 16);
        char value[16];
        TimeStampMerge::Encode(op.t, op.offset, value);
        Check(m_batch.Merge(rocksdb::Slice(key, 8 + op.pathLen + 16), rocksdb::Slice(value, 16)));
    }
    void Durable() override {
        Check(m_db->Write(m_write, &m_batch));
        m_batch.Clear();
    }
    void Close() override {
        if (m_batch.Count() > 0) {
            Durable();
        }
        Check(m_db->Close());
        m_db.reset();
    }
    std::string Notes() override {
        std::string value;
        m_db->GetProperty("rocksdb.num-files-at-level0", &value);
        return "L0 files " + value;
    }

private:
    static void Check(const rocksdb::Status& s) {
        if (!s.ok()) {
            throw std::runtime_error("rocksdb: " + s.ToString());
        }
    }

    std::vector<std::array<octet_t, 16>> m_sites;
    std::unique_ptr<rocksdb::DB> m_db;
    rocksdb::WriteOptions m_write;
    rocksdb::WriteBatch m_batch;
};
#endif

// ---- Contents ------------------------------------------------------------------------

// What a store holds after the run: the number of (field, site) records and
// the sum of their sums. Read back after the measured span, to check that
// every subject ends with the same result.
struct Contents {
    int64 records = 0;
    int64 sum = 0;
};

Contents ReadTarn(const std::string& dir) {
    StoreOptions options;
    options.mode = StoreMode::Read;
    OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
    Contents c;
    store.ForEach([&c](const FieldId&, const FieldTable& table) {
        for (const SiteRecord& r : table) {
            ++c.records;
            c.sum += r.o;
        }
        return true;
    });
    return c;
}

#ifdef TARN_BENCH_HAVE_SQLITE
Contents ReadSqlite(const std::string& dir) {
    sqlite3* db = nullptr;
    Contents c;
    if (sqlite3_open_v2((dir + "/ops.sqlite").c_str(), &db, SQLITE_OPEN_READONLY, nullptr) ==
        SQLITE_OK) {
        sqlite3_stmt* stmt = nullptr;
        if (sqlite3_prepare_v2(db, "SELECT count(*), total(o) FROM ops", -1, &stmt, nullptr) ==
                SQLITE_OK &&
            sqlite3_step(stmt) == SQLITE_ROW) {
            c.records = sqlite3_column_int64(stmt, 0);
            c.sum = static_cast<int64>(sqlite3_column_double(stmt, 1));
        }
        sqlite3_finalize(stmt);
    }
    sqlite3_close(db);
    return c;
}
#endif

#ifdef TARN_BENCH_HAVE_ROCKSDB
Contents ReadRocksdb(const std::string& dir) {
    rocksdb::Options options;
    options.merge_operator = std::make_shared<TimeStampMerge>();
    rocksdb::DB* raw = nullptr;
    Contents c;
    if (!rocksdb::DB::OpenForReadOnly(options, dir, &raw).ok()) {
        return c;
    }
    std::unique_ptr<rocksdb::DB> db(raw);
    std::unique_ptr<rocksdb::Iterator> it(db->NewIterator(rocksdb::ReadOptions()));
    for (it->SeekToFirst(); it->Valid(); it->Next()) {
        ++c.records;
        c.sum += TimeStampMerge::Decode(it->value().data() + 8);
    }
    return c;
}
#endif

Contents ReadContents(const std::string& subject, const std::string& dir) {
    if (subject == "tarn" || subject == "tarn-bounded") {
        return ReadTarn(dir);
    }
#ifdef TARN_BENCH_HAVE_SQLITE
    if (subject == "sqlite") {
        return ReadSqlite(dir);
    }
#endif
#ifdef TARN_BENCH_HAVE_ROCKSDB
    if (subject == "rocksdb") {
        return ReadRocksdb(dir);
    }
#endif
    return Contents{};
}

// What every store must hold after the stream.
Contents Expected(const Config& config) {
    OpStream stream(config.fields, config.sites, config.seed);
    std::vector<bool> seen(config.fields * config.sites);
    Contents c;
    for (uint64 i = 0; i < config.ops; ++i) {
        const RawOp op = stream.Next();
        const uint64 field = (op.oid - 1) * OpStream::kFieldsPerObject + op.path[0] - 1;
        const uint64 slot = field * config.sites + op.site;
        if (!seen[slot]) {
            seen[slot] = true;
            ++c.records;
        }
        c.sum += op.offset;
    }
    return c;
}

// ---- Cases ---------------------------------------------------------------------------

struct CaseResult {
    double seconds;
    double closeSeconds;  // of which Close
    double cpuSeconds;    // user + system, all threads, over the same span
    int64 writeBytes;
    int64 storeBytes;
    int64 peakRssKiB;
    Contents contents;  // read back after the measurements
    char notes[200];
};

struct Case {
    std::string subject;
    uint64 every = 0;
    bool synced = false;
    int64 cacheObjects = 0;  // tarn-bounded
};

std::unique_ptr<Subject> MakeSubject(const Config& config, const Case& c, const std::string& dir) {
    if (c.subject == "tarn") {
        return std::make_unique<TarnStoreSubject>(dir, c.synced, config.sites);
    }
    if (c.subject == "tarn-bounded") {
        return std::make_unique<TarnStoreSubject>(dir, c.synced, config.sites, c.cacheObjects);
    }
#ifdef TARN_BENCH_HAVE_SQLITE
    if (c.subject == "sqlite") {
        return std::make_unique<SqliteSubject>(dir, c.synced, config.sites, config.sqliteCacheMiB);
    }
#endif
#ifdef TARN_BENCH_HAVE_ROCKSDB
    if (c.subject == "rocksdb") {
        return std::make_unique<RocksdbSubject>(dir, c.synced, config.sites);
    }
#endif
    throw std::runtime_error("unknown or unavailable subject " + c.subject);
}

// Runs in the child.
CaseResult RunCase(const Config& config, const Case& c, const std::string& dir) {
    CaseResult r{};
    OpStream stream(config.fields, config.sites, config.seed);
    if (c.subject == "generator") {
        const double start = Now();
        int64 sum = 0;
        for (uint64 i = 0; i < config.ops; ++i) {
            const RawOp op = stream.Next();
            const FieldId f = OpStream::Field(op);
            sum += op.offset + static_cast<int64>(f.path.size());
        }
        r.seconds = Now() - start;
        r.cpuSeconds = r.seconds;
        std::snprintf(r.notes, sizeof r.notes, "checksum %" PRId64, sum);
        r.peakRssKiB = PeakRssKiB();
        return r;
    }
    RemoveDir(dir);
    const int64 writtenBefore = WriteBytes();
    const double cpuBefore = CpuSeconds();
    const double start = Now();
    std::unique_ptr<Subject> subject = MakeSubject(config, c, dir);
    for (uint64 i = 1; i <= config.ops; ++i) {
        subject->Record(stream.Next());
        if (i % c.every == 0) {
            subject->Durable();
        }
    }
    const double beforeNotes = Now();
    const double cpuBeforeNotes = CpuSeconds();
    const std::string notes = subject->Notes();
    const double cpuAfterNotes = CpuSeconds();
    const double afterNotes = Now();
    subject->Close();
    const double end = Now();
    r.cpuSeconds = CpuSeconds() - cpuBefore - (cpuAfterNotes - cpuBeforeNotes);
    r.seconds = (end - start) - (afterNotes - beforeNotes);
    r.closeSeconds = end - afterNotes;
    r.writeBytes = WriteBytes() - writtenBefore;
    subject.reset();
    r.storeBytes = DirBytes(dir);
    r.peakRssKiB = PeakRssKiB();
    r.contents = ReadContents(c.subject, dir);
    std::snprintf(r.notes, sizeof r.notes, "%s", notes.c_str());
    return r;
}

struct Row {
    Case c;
    std::vector<CaseResult> runs;
    std::string error;

    // The run with the median rate.
    const CaseResult& Median() const {
        std::vector<const CaseResult*> sorted;
        for (const CaseResult& r : runs) {
            sorted.push_back(&r);
        }
        std::sort(sorted.begin(), sorted.end(),
                  [](const CaseResult* a, const CaseResult* b) { return a->seconds < b->seconds; });
        return *sorted[sorted.size() / 2];
    }
};

const char* kUsage =
    "usage: MainJob [--ops N] [--fields F] [--sites S] [--seed X]\n"
    "               [--subjects tarn,sqlite,rocksdb] [--every 1000,10000,100000]\n"
    "               [--sync on,off] [--repeat R] [--dir DIR] [--no-baseline]\n"
    "               [--sqlite-cache-mib M] [--cache-nodes C | --cache-share K]\n"
    "--cache-nodes C adds tarn-bounded, the store bounded to C tree objects;\n"
    "--cache-share K bounds it to the unbounded run's nodes / K (tarn must run).\n"
    "Counts take k/M suffixes (1M, 10k).\n";

#ifdef TARN_BENCH_HAVE_SQLITE
constexpr bool kHaveSqlite = true;
#else
constexpr bool kHaveSqlite = false;
#endif
#ifdef TARN_BENCH_HAVE_ROCKSDB
constexpr bool kHaveRocksdb = true;
#else
constexpr bool kHaveRocksdb = false;
#endif

// The subjects of --subjects; exits for one this build cannot run.
std::vector<std::string> SubjectsOf(const char* list) {
    std::vector<std::string> subjects = SplitList(list);
    for (const std::string& s : subjects) {
        if (s != "tarn" && !(s == "sqlite" && kHaveSqlite) && !(s == "rocksdb" && kHaveRocksdb)) {
            std::fprintf(stderr, "MainJob: unknown or unavailable subject %s\n", s.c_str());
            std::exit(2);
        }
    }
    return subjects;
}

std::vector<uint64> EveryOf(const char* list) {
    std::vector<uint64> every;
    for (const std::string& s : SplitList(list)) {
        const std::optional<uint64> v = ParseCount(s);
        if (!v || *v == 0) {
            Usage(kUsage);
        }
        every.push_back(*v);
    }
    return every;
}

std::vector<bool> SyncedOf(const char* list) {
    std::vector<bool> synced;
    for (const std::string& s : SplitList(list)) {
        if (s != "on" && s != "off") {
            Usage(kUsage);
        }
        synced.push_back(s == "on");
    }
    return synced;
}

// The option at argv[i] (and its value, stepping i onto it); false for one
// that is not an option of MainJob.
bool ParseOption(Config& config, int argc, char** argv, int& i) {
    auto count = [&] { return NextCountArgument(argc, argv, i, kUsage); };
    const std::string arg = argv[i];
    const bool valued = i + 1 < argc;
    if (arg == "--ops") {
        config.ops = count();
    } else if (arg == "--fields") {
        config.fields = count();
    } else if (arg == "--sites") {
        config.sites = static_cast<uint32>(std::min<uint64>(count(), 1000));
    } else if (arg == "--seed") {
        config.seed = count();
    } else if (arg == "--repeat") {
        config.repeat = static_cast<int>(std::min<uint64>(count(), 99));
    } else if (arg == "--cache-nodes") {
        config.cacheNodes = static_cast<int64>(count());
    } else if (arg == "--cache-share") {
        config.cacheShare = static_cast<int64>(count());
    } else if (arg == "--sqlite-cache-mib") {
        config.sqliteCacheMiB = static_cast<int64>(count());
    } else if (arg == "--subjects" && valued) {
        config.subjects = SubjectsOf(argv[++i]);
    } else if (arg == "--every" && valued) {
        config.every = EveryOf(argv[++i]);
    } else if (arg == "--sync" && valued) {
        config.synced = SyncedOf(argv[++i]);
    } else if (arg == "--dir" && valued) {
        config.dir = argv[++i];
    } else if (arg == "--no-baseline") {
        config.baseline = false;
    } else {
        return false;
    }
    return true;
}

Config ParseArgs(int argc, char** argv) {
    Config config;
    config.subjects.push_back("tarn");
    if (kHaveSqlite) {
        config.subjects.push_back("sqlite");
    }
    if (kHaveRocksdb) {
        config.subjects.push_back("rocksdb");
    }
    for (int i = 1; i < argc; ++i) {
        if (!ParseOption(config, argc, argv, i)) {
            Usage(kUsage);
        }
    }
    if (config.subjects.empty() || config.every.empty() || config.synced.empty()) {
        Usage(kUsage);
    }
    if (config.cacheNodes > 0 || config.cacheShare > 0) {
        const bool haveTarn = std::find(config.subjects.begin(), config.subjects.end(), "tarn") !=
                              config.subjects.end();
        if (config.cacheShare > 0 && !haveTarn) {
            Usage(kUsage);
        }
        config.subjects.push_back("tarn-bounded");
    }
    if (config.dir.empty()) {
        config.dir = DefaultStoreRoot("mainjob-stores");
    }
    return config;
}

const Row* FindRow(const std::vector<Row>& rows, const std::string& subject, uint64 every,
                   bool synced) {
    for (const Row& row : rows) {
        if (row.c.subject == subject && row.c.every == every && row.c.synced == synced &&
            !row.runs.empty()) {
            return &row;
        }
    }
    return nullptr;
}

// The bound of tarn-bounded: fixed, or the nodes of the unbounded run with
// the same durability divided by the share.
int64 BoundFor(const Config& config, const std::vector<Row>& rows, const Case& c) {
    if (config.cacheShare <= 0) {
        return config.cacheNodes;
    }
    const Row* t = FindRow(rows, "tarn", c.every, c.synced);
    const char* nodes = t != nullptr ? std::strstr(t->runs.back().notes, "nodes ") : nullptr;
    if (nodes == nullptr) {
        throw std::runtime_error("--cache-share needs the unbounded tarn run first");
    }
    return std::max<int64>(std::strtoll(nodes + 6, nullptr, 10) / config.cacheShare, 64);
}

double Rate(const Config& config, const Row& row) {
    return static_cast<double>(config.ops) / row.Median().seconds;
}

void PrintHeader(const Config& config, const Contents& expected) {
    const std::string fsKind = FileSystemKind(config.dir);
    std::printf("MainJob: %s operations over %s fields from %u sites, seed %" PRIu64 "\n",
                Thousands(static_cast<double>(config.ops)).c_str(),
                Thousands(static_cast<double>(config.fields)).c_str(), config.sites, config.seed);
    std::printf("stores under %s (%s)%s\n", config.dir.c_str(), fsKind.c_str(),
                fsKind == "tmpfs" ? ": WARNING, memory, not a disk" : "");
    std::printf("machine at start: %s\n", MachineLine().c_str());
    std::printf("repeats %d (the run with the median time is shown)\n\n", config.repeat);
    std::fflush(stdout);
    std::printf("every store must end with %s (field, site) records whose sums add up to %" PRId64
                "\n\n",
                Thousands(static_cast<double>(expected.records)).c_str(), expected.sum);
}

std::vector<Row> MakeRows(const Config& config) {
    std::vector<Row> rows;
    if (config.baseline) {
        rows.push_back(Row{Case{"generator", config.ops, false}, {}, ""});
    }
    for (uint64 every : config.every) {
        for (bool synced : config.synced) {
            for (const std::string& subject : config.subjects) {
                rows.push_back(Row{Case{subject, every, synced}, {}, ""});
            }
        }
    }
    return rows;
}

// The line a finished run prints on standard error.
void PrintProgress(const Config& config, const Row& row, const CaseResult& r) {
    if (row.c.subject == "generator") {
        std::fprintf(stderr, "generator only %10.0f ops/s  rss %s\n",
                     static_cast<double>(config.ops) / r.seconds, MiB(r.peakRssKiB * 1024).c_str());
        return;
    }
    std::fprintf(stderr,
                 "%-9s every %-6" PRIu64
                 " %-8s %10.0f ops/s %8.1f B/op  %s  rss %s  close %.2f s  cpu %.2f s  %s\n",
                 row.c.subject.c_str(), row.c.every, row.c.synced ? "synced" : "unsynced",
                 static_cast<double>(config.ops) / r.seconds,
                 static_cast<double>(r.writeBytes) / static_cast<double>(config.ops),
                 MiB(r.storeBytes).c_str(), MiB(r.peakRssKiB * 1024).c_str(), r.closeSeconds,
                 r.cpuSeconds, r.notes);
}

// One run of a row's case in a child of its own; a failed run or wrong
// contents leave the row's error.
void RunRow(const Config& config, const Contents& expected, std::vector<Row>& rows, Row& row) {
    const std::string dir = config.dir + "/" + row.c.subject;
    if (row.c.subject == "tarn-bounded") {
        row.c.cacheObjects = BoundFor(config, rows, row.c);
    }
    ::sync();  // earlier cases' dirty pages go to disk outside this case
    ChildOutcome<CaseResult> outcome =
        RunInChild<CaseResult>([&config, &row, &dir] { return RunCase(config, row.c, dir); });
    RemoveDir(dir);
    if (!outcome.result) {
        row.error = outcome.error;
        std::fprintf(stderr, "%s every %" PRIu64 " %s: FAILED: %s\n", row.c.subject.c_str(),
                     row.c.every, row.c.synced ? "synced" : "unsynced", outcome.error.c_str());
        return;
    }
    const CaseResult& r = *outcome.result;
    if (row.c.subject != "generator" &&
        (r.contents.records != expected.records || r.contents.sum != expected.sum)) {
        row.error = "wrong contents: " + std::to_string(r.contents.records) + " records, sum " +
                    std::to_string(r.contents.sum) + "; expected " +
                    std::to_string(expected.records) + ", " + std::to_string(expected.sum);
        std::fprintf(stderr, "%s: %s\n", row.c.subject.c_str(), row.error.c_str());
        return;
    }
    row.runs.push_back(r);
    PrintProgress(config, row, r);
}

void PrintTable(const Config& config, const std::vector<Row>& rows) {
    std::printf(
        "| subject | durable every | synced | ops/s | written/op | store after close | "
        "peak RSS | seconds | of which close | CPU seconds |\n");
    std::printf("| --- | ---: | --- | ---: | ---: | ---: | ---: | ---: | ---: | ---: |\n");
    for (const Row& row : rows) {
        if (row.runs.empty()) {
            std::printf("| %s | %s | %s | failed: %s | | | | | | |\n", row.c.subject.c_str(),
                        Thousands(static_cast<double>(row.c.every)).c_str(),
                        row.c.synced ? "yes" : "no", row.error.c_str());
            continue;
        }
        const CaseResult& r = row.Median();
        if (row.c.subject == "generator") {
            std::printf("| generator only | - | - | %s | - | - | %s | %.3f | - | %.3f |\n",
                        Thousands(static_cast<double>(config.ops) / r.seconds).c_str(),
                        MiB(r.peakRssKiB * 1024).c_str(), r.seconds, r.cpuSeconds);
            continue;
        }
        std::printf("| %s | %s | %s | %s | %.0f B | %s | %s | %.2f | %.2f | %.2f |\n",
                    row.c.subject.c_str(), Thousands(static_cast<double>(row.c.every)).c_str(),
                    row.c.synced ? "yes" : "no",
                    Thousands(static_cast<double>(config.ops) / r.seconds).c_str(),
                    static_cast<double>(r.writeBytes) / static_cast<double>(config.ops),
                    MiB(r.storeBytes).c_str(), MiB(r.peakRssKiB * 1024).c_str(), r.seconds,
                    r.closeSeconds, r.cpuSeconds);
    }
}

void PrintRatioRow(const std::string& subject, const std::string& peer, uint64 every, bool synced,
                   const CaseResult& a, const CaseResult& b) {
    auto ratio = [](double x, double y) { return y == 0 ? 0.0 : x / y; };
    std::printf("| %s | %s | %s | %s | %.3gx | %.3gx | %.3gx | %.3gx |\n", subject.c_str(),
                peer.c_str(), Thousands(static_cast<double>(every)).c_str(), synced ? "yes" : "no",
                ratio(b.seconds, a.seconds),
                ratio(static_cast<double>(a.writeBytes), static_cast<double>(b.writeBytes)),
                ratio(static_cast<double>(a.storeBytes), static_cast<double>(b.storeBytes)),
                ratio(static_cast<double>(a.peakRssKiB), static_cast<double>(b.peakRssKiB)));
}

void PrintRatios(const Config& config, const std::vector<Row>& rows) {
    std::printf(
        "\nRatios, tarn / peer (ops/s: higher is better for tarn; written/op, store, "
        "RSS: lower is better for tarn)\n\n");
    std::printf(
        "| subject | peer | durable every | synced | ops/s | written/op | store | peak RSS "
        "|\n");
    std::printf("| --- | --- | ---: | --- | ---: | ---: | ---: | ---: |\n");
    for (const std::string subject : {"tarn", "tarn-bounded"}) {
        for (const std::string peer : {"tarn", "sqlite", "rocksdb"}) {
            if (peer == subject) {
                continue;
            }
            for (uint64 every : config.every) {
                for (bool synced : config.synced) {
                    const Row* t = FindRow(rows, subject, every, synced);
                    const Row* p = FindRow(rows, peer, every, synced);
                    if (t != nullptr && p != nullptr) {
                        PrintRatioRow(subject, peer, every, synced, t->Median(), p->Median());
                    }
                }
            }
        }
    }
    for (const Row& row : rows) {
        if (row.c.subject == "tarn-bounded") {
            std::printf("\ntarn-bounded, durable every %s, %s: bound %" PRId64 " tree objects\n",
                        Thousands(static_cast<double>(row.c.every)).c_str(),
                        row.c.synced ? "synced" : "unsynced", row.c.cacheObjects);
        }
    }
}

void PrintTargets(const Config& config, const std::vector<Row>& rows) {
    const Row* t = FindRow(rows, "tarn", 10000, true);
    const Row* s = FindRow(rows, "sqlite", 10000, true);
    if (t != nullptr && (config.ops != 1000000 || config.fields != 100000 || config.sites != 4)) {
        std::printf(
            "\n(The targets concern the default stream: 1M operations, 100k fields, 4 "
            "sites.)\n");
    } else if (t != nullptr) {
        std::printf("\nTargets (durable every 10,000, synced):\n");
        if (s != nullptr) {
            const double ratio = Rate(config, *t) / Rate(config, *s);
            std::printf("  ops/s at least 4x SQLite's: %.2fx -> %s\n", ratio,
                        ratio >= 4.0 ? "met" : "MISSED");
        }
        const double perOp =
            static_cast<double>(t->Median().writeBytes) / static_cast<double>(config.ops);
        std::printf("  at most 200 bytes written per operation: %.0f -> %s\n", perOp,
                    perOp <= 200.0 ? "met" : "MISSED");
    }
}

int Main(int argc, char** argv) {
    const Config config = ParseArgs(argc, argv);
    std::filesystem::create_directories(config.dir);
    const Contents expected = Expected(config);
    PrintHeader(config, expected);
    std::vector<Row> rows = MakeRows(config);
    for (int rep = 0; rep < config.repeat; ++rep) {
        for (Row& row : rows) {
            RunRow(config, expected, rows, row);
        }
    }
    std::printf("machine at end: %s\n\n", MachineLine().c_str());
    PrintTable(config, rows);
    PrintRatios(config, rows);
    PrintTargets(config, rows);
    return 0;
}

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    return tarn::bench::RunJob("MainJob", tarn::bench::Main, argc, argv);
}
