// The LMDB store: contents survive reopening, commits are atomic even when
// the writer is killed, damage is reported, foreign or missing directories
// are refused, and readers in other processes keep their snapshot beside the
// one writer.

#include "tnBackends/LmdbStore.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <random>
#include <set>

#include <lmdb.h>
#include <xxhash.h>

#include "tests/AssertDeath.h"
#include "tnBackends/ImageRecord.h"
#include "tnBackends/LmdbFileCheck.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

// A fresh directory, removed with everything in it when the test ends.
class TempDir {
public:
    TempDir() : m_path((fs::temp_directory_path() / "tarn-lmdb-XXXXXX").string()) {
        EXPECT_NE(::mkdtemp(m_path.data()), nullptr);
    }
    ~TempDir() {
        std::error_code ignored;
        fs::remove_all(m_path, ignored);
    }
    std::string Path() const { return m_path; }
    std::string Sub(const std::string& name) const { return m_path + "/" + name; }

private:
    std::string m_path;
};

// Expects `statement` to raise a RuntimeError whose message contains `text`.
#define EXPECT_ERROR_MENTIONS(statement, text)                                      \
    try {                                                                           \
        statement;                                                                  \
        ADD_FAILURE() << "no error";                                                \
    } catch (const RuntimeError& e) {                                               \
        EXPECT_NE(std::string(e.what()).find(text), std::string::npos) << e.what(); \
    }

// A store without fsync at commit, for tests that do not kill anything.
std::unique_ptr<LmdbStore> OpenScratch(const std::string& dir, OpenMode mode,
                                       std::size_t mapSize = LmdbStoreOptions::kDefaultMapSize) {
    return LmdbStore::Open(dir, LmdbStoreOptions{mode, false, mapSize});
}

StoredImage MakeImage(uint64 seed, uint64 oid, std::size_t size) {
    StoredImage image{"tarn::Class" + std::to_string(oid % 4), {}};
    for (std::size_t i = 0; i < size; ++i) {
        image.bytes.push_back(static_cast<octet_t>(seed * 31 + oid * 7 + i));
    }
    return image;
}

// Commit number `k` of a deterministic history: a few images among 300
// identities (now and then one spanning several pages), a few deletions, the
// root "head" naming k, the counter "journal" at 10 k (now and then another
// counter) and the identity counter k + 1.
CommitBatch MakeCommit(uint64 k) {
    std::mt19937_64 rng(k);
    CommitBatch batch;
    for (int i = 1 + static_cast<int>(rng() % 8); i > 0; --i) {
        const uint64 oid = 1 + rng() % 300;
        const std::size_t size = rng() % 10 == 0 ? 20000 + rng() % 20000 : rng() % 3000;
        batch.writes.emplace_back(oid, MakeImage(k, oid, size));
    }
    for (int i = static_cast<int>(rng() % 3); i > 0; --i) {
        batch.deletes.push_back(1 + rng() % 300);
    }
    batch.roots["head"] = k;
    batch.roots["slot" + std::to_string(k % 5)] = 1 + rng() % 300;
    batch.counters["journal"] = 10 * k;
    if (k % 4 == 0) {
        batch.counters["c" + std::to_string(k % 3)] = rng();
    }
    batch.nextIdentity = k + 1;
    return batch;
}

// The store's contents as a plain model, checked against the store in full.
struct Model {
    std::map<uint64, StoredImage> images;
    std::map<std::string, uint64> roots;
    std::map<std::string, uint64> counters;
    uint64 next = 1;

    void Apply(const CommitBatch& batch) {
        for (const auto& [oid, image] : batch.writes) {
            images[oid] = image;
        }
        for (const uint64 oid : batch.deletes) {
            images.erase(oid);
        }
        for (const auto& [name, oid] : batch.roots) {
            roots[name] = oid;
        }
        for (const auto& [name, value] : batch.counters) {
            counters[name] = value;
        }
        next = batch.nextIdentity;
    }

    // The identities are listed in numeric order to a callback that may
    // read the store.
    void ExpectHeldBy(LmdbStore& store) const {
        auto expected = images.begin();
        ssize_t bytes = 0;
        store.ForEachIdentity([&](uint64 oid) {
            ASSERT_TRUE(expected != images.end() && oid == expected->first) << oid;
            const auto& [className, image] = expected->second;
            const std::optional<StoredImage> held = store.Load(oid);
            EXPECT_TRUE(held && held->className == className && held->bytes == image) << oid;
            bytes += static_cast<ssize_t>(ImageRecordSize(expected++->second));
        });
        EXPECT_TRUE(expected == images.end());
        EXPECT_EQ(store.LargestIdentity(),
                  images.empty() ? std::nullopt : std::optional(images.rbegin()->first));
        EXPECT_EQ(store.Roots(), roots);
        std::set<std::string> names{"journal", "c0", "c1", "c2"};
        for (const auto& [name, value] : counters) {
            names.insert(name);
        }
        for (const std::string& name : names) {
            const auto it = counters.find(name);
            EXPECT_EQ(store.FindCounter(name),
                      it == counters.end() ? std::nullopt : std::optional(it->second))
                << name;
        }
        EXPECT_EQ(store.NextIdentity(), next);
        EXPECT_EQ(store.Stats().numImages, static_cast<ssize_t>(images.size()));
        EXPECT_EQ(store.Stats().numImageBytes, bytes);
    }
};

// Runs `edit` in a write transaction on database `db` (nullptr: the main
// one) of a store's environment, to plant what the store itself never writes.
void RawEdit(const std::string& dir, const char* db,
             const std::function<void(MDB_txn*, MDB_dbi)>& edit) {
    MDB_env* env = nullptr;
    MDB_txn* txn = nullptr;
    MDB_dbi dbi = 0;
    ASSERT_EQ(mdb_env_create(&env), 0);
    mdb_env_set_maxdbs(env, 4);
    ASSERT_EQ(mdb_env_open(env, dir.c_str(), MDB_NOSYNC, 0644), 0);
    ASSERT_EQ(mdb_txn_begin(env, nullptr, 0, &txn), 0);
    EXPECT_EQ(mdb_dbi_open(txn, db, MDB_CREATE, &dbi), 0);
    edit(txn, dbi);
    EXPECT_EQ(mdb_txn_commit(txn), 0);
    mdb_env_close(env);
}

MDB_val RawVal(std::span<const octet_t> bytes) {
    return {bytes.size(), const_cast<octet_t*>(bytes.data())};
}

std::span<const octet_t> AsBytes(std::string_view text) {
    return {reinterpret_cast<const octet_t*>(text.data()), text.size()};
}

