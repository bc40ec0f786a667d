// Crash safety of recording: a child process records operations and commits
// every few of them, and is killed with SIGKILL at a random moment after its
// first commit, many times over the same store. After every kill
// `offsetops validate` must pass and the store must hold exactly the
// operations of the child's last completed commit: the last one it reported,
// or the next one when the kill came between the commit and its report.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(CrashTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <random>

#include "tests/ToolSupport.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/LmdbStore.h"
#include "tools/Generator.h"
#include "tools/Recorder.h"

namespace tarn::testing {
namespace {

constexpr int64 kCommitEvery = 37;
constexpr int64 kFields = 3000;
// Rounds go on until the time budget is spent, but never fewer than
// kMinRounds however slow the machine, nor more than kMaxRounds.
constexpr auto kTimeBudget = std::chrono::seconds(20);
constexpr int kMinRounds = 20;
constexpr int kMaxRounds = 200;

// Operation i of an endless, fixed stream: three sites whose time stamps rise
// with i, fields visited in a scattered order over kFields keys.
tool::OffsetOperation OpAt(int64 i) {
    return {tool::Generator::SiteGuid(1 + i % 3), i / 3 + 1,
            tool::Generator::FieldKey(i * 7919 % kFields), i * 31 % 2001 - 1000};
}

// The child: records operations start, start+1, ... into the store until it
// is killed, reporting each commit's count (of this run) on `fd`. It ends by
// itself (an exception ends it with SIGABRT) only when something failed.
[[noreturn]] void RecordUntilKilled(const std::string& dir, int64 start, int fd) {
    CSpace space(LmdbStore::Open(dir, OpenMode::CreateIfMissing));
    CSpaceGuard guard(space, LockMode::Exclusive);
    tool::Recorder recorder(
        space, {.commitEvery = kCommitEvery, .onCommit = [fd](int64 committed) {
                    if (::write(fd, &committed, sizeof committed) != sizeof committed) {
                        ::_exit(5);
                    }
                }});
    for (int64 i = start; recorder.Record(OpAt(i)).empty(); ++i) {
    }
    ::_exit(3);
}

TEST(CrashTest, KilledRecordingKeepsExactlyItsLastCommit) {
    ScratchDir scratch;
    const std::string dir = scratch.Sub("store");
    std::mt19937 random(20240611);
    Model model;  // the first `applied` operations
    int64 applied = 0;
    auto apply = [&](int64 count) {
        for (const int64 end = applied + count; applied < end; ++applied) {
            Apply(model, OpAt(applied));
        }
    };
    int rounds = 0, unreportedCommits = 0;
    const auto start = std::chrono::steady_clock::now();
    for (; rounds < kMinRounds ||
           (rounds < kMaxRounds && std::chrono::steady_clock::now() - start < kTimeBudget);
         ++rounds) {
        int fds[2];
        ASSERT_EQ(::pipe(fds), 0);
        const pid_t pid = ::fork();
        if (pid == 0) {
            ::close(fds[0]);
            RecordUntilKilled(dir, applied, fds[1]);
        }
        ::close(fds[1]);
        // The kill lands at a random moment after the child's first commit
        // of this round, so the history grows however slow the disk is.
        int64 reported = 0;
        const bool committed = ::read(fds[0], &reported, sizeof reported) == sizeof reported;
        const timespec delay{0, std::uniform_int_distribution<long>(0, 60'000'000)(random)};
        ::nanosleep(&delay, nullptr);
        ::kill(pid, SIGKILL);
        int status = 0;
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(committed && WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)
            << "the child ended by itself, status " << status;
        for (int64 value = 0; ::read(fds[0], &value, sizeof value) == sizeof value;) {
            reported = value;
        }
        ::close(fds[0]);

        RunOk({"validate", "--store", dir});
        const std::string stored = Shown(dir);
        ASSERT_FALSE(HasFailure())
            << "round " << rounds << ", killed " << delay.tv_nsec << " ns after the first commit";
        // The store holds the reported commit or, if the kill fell between a
        // commit and its report, the one after it.
        apply(reported);
        if (stored != ShowText(model)) {
            apply(kCommitEvery);
            ++unreportedCommits;
        }
        ASSERT_TRUE(stored == ShowText(model))
            << "round " << rounds << ": the store holds neither " << applied - kCommitEvery
            << " nor " << applied << " operations";
    }
    RecordProperty("rounds", rounds);
    RecordProperty("unreportedCommits", unreportedCommits);
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
