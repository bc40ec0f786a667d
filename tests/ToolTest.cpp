// The offsetops program: its ops-line parser and generator in-process, and the
// program itself as a child process: record, show, dump, validate, stats and
// clear in separate processes; refused input; wrong arguments; damaged,
// foreign and missing stores; a bounded cache.

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

#include "tests/ToolSupport.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/LmdbStore.h"
#include "tools/Generator.h"
#include "tools/Recorder.h"

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;
using tool::Generator;
using tool::ParsedLine;

const std::string kSiteA = "00000000-0000-4000-8000-00000000000a";
const std::string kSiteB = "00000000-0000-4000-8000-00000000000b";

// The program's error report: one line, naming `part`.
auto OneLineWith(const std::string& part) {
    return ::testing::AllOf(::testing::MatchesRegex("offsetops: [^\n]*\n"), HasSubstr(part));
}

// The value of a "label   value" row of the program's output.
std::string RowValue(const std::string& out, const std::string& label) {
    const std::size_t row = ("\n" + out).find("\n" + label + ' ');
    if (row == std::string::npos) {
        return {};
    }
    const std::size_t at = out.find_first_not_of(' ', row + label.size());
    return out.substr(at, out.find('\n', at) - at);
}

// The tables the operations of an ops text make.
Model ModelOf(const std::string& opsText) {
    Model model;
    std::istringstream in(opsText);
    for (std::string line; std::getline(in, line);) {
        ParsedLine p = tool::ParseOpsLine(line);
        if (p.kind == ParsedLine::Kind::Operation) {
            Apply(model, p.op);
        }
    }
    return model;
}

// The generator's operations as an ops text, with comments and blank lines.
std::string Generated(const tool::GeneratorSettings& settings, const Model& stored = {}) {
    std::map<Guid, int64> last;  // each site's largest stored time stamp
    for (const auto& [field, sites] : stored) {
        for (const auto& [site, so] : sites) {
            last[site] = std::max(last[site], so.t);
        }
    }
    Generator gen(settings, last);
    std::string text = "# generated\n";
    tool::OffsetOperation op;
    std::string error;
    while (gen.Next(op, error)) {
        text += tool::FormatOpsLine(op) + (gen.Made() % 7 == 0 ? "  # seventh\n\n" : "\n");
    }
    EXPECT_EQ(error, "");
    return text;
}

// ---------------------------------------------------------------------------

TEST(OpsFileParsing, ReadsFieldsAroundBlanksAndCommentsAndSaysWhatIsWrongWithALine) {
    const std::string site = "00000000-0000-4000-8000-000000000001";
    ParsedLine p =
        tool::ParseOpsLine(" 0123abcd-0000-4000-8000-00000000002A , 17,\t42, 0aFF ,-9 # note\r");
    ASSERT_EQ(p.kind, ParsedLine::Kind::Operation) << p.error;
    EXPECT_EQ(tool::FormatOpsLine(p.op), "0123abcd-0000-4000-8000-00000000002a,17,42,0aff,-9");
    p = tool::ParseOpsLine(site + ",0,1,,+5");
    ASSERT_EQ(p.kind, ParsedLine::Kind::Operation) << p.error;
    EXPECT_EQ(tool::FormatOpsLine(p.op), site + ",0,1,,5");
    p = tool::ParseOpsLine(site + ",4294967295,18446744073709551615,,-9223372036854775808");
    EXPECT_EQ(p.kind, ParsedLine::Kind::Operation) << p.error;
    EXPECT_EQ(tool::ParseOpsLine("   # only a comment").kind, ParsedLine::Kind::Nothing);
    EXPECT_EQ(tool::ParseOpsLine(" \t\r").kind, ParsedLine::Kind::Nothing);
    std::string error;
    EXPECT_EQ(ToString(*tool::ParseFieldId("#12/0a0b", &error)), "#12/0a0b");
    EXPECT_EQ(ToString(*tool::ParseFieldId("12", &error)), "#12/");
    EXPECT_FALSE(tool::ParseFieldId("#0/00", &error));
    EXPECT_FALSE(tool::ParseFieldId("#12/0", &error));
    EXPECT_THAT(error, HasSubstr("expected OID/PATH"));

    const std::vector<std::pair<std::string, std::string> > cases = {
        {site + ",1,2,ab", "expected 5 comma-separated fields"},
        {site + ",1,2,ab,3,4", "found 6"},
        {"0000-0000,1,2,ab,3", "site '0000-0000' is not a Guid"},
        {site + ",,2,ab,3", "the time stamp is missing"},
        {site + ",x1,2,ab,3", "time stamp 'x1' is not a decimal integer"},
        {site + ",-1,2,ab,3", "time stamp -1 is outside 0..4294967295"},
        {site + ",4294967296,2,ab,3", "time stamp 4294967296 is outside 0..4294967295"},
        {site + ",99999999999999999999,2,ab,3", "is outside 0..4294967295"},
        {site + ",1,0,ab,3", "oid 0 names no object"},
        {site + ",1,-2,ab,3", "oid '-2' is not an unsigned decimal integer"},
        {site + ",1,18446744073709551616,ab,3", "does not fit in 64 bits"},
        {site + ",1,2,abc,3", "odd number of hex digits"},
        {site + ",1,2,zz,3", "path 'zz' is not hex"},
        {site + ",1,2,ab,", "the offset is missing"},
        {site + ",1,2,ab,3x", "offset '3x' is not a signed decimal integer"},
        {site + ",1,2,ab,9223372036854775808", "offset 9223372036854775808 does not fit"},
    };
    for (const auto& [line, expected] : cases) {
        ParsedLine p = tool::ParseOpsLine(line);
        EXPECT_EQ(p.kind, ParsedLine::Kind::Error) << line;
        EXPECT_THAT(p.error, HasSubstr(expected)) << line;
    }
}