// Puts one entry straight into a store's environment.
void RawPut(const std::string& dir, const char* db, std::string_view key,
            std::span<const octet_t> value) {
    RawEdit(dir, db, [&](MDB_txn* txn, MDB_dbi dbi) {
        MDB_val k = RawVal(AsBytes(key));
        MDB_val v = RawVal(value);
        EXPECT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
    });
}

// Every entry of database `db` of a store's environment, read without the
// store.
std::map<std::string, std::string> RawEntries(const std::string& dir, const char* db) {
    std::map<std::string, std::string> entries;
    MDB_env* env = nullptr;
    MDB_txn* txn = nullptr;
    MDB_dbi dbi = 0;
    MDB_cursor* cursor = nullptr;
    EXPECT_EQ(mdb_env_create(&env), 0);
    mdb_env_set_maxdbs(env, 4);
    EXPECT_EQ(mdb_env_open(env, dir.c_str(), MDB_RDONLY, 0644), 0);
    EXPECT_EQ(mdb_txn_begin(env, nullptr, MDB_RDONLY, &txn), 0);
    if (mdb_dbi_open(txn, db, 0, &dbi) == 0 && mdb_cursor_open(txn, dbi, &cursor) == 0) {
        MDB_val k;
        MDB_val v;
        while (mdb_cursor_get(cursor, &k, &v, MDB_NEXT) == 0) {
            entries.emplace(std::string(static_cast<const char*>(k.mv_data), k.mv_size),
                            std::string(static_cast<const char*>(v.mv_data), v.mv_size));
        }
        mdb_cursor_close(cursor);
    }
    mdb_txn_abort(txn);
    mdb_env_close(env);
    return entries;
}

// Little-endian bytes, for records laid out by hand.
void PutLeBytes(std::vector<octet_t>& out, uint64 value, int width) {
    for (int i = 0; i < width; ++i) {
        out.push_back(static_cast<octet_t>(value >> (8 * i)));
    }
}

// `body` with its XXH3-64 appended: a meta record as far as its checksum
// goes.
std::string Sealed(std::vector<octet_t> body) {
    PutLeBytes(body, XXH3_64bits(body.data(), body.size()), 8);
    return {body.begin(), body.end()};
}

// The start of a meta record: magic, `version`, identity counter `next`,
// image bytes `imageBytes`.
std::vector<octet_t> StateHead(uint32 version, uint64 next = 1, uint64 imageBytes = 0) {
    std::vector<octet_t> out(AsBytes("TARNSTOR").begin(), AsBytes("TARNSTOR").end());
    PutLeBytes(out, version, 4);
    PutLeBytes(out, next, 8);
    PutLeBytes(out, imageBytes, 8);
    return out;
}

// One section of a meta record (roots or counters), entries as given.
void PutSection(std::vector<octet_t>& out,
                const std::vector<std::pair<std::string, uint64>>& entries) {
    PutLeBytes(out, entries.size(), 4);
    for (const auto& [name, value] : entries) {
        PutLeBytes(out, name.size(), 2);
        out.insert(out.end(), name.begin(), name.end());
        PutLeBytes(out, value, 8);
    }
}

// The map starts small and must grow to hold the history. A commit that fails
// part-way (its images and deletions apply before a root name too long for an
// LMDB key) changes nothing.
TEST(LmdbStoreRoundTrip, HistoryOfCommitsSurvivesReopeningAndFailedCommits) {
    TempDir dir;
    Model model;
    auto store = OpenScratch(dir.Sub("a/b"), OpenMode::CreateIfMissing, 256 * 1024);
    model.ExpectHeldBy(*store);
    CommitBatch first;  // identities across all key bytes; one written and deleted at once
    for (const uint64 oid : {~uint64{0}, uint64{1} << 40, uint64{3000}}) {
        first.writes.emplace_back(oid, MakeImage(0, oid, 3));
    }
    first.deletes = {3000, 3001};
    store->Commit(first);
    model.Apply(first);
    for (uint64 k = 1; k <= 60; ++k) {
        const CommitBatch batch = MakeCommit(k);
        store->Commit(batch);
        model.Apply(batch);
        if (k == 30) {
            CommitBatch bad = MakeCommit(31);
            bad.roots[std::string(2000, 'r')] = 1;
            EXPECT_ERROR_MENTIONS(store->Commit(bad), "commit: setting root 'rrr");
            model.ExpectHeldBy(*store);  // the writer's meta values too
        }
        if (k % 15 == 0) {
            EXPECT_GT(store->MapSize(), 256u * 1024);
            store.reset();
            store = OpenScratch(dir.Sub("a/b"), OpenMode::MustExist);
            model.ExpectHeldBy(*store);
        }
    }
    EXPECT_EQ(store->FindRoot("head"), 60u);
    EXPECT_FALSE(store->FindRoot("hea").has_value());
}

// The meta record of a small store: images, two roots, two counters.
std::string MakeSmallStore(const std::string& dir) {
    {
        auto store = OpenScratch(dir, OpenMode::CreateIfMissing);
        store->Commit(MakeCommit(1));
        store->Commit(MakeCommit(4));
    }
    return RawEntries(dir, "meta").at("state");
}

// A copy of the data file of the store in `from` as the store in `to`.
void CopyStore(const std::string& from, const std::string& to) {
    fs::remove_all(to);
    fs::create_directory(to);
    fs::copy_file(from + "/data.mdb", to + "/data.mdb");
}

// Replaces the meta record of the store in `dir` by `value` under `key`.
void PlantRecord(const std::string& dir, const std::string& key, const std::string& value) {
    RawEdit(dir, "meta", [&](MDB_txn* txn, MDB_dbi dbi) {
        MDB_val state = RawVal(AsBytes("state"));
        EXPECT_EQ(mdb_del(txn, dbi, &state, nullptr), 0);
        MDB_val k = RawVal(AsBytes(key));
        MDB_val v = RawVal(AsBytes(value));
        EXPECT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
    });
}

// Both a writer that would make a missing store and a reader refuse the
// store in `dir` with an error naming `error`, and leave its meta values as
// they were: none takes it for a store without roots or makes a new one.
void ExpectEveryOpenerRefuses(const std::string& dir, const std::string& error) {
    const auto planted = RawEntries(dir, "meta");
    for (const OpenMode mode : {OpenMode::CreateIfMissing, OpenMode::ReadOnly}) {
        EXPECT_ERROR_MENTIONS(OpenScratch(dir, mode), error);
    }
    EXPECT_EQ(RawEntries(dir, "meta"), planted);
}

