// The embedding API: recording and reading back, refusals, durability
// through the journal, readers beside a writer, the cache bound.

#include "tests/StoreTables.h"
#include "tests/StoreTestDir.h"
#include "tnStore/OffsetOpsStore.h"

#include "tnStore/Journal.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>

namespace tarn {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;

using storetest::Site;

FieldId Field(uint64 oid, std::string_view path = "\x01") {
    return FieldId(OID(Seid(oid)), Path(path.data(), static_cast<ssize_t>(path.size())));
}

class StoreDir : public storetest::StoreDirTest {
protected:
    // Runs `body` with a writer in a child process that ends without closing
    // (as a crash would), and waits for it.
    template <class Body>
    void InCrashingChild(Body body) {
        const pid_t pid = ::fork();
        if (pid == 0) {
            {
                OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
                body(store);
                ::_exit(0);
            }
        }
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
};

TEST(OffsetOpsStoreMemory, RecordsFindsAndWalksInKeyOrder) {
    OffsetOpsStore store = OffsetOpsStore::OpenInMemory();
    for (uint64 oid = 300; oid >= 1; --oid) {
        store.Record(Opid(Site(1), 5), Field(oid, "\x02"), 1);
        store.Record(Opid(Site(1), 5), Field(oid, "\x01"), 2);
    }
    store.Record(Opid(Site(2), 9), Field(7), -4);
    store.Record(Opid(Site(1), 6), Field(7), 10);
    EXPECT_EQ(store.Size(), 600);

    // A table's records in site order, and nothing for a field without one.
    EXPECT_EQ(store.Find(Field(7)), (FieldTable{{Site(1), 6, 12}, {Site(2), 9, -4}}));
    EXPECT_EQ(store.Find(Field(7, "\x03")), std::nullopt);

    // From a key between stored keys, across batch boundaries, stopping early.
    std::vector<FieldId> seen;
    store.ForEachFrom(Field(150, std::string_view("\x01\x00", 2)),
                      [&](const FieldId& f, const auto&) {
                          seen.push_back(f);
                          return seen.size() < 400;
                      });
    ASSERT_EQ(seen.size(), 301u);
    EXPECT_EQ(seen.front(), Field(150, "\x02"));
    EXPECT_TRUE(std::is_sorted(seen.begin(), seen.end()));

    std::vector<FieldId> ofObject;
    store.ForEachOfObject(OID(Seid(uint64{42})), [&](const FieldId& f, const auto&) {
        ofObject.push_back(f);
        return true;
    });
    EXPECT_EQ(ofObject, (std::vector<FieldId>{Field(42, "\x01"), Field(42, "\x02")}));

    store.Clear();
    EXPECT_TRUE(store.Empty());
    store.Record(Opid(Site(1), 1), Field(7), 3);  // an older stamp is fine after Clear
    EXPECT_TRUE(store.Check().Ok());
}

TEST(OffsetOpsStoreMemory, RefusalsNameFieldAndSiteAndChangeNothing) {
    OffsetOpsStore store = OffsetOpsStore::OpenInMemory();
    store.Record(Opid(Site(3), 10), Field(5), std::numeric_limits<int64>::max() - 1);
    struct Case {
        Opid opid;
        int64 offset;
        RecordRefused::Reason reason;
        const char* says;
    } cases[] = {
        {Opid(Site(3), 9), 1, RecordRefused::Reason::TimeStampOlder, "older than 10"},
        {Opid(Site(3), 11), 2, RecordRefused::Reason::SumOverflow, "would overflow"},
        {Opid(Site(3), -1), 0, RecordRefused::Reason::TimeStampOutOfRange, "outside 0..4294967295"},
        {Opid(Site(4), 4294967296), 0, RecordRefused::Reason::TimeStampOutOfRange, "outside"},
    };
    for (const Case& c : cases) {
        try {
            store.Record(c.opid, Field(5), c.offset);
            ADD_FAILURE() << c.says;
        } catch (const RecordRefused& e) {
            EXPECT_EQ(e.GetReason(), c.reason);
            EXPECT_EQ(e.Field(), Field(5));
            EXPECT_EQ(e.Site(), c.opid.s);
            EXPECT_THAT(e.what(), HasSubstr(c.says));
            EXPECT_THAT(e.what(), HasSubstr("#5/01"));
            EXPECT_THAT(e.what(), HasSubstr(ToString(c.opid.s)));
        }
    }
    EXPECT_EQ(store.Size(), 1);
    EXPECT_EQ(store.Find(Field(5))->size(), 1u);
    store.Record(Opid(Site(3), 4294967295), Field(5), 1);  // the largest stamp, the largest sum
}

TEST_F(StoreDir, ReopeningReplaysExactlyTheDurableOperations) {
    InCrashingChild([](OffsetOpsStore& store) {
        store.Record(Opid(Site(1), 1), Field(1), 5);
        store.Checkpoint();
        store.Record(Opid(Site(1), 2), Field(1), 6);
        store.Clear();
        store.Record(Opid(Site(2), 1), Field(2), 7);
        store.Sync();
        store.Record(Opid(Site(2), 2), Field(3), 8);  // never durable
    });
    const Tables expected = {{Field(2), {{Site(2), {1, 7}}}}};
    {
        OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, Reading());
        EXPECT_EQ(AllTables(reader), expected);
        EXPECT_EQ(reader.Stats().replayedOperations, 3);
        EXPECT_THROW(reader.Record(Opid(Site(1), 9), Field(1), 1), RuntimeError);
    }
    {
        OffsetOpsStore writer = OffsetOpsStore::Open(m_dir);
        EXPECT_EQ(AllTables(writer), expected);
        const StoreStatistics stats = writer.Stats();
        EXPECT_EQ(stats.durableOperations, 4u);
        EXPECT_EQ(stats.checkpointedOperations, 1u);
        // The refusals hold for what was stored and what was replayed alike.
        EXPECT_THROW(writer.Record(Opid(Site(2), 0), Field(2), 1), RecordRefused);
        EXPECT_THROW(writer.Record(Opid(Site(2), 1), Field(2), std::numeric_limits<int64>::max()),
                     RecordRefused);
        writer.Close();
        EXPECT_THROW(writer.Size(), RuntimeError);
    }
    OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir);
    EXPECT_EQ(AllTables(reopened), expected);
    EXPECT_EQ(reopened.Stats().replayedOperations, 0);  // Close checkpointed
    EXPECT_TRUE(reopened.Validate().Ok());
}

