// The offsetops program: its ops-line parser in-process, and the
// program itself as a child process: record, show, dump, validate, stats and
// clear in separate processes; readers beside a writer; refused input; wrong
// arguments; damaged, foreign and missing stores; a bounded cache.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <gmock/gmock.h>

#include <algorithm>
#include <functional>
#include <set>
#include <sstream>

#include "tests/ToolSupport.h"
#include "tnBackends/LmdbStore.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/SpaceRef.h"
#include "tnStore/OffsetOpsStore.h"
#include "tools/Generator.h"

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;
using tool::Generator;
using tool::ParsedLine;

const std::string kSiteA = "00000000-0000-4000-8000-00000000000a";
const std::string kSiteB = "00000000-0000-4000-8000-00000000000b";
const std::string kBom = "\xEF\xBB\xBF";

// ---------------------------------------------------------------------------

TEST(OpsFileParsing, ReadsFieldsAroundBlanksAndCommentsAndSaysWhatIsWrongWithALine) {
    const std::string site = "00000000-0000-4000-8000-000000000001";
    const std::string extremes = site + ",4294967295,18446744073709551615,,-9223372036854775808";
    // A line, and "= " its operation as the program writes it, "nothing", or
    // what is wrong with it.
    const std::vector<std::pair<std::string, std::string> > cases = {
        {" 0123abcd-0000-4000-8000-00000000002A , 17,\t42, 0aFF ,-9 # note\r",
         "= 0123abcd-0000-4000-8000-00000000002a,17,42,0aff,-9"},
        {site + ",0,1,,+5", "= " + site + ",0,1,,5"},
        {extremes, "= " + extremes},
        {"   # only a comment", "nothing"},
        {" \t\r", "nothing"},
        {site + ",1,2,ab", "expected 5 comma-separated fields"},
        {site + ",1,2,ab,3,4", "found 6"},
        {"0000-0000,1,2,ab,3", "site '0000-0000' is not a Guid"},
        {site + ",,2,ab,3", "the time stamp is missing"},
        {site + ",x1,2,ab,3", "time stamp 'x1' is not a decimal integer"},
        {site + ",-1,2,ab,3", "time stamp -1 is outside 0..4294967295"},
        {site + ",99999999999999999999,2,ab,3", "is outside 0..4294967295"},
        {site + ",1,0,ab,3", "oid 0 names no object"},
        {site + ",1,-2,ab,3", "oid '-2' is not an unsigned decimal integer"},
        {site + ",1,18446744073709551616,ab,3", "does not fit in 64 bits"},
        {site + ",1,2,abc,3", "odd number of hex digits"},
        {site + ",1,2,zz,3", "path 'zz' is not hex"},
        {site + ",1,2,ab,", "the offset is missing"},
        {site + ",1,2,ab,9223372036854775808", "offset 9223372036854775808 does not fit"},
    };
    for (const auto& [line, expected] : cases) {
        const ParsedLine p = tool::ParseOpsLine(line);
        EXPECT_THAT(p.kind == ParsedLine::Kind::Operation ? "= " + tool::FormatOpsLine(p.op)
                    : p.kind == ParsedLine::Kind::Nothing ? "nothing"
                                                          : p.error,
                    HasSubstr(expected))
            << line;
    }
    EXPECT_EQ(ToString(*ParseFieldId("12", nullptr)), "#12/");
}

// ---------------------------------------------------------------------------