// One byte changed anywhere in the meta record's value or key, the record
// cut short or lengthened: each is damage, never a store without roots.
TEST(LmdbStoreMetaRecord, EveryChangedByteIsRefusedByEveryOpener) {
    TempDir dir;
    const std::string original = dir.Sub("original");
    const std::string record = MakeSmallStore(original);
    ASSERT_GT(record.size(), 60u);
    const std::string copy = dir.Sub("copy");
    const std::string damaged = "damaged store: the meta record \"state\" ";
    for (std::size_t i = 0; i < record.size(); ++i) {
        for (const int mask : {1 << (i % 8), 0xff}) {
            SCOPED_TRACE("value byte " + std::to_string(i) + " ^= " + std::to_string(mask));
            std::string changed = record;
            changed[i] = static_cast<char>(changed[i] ^ mask);
            CopyStore(original, copy);
            PlantRecord(copy, "state", changed);
            ExpectEveryOpenerRefuses(copy, damaged + "does not match its checksum");
        }
    }
    for (std::size_t i = 0; i < std::string_view("state").size(); ++i) {
        for (const int mask : {1 << (i % 8), 0xff}) {
            SCOPED_TRACE("key byte " + std::to_string(i) + " ^= " + std::to_string(mask));
            std::string key = "state";
            key[i] = static_cast<char>(key[i] ^ mask);
            CopyStore(original, copy);
            PlantRecord(copy, key, record);
            ExpectEveryOpenerRefuses(copy, damaged + "is missing");
        }
    }
    const std::pair<std::string, std::string> lengths[] = {
        {record.substr(0, record.size() - 1), "does not match its checksum (checksum mismatch)"},
        {record + '\0', "does not match its checksum (checksum mismatch)"},
        {record.substr(0, 43), "has 43 bytes, fewer than the 44 of the smallest (wrong length)"},
        {"", "has 0 bytes"},
    };
    for (const auto& [value, error] : lengths) {
        SCOPED_TRACE(std::to_string(value.size()) + " bytes");
        CopyStore(original, copy);
        PlantRecord(copy, "state", value);
        ExpectEveryOpenerRefuses(copy, damaged + error);
    }
    if (!HasFailure()) {
        CopyStore(original, copy);
        Model model;
        model.Apply(MakeCommit(1));
        model.Apply(MakeCommit(4));
        model.ExpectHeldBy(*OpenScratch(copy, OpenMode::ReadOnly));
    }
}

// A record whose checksum holds may still not be one this program wrote:
// each fault of the layout is named.
TEST(LmdbStoreMetaRecord, ARecordThatDoesNotParseIsRefused) {
    TempDir dir;
    const std::string original = dir.Sub("original");
    MakeSmallStore(original);
    using Entries = std::vector<std::pair<std::string, uint64>>;
    const auto record = [](std::vector<octet_t> head, const Entries& roots,
                           const Entries& counters) {
        PutSection(head, roots);
        PutSection(head, counters);
        return head;
    };
    std::vector<octet_t> magic = record(StateHead(2), {}, {});
    magic[7] = 'X';
    std::vector<octet_t> overrun = StateHead(2);
    PutLeBytes(overrun, 1, 4);  // one root, whose name ends early
    PutLeBytes(overrun, 10, 2);
    overrun.insert(overrun.end(), 6, 'r');
    std::vector<octet_t> trailing = record(StateHead(2), {}, {});
    trailing.push_back(0);
    const Entries unordered = {{"b", 1}, {"a", 2}};
    const Entries twice = {{"a", 1}, {"a", 2}};
    const Entries huge = {{std::string(1025, 'n'), 1}};
    const std::pair<std::vector<octet_t>, std::string> cases[] = {
        {record(StateHead(3), {}, {}), "store format version 3 is not supported"},
        {magic, "lacks the magic \"TARNSTOR\""},
        {overrun, "cannot be parsed: the record ends inside the roots"},
        {trailing, "cannot be parsed: 1 bytes follow the counters"},
        {record(StateHead(2), unordered, {}), "cannot be parsed: the roots are out of order"},
        {record(StateHead(2), {}, twice), "cannot be parsed: the counters are out of order"},
        {record(StateHead(2), huge, {}), "a name of the roots has 1025 bytes"},
    };
    const std::string copy = dir.Sub("copy");
    for (const auto& [body, error] : cases) {
        SCOPED_TRACE(error);
        CopyStore(original, copy);
        PlantRecord(copy, "state", Sealed(body));
        ExpectEveryOpenerRefuses(copy, error);
    }
}

// Writes `model` as a store of format 1 into `dir`, as the program before
// the meta record did: a format marker, the identity counter, each root and
// each counter under a key of its own, without a checksum.
void MakeFormat1Store(const std::string& dir, const Model& model) {
    fs::create_directories(dir);
    RawEdit(dir, "images", [&](MDB_txn* txn, MDB_dbi dbi) {
        for (const auto& [oid, image] : model.images) {
            std::vector<octet_t> key;
            for (int i = 7; i >= 0; --i) {
                key.push_back(static_cast<octet_t>(oid >> (8 * i)));
            }
            const std::vector<octet_t> value = EncodeImageRecord(oid, image);
            MDB_val k = RawVal(key);
            MDB_val v = RawVal(value);
            EXPECT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
        }
    });
    const auto le = [](uint64 value) {
        std::vector<octet_t> bytes;
        PutLeBytes(bytes, value, 8);
        return std::string(bytes.begin(), bytes.end());
    };
    RawEdit(dir, "meta", [&](MDB_txn* txn, MDB_dbi dbi) {
        std::map<std::string, std::string> entries = {
            {"format", std::string("TARNSTOR\x01\0\0\0", 12)}, {"next-identity", le(model.next)}};
        for (const auto& [name, oid] : model.roots) {
            entries["root:" + name] = le(oid);
        }
        for (const auto& [name, value] : model.counters) {
            entries["counter:" + name] = le(value);
        }
        for (const auto& [key, value] : entries) {
            MDB_val k = RawVal(AsBytes(key));
            MDB_val v = RawVal(AsBytes(value));
            EXPECT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
        }
    });
}

// Everything the format-1 store in `dir` holds, read through a ReadOnly
// store; the counters' names come from the store's keys.
Model ReadFormat1Model(const std::string& dir) {
    Model model;
    auto store = OpenScratch(dir, OpenMode::ReadOnly);
    EXPECT_EQ(store->FormatVersion(), 1u);
    store->ForEachIdentity([&](uint64 oid) { model.images[oid] = *store->Load(oid); });
    model.roots = store->Roots();
    for (const auto& [key, value] : RawEntries(dir, "meta")) {
        if (key.starts_with("counter:")) {
            model.counters[key.substr(8)] = *store->FindCounter(key.substr(8));
        }
    }
    model.next = store->NextIdentity();
    return model;
}

