// Replicas: each site's stream reaches every replica in the site's order, so a
// replica holds a prefix of every site's stream. `offsetops sites` says how
// far, `offsetops merge` joins two replicas by their records alone, and
// replicas merged in any order end equal to one store given every operation.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolReplica, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <random>

#include "tests/ToolSupport.h"

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;
using Stream = std::vector<tool::OffsetOperation>;

constexpr int kSites = 4;

Guid Site(int n) {
    Guid g{};
    g.Data1 = 0x5e1f0000u + static_cast<uint32>(n);
    g.Data4[7] = static_cast<uint8>(n);
    return g;
}

// Site n's stream: stamps rising by one, fields of `fields` at random.
Stream SiteStream(int n, int64 length, int64 fields, std::mt19937_64& random) {
    Stream ops;
    for (int64 i = 0; i < length; ++i) {
        const uint64 key = random() % static_cast<uint64>(fields);
        const char path[1] = {static_cast<char>(key % 4)};
        ops.push_back({Site(n), i + 1, FieldId(OID(Seid(1 + key / 4)), Path(path, 1)),
                       static_cast<int64>(random() % 101) - 50});
    }
    return ops;
}

// The first prefix[s] operations of every site's stream, interleaved at
// random, each site's in its own order.
std::string Interleaved(const std::vector<Stream>& streams, const std::vector<int64>& prefix,
                        std::mt19937_64& random) {
    std::vector<int64> next(streams.size(), 0);
    std::string text;
    for (;;) {
        std::vector<std::size_t> open;
        for (std::size_t s = 0; s < streams.size(); ++s) {
            if (next[s] < prefix[s]) {
                open.push_back(s);
            }
        }
        if (open.empty()) {
            return text;
        }
        const std::size_t s = open[random() % open.size()];
        text += tool::FormatOpsLine(streams[s][static_cast<std::size_t>(next[s]++)]) + '\n';
    }
}

std::vector<Stream> Streams(int64 length, int64 fields, std::mt19937_64& random) {
    std::vector<Stream> streams;
    for (int s = 0; s < kSites; ++s) {
        streams.push_back(SiteStream(s + 1, length, fields, random));
    }
    return streams;
}

// A new store holding `ops`.
void Recorded(const ScratchDir& dir, const std::string& store, const std::string& name,
              const std::string& ops) {
    RunOk({"record", "--store", store, "--ops", dir.Write(name, ops), "--no-sync"});
}

// Two replicas with other prefixes of every site: the merge gives the longer
// prefix of each site, `sites` names each site's newest stamp, and a record
// with the same stamp and another sum is a conflict, named and left alone.
TEST(ToolReplica, MergeTakesTheLongerPrefixOfEverySiteAndNamesConflicts) {
    ScratchDir dir;
    std::mt19937_64 random(7);
    const std::vector<Stream> streams = Streams(400, 200, random);
    const std::vector<int64> prefixA = {400, 100, 250, 0};
    const std::vector<int64> prefixB = {150, 400, 250, 320};
    std::vector<int64> longer(kSites);
    for (int s = 0; s < kSites; ++s) {
        longer[s] = std::max(prefixA[s], prefixB[s]);
    }
    const std::string a = dir.Sub("a"), b = dir.Sub("b"), whole = dir.Sub("whole");
    Recorded(dir, a, "a.ops", Interleaved(streams, prefixA, random));
    Recorded(dir, b, "b.ops", Interleaved(streams, prefixB, random));
    Recorded(dir, whole, "whole.ops", Interleaved(streams, longer, random));

    // What each has seen: the stamp of its last operation of each site.
    std::string expectedSites;
    for (int s = 0; s < kSites; ++s) {
        if (prefixB[s] > 0) {
            expectedSites += ToString(Site(s + 1)) + " " + std::to_string(prefixB[s]) + "\n";
        }
    }
    EXPECT_EQ(RunOk({"sites", "--store", b}), expectedSites);

    const std::string before = Shown(a);
    const ToolRun dry = Tool({"merge", "--store", a, "--from", b, "--dry-run"});
    EXPECT_EQ(dry.status, 0) << dry.err;
    EXPECT_EQ(Shown(a), before) << "a dry run changed the store";

    const ToolRun merged = Tool({"merge", "--store", a, "--from", b});
    EXPECT_EQ(merged.status, 0) << merged.err;
    EXPECT_EQ(merged.out, "");
    EXPECT_THAT(merged.err, HasSubstr("0 conflicts"));
    const ToolRun diff = Tool({"diff", "--store", a, "--with", whole});
    EXPECT_EQ(diff.status, 0) << diff.out;
    EXPECT_EQ(Tool({"validate", "--store", a}).status, 0);
    EXPECT_EQ(RunOk({"sites", "--store", a}), RunOk({"sites", "--store", whole}));
    // Merging again takes nothing.
    EXPECT_THAT(Tool({"merge", "--store", a, "--from", b}).err, HasSubstr("0 site records taken"));

    // A replica that saw one more offset under a stamp it shares with `a`:
    // the same stamp with another sum.
    const tool::OffsetOperation& last = streams[0][399];
    tool::OffsetOperation extra = last;
    extra.offset = 5;
    const std::string c = dir.Sub("c");
    Recorded(dir, c, "c.ops",
             Interleaved(streams, prefixA, random) + tool::FormatOpsLine(extra) + "\n");
    const std::string aBefore = Shown(a);
    const ToolRun conflict = Tool({"merge", "--store", a, "--from", c});
    EXPECT_EQ(conflict.status, 1) << conflict.err;
    // A's record of that field and site: the sum of site 1's offsets on it.
    int64 sum = 0;
    for (const tool::OffsetOperation& op : streams[0]) {
        if (op.field == last.field) {
            sum += op.offset;
        }
    }
    EXPECT_EQ(conflict.out, "! " + ToString(last.field) + " " + ToString(last.site) + " (400," +
                                std::to_string(sum) + ") (400," + std::to_string(sum + 5) + ")\n");
    EXPECT_THAT(conflict.err, HasSubstr("1 conflict left as they were"));
    EXPECT_EQ(Shown(a), aBefore);

    // Errors: a store merged into itself, a missing one.
    EXPECT_EQ(Tool({"merge", "--store", a, "--from", a}).status, 2);
    EXPECT_EQ(Tool({"merge", "--store", a, "--from", dir.Sub("none")}).status, 2);
}

