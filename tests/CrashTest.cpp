// Crash safety: a child process records an ops file into a store, with a
// durable point every kK operations, and is killed with SIGKILL at a random
// moment: while it opens the store and replays its journal, while it
// appends, while it checkpoints. Many rounds over one store; every round's
// child goes on from the operation of the file where the store ends. After
// every kill the store opens and holds exactly the first N operations of the
// file, N a multiple of kK, and at least as many as the child was told were
// durable.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(CrashTest, NeedsTheOpsFileReader) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build the ops-file reader";
}

#else

#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>

#include "tests/StoreTables.h"
#include "tnStore/OffsetOpsStore.h"
#include "tools/OpsFile.h"

namespace tarn {
namespace {

constexpr int64 kK = 50;
constexpr int64 kFields = 3000;
// The file's length, a multiple of kK: a child that reaches its end waits
// for the kill holding the store.
constexpr int64 kFileOps = 200 * 1000;
// Rounds go on until the time budget is spent, but never fewer than
// kMinRounds however slow the machine, nor more than kMaxRounds.
constexpr auto kTimeBudget = std::chrono::seconds(25);
constexpr int kMinRounds = 30;
constexpr int kMaxRounds = 300;

Guid Site(int64 n) {
    Guid g{};
    g.Data1 = 0x5173e000u + static_cast<uint32>(n);
    g.Data4[7] = static_cast<uint8>(n);
    return g;
}

// Operation i of the file: three sites whose time stamps rise with i, fields
// visited in a scattered order, paths of 0 to 3 bytes.
tool::OffsetOperation OpAt(int64 i) {
    const int64 key = i * 7919 % kFields;
    const char path[3] = {static_cast<char>(key % 7), static_cast<char>(key % 5), '\x7f'};
    return {Site(1 + i % 3), i / 3 + 1,
            FieldId(OID(Seid(static_cast<uint64>(1 + key / 4))), Path(path, key % 4)),
            i * 31 % 2001 - 1000};
}

Tables Model(int64 n) {
    Tables model;
    for (int64 i = 0; i < n; ++i) {
        const tool::OffsetOperation op = OpAt(i);
        auto& so = model[op.field][op.site];
        so.first = op.t;
        so.second += op.offset;
    }
    return model;
}

// The child: opens the store (replaying its journal), then records the ops
// file from the operation where the store ends, a durable point every kK
// operations, reporting each durable count on `fd`, until it is killed.
[[noreturn]] void RecordUntilKilled(const std::string& dir, const std::string& opsFile,
                                    std::size_t journalLimit, ssize_t cacheObjects, int fd) {
    try {
        StoreOptions options;
        options.journalLimitBytes = journalLimit;
        options.cacheObjects = cacheObjects;
        OffsetOpsStore store = OffsetOpsStore::Open(dir, options);
        const auto start = static_cast<int64>(store.Stats().durableOperations);
        std::ifstream in(opsFile);
        tool::OpsFileReader reader(in, opsFile);
        tool::OffsetOperation op;
        std::string error;
        for (int64 i = 0; reader.Next(op, error) == tool::OpsFileReader::Status::Operation; ++i) {
            if (i < start) {
                continue;
            }
            store.Record(Opid(op.site, op.t), op.field, op.offset);
            if ((i + 1) % kK == 0) {
                store.Sync();
                const int64 durable = i + 1;
                if (::write(fd, &durable, sizeof durable) != sizeof durable) {
                    ::_exit(5);
                }
            }
        }
        if (!error.empty()) {
            ::_exit(6);
        }
        // The whole file is durable: say so (the parent may be waiting for a
        // first report), then wait for the kill.
        const int64 durable = std::max(start, kFileOps);
        if (::write(fd, &durable, sizeof durable) != sizeof durable) {
            ::_exit(5);
        }
        ::pause();
        ::_exit(7);
    } catch (const std::exception& e) {
        [[maybe_unused]] const auto written = ::write(2, e.what(), std::strlen(e.what()));
        ::_exit(4);
    }
}

TEST(CrashTest, KilledWriterKeepsExactlyADurablePoint) {
    const std::string dir = ::testing::TempDir() + "/crash-" + std::to_string(::getpid());
    std::filesystem::remove_all(dir);
    OffsetOpsStore::Open(dir).Close();
    const std::string opsFile = dir + ".ops";
    {
        std::ofstream out(opsFile);
        for (int64 i = 0; i < kFileOps; ++i) {
            out << tool::FormatOpsLine(OpAt(i)) << '\n';
        }
    }
    std::mt19937 random(20261123);
    // Small limits checkpoint every few durable points; large ones leave a
    // long journal for the next child to replay.
    const std::size_t limits[] = {2 << 10, 32 << 10, 4 << 20};
    int64 durable = 0;  // the most the store held after a kill
    int rounds = 0;
    const auto start = std::chrono::steady_clock::now();
    for (; rounds < kMinRounds ||
           (rounds < kMaxRounds && std::chrono::steady_clock::now() - start < kTimeBudget);
         ++rounds) {
        int fds[2];
        ASSERT_EQ(::pipe(fds), 0);
        const std::size_t limit = limits[random() % 3];
        // A third of the rounds record within a bound on the tree's objects
        // (of some 50 nodes): changed nodes leave memory through the
        // writer's own file between checkpoints, and operations wait to be
        // applied in key order; what a kill leaves is the same.
        const ssize_t cache = random() % 3 == 0 ? 40 : 0;
        const pid_t pid = ::fork();
        if (pid == 0) {
            ::close(fds[0]);
            RecordUntilKilled(dir, opsFile, limit, cache, fds[1]);
        }
        ::close(fds[1]);
        // Every other round is killed at a random moment from the start (it
        // may still be replaying); the others after their first durable
        // point, so the stream grows however slow the disk is.
        int64 reported = durable;
        if (rounds % 2 == 1) {
            ASSERT_EQ(::read(fds[0], &reported, sizeof reported),
                      static_cast<ssize_t>(sizeof reported))
                << "the child ended before its first durable point";
        }
        const timespec delay{0, std::uniform_int_distribution<long>(0, 40'000'000)(random)};
        ::nanosleep(&delay, nullptr);
        ::kill(pid, SIGKILL);
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)
            << "the child ended by itself, status " << status;
        for (int64 value = 0; ::read(fds[0], &value, sizeof value) == sizeof value;) {
            reported = value;
        }
        ::close(fds[0]);

        StoreOptions read;
        read.mode = StoreMode::Read;
        OffsetOpsStore store = OffsetOpsStore::Open(dir, read);
        const auto n = static_cast<int64>(store.Stats().durableOperations);
        ASSERT_EQ(n % kK, 0) << "round " << rounds;
        ASSERT_GE(n, reported) << "round " << rounds << ": a durable point was lost";
        ASSERT_TRUE(AllTables(store) == Model(n))
            << "round " << rounds << ": the tables are not those of the first " << n
            << " operations";
        durable = n;
    }
    RecordProperty("rounds", rounds);
    RecordProperty("operations", static_cast<int>(durable));
    std::filesystem::remove_all(dir);
    std::filesystem::remove(opsFile);
}

}  // namespace
}  // namespace tarn

#endif  // TARN_HAVE_TOOLS