std::string FileText(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

// Stores of format 1, as the program before the meta record left them (the
// archive beside this test) and as made here: a reader reads each as it is
// and leaves it so; the first writer upgrades it, keeping every image, root,
// counter and the identity counter; the store then opens as format 2.
TEST(LmdbStoreFormat1, IsReadAsItIsAndUpgradedByTheFirstWriter) {
    TempDir dir;
    const std::string command =
        "tar -xJf '" TARN_TEST_DATA_DIR "/store-format1.tar.xz' -C '" + dir.Path() + "'";
    ASSERT_EQ(std::system(command.c_str()), 0) << command;
    Model made;
    for (uint64 k = 1; k <= 40; ++k) {
        made.Apply(MakeCommit(k));
    }
    made.roots["a name: with \x01 odd bytes"] = 7;
    made.counters[""] = 3;
    MakeFormat1Store(dir.Sub("made"), made);
    for (const std::string name : {"v1", "v1tail", "made"}) {
        SCOPED_TRACE(name);
        const std::string store = dir.Sub(name);
        const std::string before = FileText(store + "/data.mdb");
        const auto beforeMeta = RawEntries(store, "meta");
        ASSERT_TRUE(beforeMeta.contains("format"));
        const Model model = ReadFormat1Model(store);
        if (name == "made") {
            made.ExpectHeldBy(*OpenScratch(store, OpenMode::ReadOnly));
        } else {
            EXPECT_FALSE(model.roots.empty());
            EXPECT_FALSE(model.counters.empty());
        }
        {
            auto reader = OpenScratch(store, OpenMode::ReadOnly);
            model.ExpectHeldBy(*reader);  // the image bytes counted on demand
            EXPECT_TRUE(reader->Repairs().empty());
        }
        EXPECT_EQ(FileText(store + "/data.mdb"), before);
        {
            auto writer = OpenScratch(store, OpenMode::MustExist);
            EXPECT_EQ(writer->FormatVersion(), 1u);
            ASSERT_EQ(writer->Repairs().size(), 1u);
            EXPECT_EQ(writer->Repairs()[0].find("upgraded the store from format 1 to 2"), 0u);
            model.ExpectHeldBy(*writer);
        }
        const auto afterMeta = RawEntries(store, "meta");
        EXPECT_EQ(afterMeta.size(), 1u);
        EXPECT_TRUE(afterMeta.contains("state"));
        for (const OpenMode mode : {OpenMode::ReadOnly, OpenMode::MustExist}) {
            auto reopened = OpenScratch(store, mode);
            EXPECT_EQ(reopened->FormatVersion(), 2u);
            EXPECT_TRUE(reopened->Repairs().empty());
            model.ExpectHeldBy(*reopened);
        }
        Model later = model;
        later.Apply(MakeCommit(50));
        OpenScratch(store, OpenMode::MustExist)->Commit(MakeCommit(50));
        later.ExpectHeldBy(*OpenScratch(store, OpenMode::ReadOnly));
    }
}

// A reader of a format-1 store keeps its snapshot while a writer in another
// process upgrades the store and commits; the latest counter it asks for
// comes from the writer's meta record.
TEST(LmdbStoreFormat1, AReaderBesideTheUpgradingWriterSeesTheLatestCounter) {
    TempDir dir;
    Model model;
    model.Apply(MakeCommit(1));
    MakeFormat1Store(dir.Path(), model);
    auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
    EXPECT_EQ(reader->FindLatestCounter("journal"), 10u);
    const pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        try {
            auto writer = OpenScratch(dir.Path(), OpenMode::MustExist);
            writer->Commit(MakeCommit(2));
            ::_exit(writer->FormatVersion() == 1 ? 0 : 1);
        } catch (const RuntimeError&) {
            ::_exit(2);
        }
    }
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
    EXPECT_EQ(reader->FindLatestCounter("journal"), 20u);
    EXPECT_EQ(reader->FormatVersion(), 1u);
    model.ExpectHeldBy(*reader);
}

// The image bytes that Stats reports are kept in the meta record and follow
// every kind of change, as the sum of the sizes of the records held.
TEST(LmdbStoreStats, ImageBytesFollowEveryChangeAndSurviveReopening) {
    TempDir dir;
    Model model;
    auto store = OpenScratch(dir.Path(), OpenMode::CreateIfMissing);
    std::vector<CommitBatch> batches(4);
    batches[0].writes = {{1, MakeImage(0, 1, 10)}, {2, MakeImage(0, 2, 50000)}, {3, {}}};
    // Overwritten smaller and larger (between in-page and overflow pages),
    // deleted, and an absent identity deleted.
    batches[1].writes = {{2, MakeImage(1, 2, 5)}, {1, MakeImage(1, 1, 70000)}};
    batches[1].deletes = {3, 99};
    // Written and deleted at once; written twice in one batch.
    batches[2].writes = {
        {5, MakeImage(2, 5, 100)}, {6, MakeImage(2, 6, 900)}, {6, MakeImage(3, 6, 30)}};
    batches[2].deletes = {5};
    // Everything deleted, then one image more.
    batches[3].deletes = {1, 2, 6};
    for (CommitBatch& batch : batches) {
        store->Commit(batch);
        model.Apply(batch);
        model.ExpectHeldBy(*store);
    }
    CommitBatch last;
    last.writes = {{8, MakeImage(4, 8, 4000)}};
    store->Commit(last);
    model.Apply(last);
    CommitBatch failed;  // its images count for nothing
    failed.writes = {{9, MakeImage(5, 9, 3000)}};
    failed.counters[std::string(1025, 'c')] = 1;
    EXPECT_ERROR_MENTIONS(store->Commit(failed), "commit: setting counter 'ccc");
    model.ExpectHeldBy(*store);
    store.reset();
    model.ExpectHeldBy(*OpenScratch(dir.Path(), OpenMode::ReadOnly));
    model.ExpectHeldBy(*OpenScratch(dir.Path(), OpenMode::MustExist));
}

// LMDB 0.9's data.mdb as far as the tests below take it apart: pages of the
// size that meta page 0 names (at byte 40); each page starts with a 16-byte
// header (page number 8, pad 2, flags 2, lower bound 2, upper bound 2), and a
// branch or leaf page's node offsets (2 bytes each) follow it up to the lower
// bound. A node: two 2-byte halves of a leaf's data size or of a branch's
// child page number, flags 2 (a branch: the child's high 16 bits), key size
// 2, the key, then a leaf's data. A meta page holds the main database's
// record at byte 88 (its root page at byte 128) and the transaction id at
// byte 144; the main database's leaf names each named database, its 48-byte
// record (root page at byte 40) as the data.
class DataFile {
public:
    static constexpr uint64 kBranch = 0x01;

    explicit DataFile(std::string path) : m_path(std::move(path)), m_bytes(FileText(m_path)) {
        m_pageSize = Le(40, 4);
    }

