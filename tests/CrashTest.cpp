// Crash safety of recording: a child process records operations and commits
// every few of them, and is killed with SIGKILL at random moments, many times
// over the same store. After every kill the store must open, pass every check
// of `offsetops validate`, and hold exactly the operations of the child's last
// completed commit: the last one it reported, or the next one when the kill
// came between the commit and its report.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(CrashTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <signal.h>
#include <time.h>

#include <chrono>
#include <random>

#include "tests/ToolSupport.h"
#include "tools/Generator.h"
#include "tools/Reachability.h"
#include "tools/TreeCheck.h"

namespace tarn::testing {
namespace {

using tool::OffsetOperation;

constexpr int64 kCommitEvery = 37;
constexpr int64 kFields = 3000;
constexpr auto kTimeBudget = std::chrono::seconds(20);
constexpr int kMaxRounds = 200;

// Operation i of an endless, fixed stream: three sites whose time stamps rise
// with i, fields spread over kFields keys.
OffsetOperation OpAt(int64 i) {
    uint64 h = static_cast<uint64>(i) * 0x9e3779b97f4a7c15ULL;
    h = (h ^ (h >> 31)) * 0xbf58476d1ce4e5b9ULL;
    h ^= h >> 29;
    OffsetOperation op;
    op.site = tool::Generator::SiteGuid(1 + i % 3);
    op.t = i / 3 + 1;
    op.field = tool::Generator::FieldKey(static_cast<int64>(h % kFields));
    op.offset = static_cast<int64>((h >> 32) % 2001) - 1000;
    return op;
}

// The child: records operations start, start+1, ... into the store until it
// is killed, reporting each commit's count (of this run) on `fd`.
[[noreturn]] void RecordUntilKilled(const std::string& dir, int64 start, int fd) {
    try {
        CSpace space(LmdbStore::Open(dir, OpenMode::CreateIfMissing));
        CSpaceGuard guard(space, LockMode::Exclusive);
        tool::RecordSettings settings;
        settings.commitEvery = kCommitEvery;
        settings.onCommit = [fd](int64 committed) {
            if (::write(fd, &committed, sizeof committed) != sizeof committed) {
                ::_exit(5);
            }
        };
        tool::Recorder recorder(space, settings);
        for (int64 i = start;; ++i) {
            if (!recorder.Record(OpAt(i)).empty()) {
                ::_exit(3);
            }
        }
    } catch (...) {
        ::_exit(4);
    }
}

// The last count the child reported before it died (`last` if none).
int64 LastReport(int fd, int64 last = 0) {
    int64 value = 0;
    while (::read(fd, &value, sizeof value) == sizeof value) {
        last = value;
    }
    return last;
}

// Everything `offsetops validate` checks, in-process; "" when all holds.
std::string Validate(const std::string& dir) {
    CSpace space(LmdbStore::Open(dir, OpenMode::ReadOnly));
    CSpaceGuard guard(space, LockMode::Shared);
    const OID root = space.GetRoot(tool::kRecordRoot);
    if (!root.IsNull()) {
        SpaceRef<OffsetOps> record(space, root);
        const FieldIdToOffsetOpsOnInt64FieldMap& map = *record->m_map;
        tool::TreeCheckResult check = tool::CheckTree(map);
        if (!check.Ok()) {
            return check.problems.front();
        }
        map.Validate();
    }
    tool::ReachabilityResult reach = tool::FindUnreachableImages(space);
    if (!reach.errors.empty()) {
        return reach.errors.front();
    }
    if (!reach.unreachable.empty()) {
        return std::to_string(reach.unreachable.size()) + " unreachable images";
    }
    return {};
}

TEST(CrashTest, KilledRecordingKeepsExactlyItsLastCommit) {
    ScratchDir scratch;
    const std::string dir = scratch.Sub("store");
    std::mt19937 random(20240611);
    std::uniform_int_distribution<int> delayMicros(0, 60000);

    Model model;  // the first `applied` operations
    int64 applied = 0;
    int rounds = 0;
    int unreportedCommits = 0;
    const auto start = std::chrono::steady_clock::now();
    while (rounds < kMaxRounds && std::chrono::steady_clock::now() - start < kTimeBudget) {
        ++rounds;
        int fds[2];
        ASSERT_EQ(::pipe(fds), 0);
        const pid_t pid = ::fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            ::close(fds[0]);
            RecordUntilKilled(dir, applied, fds[1]);
        }
        ::close(fds[1]);
        // Every other round lets the child finish one commit first, so that
        // the history grows however slow the disk is; the others may also
        // kill it while it opens the store or before its first commit.
        int64 first = 0;
        if (rounds % 2 == 0 && ::read(fds[0], &first, sizeof first) != sizeof first) {
            first = 0;
        }
        const int delay = delayMicros(random);
        const timespec pause{0, static_cast<long>(delay) * 1000};
        ::nanosleep(&pause, nullptr);
        ::kill(pid, SIGKILL);
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)
            << "the child ended by itself, status " << status;
        const int64 reported = LastReport(fds[0], first);
        ::close(fds[0]);

        if (!std::filesystem::exists(dir + "/data.mdb")) {
            ASSERT_EQ(reported, 0);  // killed before the store was made
            continue;
        }
        const std::string problem = Validate(dir);
        ASSERT_EQ(problem, "") << "round " << rounds << ", killed after " << delay << " us";
        Model stored = ReadStore(dir);

        // The store holds the reported commit or, if the kill fell between a
        // commit and its report, the one after it.
        Model expected = model;
        for (int64 i = applied; i < applied + reported; ++i) {
            Apply(expected, OpAt(i));
        }
        int64 now = applied + reported;
        if (stored != expected) {
            for (int64 i = now; i < now + kCommitEvery; ++i) {
                Apply(expected, OpAt(i));
            }
            now += kCommitEvery;
            ++unreportedCommits;
        }
        ASSERT_TRUE(stored == expected) << "round " << rounds << ": the store holds neither "
                                        << applied + reported << " nor " << now << " operations";
        model = std::move(expected);
        applied = now;
    }
    EXPECT_GE(rounds, 20);
    EXPECT_GT(applied, 20 * kCommitEvery);
    RecordProperty("rounds", rounds);
    RecordProperty("operations", static_cast<int>(applied));
    RecordProperty("unreportedCommits", unreportedCommits);

    // The program agrees.
    ToolRun run = RunProgram(OFFSETOPS_PATH, {"validate", "--store", dir});
    EXPECT_EQ(run.status, 0) << run.out << run.err;
    EXPECT_EQ(RunProgram(OFFSETOPS_PATH, {"show", "--store", dir}).out, ShowText(model));
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