// record, show, validate, stats, dump and clear in separate processes; a
// writer with readers beside it, each of which sees one of its durable
// points, and a second writer refused at once.
TEST(ToolRoundTrip, RecordShowValidateStatsDumpAndClearInSeparateProcesses) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    Model model = ModelOf(Generated({3000, 400, 3, 11}));
    const std::string fields = std::to_string(model.size());
    const std::string rec = RunOk({"record", "--store", store, "--generate", "3000", "--fields",
                                   "400", "--sites", "3", "--seed", "11", "--commit-every", "25"});
    EXPECT_EQ(RowValue(rec, "operations"), "3000");
    EXPECT_EQ(RowValue(rec, "fields"), fields);
    EXPECT_EQ(RowValue(rec, "height"), "1");
    EXPECT_EQ(RowValue(rec, "durable points"), "120");
    EXPECT_EQ(Shown(store), ShowText(model));
    const auto& [someField, someSites] = *std::next(model.begin(), 17);
    EXPECT_EQ(RunOk({"show", "--store", store, "--field", ToString(someField)}),
              ShowText({{someField, someSites}}));
    EXPECT_EQ(RunOk({"show", "--store", store, "--limit", "5"}),
              ShowText(Model(model.begin(), std::next(model.begin(), 5))) + "(5 of " + fields +
                  " fields shown)\n");
    EXPECT_THAT(RunOk({"validate", "--store", store}), HasSubstr("\nvalid\n"));
    std::string stats = RunOk({"stats", "--store", store});
    EXPECT_EQ(RowValue(stats, "fields"), fields);
    EXPECT_EQ(RowValue(stats, "height"), "1");
    EXPECT_EQ(RowValue(stats, "ops since checkpoint"), "0");
    EXPECT_EQ(RunOk({"dump", "--store", store}).rfind("Height = 1\n{\n", 0), 0u);

    // A second generating run continues each site's stored time stamps, and
    // so does a writer reading 1500 operations from standard input: some
    // 100 KB, more than a pipe holds, so once they are written the writer has
    // opened the store.
    model = ModelOf(Generated({500, 400, 3, 12}, model), model);
    RunOk({"record", "--store", store, "--generate", "500", "--fields", "400", "--sites", "3",
           "--seed", "12"});
    std::set<std::string> durablePoints{ShowText(model)};  // what show may print meanwhile
    const std::string ops = HundredsAfter(model, 400, 3, 13, 28, durablePoints);
    const ToolRun run = ToolBeside(
        {"record", "--store", store, "--ops", "-", "--commit-every", "100", "--journal-limit", "0"},
        ops, [&] {
            EXPECT_EQ(durablePoints.count(Shown(store)), 1u);
            RunOk({"stats", "--store", store});
            RunOk({"validate", "--store", store});
            for (const ToolRun& refused : {Tool({"record", "--store", store, "--ops", "-"}),
                                           Tool({"clear", "--store", store})}) {
                EXPECT_EQ(refused.status, 1);
                EXPECT_THAT(refused.err, OneLineWith("in use"));
            }
        });
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(Shown(store), ShowText(model));

    // Clearing leaves an empty record, which takes old time stamps again.
    EXPECT_THAT(RunOk({"clear", "--store", store}), HasSubstr("cleared "));
    EXPECT_EQ(Shown(store), "");
    stats = RunOk({"stats", "--store", store});
    EXPECT_EQ(RowValue(stats, "images"), "2");  // the record and the map header
    EXPECT_EQ(RowValue(stats, "height"), "-1");
    RunOk({"validate", "--store", store});
    RunOk({"record", "--store", store, "--ops", "-"}, kSiteA + ",1,5,,3\n");
    EXPECT_EQ(Shown(store), ShowText(ModelOf(kSiteA + ",1,5,,3\n")));
}