    uint64 Pages() const { return m_bytes.size() / m_pageSize; }
    uint64 Flags(uint64 page) const { return Le(page * m_pageSize + 10, 2); }

    // The byte offsets within `page` of its nodes.
    std::vector<uint64> Nodes(uint64 page) const {
        std::vector<uint64> nodes;
        const uint64 lower = Le(page * m_pageSize + 12, 2);
        for (uint64 at = 16; at + 2 <= lower; at += 2) {
            nodes.push_back(Le(page * m_pageSize + at, 2));
        }
        return nodes;
    }
    std::string Key(uint64 page, uint64 node) const {
        const uint64 at = page * m_pageSize + node;
        return m_bytes.substr(at + 8, Le(at + 6, 2));
    }
    uint64 Child(uint64 page, uint64 node) const {
        const uint64 at = page * m_pageSize + node;
        return Le(at, 2) | Le(at + 2, 2) << 16 | Le(at + 4, 2) << 32;
    }
    void SetChild(uint64 page, uint64 node, uint64 child) {
        const uint64 at = page * m_pageSize + node;
        Put(at, child & 0xffff, 2);
        Put(at + 2, (child >> 16) & 0xffff, 2);
        Put(at + 4, child >> 32, 2);
    }
    void SetNodeOffset(uint64 page, std::size_t index, uint64 offset) {
        Put(page * m_pageSize + 16 + 2 * index, offset, 2);
    }
    void SetNodeFlags(uint64 page, uint64 node, uint64 flags) {
        Put(page * m_pageSize + node + 4, flags, 2);
    }
    void SetLowerBound(uint64 page, uint64 lower) { Put(page * m_pageSize + 12, lower, 2); }
    void SetFlags(uint64 page, uint64 flags) { Put(page * m_pageSize + 10, flags, 2); }
    // A leaf node's first overflow page (a node with flag 0x01 holds its
    // page number as its data), and the run's page count (at byte 12).
    uint64 Overflow(uint64 page, uint64 node) const {
        const uint64 at = page * m_pageSize + node;
        return Le(at + 8 + Le(at + 6, 2), 8);
    }
    uint64 RunPages(uint64 page) const { return Le(page * m_pageSize + 12, 4); }
    void SetRunPages(uint64 page, uint64 count) { Put(page * m_pageSize + 12, count, 4); }

    // The root page of the named database `name`, as the newest meta page
    // has it.
    uint64 Root(const std::string& name) const {
        const uint64 meta = Le(m_pageSize + 144, 8) > Le(144, 8) ? m_pageSize : 0;
        const uint64 main = Le(meta + 128, 8);
        for (const uint64 node : Nodes(main)) {
            if (Key(main, node) == name) {
                return Le(main * m_pageSize + node + 8 + name.size() + 40, 8);
            }
        }
        ADD_FAILURE() << "no database " << name;
        return 0;
    }

    // The leaves of the tree under `page`, left to right.
    std::vector<uint64> Leaves(uint64 page) const {
        if (Flags(page) != kBranch) {
            return {page};
        }
        std::vector<uint64> leaves;
        for (const uint64 node : Nodes(page)) {
            for (const uint64 leaf : Leaves(Child(page, node))) {
                leaves.push_back(leaf);
            }
        }
        return leaves;
    }

    void Write() const { std::ofstream(m_path, std::ios::binary | std::ios::trunc) << m_bytes; }

private:
    uint64 Le(uint64 at, int width) const {
        uint64 value = 0;
        for (int i = width - 1; i >= 0; --i) {
            value = value << 8 | static_cast<unsigned char>(m_bytes.at(at + i));
        }
        return value;
    }
    void Put(uint64 at, uint64 value, int width) {
        for (int i = 0; i < width; ++i) {
            m_bytes.at(at + i) = static_cast<char>(value >> (8 * i));
        }
    }

    std::string m_path;
    std::string m_bytes;
    uint64 m_pageSize = 0;
};

uint64 IdentityOfKeyText(const std::string& key) {
    uint64 oid = 0;
    for (const char c : key) {
        oid = oid << 8 | static_cast<unsigned char>(c);
    }
    return oid;
}

// A store of 3000 small images written in one commit, so that the images'
// tree has branch pages; the identity counter is 5000.
void MakeBranchyStore(const std::string& dir) {
    CommitBatch batch;
    for (uint64 oid = 1; oid <= 3000; ++oid) {
        batch.writes.emplace_back(oid, MakeImage(7, oid, 40));
    }
    batch.roots["head"] = 1;
    batch.nextIdentity = 5000;
    OpenScratch(dir, OpenMode::CreateIfMissing)->Commit(batch);
}

// A child page number past the end of the file: LMDB itself bounds page
// numbers by the commit's last page, and the store turns its answer into a
// damaged store for this call and every later one. Opening reads no branch
// page and so opens; the whole-store walk finds the damage.
TEST(LmdbStorePageFaults, AChildPagePastTheEndOfTheFileIsAnError) {
    TempDir dir;
    MakeBranchyStore(dir.Path());
    DataFile file(dir.Sub("data.mdb"));
    const uint64 root = file.Root("images");
    ASSERT_EQ(file.Flags(root), DataFile::kBranch);
    const std::vector<uint64> nodes = file.Nodes(root);
    ASSERT_GT(nodes.size(), 6u);
    const uint64 cut = IdentityOfKeyText(file.Key(root, nodes[5]));  // the first under child 5
    file.SetChild(root, nodes[5], file.Pages() + 1000);
    file.Write();
    EXPECT_ERROR_MENTIONS(CheckLmdbPages(dir.Path()),
                          "data.mdb is damaged: page " + std::to_string(root));
    const std::string damaged = "damaged store: reading image #" + std::to_string(cut);
    for (const OpenMode mode : {OpenMode::ReadOnly, OpenMode::MustExist}) {
        auto store = OpenScratch(dir.Path(), mode);
        EXPECT_EQ(store->Load(1)->bytes, MakeImage(7, 1, 40).bytes);
        EXPECT_ERROR_MENTIONS(store->Load(cut), damaged);
        EXPECT_ERROR_MENTIONS(store->Load(1), damaged);
        EXPECT_ERROR_MENTIONS(store->FindRoot("head"), damaged);
    }
}

