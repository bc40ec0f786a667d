// One handle shared by threads: readers beside a writer never see a torn
// table nor a stamp going back, walks see consistent batches, and Sync from
// many threads makes each thread's operations durable. Every offset is 1 and
// each site's stamps count up from 0, so a table whose sum is not its stamp
// + 1 was read half changed. Run under ThreadSanitizer by the test command.

#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "tests/StoreTestDir.h"
#include "tnStore/FieldCursor.h"
#include "tnStore/OffsetOpsStore.h"

namespace tarn {
namespace {

using storetest::Site;

FieldId Field(uint64 n) {
    return FieldId(OID(Seid(1 + n)), Path("\x07", 1));
}

// What the readers found wrong; the test fails on anything but zeros.
struct Faults {
    std::atomic<int64> torn{0};
    std::atomic<int64> wentBack{0};
    std::atomic<int64> reads{0};
};

// A reader's view of the stamps it saw, per field and site.
class StampsSeen {
public:
    // Checks one table read: each sum is its stamp + 1, no stamp below one
    // seen before.
    void Check(const FieldId& field, const FieldTable& table, Faults& faults) {
        for (const SiteRecord& r : table) {
            if (r.o != r.t + 1) {
                ++faults.torn;
            }
            int64& seen = m_seen[{field, r.site}];
            if (r.t < seen) {
                ++faults.wentBack;
            }
            seen = r.t;
        }
        ++faults.reads;
    }

private:
    std::map<std::pair<FieldId, Guid>, int64> m_seen;
};

struct Shape {
    uint64 fields;
    uint32 sites;
    int64 rounds;
    int syncEvery;        // operations between durable points
    int checkpointEvery;  // rounds between checkpoints
};

// Round r gives every field and site the stamp r and adds 1.
void Write(OffsetOpsStore& store, const Shape& shape) {
    int sinceSync = 0;
    for (int64 round = 0; round < shape.rounds; ++round) {
        for (uint64 f = 0; f < shape.fields; ++f) {
            for (uint32 s = 0; s < shape.sites; ++s) {
                store.Record(Opid(Site(s + 1), round), Field(f), 1);
                if (++sinceSync == shape.syncEvery) {
                    store.Sync();
                    sinceSync = 0;
                }
            }
        }
        if ((round + 1) % shape.checkpointEvery == 0) {
            store.Checkpoint();
        }
    }
    store.Sync();
}

// Finds random fields, walks from random ones and reads the statistics
// until the writer is done.
void Read(OffsetOpsStore& store, const Shape& shape, uint32 seed, const std::atomic<bool>& done,
          Faults& faults) {
    std::mt19937_64 random(seed);
    StampsSeen seen;
    uint64 lastDurable = 0;
    while (!done.load()) {
        const FieldId field = Field(random() % shape.fields);
        if (std::optional<FieldTable> table = store.Find(field)) {
            seen.Check(field, *table, faults);
        }
        if (random() % 16 == 0) {
            int left = 300;
            store.ForEachFrom(field, [&](const FieldId& f, const FieldTable& t) {
                seen.Check(f, t, faults);
                return --left > 0;
            });
        }
        if (random() % 32 == 0) {
            const StoreStatistics stats = store.Stats();
            if (stats.durableOperations < lastDurable) {
                ++faults.wentBack;
            }
            lastDurable = stats.durableOperations;
        }
    }
}

class StoreThreads : public storetest::StoreDirTest {
protected:
    // A writer thread and `readers` reader threads on one handle, then the
    // whole record checked.
    void ReadersBesideAWriter(const StoreOptions& options, const Shape& shape, int readers,
                              uint32 seed) {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir, options);
        std::atomic<bool> done{false};
        Faults faults;
        std::vector<std::thread> threads;
        for (int i = 0; i < readers; ++i) {
            threads.emplace_back(
                [&, i] { Read(store, shape, seed + static_cast<uint32>(i), done, faults); });
        }
        Write(store, shape);
        done = true;
        for (std::thread& t : threads) {
            t.join();
        }
        EXPECT_EQ(faults.torn.load(), 0);
        EXPECT_EQ(faults.wentBack.load(), 0);
        EXPECT_GT(faults.reads.load(), 0);
        ExpectComplete(store, shape);
        store.Close();
        OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir, Reading());
        ExpectComplete(reopened, shape);
    }