// Wrong arguments (status 2), and refused input and stores that cannot serve
// (status 1): one line on standard error names the fault, no store is made
// where none was, and a run stopped by a refused line keeps everything before
// it, nothing from it on.
TEST(ToolErrors, EachEndsWithOneLineAndItsStatusKeepingWhatCameBefore) {
    ScratchDir dir;
    const std::string store = dir.Sub("store"), missing = dir.Sub("missing");
    const std::string empty = dir.Sub("empty"), ops = dir.Sub("ops.txt");
    // Extremes stored as given, and a site with no time stamps left.
    const std::string first = kSiteA + ",4294967295,5,,9223372036854775807\n" + kSiteB +
                              ",0,5,,-9223372036854775808\n" + ToString(Generator::SiteGuid(1)) +
                              ",4294967295,6,,1\n";
    RunOk({"record", "--store", store, "--ops", "-"}, first);
    Model model = ModelOf(first);
    LmdbStore::Open(empty, OpenMode::CreateIfMissing).reset();
    const std::string help = " (see 'offsetops --help')";
    const std::vector<std::string> record{"record", "--store",        store, "--ops",
                                          ops,      "--commit-every", "2"};
    auto generate = [&](const std::string& option, const std::string& value) {
        return std::vector<std::string>{"record", "--store", missing, "--generate",
                                        "3",      option,    value};
    };
    const std::string tooSmall = " is too small: a tree of height ";
    // `kept` lines of the ops file come before `input`.
    struct Case {
        std::vector<std::string> args;
        int status;
        std::string message;
        std::string input = {};
        std::string kept = {};
    };
    std::vector<Case> cases = {
        {{},
         2,
         "a command is needed: record, show, export, diff, backup, sites, merge, compact, dump, "
         "validate, "
         "stats or clear" +
             help},
        {{"frobnicate"},
         2,
         "unknown command 'frobnicate': use record, show, export, diff, backup, sites, merge, "
         "compact, "
         "dump, validate, "
         "stats or"},
        {{"--bogus", "show"}, 2, "unknown option '--bogus': options follow the command" + help},
        {{"stats", "--store", store, "-x"}, 2, "option '-x' for stats (see 'offsetops stats --"},
        {{"validate", "--store", store, "extra"}, 2, "unexpected argument 'extra' for validate"},
        {{"record", "--store", missing}, 2, "record needs --ops FILE or --generate N"},
        {{"record", "--ops", ops}, 2, "record needs --store DIR"},
        {{"show", "--store"}, 2, "--store needs a value"},
        {{"show", "--store", store, "--store", store}, 2, "--store is given 2 times; give it once"},
        {{"record", "--store", missing, "--ops", ops, "--generate", "5"}, 2, "not both"},
        {{"record", "--store", missing, "--ops", ops, "--fields", "3"}, 2, "--fields goes with --"},
        {generate("--commit-every", "0"), 2,
         "every must be a whole number from 1 to 1000000000, got 0"},
        {generate("--commit-every", "99999999999999999999"), 2, "1000000000, got 999999"},
        {generate("--sites", "x"), 2, "--sites must be a whole number from 1 to 1000000, got 'x'"},
        {generate("--seed", "18446744073709551616"), 2, "to 18446744073709551615, got 1844"},
        {generate("--journal-limit", "-1"), 2, "--journal-limit must be a whole number from 0"},
        {generate("--cache-nodes", "+5"), 2, "be 0 (no bound) or a whole number up to 1000000000"},
        {generate("--cache-nodes", "5"), 2,
         "--cache-nodes 5" + tooSmall + "0 needs at least " +
             std::to_string(OffsetOpsStore::MinCacheObjects(0)) + " objects in memory"},
        {{"record", "--store", missing, "--generate", "-3"}, 2, "from 0 to 1000000000000, got -3"},
        {{"show", "--store", store, "--field", "xyz"}, 2, "expected OID/PATH"},
        {{"show", "--store", store, "--limit", "-1"},
         2,
         "--limit must be a whole number from 0 to"},
        {{"record", "--store", missing, "--ops", dir.Sub("none")}, 1, "cannot open ops file"},
        {{"record", "--store", missing, "--ops", empty}, 1, "is a directory"},
        {{"show", "--store", empty}, 1, "holds no offsets record"},
        {{"show", "--store", store, "--field", "#999999/"}, 1, "no offsets recorded for field"},
        {{"record", "--store", store, "--generate", "9", "--sites", "1"},
         1,
         "generated operation 1: site " + ToString(Generator::SiteGuid(1)) + " has no time stamps"},
        // The tree outgrows the bound mid-run: the operation that would
        // pass it changes nothing, everything before it is made durable.
        {{"record", "--store", dir.Sub("grown"), "--generate", "500", "--cache-nodes", "12",
          "--commit-every", "100"},
         1,
         "--cache-nodes 12" + tooSmall + "1 needs at least " +
             std::to_string(OffsetOpsStore::MinCacheObjects(1)) +
             " objects in memory, and the tree has grown to that height; stopped there: the "
             "264 operations of this run before it are durable, nothing from it on"},
        {record, 1,
         "ops.txt:5: offset '3x' is not a signed decimal integer; stopped there: the 3 "
         "operations of this run before it are durable, nothing from it on; to go on after "
         "fixing it: offsetops record --store " +
             store + " --ops " + ops + " --skip 4",
         kSiteA + ",3,8,,3x\n" + kSiteA + ",4,9,,1\n",
         kSiteA + ",1,7,0a,3\n" + kSiteB + ",2,7,0a,4\n# comment\n" + kSiteA + ",2,8,,-1\n"},
        // Equal stamps, and an older one on another field, are taken.
        {record, 1,
         "ops.txt:5: time stamp 4 of site " + kSiteA +
             " is older than 5, the one recorded for field #7/0a; stopped there: the 4 "
             "operations",
         kSiteA + ",4,7,0a,1\n" + kSiteA + ",9,9,,1\n",
         kSiteA + ",5,7,0a,3\n" + kSiteA + ",5,7,0a,4\n" + kSiteB + ",3,7,0a,1\n" + kSiteA +
             ",1,9,,1\n"},
        // A byte order mark starts the first line only; CRLF ends lines.
        {record, 1, "ops.txt:3: site '" + kBom + kSiteB + "' is not a Guid",
         kBom + kSiteB + ",1,9,,1\r\n", kBom + kSiteB + ",4,9,,1\r\n" + kSiteB + ",5,9,,1\r\n"},
        {record, 1,
         "ops.txt:1: time stamp 4294967296 is outside 0..4294967295 (time stamps are "
         "stored as 32-bit values)",
         kSiteB + ",4294967296,7,,1\n"},
        {record, 1,
         "ops.txt:1: time stamp 7 of site " + kSiteA +
             " is older than 4294967295, the one recorded for field #5/",
         kSiteA + ",7,5,,1\n"},
        {record, 1, "ops.txt:1: offset 1 would overflow the sum 9223372036854775807",
         kSiteA + ",4294967295,5,,1\n"},
    };
    for (const char* command : {"show", "dump", "validate", "stats", "clear"}) {
        cases.push_back(
            {{command, "--store", missing},
             1,
             "store '" + missing + "' does not exist; 'offsetops record' creates stores"});
    }
    for (const Case& c : cases) {
        dir.Write("ops.txt", c.kept + c.input);
        ToolRun run = Tool(c.args);
        EXPECT_EQ(run.status, c.status) << ::testing::PrintToString(c.args);
        EXPECT_EQ(run.out, "") << ::testing::PrintToString(c.args);
        EXPECT_THAT(run.err, OneLineWith(c.message)) << ::testing::PrintToString(c.args);
        model = ModelOf(c.kept, model);
    }
    EXPECT_FALSE(fs::exists(missing));
    EXPECT_EQ(Shown(store), ShowText(model));
    RunOk({"validate", "--store", store});
    RunOk({"validate", "--store", dir.Sub("grown")});
    EXPECT_THAT(RunOk({"--help"}), HasSubstr("record"));
}