// A leaf whose node offsets point past the end of the file makes LMDB read
// past it: a SIGBUS inside the map, which the page guard turns into a
// damaged store, for this call and every later one. The process goes on,
// and a later opener reads the rest.
TEST(LmdbStorePageFaults, AReadPastTheEndOfTheFileIsConfinedToAnError) {
    TempDir dir;
    MakeBranchyStore(dir.Path());
    DataFile file(dir.Sub("data.mdb"));
    std::vector<uint64> leaves = file.Leaves(file.Root("images"));
    ASSERT_GT(leaves.size(), 10u);
    const uint64 leaf = *std::max_element(leaves.begin(), leaves.end());
    // Offsets reach at most 64 KiB past the start of their page.
    ASSERT_GT((leaf * 4096 + 0xfff8) / 4096, file.Pages()) << "the last leaf lies too early";
    const std::vector<uint64> nodes = file.Nodes(leaf);
    const uint64 inLeaf = IdentityOfKeyText(file.Key(leaf, nodes[nodes.size() / 2]));
    for (std::size_t i = 0; i < nodes.size(); ++i) {
        file.SetNodeOffset(leaf, i, 0xfff8);
    }
    file.Write();
    const std::string fault = "damaged store: a page of data.mdb could not be read while ";
    {
        auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
        EXPECT_EQ(reader->Load(1)->bytes, MakeImage(7, 1, 40).bytes);
        std::string first;
        try {
            reader->Load(inLeaf);
            ADD_FAILURE() << "no error";
        } catch (const RuntimeError& e) {
            first = e.what();
        }
        EXPECT_NE(first.find(fault + "reading an image (SIGBUS at byte "), std::string::npos)
            << first;
        for (const auto& call : std::vector<std::function<void()>>{
                 [&] { reader->Load(1); }, [&] { reader->Stats(); }, [&] { reader->Roots(); },
                 [&] { reader->ForEachIdentity([](uint64) {}); }}) {
            EXPECT_ERROR_MENTIONS(call(), first);
        }
    }
    EXPECT_ERROR_MENTIONS(
        OpenScratch(dir.Path(), OpenMode::ReadOnly)->ForEachIdentity([](uint64) {}),
        fault + "listing the images (SIGBUS");
    auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
    EXPECT_EQ(reader->NextIdentity(), 5000u);
    EXPECT_EQ(reader->Load(1)->bytes, MakeImage(7, 1, 40).bytes);
}

// A data.mdb cut short under a writer (after its walk of the pages, before
// its next commit) makes LMDB fault inside the map in the middle of a
// commit: the commit is aborted, never committed, and the writer takes no
// further call.
TEST(LmdbStorePageFaults, AFileCutShortUnderTheWriterStopsItsCommit) {
    TempDir dir;
    MakeBranchyStore(dir.Path());
    const std::string path = dir.Sub("data.mdb");
    CommitBatch first;
    first.writes.emplace_back(2000, MakeImage(8, 2000, 10));
    first.nextIdentity = 6000;
    CommitBatch second = first;
    second.writes[0].second = MakeImage(9, 2000, 10);
    second.nextIdentity = 7000;
    {
        auto writer = OpenScratch(dir.Path(), OpenMode::MustExist);
        writer->Commit(first);
        const std::string committed = FileText(path);
        fs::resize_file(path, 2 * 4096);
        const std::string fault = "damaged store: a page of data.mdb could not be read while ";
        EXPECT_ERROR_MENTIONS(writer->Commit(second), fault + "committing (SIGBUS");
        EXPECT_ERROR_MENTIONS(writer->Load(1), fault + "committing (SIGBUS");
        EXPECT_ERROR_MENTIONS(writer->Commit(second), fault + "committing (SIGBUS");
        std::ofstream(path, std::ios::binary | std::ios::trunc) << committed;
    }
    auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
    EXPECT_EQ(reader->NextIdentity(), 6000u);
    EXPECT_EQ(reader->Load(2000)->bytes, first.writes[0].second.bytes);
}

// Two more ways in which LMDB meets a damaged page, confined the same way: a
// node flagged as holding duplicate keys (this store makes no such
// database, and LMDB follows a null pointer), and a branch page left with
// one key (one of LMDB's own assertions, which would abort the process).
TEST(LmdbStorePageFaults, NullPointersAndAssertionsOfLmdbAreConfinedToAnError) {
    TempDir dir;
    const std::string original = dir.Sub("original");
    MakeBranchyStore(original);
    const std::string copy = dir.Sub("copy");
    const struct {
        std::function<uint64(DataFile&)> damage;  // returns an identity it hits
        std::string error;
    } cases[] = {
        {[](DataFile& file) {
             const uint64 leaf = file.Leaves(file.Root("images")).at(0);
             const uint64 node = file.Nodes(leaf).at(2);
             file.SetNodeFlags(leaf, node, 0x04);
             return IdentityOfKeyText(file.Key(leaf, node));
         },
         "damaged store: a page of data.mdb led LMDB to a null pointer while reading an image "
         "(SIGSEGV at address "},
        {[](DataFile& file) {
             file.SetLowerBound(file.Root("images"), 18);
             return uint64{1};
         },
         "damaged store: LMDB found its pages inconsistent while reading an image ("},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.error);
        CopyStore(original, copy);
        DataFile file(copy + "/data.mdb");
        const uint64 hit = c.damage(file);
        file.Write();
        auto store = OpenScratch(copy, OpenMode::ReadOnly);
        EXPECT_ERROR_MENTIONS(store->Load(hit), c.error);
        EXPECT_ERROR_MENTIONS(store->NextIdentity(), c.error);
    }
}

// A writer trusts pages that no read checks: a page's flags, the page count
// of an overflow run it frees, the free-page lists. Damage there, which
// readers do not notice, would have it write over pages in use. So before
// its first change a writer walks every page, and with damage found it takes
// no change at all; its reads go on.
TEST(LmdbStorePageFaults, AWriterWalksThePagesBeforeItsFirstChange) {
    TempDir dir;
    const std::string original = dir.Sub("original");
    {
        CommitBatch batch;
        for (uint64 oid = 1; oid <= 4; ++oid) {
            batch.writes.emplace_back(oid, MakeImage(7, oid, oid == 4 ? 20000 : 40));
        }
        OpenScratch(original, OpenMode::CreateIfMissing)->Commit(batch);
    }
    DataFile file(original + "/data.mdb");
    const uint64 leaf = file.Root("images");
    const uint64 run = file.Overflow(leaf, file.Nodes(leaf).at(3));
    const uint64 pages = file.RunPages(run);
    ASSERT_EQ(pages, 5u);  // the 20 KiB record on 4 KiB pages
    const struct {
        std::function<void(DataFile&)> damage;
        std::string error;
    } cases[] = {
        {[&](DataFile& f) { f.SetRunPages(run, pages - 1); }, "has a damaged header"},
        {[&](DataFile& f) { f.SetRunPages(run, pages | 0x57000000); }, "has a damaged header"},
        {[&](DataFile& f) { f.SetFlags(leaf, 0xe002); }, "has flags 0xe002 where a leaf page"},
    };
    const std::string copy = dir.Sub("copy");
    for (const auto& c : cases) {
        SCOPED_TRACE(c.error);
        CopyStore(original, copy);
        DataFile damaged(copy + "/data.mdb");
        c.damage(damaged);
        damaged.Write();
        CommitBatch batch;
        batch.writes.emplace_back(4, MakeImage(8, 4, 10));
        batch.deletes.push_back(3);
        batch.nextIdentity = 9;
        EXPECT_EQ(OpenScratch(copy, OpenMode::ReadOnly)->Load(4)->bytes,
                  MakeImage(7, 4, 20000).bytes);
        auto writer = OpenScratch(copy, OpenMode::MustExist);
        const std::string refused = "data.mdb is damaged: page " + std::to_string(leaf);
        EXPECT_ERROR_MENTIONS(writer->Commit(batch), refused);
        EXPECT_ERROR_MENTIONS(writer->Commit(batch), c.error);
        EXPECT_ERROR_MENTIONS(writer->Commit(CommitBatch{}), "the store takes no more changes");
        EXPECT_EQ(writer->Load(4)->bytes, MakeImage(7, 4, 20000).bytes);
        writer.reset();
        EXPECT_EQ(OpenScratch(copy, OpenMode::ReadOnly)->NextIdentity(), 1u);
    }
}

