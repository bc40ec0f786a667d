#include "tnRuntime/LmdbStore.h"

#include <gtest/gtest.h>

#ifdef TARN_HAVE_LMDB

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>

#include <lmdb.h>

#include "tests/AssertDeath.h"
#include "tnRuntime/ImageRecord.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

// A fresh directory under the system's temporary directory, removed with
// everything in it when the test ends.
class TempDir {
public:
    TempDir() {
        std::string pattern = (fs::temp_directory_path() / "tarn-lmdb-XXXXXX").string();
        const char* made = ::mkdtemp(pattern.data());
        EXPECT_NE(made, nullptr);
        m_path = pattern;
    }
    ~TempDir() {
        std::error_code ec;
        fs::permissions(m_path, fs::perms::owner_all, fs::perm_options::add, ec);
        fs::remove_all(m_path, ec);
    }
    std::string Path() const { return m_path.string(); }
    std::string Sub(const std::string& name) const { return (m_path / name).string(); }

private:
    fs::path m_path;
};

// The message of the RuntimeError `fn` raises.
template <class Fn>
std::string ErrorOf(Fn&& fn) {
    try {
        fn();
    } catch (const RuntimeError& e) {
        return e.what();
    }
    return "(no error)";
}

#define EXPECT_ERROR_MENTIONS(statement, text)                           \
    EXPECT_NE(ErrorOf([&] { statement; }).find(text), std::string::npos) \
        << ErrorOf([&] { statement; })

// The store's contents as a plain model.
struct Model {
    std::map<uint64, StoredImage> images;
    std::map<std::string, uint64> roots;
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
        next = batch.nextIdentity;
    }
};

StoredImage MakeImage(uint64 seed, uint64 oid, std::size_t size) {
    StoredImage image;
    image.className = "tarn::Class" + std::to_string(oid % 4);
    image.bytes.resize(size);
    for (std::size_t i = 0; i < size; ++i) {
        image.bytes[i] = static_cast<octet_t>(seed * 31 + oid * 7 + i);
    }
    return image;
}

// Commit number `k` of a deterministic history: a few images among 300
// identities (now and then one spanning several pages), a few deletions, the
// root "head" naming k and the counter k + 1.
CommitBatch MakeCommit(uint64 k) {
    std::mt19937_64 rng(k);
    CommitBatch batch;
    const int writes = 1 + static_cast<int>(rng() % 8);
    for (int i = 0; i < writes; ++i) {
        const uint64 oid = 1 + rng() % 300;
        const std::size_t size = rng() % 10 == 0 ? 20000 + rng() % 20000 : rng() % 3000;
        batch.writes.emplace_back(oid, MakeImage(k, oid, size));
    }
    const int deletes = static_cast<int>(rng() % 3);
    for (int i = 0; i < deletes; ++i) {
        batch.deletes.push_back(1 + rng() % 300);
    }
    batch.roots["head"] = k;
    batch.roots["slot" + std::to_string(k % 5)] = 1 + rng() % 300;
    batch.nextIdentity = k + 1;
    return batch;
}

void ExpectStoreHolds(LmdbStore& store, const Model& model) {
    std::vector<uint64> ids;
    store.ForEachIdentity([&](uint64 oid) { ids.push_back(oid); });
    std::vector<uint64> expected;
    ssize_t bytes = 0;
    for (const auto& [oid, image] : model.images) {
        expected.push_back(oid);
        bytes += static_cast<ssize_t>(ImageRecordSize(image));
    }
    ASSERT_EQ(ids, expected);
    for (const auto& [oid, image] : model.images) {
        const std::optional<StoredImage> loaded = store.Load(oid);
        ASSERT_TRUE(loaded.has_value()) << oid;
        EXPECT_EQ(loaded->className, image.className) << oid;
        EXPECT_EQ(loaded->bytes, image.bytes) << oid;
    }
    EXPECT_EQ(store.Roots(), model.roots);
    EXPECT_EQ(store.NextIdentity(), model.next);
    const StoreStats stats = store.Stats();
    EXPECT_EQ(stats.numImages, static_cast<ssize_t>(model.images.size()));
    EXPECT_EQ(stats.numImageBytes, bytes);
}

LmdbStoreOptions Scratch(OpenMode mode) {
    LmdbStoreOptions options;
    options.mode = mode;
    options.syncOnCommit = false;
    return options;
}