TEST_F(StoreDir, TornJournalTailIsDroppedAndReported) {
    InCrashingChild([](OffsetOpsStore& store) {
        store.Record(Opid(Site(1), 1), Field(1), 5);
        store.Sync();
        store.Record(Opid(Site(1), 2), Field(1), 6);
        store.Sync();
    });
    const std::string journal = m_dir + "/journal";
    fs::resize_file(journal, fs::file_size(journal) - 3);
    OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
    EXPECT_EQ(AllTables(store), (Tables{{Field(1), {{Site(1), {1, 5}}}}}));
    ASSERT_EQ(store.Repairs().size(), 1u);
    EXPECT_THAT(store.Repairs()[0], HasSubstr("incomplete last record"));
}

TEST_F(StoreDir, DamagedOrMissingJournalIsAClearError) {
    InCrashingChild([](OffsetOpsStore& store) {
        for (int t = 1; t <= 3; ++t) {
            store.Record(Opid(Site(1), t), Field(1), t);
            store.Sync();
        }
    });
    const std::string journal = m_dir + "/journal";
    {
        std::fstream f(journal, std::ios::in | std::ios::out | std::ios::binary);
        f.seekp(Journal::kHeaderBytes + Journal::kRecordHeaderBytes + 2);
        f.put('\x55');
    }
    for (StoreMode mode : {StoreMode::Write, StoreMode::Read}) {
        StoreOptions options;
        options.mode = mode;
        try {
            OffsetOpsStore::Open(m_dir, options);
            ADD_FAILURE() << "a damaged journal was accepted";
        } catch (const RuntimeError& e) {
            EXPECT_THAT(e.what(), HasSubstr(journal));
            EXPECT_THAT(e.what(), HasSubstr("damaged"));
        }
    }
    fs::remove(journal);
    try {
        OffsetOpsStore::Open(m_dir);
        ADD_FAILURE() << "a missing journal was accepted";
    } catch (const RuntimeError& e) {
        EXPECT_THAT(e.what(), HasSubstr("is missing"));
    }
}

TEST_F(StoreDir, ReadersSeeDurablePointsBesideAWriterAndSecondWritersAreRefused) {
    OffsetOpsStore writer = OffsetOpsStore::Open(m_dir);
    writer.Record(Opid(Site(1), 1), Field(1), 5);
    writer.Sync();
    writer.Record(Opid(Site(1), 2), Field(1), 6);  // not durable: readers do not see it
    // Other processes: a reader and a second writer.
    const pid_t pid = ::fork();
    if (pid == 0) {
        int failures = 0;
        try {
            OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, Reading());
            failures += AllTables(reader) != Tables{{Field(1), {{Site(1), {1, 5}}}}};
        } catch (const std::exception& e) {
            std::fprintf(stderr, "reader: %s\n", e.what());
            failures += 10;
        }
        try {
            OffsetOpsStore::Open(m_dir);
            failures += 100;
        } catch (const RuntimeError& e) {
            failures += std::string(e.what()).find("in use") == std::string::npos ? 1000 : 0;
        }
        ::_exit(failures);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST_F(StoreDir, ACacheBoundKeepsTheSameTablesWithinTheBound) {
    StoreOptions bounded;
    bounded.cacheObjects = 40;
    bounded.journalLimitBytes = 1 << 14;
    Tables expected;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir, bounded);
        for (int64 i = 0; i < 20000; ++i) {
            const FieldId f = Field(1 + static_cast<uint64>(i * 7919 % 5000));
            store.Record(Opid(Site(1 + i % 2), i), f, i);
            auto& so = expected[f][Site(1 + i % 2)];
            so = {i, so.second + i};
            if (i % 100 == 99) {
                store.Sync();
                EXPECT_LE(store.Stats().residents, bounded.cacheObjects);
            }
        }
        EXPECT_GT(store.Stats().checkpoints, 1);
        EXPECT_EQ(AllTables(store), expected);
        // At all times, not only at durable points: changed nodes leave
        // memory through the writer's overlay between checkpoints.
        EXPECT_LE(store.Stats().peakResidents, bounded.cacheObjects);
    }
    {
        // A reader checks and walks the whole tree within the bound too.
        StoreOptions reading = bounded;
        reading.mode = StoreMode::Read;
        OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, reading);
        EXPECT_TRUE(reader.Check().Ok());
        EXPECT_EQ(AllTables(reader), expected);
        const StoreStatistics stats = reader.Stats();
        EXPECT_GT(stats.Nodes(), bounded.cacheObjects);
        EXPECT_LE(stats.peakResidents, bounded.cacheObjects);
    }
    OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir, bounded);
    EXPECT_EQ(AllTables(reopened), expected);
    EXPECT_TRUE(reopened.Validate().Ok());
    StoreOptions tiny;
    tiny.cacheObjects = 5;
    EXPECT_THROW(OffsetOpsStore::Open(m_dir, tiny).Record(Opid(Site(1), 1 << 20), Field(1), 1),
                 RuntimeError);
}