// The page guards' handler passes on a fault outside every guard (here a
// null pointer's, which inside a guard would be confined): the process ends
// as it would without a store (by the signal, or through the sanitizer's
// report in a sanitized build), neither carrying on nor faulting forever.
TEST(LmdbStorePageFaults, AFaultOutsideEveryGuardEndsTheProcessAsBefore) {
    TempDir dir;
    MakeBranchyStore(dir.Path());
    const pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        ::alarm(20);  // a fault repeated forever ends by SIGALRM
        try {
            auto store = OpenScratch(dir.Path(), OpenMode::ReadOnly);
            if (store->Load(1)->bytes != MakeImage(7, 1, 40).bytes) {
                ::_exit(2);
            }
            // An address the compiler cannot see through (a constant one
            // draws -Warray-bounds from an optimising build).
            volatile std::uintptr_t address = 64;
            static_cast<void>(*reinterpret_cast<volatile const int*>(address));
        } catch (const RuntimeError&) {
            ::_exit(3);
        }
        ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
#if defined(__SANITIZE_ADDRESS__)
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1) << "status " << status;
#else
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGSEGV) << "status " << status;
#endif
}

// The writer of the crash test: commits MakeCommit(k), k = 1, 2, ... after
// what the store already holds, and reports each finished k on `fd`, until it
// is killed.
[[noreturn]] void RunWriter(const std::string& dir, int fd) {
    try {
        auto store = LmdbStore::Open(dir, OpenMode::MustExist);
        for (uint64 k = store->NextIdentity(); k < 1000000; ++k) {
            store->Commit(MakeCommit(k));
            if (::write(fd, &k, sizeof k) != sizeof k) {
                ::_exit(3);
            }
        }
    } catch (const RuntimeError&) {
        ::_exit(2);
    }
    ::_exit(0);
}

TEST(LmdbStoreAtomicity, KilledWriterLeavesTheLastOrTheNextCommit) {
    TempDir dir;
    LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing).reset();
    Model model;
    uint64 applied = 0;
    std::mt19937 rng(20240611);
    const auto start = std::chrono::steady_clock::now();
    int kills = 0;
    for (int round = 0; round < 120; ++round) {
        // Keeps the test's running time bounded on a slow machine.
        if (std::chrono::steady_clock::now() - start > std::chrono::seconds(20)) {
            break;
        }
        int fds[2];
        ASSERT_EQ(::pipe(fds), 0);
        const pid_t pid = ::fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            ::close(fds[0]);
            RunWriter(dir.Path(), fds[1]);
        }
        ::close(fds[1]);
        // Every round lets the writer finish one commit before the kill
        // lands at a random point, so that the history grows however slow
        // the machine's disk is.
        uint64 reported = applied;
        uint64 k = 0;
        if (::read(fds[0], &k, sizeof k) == sizeof k) {
            reported = k;
        }
        ::usleep(rng() % 25000);
        ::kill(pid, SIGKILL);
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        while (::read(fds[0], &k, sizeof k) == sizeof k) {
            reported = k;
        }
        ::close(fds[0]);
        ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << "status " << status;
        ++kills;

        auto store = LmdbStore::Open(dir.Path(), OpenMode::MustExist);
        const uint64 held = store->NextIdentity() - 1;
        ASSERT_TRUE(held == reported || held == reported + 1)
            << "store holds commit " << held << ", writer reported " << reported;
        while (applied < held) {
            model.Apply(MakeCommit(++applied));
        }
        model.ExpectHeldBy(*store);
        if (HasFailure()) {
            return;
        }
    }
    EXPECT_GT(kills, 10);
    EXPECT_GT(applied, 10u);
}

TEST(LmdbStoreDamage, FlippedByteAndTruncatedRecordAreReported) {
    TempDir dir;
    CommitBatch batch;
    batch.writes = {{5, MakeImage(0, 5, 200)}, {6, MakeImage(0, 6, 100)}};
    LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing)->Commit(batch);
    const std::string file = dir.Sub("data.mdb");
    std::ifstream in(file, std::ios::binary);
    std::string bytes(std::istreambuf_iterator<char>(in), {});
    const std::string payload(batch.writes[0].second.bytes.begin(),
                              batch.writes[0].second.bytes.end());
    int flipped = 0;
    for (auto at = bytes.find(payload); at != std::string::npos; at = bytes.find(payload, at + 1)) {
        bytes[at + 77] ^= 0x04;
        ++flipped;
    }
    ASSERT_GT(flipped, 0);
    std::ofstream(file, std::ios::binary | std::ios::trunc) << bytes;
    const std::vector<octet_t> record = EncodeImageRecord(9, MakeImage(0, 9, 500));
    const std::string key9("\0\0\0\0\0\0\0\x09", 8);  // identities are big-endian keys
    RawPut(dir.Path(), "images", key9, std::span(record).first(record.size() - 30));
    auto store = LmdbStore::Open(dir.Path(), OpenMode::MustExist);
    EXPECT_ERROR_MENTIONS(store->Load(5), "image #5: checksum mismatch");
    EXPECT_ERROR_MENTIONS(store->Load(5), dir.Path());
    EXPECT_EQ(store->Load(6)->bytes, batch.writes[1].second.bytes);
    EXPECT_ERROR_MENTIONS(store->Load(9), "image #9: truncated record");
}