// The environment of a store opened directly, bypassing the store, to plant
// faults the store itself never writes.
class RawEnvironment {
public:
    explicit RawEnvironment(const std::string& dir) {
        EXPECT_EQ(mdb_env_create(&m_env), 0);
        mdb_env_set_maxdbs(m_env, 4);
        EXPECT_EQ(mdb_env_open(m_env, dir.c_str(), 0, 0644), 0);
    }
    ~RawEnvironment() { mdb_env_close(m_env); }

    void Put(const char* db, std::string_view key, std::span<const octet_t> value) {
        MDB_txn* txn = nullptr;
        ASSERT_EQ(mdb_txn_begin(m_env, nullptr, 0, &txn), 0);
        MDB_dbi dbi = 0;
        ASSERT_EQ(mdb_dbi_open(txn, db, MDB_CREATE, &dbi), 0);
        MDB_val k{key.size(), const_cast<char*>(key.data())};
        MDB_val v{value.size(), const_cast<octet_t*>(value.data())};
        ASSERT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
        ASSERT_EQ(mdb_txn_commit(txn), 0);
    }

private:
    MDB_env* m_env = nullptr;
};

std::string ImageKey(uint64 oid) {
    std::string key(8, '\0');
    for (int i = 0; i < 8; ++i) {
        key[i] = static_cast<char>(oid >> (56 - 8 * i));
    }
    return key;
}

// ---------------------------------------------------------------------------

TEST(LmdbStoreRoundTrip, NewStoreIsEmpty) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Sub("a/b"), OpenMode::CreateIfMissing);
    EXPECT_EQ(store->NextIdentity(), 1u);
    EXPECT_TRUE(store->Roots().empty());
    EXPECT_FALSE(store->Load(1).has_value());
    EXPECT_FALSE(store->FindRoot("head").has_value());
    ExpectStoreHolds(*store, Model{});
}

TEST(LmdbStoreRoundTrip, HistoryOfCommitsSurvivesReopening) {
    TempDir dir;
    Model model;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    for (uint64 k = 1; k <= 60; ++k) {
        const CommitBatch batch = MakeCommit(k);
        store->Commit(batch);
        model.Apply(batch);
        if (k % 15 == 0) {
            store.reset();
            store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::MustExist));
            ExpectStoreHolds(*store, model);
        }
    }
    EXPECT_EQ(store->FindRoot("head"), 60u);
    EXPECT_FALSE(store->FindRoot("hea").has_value());
}

TEST(LmdbStoreRoundTrip, IdentitiesAreListedInNumericOrder) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    const std::vector<uint64> ids = {1, 255, 256, 65536, uint64{1} << 40, ~uint64{0}};
    CommitBatch batch;
    for (auto it = ids.rbegin(); it != ids.rend(); ++it) {
        batch.writes.emplace_back(*it, MakeImage(0, *it, 3));
    }
    store->Commit(batch);
    std::vector<uint64> listed;
    store->ForEachIdentity([&](uint64 oid) { listed.push_back(oid); });
    EXPECT_EQ(listed, ids);
}

TEST(LmdbStoreRoundTrip, ForEachIdentityCallbackMayUseTheStore) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    CommitBatch batch;
    for (uint64 oid = 1; oid <= 2500; ++oid) {
        batch.writes.emplace_back(oid, MakeImage(1, oid, oid % 5));
    }
    store->Commit(batch);
    uint64 seen = 0;
    store->ForEachIdentity([&](uint64 oid) {
        ++seen;
        ASSERT_EQ(oid, seen);
        ASSERT_EQ(store->Load(oid)->bytes.size(), oid % 5);
    });
    EXPECT_EQ(seen, 2500u);
}

TEST(LmdbStoreRoundTrip, WriteAndDeleteInOneBatchLeavesNoImage) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    CommitBatch batch;
    batch.writes.emplace_back(5, MakeImage(0, 5, 10));
    batch.deletes = {5, 6};
    store->Commit(batch);
    EXPECT_FALSE(store->Load(5).has_value());
}