TEST(OffsetOpsGenerator, IsAFunctionOfItsSeedAndNeverLowersASitesStamp) {
    EXPECT_EQ(Generated({5000, 300, 3, 7}), Generated({5000, 300, 3, 7}));
    EXPECT_NE(Generated({5000, 300, 3, 8}), Generated({5000, 300, 3, 7}));
    Generator gen({5000, 300, 3, 7}, {});
    std::string error;
    std::map<Guid, int64> last;
    std::set<FieldId> fields;
    for (tool::OffsetOperation op; gen.Next(op, error);) {
        EXPECT_GE(op.t, std::max<int64>(last[op.site], 1));
        last[op.site] = op.t;
        fields.insert(op.field);
        EXPECT_LE(std::abs(op.offset), 1000);
    }
    EXPECT_EQ(gen.Made(), 5000);
    EXPECT_EQ(last.size(), 3u);
    EXPECT_GT(fields.size(), 250u);
    EXPECT_LE(fields.size(), 300u);
}

// ---------------------------------------------------------------------------

TEST(ToolRoundTrip, RecordShowValidateStatsDumpAndClearInSeparateProcesses) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    std::string ops = Generated({3000, 400, 3, 11});
    const Model model = ModelOf(ops);
    const std::string fields = std::to_string(model.size());
    const std::string rec = RunOk({"record", "--store", store, "--generate", "3000", "--fields",
                                   "400", "--sites", "3", "--seed", "11", "--commit-every", "25"});
    EXPECT_EQ(RowValue(rec, "operations"), "3000");
    EXPECT_EQ(RowValue(rec, "fields"), fields);
    EXPECT_EQ(RowValue(rec, "height"), "1");
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
    EXPECT_EQ(RowValue(stats, "sites"), "3");
    EXPECT_EQ(RunOk({"dump", "--store", store}).rfind("Height = 1\n{\n", 0), 0u);

    // A second generating run continues each site's stored time stamps, and
    // so does an ops file read from standard input.
    ops += Generated({500, 400, 3, 12}, ModelOf(ops));
    RunOk({"record", "--store", store, "--generate", "500", "--fields", "400", "--sites", "3",
           "--seed", "12"});
    ops += Generated({500, 400, 3, 13}, ModelOf(ops));
    RunOk({"record", "--store", store, "--ops", "-"}, ops.substr(ops.rfind("# generated")));
    EXPECT_EQ(Shown(store), ShowText(ModelOf(ops)));

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
    std::string kept = kSiteA + ",4294967295,5,,9223372036854775807\n" + kSiteB +
                       ",0,5,,-9223372036854775808\n" + ToString(Generator::SiteGuid(1)) +
                       ",4294967295,6,,1\n";
    RunOk({"record", "--store", store, "--ops", "-"}, kept);
    LmdbStore::Open(empty, OpenMode::CreateIfMissing).reset();
    const std::string usage = "(see 'offsetops --help')";
    const std::vector<std::string> record{"record", "--store",        store, "--ops",
                                          ops,      "--commit-every", "2"};
    // `kept` lines of the ops file come before `input`.
    struct Case {
        std::vector<std::string> args;
        int status;
        std::string message;
        std::string input = {};
        std::string kept = {};
    };
    std::vector<Case> cases = {
        {{}, 2, usage},
        {{"frobnicate"}, 2, usage},
        {{"record", "--store", missing}, 2, "record needs --ops FILE or --generate N"},
        {{"record", "--ops", ops}, 2, usage},
        {{"record", "--store", missing, "--ops", ops, "--generate", "5"}, 2, "--ops excludes"},
        {{"record", "--store", missing, "--ops", ops, "--fields", "3"}, 2, "requires --generate"},
        {{"record", "--store", missing, "--generate", "-3"}, 2, usage},
        {{"record", "--store", missing, "--generate", "3", "--commit-every", "0"}, 2, usage},
        {{"record", "--store", missing, "--generate", "3", "--sites", "x"}, 2, usage},
        {{"show"}, 2, usage},
        {{"show", "--store", store, "--field", "xyz"}, 2, "expected OID/PATH"},
        {{"show", "--store", store, "--limit", "-1"}, 2, usage},
        {{"validate", "--store", store, "extra"}, 2, usage},
        {{"record", "--store", missing, "--ops", dir.Sub("none")}, 1, "cannot open ops file"},
        {{"show", "--store", empty}, 1, "holds no offsets record"},
        {{"show", "--store", ops}, 1, "not a directory"},
        {{"show", "--store", store, "--field", "#999999/"}, 1, "no offsets recorded for field"},
        {{"record", "--store", store, "--generate", "9", "--cache-nodes", "5"},
         1,
         "5 is too small"},
        {{"record", "--store", store, "--generate", "9", "--sites", "1"},
         1,
         "generated operation 1: site 00000000-0000-4000-8000-000000000001 has no time stamps "
         "left"},
        {record, 1,
         "ops.txt:5: offset '3x' is not a signed decimal integer; stopped there: the 3 "
         "operations of this run before it are committed, nothing from it on",
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
        {record, 1,
         "ops.txt:1: time stamp 4294967296 is outside 0..4294967295 (time stamps are stored as "
         "32-bit values)",
         kSiteB + ",4294967296,7,,1\n"},
        {record, 1,
         "ops.txt:1: time stamp 7 of site " + kSiteA +
             " is older than 4294967295, the one recorded for field #5/",
         kSiteA + ",7,5,,1\n"},
        {record, 1, "ops.txt:1: offset 1 would overflow the sum 9223372036854775807",
         kSiteA + ",4294967295,5,,1\n"},
    };
    for (const char* command : {"show", "dump", "validate", "stats", "clear"}) {
        cases.push_back({{command, "--store", missing}, 1, "directory does not exist"});
    }
    for (const Case& c : cases) {
        dir.Write("ops.txt", c.kept + c.input);
        ToolRun run = Tool(c.args);
        EXPECT_EQ(run.status, c.status) << ::testing::PrintToString(c.args);
        EXPECT_EQ(run.out, "") << ::testing::PrintToString(c.args);
        EXPECT_THAT(run.err, OneLineWith(c.message)) << ::testing::PrintToString(c.args);
        kept += c.kept;
    }
    EXPECT_FALSE(fs::exists(missing));
    EXPECT_EQ(Shown(store), ShowText(ModelOf(kept)));
    RunOk({"validate", "--store", store});
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
    uint64 record = 0, root = 0, leaf = 0;  // the first leaf
    {
        CSpace space(LmdbStore::Open(base, OpenMode::ReadOnly));
        CSpaceGuard guard(space, LockMode::Shared);
        record = space.GetRoot(tool::kRecordRoot).value_;
        SpaceRef<OffsetOps> r(space, space.GetRoot(tool::kRecordRoot));
        ASSERT_EQ(r->m_map->m_height, 1);
        root = r->m_map->m_root.m_oid.value_;
        leaf = r->m_map->m_firstLeaf.m_oid.value_;
    }
    // A flipped bit in the image, and a length (little-endian, just before
    // the image) that claims more bytes than the record holds.
    auto flip = [](std::string& file, std::size_t at) { file[at + 20] ^= 0x10; };
    auto cut = [](std::string& file, std::size_t at) { file[at - 1] = 1; };
    struct Damage {
        std::function<void(const std::string&)> plant;
        std::string message;
    };
    const std::vector<Damage> damages = {
        {[&](auto& s) { DamageOnDisk(s, leaf, flip); },
         "image #" + std::to_string(leaf) + ": checksum mismatch"},
        {[&](auto& s) { DamageOnDisk(s, root, cut); },
         "image #" + std::to_string(root) + ": truncated record"},
        {[&](auto& s) { CopyImage(s, root, record); }, "where 'tarn::OffsetOps' was expected"},
        {[&](auto& s) { CopyImage(s, leaf, root); },
         "'tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode' where"},
    };
    const std::vector<std::vector<std::string> > commands = {
        {"show"},  {"show", "--field", "#1/"},     {"dump"}, {"validate"},
        {"stats"}, {"record", "--generate", "10"}, {"clear"}};
    for (std::size_t d = 0; d < damages.size(); ++d) {
        const std::string store = dir.Sub("damaged" + std::to_string(d));
        fs::copy(base, store, fs::copy_options::recursive);
        damages[d].plant(store);
        for (std::vector<std::string> args : commands) {
            args.insert(args.begin() + 1, {"--store", store});
            ToolRun run = Tool(args);
            EXPECT_EQ(run.status, 1) << ::testing::PrintToString(args) << run.err;
            EXPECT_THAT(run.err, OneLineWith("")) << ::testing::PrintToString(args);
            EXPECT_THAT(args[0] == "validate" ? run.out : run.err, HasSubstr(damages[d].message))
                << ::testing::PrintToString(args);
        }
    }

    // Images no root reaches fail validation only; the tables are intact.
    CopyImage(base, leaf, 999999);
    ToolRun run = Tool({"validate", "--store", base});
    EXPECT_EQ(run.status, 1);
    EXPECT_THAT(run.out, HasSubstr("problem: 1 images that no root reaches: #999999"));
    EXPECT_THAT(run.err, OneLineWith("validation of"));
    EXPECT_NE(Shown(base), "");
}