// A reader with a cache bound keeps to it also while it replays a long
// journal: what replaying changed goes to its overlay, not to the store.
TEST_F(StoreDir, ABoundedReaderReplaysALongJournalWithinTheBound) {
    Tables expected;
    InCrashingChild([&](OffsetOpsStore& store) {
        for (int64 i = 0; i < 20000; ++i) {
            store.Record(Opid(Site(1 + i % 3), i), Field(1 + static_cast<uint64>(i * 7919 % 5000)),
                         i);
            if (i % 100 == 99) {
                store.Sync();
            }
            if (i == 99) {
                store.Checkpoint();
            }
        }
    });
    for (int64 i = 0; i < 20000; ++i) {
        auto& so = expected[Field(1 + static_cast<uint64>(i * 7919 % 5000))][Site(1 + i % 3)];
        so = {i, so.second + i};
    }
    const auto imagesBefore = fs::file_size(m_dir + "/data.mdb");
    StoreOptions reading = Reading();
    reading.cacheObjects = 40;
    {
        OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, reading);
        EXPECT_EQ(AllTables(reader), expected);
        const StoreStatistics stats = reader.Stats();
        EXPECT_EQ(stats.replayedOperations, 19900);
        EXPECT_GT(stats.Nodes(), reading.cacheObjects);
        EXPECT_LE(stats.peakResidents, reading.cacheObjects);
        EXPECT_EQ(reader.Find(Field(1))->size(), 3u);
    }
    EXPECT_EQ(fs::file_size(m_dir + "/data.mdb"), imagesBefore);
    OffsetOpsStore writer = OffsetOpsStore::Open(m_dir);
    EXPECT_EQ(AllTables(writer), expected);
}

// A backup holds the last durable point, whatever the writer recorded since,
// and opens as a store of its own.
TEST_F(StoreDir, BackupsHoldTheLastDurablePointAndOpenAsStores) {
    const std::string copyDir = m_dir + "-copy", compactDir = m_dir + "-compact";
    Tables durable;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
        store.Record(Opid(Site(1), 1), Field(1), 5);
        store.Checkpoint();
        store.Record(Opid(Site(1), 2), Field(2), 6);
        store.Sync();
        durable = AllTables(store);
        store.Record(Opid(Site(1), 3), Field(3), 7);
        const BackupResult copied = store.Backup(copyDir);
        EXPECT_EQ(copied.checkpointedOperations, 1u);
        EXPECT_EQ(copied.durableOperations, 2u);
        // Open in this process: the store's own handle makes its backups.
        EXPECT_THROW(OffsetOpsStore::Backup(m_dir, compactDir), RuntimeError);
        EXPECT_FALSE(fs::exists(compactDir));
    }
    {
        OffsetOpsStore copy = OffsetOpsStore::Open(copyDir, Reading());
        EXPECT_EQ(AllTables(copy), durable);
        EXPECT_TRUE(copy.Validate().Ok());
        EXPECT_TRUE(copy.Repairs().empty());
    }
    BackupOptions compact;
    compact.compact = true;
    EXPECT_EQ(OffsetOpsStore::Backup(m_dir, compactDir, compact).durableOperations, 3u);
    EXPECT_THAT([&] { OffsetOpsStore::Backup(m_dir, compactDir); },
                ::testing::ThrowsMessage<RuntimeError>(HasSubstr("exists and is not empty")));
    {
        OffsetOpsStore copy = OffsetOpsStore::Open(compactDir);
        copy.Record(Opid(Site(1), 4), Field(4), 8);
        EXPECT_EQ(copy.Size(), 4);
    }
    EXPECT_THROW(OffsetOpsStore::OpenInMemory().Backup(m_dir + "-memory"), RuntimeError);
    fs::remove_all(copyDir);
    fs::remove_all(compactDir);
}

}  // namespace
}  // namespace tarn