TEST(LmdbStoreOpening, MissingAndForeignDirectoriesAreRefused) {
    TempDir dir;
    const std::string missing = dir.Sub("nowhere");
    fs::create_directory(dir.Sub("empty"));
    fs::create_directory(dir.Sub("used"));
    std::ofstream(dir.Sub("used/notes.txt")) << "mine";
    fs::create_directory(dir.Sub("garbage"));
    std::ofstream(dir.Sub("garbage/data.mdb")) << std::string(24000, 'g');
    fs::create_directory(dir.Sub("other"));
    RawPut(dir.Sub("other"), nullptr, "key", std::vector<octet_t>{1});
    // A newer format, marked as format 1 marked itself, or in a meta record.
    LmdbStore::Open(dir.Sub("newer"), OpenMode::CreateIfMissing).reset();
    RawEdit(dir.Sub("newer"), "meta", [](MDB_txn* txn, MDB_dbi dbi) {
        MDB_val key = RawVal(AsBytes("state"));
        EXPECT_EQ(mdb_del(txn, dbi, &key, nullptr), 0);
    });
    RawPut(dir.Sub("newer"), "meta", "format", AsBytes(std::string("TARNSTOR\x03\0\0\0", 12)));
    LmdbStore::Open(dir.Sub("newest"), OpenMode::CreateIfMissing).reset();
    std::vector<octet_t> newest = StateHead(4);
    PutSection(newest, {});
    PutSection(newest, {});
    RawPut(dir.Sub("newest"), "meta", "state", AsBytes(Sealed(newest)));
    const struct {
        std::string path;
        OpenMode mode;
        std::string error;
    } cases[] = {
        {missing, OpenMode::MustExist, "'" + missing + "': directory does not exist"},
        {missing, OpenMode::ReadOnly, "directory does not exist"},
        {dir.Sub("empty"), OpenMode::MustExist, "holds no data.mdb"},
        {dir.Sub("used"), OpenMode::CreateIfMissing,
         "not a store: the directory holds other files"},
        {dir.Sub("used/notes.txt"), OpenMode::CreateIfMissing, "not a directory"},
        {dir.Sub("garbage"), OpenMode::MustExist, "not a store: data.mdb is not an LMDB file"},
        {dir.Sub("other"), OpenMode::CreateIfMissing,
         "not a store: an LMDB environment with other contents"},
        {dir.Sub("other"), OpenMode::MustExist,
         "not a store: the environment has no \"meta\" database"},
        {dir.Sub("newer"), OpenMode::MustExist, "store format version 3 is not supported"},
        {dir.Sub("newer"), OpenMode::ReadOnly, "store format version 3 is not supported"},
        {dir.Sub("newest"), OpenMode::CreateIfMissing, "store format version 4 is not supported"},
    };
    for (const auto& c : cases) {
        EXPECT_ERROR_MENTIONS(LmdbStore::Open(c.path, c.mode), c.error);
    }
    EXPECT_FALSE(fs::exists(missing));
}

// Within one process a store is open once, whatever the modes; a reader
// cannot commit.
TEST(LmdbStoreOpening, OneOpenerPerProcessAndReadersCannotCommit) {
    TempDir dir;
    auto first = LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing);
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist), "in use");
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::ReadOnly),
                          "in use: the store is already open in this process");
    CommitBatch zero;
    zero.writes.emplace_back(0, StoredImage{});
    EXPECT_TARN_ASSERT(first->Commit(zero), "write.first != 0");
    first->Commit(MakeCommit(1));
    first.reset();
    auto reader = LmdbStore::Open(dir.Path(), OpenMode::ReadOnly);
    Model model;
    model.Apply(MakeCommit(1));
    model.ExpectHeldBy(*reader);
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist), "in use");
    EXPECT_TARN_ASSERT(reader->Commit(CommitBatch{}), "!m_readOnly");
}

// The writer of the reader test, in a child process: opens the store and
// answers 'o'; then for each 'c' on `in` commits the next 60 commits of the
// history (growing the map) and answers 'd'; ends at 'q'.
[[noreturn]] void RunSteppedWriter(const std::string& dir, int in, int out) {
    try {
        auto store = OpenScratch(dir, OpenMode::MustExist);
        char c = 'o';
        for (;;) {
            if (::write(out, &c, 1) != 1 || ::read(in, &c, 1) != 1) {
                ::_exit(3);
            }
            if (c == 'q') {
                ::_exit(0);
            }
            for (int i = 0; i < 60; ++i) {
                store->Commit(MakeCommit(store->NextIdentity()));
            }
            c = 'd';
        }
    } catch (const RuntimeError&) {
        ::_exit(2);
    }
}

// A writer in another process: a second writer is refused at once, readers
// open beside it, and a reader keeps the commit it opened at while the
// writer commits on; a reader opened later sees the later commits.
TEST(LmdbStoreOpening, ReadersBesideAWriterInAnotherProcessKeepTheirSnapshot) {
    TempDir dir;
    Model model;
    {
        auto store = OpenScratch(dir.Path(), OpenMode::CreateIfMissing, 256 * 1024);
        for (uint64 k = 1; k <= 3; ++k) {
            store->Commit(MakeCommit(k));
            model.Apply(MakeCommit(k));
        }
    }  // nothing of the store is open across the fork
    int toChild[2];
    int fromChild[2];
    ASSERT_EQ(::pipe(toChild), 0);
    ASSERT_EQ(::pipe(fromChild), 0);
    const pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        ::close(toChild[1]);
        ::close(fromChild[0]);
        RunSteppedWriter(dir.Path(), toChild[0], fromChild[1]);
    }
    ::close(toChild[0]);
    ::close(fromChild[1]);
    const auto tell = [&](char c) {
        char answer = 0;
        return (c == 0 || ::write(toChild[1], &c, 1) == 1) && ::read(fromChild[0], &answer, 1) == 1
                   ? answer
                   : char{0};
    };
    ASSERT_EQ(tell(0), 'o');
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist),
                          "in use: another writer (in this or another process) holds the store");
    {
        auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
        EXPECT_EQ(tell('c'), 'd');
        model.ExpectHeldBy(*reader);  // still commit 3
    }
    auto reader = OpenScratch(dir.Path(), OpenMode::ReadOnly);
    EXPECT_GT(reader->MapSize(), 256u * 1024);  // grown by the writer, adopted
    while (model.next < 64) {
        model.Apply(MakeCommit(model.next));
    }
    model.ExpectHeldBy(*reader);
    EXPECT_EQ(tell('c'), 'd');
    model.ExpectHeldBy(*reader);
    EXPECT_EQ(tell('q'), char{0});
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
    ::close(toChild[1]);
    ::close(fromChild[0]);
}

}  // namespace
}  // namespace tarn
