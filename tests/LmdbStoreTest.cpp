// The LMDB store: contents survive reopening, commits are atomic even when
// the writer is killed, damage is reported, foreign or missing directories
// are refused, and readers in other processes keep their snapshot beside the
// one writer.

#include "tnRuntime/LmdbStore.h"

#include <gtest/gtest.h>

#ifdef TARN_HAVE_LMDB

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
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
        for (const char* name : {"journal", "c0", "c1", "c2"}) {
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

// Puts one entry straight into a store's environment, to plant what the
// store itself never writes.
void RawPut(const std::string& dir, const char* db, std::string_view key,
            std::span<const octet_t> value) {
    MDB_env* env = nullptr;
    MDB_txn* txn = nullptr;
    MDB_dbi dbi = 0;
    ASSERT_EQ(mdb_env_create(&env), 0);
    mdb_env_set_maxdbs(env, 4);
    MDB_val k{key.size(), const_cast<char*>(key.data())};
    MDB_val v{value.size(), const_cast<octet_t*>(value.data())};
    ASSERT_EQ(mdb_env_open(env, dir.c_str(), 0, 0644), 0);
    ASSERT_EQ(mdb_txn_begin(env, nullptr, 0, &txn), 0);
    EXPECT_EQ(mdb_dbi_open(txn, db, MDB_CREATE, &dbi), 0);
    EXPECT_EQ(mdb_put(txn, dbi, &k, &v, 0), 0);
    EXPECT_EQ(mdb_txn_commit(txn), 0);
    mdb_env_close(env);
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
            bad.roots[std::string(600, 'r')] = 1;
            EXPECT_ERROR_MENTIONS(store->Commit(bad), "commit: setting root 'rrr");
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

TEST(LmdbStoreDamage, FlippedByteTruncatedRecordAndBadMetaEntryAreReported) {
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
    RawPut(dir.Path(), "meta", "next-identity", std::vector<octet_t>{1, 2, 3});
    auto store = LmdbStore::Open(dir.Path(), OpenMode::MustExist);
    EXPECT_ERROR_MENTIONS(store->Load(5), "image #5: checksum mismatch");
    EXPECT_ERROR_MENTIONS(store->Load(5), dir.Path());
    EXPECT_EQ(store->Load(6)->bytes, batch.writes[1].second.bytes);
    EXPECT_ERROR_MENTIONS(store->Load(9), "image #9: truncated record");
    EXPECT_ERROR_MENTIONS(store->NextIdentity(), "meta entry 'next-identity' has 3 bytes");
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
    LmdbStore::Open(dir.Sub("newer"), OpenMode::CreateIfMissing).reset();
    const std::string marker = std::string("TARNSTOR") + '\x02' + '\0' + '\0' + '\0';
    RawPut(dir.Sub("newer"), "meta", "format",
           std::span(reinterpret_cast<const octet_t*>(marker.data()), 12));
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
        {dir.Sub("newer"), OpenMode::MustExist, "store format version 2 is not supported"},
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

#endif  // TARN_HAVE_LMDB