// ---------------------------------------------------------------------------

// A million generated operations with a cache far below the tree's node
// count. Sanitizer builds, several times slower, use 200,000, which still
// makes several hundred nodes.
#if defined(__SANITIZE_ADDRESS__)
constexpr const char* kCachedRunOperations = "200000";
#else
constexpr const char* kCachedRunOperations = "1000000";
#endif

TEST(ToolCache, BoundedRunStaysUnderItsBoundAndMatchesAnUnboundedRun) {
    ScratchDir dir;
    const std::vector<std::string> gen{
        "--generate", kCachedRunOperations, "--fields", "100000", "--sites", "2", "--no-sync"};
    std::vector<std::string> free{"record", "--store", dir.Sub("free")};
    std::vector<std::string> bounded{"record", "--store", dir.Sub("bounded"), "--cache-nodes",
                                     "100"};
    free.insert(free.end(), gen.begin(), gen.end());
    bounded.insert(bounded.end(), gen.begin(), gen.end());
    ToolRun a = Tool(free);
    ToolRun b = Tool(bounded);
    ASSERT_EQ(a.status, 0) << a.err;
    ASSERT_EQ(b.status, 0) << b.err;
    EXPECT_GT(std::stoll(RowValue(b.out, "nodes")), 700);
    EXPECT_EQ(RowValue(a.out, "nodes"), RowValue(b.out, "nodes"));
    EXPECT_LE(std::stoll(RowValue(b.out, "peak residents")), 100) << b.out;
    EXPECT_GT(std::stoll(RowValue(a.out, "peak residents")), 700) << a.out;

    ToolRun showA = Tool({"show", "--store", dir.Sub("free")});
    ToolRun showB = Tool({"show", "--store", dir.Sub("bounded")});
    EXPECT_GT(showA.out.size(), 1000000u);
    EXPECT_TRUE(showA.out == showB.out);
    EXPECT_EQ(Tool({"validate", "--store", dir.Sub("bounded")}).status, 0);
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