    static void ExpectComplete(OffsetOpsStore& store, const Shape& shape) {
        EXPECT_EQ(store.Size(), static_cast<int64>(shape.fields));
        int64 wrong = 0;
        store.ForEach([&](const FieldId&, const FieldTable& table) {
            for (const SiteRecord& r : table) {
                wrong += r.t != shape.rounds - 1 || r.o != shape.rounds;
            }
            wrong += table.size() != shape.sites;
            return true;
        });
        EXPECT_EQ(wrong, 0);
    }
};

TEST_F(StoreThreads, ReadersBesideAWriterSeeNoTornTableAndNoStampGoingBack) {
    ReadersBesideAWriter(StoreOptions(), Shape{400, 3, 12, 97, 4}, 2, 11);
}

// A bounded store releases nodes, defers operations and checkpoints while
// the readers read; its reads take turns with each other.
TEST_F(StoreThreads, ABoundedStoreKeepsItsBoundAndItsTablesWhileThreadsRead) {
    StoreOptions bounded;
    bounded.cacheObjects = 40;
    ReadersBesideAWriter(bounded, Shape{1500, 2, 6, 211, 3}, 2, 23);
}

// Each thread records and syncs its own field; after every Sync its own
// operations are durable, whoever appended them.
TEST_F(StoreThreads, SyncFromManyThreadsMakesEachThreadsOperationsDurable) {
    constexpr int kThreads = 8;
    constexpr int64 kRounds = 60;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
        std::vector<std::thread> threads;
        for (int i = 0; i < kThreads; ++i) {
            threads.emplace_back([&store, i] {
                for (int64 t = 0; t < kRounds; ++t) {
                    store.Record(Opid(Site(static_cast<uint32>(i) + 1), t), Field(i), 1);
                    store.Sync();
                }
            });
        }
        for (std::thread& t : threads) {
            t.join();
        }
        const StoreStatistics stats = store.Stats();
        EXPECT_EQ(stats.durableOperations, static_cast<uint64>(kThreads * kRounds));
        EXPECT_EQ(stats.pendingOperations, 0);
    }
    OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir, Reading());
    for (int i = 0; i < kThreads; ++i) {
        const std::optional<FieldTable> table = reopened.Find(Field(i));
        ASSERT_TRUE(table.has_value());
        ASSERT_EQ(table->size(), 1u);
        EXPECT_EQ((*table)[0].t, kRounds - 1);
        EXPECT_EQ((*table)[0].o, kRounds);
    }
}

// Close from one thread while others read: the reads in progress end first,
// later ones throw, and nothing crashes.
TEST_F(StoreThreads, CloseWaitsForReadsInProgressAndLaterCallsThrow) {
    OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
    for (uint64 f = 0; f < 300; ++f) {
        store.Record(Opid(Site(1), 0), Field(f), 1);
    }
    std::atomic<int64> closedErrors{0};
    std::atomic<bool> started{false};
    std::vector<std::thread> readers;
    for (int i = 0; i < 2; ++i) {
        readers.emplace_back([&] {
            for (int n = 0; n < 2000; ++n) {
                try {
                    store.ForEach([](const FieldId&, const FieldTable&) { return true; });
                    started = true;
                } catch (const RuntimeError&) {
                    ++closedErrors;
                    return;
                }
            }
        });
    }
    while (!started.load()) {
        std::this_thread::yield();
    }
    store.Close();
    for (std::thread& t : readers) {
        t.join();
    }
    EXPECT_THROW(store.Find(Field(1)), RuntimeError);
    OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir, Reading());
    EXPECT_EQ(reopened.Size(), 300);
}

}  // namespace
}  // namespace tarn