// Several replicas (each a store written by its own processes) are given
// random prefixes of every site's stream, in random interleavings, and are
// merged in random pairs: in the end every pair is equal, and equal to one
// store given every operation. Fixed seeds keep the run the same each time.
TEST(ToolReplica, ReplicasMergedInRandomPairsConverge) {
    for (uint64 seed : {1u, 2u, 3u}) {
        SCOPED_TRACE("seed " + std::to_string(seed));
        ScratchDir dir;
        std::mt19937_64 random(seed);
        constexpr int kReplicas = 3;
        const int64 length = 300;
        const std::vector<Stream> streams = Streams(length, 150, random);
        std::vector<std::string> replicas;
        std::vector<int64> all(kSites, length);
        for (int r = 0; r < kReplicas; ++r) {
            std::vector<int64> prefix(kSites);
            for (int s = 0; s < kSites; ++s) {
                // Each site's whole stream reaches one replica at least.
                prefix[s] =
                    s % kReplicas == r ? length : static_cast<int64>(random() % (length + 1));
            }
            replicas.push_back(dir.Sub("r" + std::to_string(r)));
            Recorded(dir, replicas.back(), "r" + std::to_string(r) + ".ops",
                     Interleaved(streams, prefix, random));
        }
        const std::string whole = dir.Sub("whole");
        Recorded(dir, whole, "whole.ops", Interleaved(streams, all, random));

        // Random pairs, then a ring twice round, so that every replica has
        // heard from every other.
        std::vector<std::pair<int, int> > merges;
        for (int i = 0; i < 4; ++i) {
            const int into = static_cast<int>(random() % kReplicas);
            const int from = (into + 1 + static_cast<int>(random() % (kReplicas - 1))) % kReplicas;
            merges.emplace_back(into, from);
        }
        for (int round = 0; round < 2; ++round) {
            for (int r = 0; r < kReplicas; ++r) {
                merges.emplace_back((r + 1) % kReplicas, r);
            }
        }
        for (const auto& [into, from] : merges) {
            const ToolRun run =
                Tool({"merge", "--store", replicas[static_cast<std::size_t>(into)], "--from",
                      replicas[static_cast<std::size_t>(from)], "--no-sync"});
            ASSERT_EQ(run.status, 0) << run.out << run.err;
        }
        for (int r = 0; r < kReplicas; ++r) {
            const ToolRun diff =
                Tool({"diff", "--store", replicas[static_cast<std::size_t>(r)], "--with", whole});
            EXPECT_EQ(diff.status, 0) << "replica " << r << "\n" << diff.out.substr(0, 500);
            for (int q = r + 1; q < kReplicas; ++q) {
                EXPECT_EQ(Tool({"diff", "--store", replicas[static_cast<std::size_t>(r)], "--with",
                                replicas[static_cast<std::size_t>(q)]})
                              .status,
                          0);
            }
        }
    }
}

// A merge killed at any moment leaves the store at one of its durable
// points: a merge into an empty store walks the other in key order and makes
// whole fields durable, so the killed store shows a prefix of the other's
// fields, each with the other's table.
TEST(ToolReplica, AMergeKilledAtAnyMomentLeavesADurablePoint) {
    ScratchDir dir;
    std::mt19937_64 random(11);
    const std::vector<Stream> streams = Streams(6000, 20000, random);
    const std::string source = dir.Sub("source");
    Recorded(dir, source, "source.ops",
             Interleaved(streams, std::vector<int64>(kSites, 6000), random));
    const std::string shown = Shown(source);
    for (const char* delay : {"0.02", "0.05", "0.15"}) {
        SCOPED_TRACE(std::string("killed after ") + delay + " s");
        const std::string into = dir.Sub(std::string("into-") + delay);
        Recorded(dir, into, "empty.ops", "");
        const std::string command = std::string("timeout -s KILL ") + delay + " " + OFFSETOPS_PATH +
                                    " merge --store " + into + " --from " + source +
                                    " --commit-every 200 --no-sync >/dev/null 2>&1";
        (void)std::system(command.c_str());
        const ToolRun killed = Tool({"show", "--store", into});
        ASSERT_TRUE(killed.status == 0 || killed.err.find("holds no offsets record") == 0)
            << killed.err;
        EXPECT_EQ(shown.substr(0, killed.out.size()), killed.out);
        EXPECT_EQ(Tool({"validate", "--store", into}).status, 0);
        // Merging again completes it.
        EXPECT_EQ(Tool({"merge", "--store", into, "--from", source}).status, 0);
        EXPECT_EQ(Shown(into), shown);
    }
}

}  // namespace
}  // namespace tarn::testing

#endif