// ---------------------------------------------------------------------------

// Changes the image of `oid` in the store's data file, as a failing disk
// would; `patch` gets the file's bytes and where the image's bytes begin.
void DamageOnDisk(const std::string& dir, uint64 oid,
                  const std::function<void(std::string&, std::size_t)>& patch) {
    const std::vector<octet_t> image = LmdbStore::Open(dir, OpenMode::ReadOnly)->Load(oid)->bytes;
    const std::string bytes(image.begin(), image.end());
    std::string file = ReadFile(dir + "/data.mdb");
    const std::size_t at = file.find(bytes);
    ASSERT_TRUE(at != std::string::npos && file.find(bytes, at + 1) == std::string::npos);
    patch(file, at);
    std::ofstream(dir + "/data.mdb", std::ios::binary) << file;
}

// Stores the image of `from` under `to` through the store, framed and
// checksummed as the store writes every image.
void CopyImage(const std::string& dir, uint64 from, uint64 to) {
    auto store = LmdbStore::Open(dir, OpenMode::MustExist);
    CommitBatch batch;
    batch.writes.emplace_back(to, *store->Load(from));
    batch.nextIdentity = std::max(store->NextIdentity(), to + 1);
    store->Commit(batch);
}

// Damaged images, and images of the wrong class, are reported by every
// command that reads them: status 1, one line naming the image or the class.
TEST(ToolStores, DamagedAndForeignImagesAreReportedNotCrashedOn) {
    ScratchDir dir;
    const std::string base = dir.Sub("base");
    RunOk({"record", "--store", base, "--generate", "3000", "--fields", "1000"});
    // Without free pages, every image's bytes are in the file once.
    RunOk({"compact", "--store", base});
    uint64 record = 0, root = 0, leaf = 0;  // the first leaf
    {
        StoreOptions read;
        read.mode = StoreMode::Read;
        record = OffsetOpsStore::Open(base, read).Validate().record.value_;
        CSpace space(LmdbStore::Open(base, OpenMode::ReadOnly));
        CSpaceGuard guard(space, LockMode::Shared);
        SpaceRef<OffsetOps> r(space, OID(Seid(record)));
        ASSERT_EQ(r->m_map->m_height, 1);
        root = r->m_map->m_root.m_oid.value_;
        leaf = r->m_map->m_firstLeaf.m_oid.value_;
    }
    // A flipped bit in the image, and a length (little-endian, just before
    // the image) that claims more bytes than the record holds.
    auto flip = [](std::string& file, std::size_t at) { file[at + 20] ^= 0x10; };
    auto cut = [](std::string& file, std::size_t at) { file[at - 1] = 1; };
    // How to damage a store, and what the commands then name: a leaf image
    // in the root's place is refused by the check of nodes as they load
    // (lookups, walks) or by the whole-tree check (validate, dump, clear).
    using ::testing::AnyOf;
    const std::vector<
        std::pair<std::function<void(const std::string&)>, ::testing::Matcher<std::string> > >
        damages = {
            {[&](auto& s) { DamageOnDisk(s, leaf, flip); },
             HasSubstr("image #" + std::to_string(leaf) + ": checksum mismatch")},
            {[&](auto& s) { DamageOnDisk(s, root, cut); },
             HasSubstr("image #" + std::to_string(root) + ": truncated record")},
            {[&](auto& s) { CopyImage(s, root, record); },
             HasSubstr("where 'tarn::OffsetOps' was expected")},
            {[&](auto& s) { CopyImage(s, leaf, root); },
             AnyOf(HasSubstr("'tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode' where"),
                   HasSubstr("node #" + std::to_string(root) +
                             " is a leaf where the root of a tree of height 1 needs an "
                             "internal node at level 1"))},
        };
    // `stats` is not among them: it answers from the counts the store keeps
    // and reads no node. The record touches the first leaf (field #1/).
    const std::string firstField =
        dir.Write("first-field.ops", "0123abcd-0000-4000-8000-0000000000ff,1,1,,1\n");
    const std::vector<std::vector<std::string> > commands = {
        {"show"},     {"show", "--field", "#1/"},      {"dump"},
        {"validate"}, {"record", "--ops", firstField}, {"clear"},
        {"export"}};
    for (std::size_t d = 0; d < damages.size(); ++d) {
        const std::string store = dir.Sub("damaged" + std::to_string(d));
        fs::copy(base, store, fs::copy_options::recursive);
        damages[d].first(store);
        for (std::vector<std::string> args : commands) {
            args.insert(args.begin() + 1, {"--store", store});
            ToolRun run = Tool(args);
            EXPECT_EQ(run.status, 1) << ::testing::PrintToString(args) << run.err;
            EXPECT_THAT(run.err, OneLineWith("")) << ::testing::PrintToString(args);
            EXPECT_THAT(run.out + run.err, damages[d].second) << ::testing::PrintToString(args);
        }
    }

    // Images no root reaches fail validation only; the tables are intact.
    CopyImage(base, leaf, 999999);
    ToolRun run = Tool({"validate", "--store", base});
    EXPECT_EQ(run.status, 1);
    EXPECT_THAT(run.out, HasSubstr("problem: 1 image that no root reaches: #999999"));
    EXPECT_THAT(run.err, OneLineWith("validation of"));
    EXPECT_NE(Shown(base), "");

    // A bound below what the stored tree needs: refused before recording.
    run = Tool({"record", "--store", base, "--generate", "1", "--cache-nodes", "15"});
    EXPECT_EQ(run.status, 2);
    EXPECT_THAT(run.err, OneLineWith("--cache-nodes 15 is too small: a tree of height 1 needs at "
                                     "least " +
                                     std::to_string(OffsetOpsStore::MinCacheObjects(1))));
}

// ---------------------------------------------------------------------------

// 200,000 generated operations, some 1,000 nodes, with a cache of 100
// objects: every table as without a bound.
TEST(ToolCache, BoundedRunStaysNearItsBoundAndKeepsEveryTable) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string out =
        RunOk({"record", "--store", store, "--generate", "200000", "--fields", "100000", "--sites",
               "2", "--no-sync", "--cache-nodes", "100", "--commit-every", "10"});
    EXPECT_GT(std::stoll(RowValue(out, "nodes")), 700);
    // The bound holds at all times: before each operation the store makes
    // room for the most it can make resident.
    EXPECT_LE(std::stoll(RowValue(out, "peak residents")), 100) << out;
    EXPECT_TRUE(Shown(store) == ShowText(ModelOf(Generated({200000, 100000, 2, 1}))));
    RunOk({"validate", "--store", store});
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