TEST(LmdbStoreGrowth, MapGrowsInsteadOfFailing) {
    TempDir dir;
    LmdbStoreOptions options = Scratch(OpenMode::CreateIfMissing);
    options.initialMapSize = 256 * 1024;
    auto store = LmdbStore::Open(dir.Path(), options);
    Model model;
    for (uint64 k = 1; k <= 4; ++k) {
        CommitBatch batch;
        for (uint64 i = 0; i < 50; ++i) {
            const uint64 oid = k * 100 + i;
            batch.writes.emplace_back(oid, MakeImage(k, oid, 20000));
        }
        batch.nextIdentity = k * 100 + 50;
        store->Commit(batch);
        model.Apply(batch);
    }
    EXPECT_GT(store->MapSize(), 4000000u);
    store.reset();
    store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::MustExist));
    ExpectStoreHolds(*store, model);
}

// ---------------------------------------------------------------------------

TEST(LmdbStoreAtomicity, FailedCommitLeavesThePreviousState) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    Model model;
    const CommitBatch first = MakeCommit(1);
    store->Commit(first);
    model.Apply(first);
    // The images and deletions apply before the root whose name is too long
    // for an LMDB key fails the transaction.
    CommitBatch bad = MakeCommit(2);
    bad.roots[std::string(600, 'r')] = 1;
    EXPECT_ERROR_MENTIONS(store->Commit(bad), "commit: setting root 'rrr");
    ExpectStoreHolds(*store, model);
    const CommitBatch third = MakeCommit(3);
    store->Commit(third);
    model.Apply(third);
    ExpectStoreHolds(*store, model);
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
        ExpectStoreHolds(*store, model);
        if (HasFatalFailure()) {
            return;
        }
    }
    EXPECT_GT(kills, 10);
    EXPECT_GT(applied, 10u);
}

// ---------------------------------------------------------------------------

TEST(LmdbStoreCorruption, FlippedByteInTheFileFailsTheChecksum) {
    TempDir dir;
    StoredImage image;
    image.className = "tarn::OffsetOps";
    const std::string pattern = "distinctive-payload-pattern-0123456789-abcdefghij";
    for (int i = 0; i < 4; ++i) {
        image.bytes.insert(image.bytes.end(), pattern.begin(), pattern.end());
    }
    {
        auto store = LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing);
        CommitBatch batch;
        batch.writes.emplace_back(5, image);
        batch.writes.emplace_back(6, MakeImage(0, 6, 100));
        store->Commit(batch);
    }
    const std::string file = dir.Sub("data.mdb");
    std::string bytes;
    {
        std::ifstream in(file, std::ios::binary);
        bytes.assign(std::istreambuf_iterator<char>(in), {});
    }
    const std::string whole(image.bytes.begin(), image.bytes.end());
    int flipped = 0;
    for (std::size_t at = bytes.find(whole); at != std::string::npos;
         at = bytes.find(whole, at + 1)) {
        bytes[at + 77] ^= 0x04;
        ++flipped;
    }
    ASSERT_GT(flipped, 0);
    {
        std::ofstream out(file, std::ios::binary | std::ios::trunc);
        out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    }
    auto store = LmdbStore::Open(dir.Path(), OpenMode::MustExist);
    const std::string error = ErrorOf([&] { store->Load(5); });
    EXPECT_NE(error.find("image #5: checksum mismatch"), std::string::npos) << error;
    EXPECT_NE(error.find(dir.Path()), std::string::npos) << error;
    EXPECT_EQ(store->Load(6)->bytes, MakeImage(0, 6, 100).bytes);
}

TEST(LmdbStoreCorruption, DamagedRecordsAreReported) {
    TempDir dir;
    LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing).reset();
    const std::vector<octet_t> record = EncodeImageRecord(9, MakeImage(0, 9, 500));
    {
        RawEnvironment raw(dir.Path());
        raw.Put("images", ImageKey(9), std::span(record).first(record.size() - 30));
        std::vector<octet_t> version = record;
        version[4] = 2;
        raw.Put("images", ImageKey(10), version);
        raw.Put("images", ImageKey(11), EncodeImageRecord(12, MakeImage(0, 12, 5)));
        raw.Put("meta", "next-identity", std::vector<octet_t>{1, 2, 3});
    }
    auto store = LmdbStore::Open(dir.Path(), OpenMode::MustExist);
    EXPECT_ERROR_MENTIONS(store->Load(9), "image #9: truncated record");
    EXPECT_ERROR_MENTIONS(store->Load(10), "image #10: unknown record version 2");
    EXPECT_ERROR_MENTIONS(store->Load(11), "image #11: checksum mismatch");
    EXPECT_ERROR_MENTIONS(store->NextIdentity(), "meta entry 'next-identity' has 3 bytes");
}

// ---------------------------------------------------------------------------

TEST(LmdbStoreOpening, MissingDirectoryIsReportedUnlessCreating) {
    TempDir dir;
    const std::string missing = dir.Sub("nowhere");
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(missing, OpenMode::MustExist),
                          "'" + missing + "': directory does not exist");
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(missing, OpenMode::ReadOnly), "directory does not exist");
    EXPECT_FALSE(fs::exists(missing));
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist), "holds no data.mdb");
}

TEST(LmdbStoreOpening, ForeignPathsAreRefused) {
    TempDir dir;
    // A directory in use for something else.
    { std::ofstream(dir.Sub("notes.txt")) << "mine"; }
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing),
                          "not a store: the directory holds other files");
    // A file where the directory should be.
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Sub("notes.txt"), OpenMode::CreateIfMissing),
                          "not a directory");
    // A data.mdb that is not LMDB's.
    fs::create_directory(dir.Sub("garbage"));
    {
        std::ofstream out(dir.Sub("garbage/data.mdb"), std::ios::binary);
        for (int i = 0; i < 3000; ++i) {
            out << "garbage!";
        }
    }
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Sub("garbage"), OpenMode::MustExist),
                          "not a store: data.mdb is not an LMDB file");
    // Somebody else's LMDB environment.
    fs::create_directory(dir.Sub("other"));
    RawEnvironment(dir.Sub("other")).Put(nullptr, "key", std::vector<octet_t>{1});
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Sub("other"), OpenMode::CreateIfMissing),
                          "not a store: an LMDB environment with other contents");
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Sub("other"), OpenMode::MustExist),
                          "not a store: the environment has no \"meta\" database");
}

TEST(LmdbStoreOpening, NewerFormatVersionIsRefused) {
    TempDir dir;
    LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing).reset();
    const std::string marker = std::string("TARNSTOR") + '\x02' + '\0' + '\0' + '\0';
    RawEnvironment(dir.Path())
        .Put("meta", "format", std::span(reinterpret_cast<const octet_t*>(marker.data()), 12));
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist),
                          "store format version 2 is not supported");
}

TEST(LmdbStoreOpening, SecondOpenerIsRefusedUntilTheFirstCloses) {
    TempDir dir;
    auto first = LmdbStore::Open(dir.Path(), OpenMode::CreateIfMissing);
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist), "in use");
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::ReadOnly), "in use");
    first.reset();
    auto reader = LmdbStore::Open(dir.Path(), OpenMode::ReadOnly);
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Path(), OpenMode::MustExist), "in use");
}

TEST(LmdbStoreOpening, ReadOnlyStoreReadsButRefusesCommits) {
    TempDir dir;
    Model model;
    {
        auto store = OpenStore(dir.Path());
        const CommitBatch batch = MakeCommit(1);
        store->Commit(batch);
        model.Apply(batch);
    }
    auto store = LmdbStore::Open(dir.Path(), OpenMode::ReadOnly);
    ExpectStoreHolds(*store, model);
    EXPECT_TARN_ASSERT(store->Commit(CommitBatch{}), "!m_readOnly");
}

TEST(LmdbStoreOpening, IdentityZeroIsNeverWritten) {
    TempDir dir;
    auto store = LmdbStore::Open(dir.Path(), Scratch(OpenMode::CreateIfMissing));
    CommitBatch batch;
    batch.writes.emplace_back(0, StoredImage{});
    EXPECT_TARN_ASSERT(store->Commit(batch), "write.first != 0");
}

TEST(LmdbStoreOpening, UnreadableDirectoryIsReported) {
    if (::geteuid() == 0) {
        GTEST_SKIP() << "permissions do not bind the superuser";
    }
    TempDir dir;
    LmdbStore::Open(dir.Sub("s"), OpenMode::CreateIfMissing).reset();
    fs::permissions(dir.Sub("s"), fs::perms::none);
    EXPECT_ERROR_MENTIONS(LmdbStore::Open(dir.Sub("s"), OpenMode::MustExist), "Permission denied");
    fs::permissions(dir.Sub("s"), fs::perms::owner_all);
}

}  // namespace
}  // namespace tarn

#endif  // TARN_HAVE_LMDB
