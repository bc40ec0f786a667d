// The offsetops program: its ops-file parser and generator in-process, and the
// program itself as a child process (record, show, dump, validate, stats,
// clear in separate processes; bad input; damaged and foreign stores; wrong
// arguments; a bounded cache).

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <lmdb.h>

#include <algorithm>
#include <functional>
#include <set>
#include <sstream>

#include "tests/ToolSupport.h"
#include "tools/Generator.h"
#include "tools/OpsFile.h"

namespace tarn::testing {
namespace {

using tool::Generator;
using tool::GeneratorSettings;
using tool::OffsetOperation;
using tool::OpsFileReader;
using tool::ParsedLine;

ToolRun Tool(const std::vector<std::string>& args, const std::string& input = {}) {
    return RunProgram(OFFSETOPS_PATH, args, input);
}

// Exactly one line.
::testing::AssertionResult OneLine(const std::string& text) {
    if (!text.empty() && text.back() == '\n' && std::count(text.begin(), text.end(), '\n') == 1) {
        return ::testing::AssertionSuccess();
    }
    return ::testing::AssertionFailure() << "not one line: \"" << text << "\"";
}

bool Mentions(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// The value of a "label   value" row of the program's output.
std::string RowValue(const std::string& out, const std::string& label) {
    std::istringstream lines(out);
    for (std::string line; std::getline(lines, line);) {
        if (line.rfind(label, 0) == 0 && line.size() > label.size() && line[label.size()] == ' ') {
            std::size_t at = line.find_first_not_of(' ', label.size());
            return line.substr(at);
        }
    }
    return {};
}

Model ModelOf(const std::string& opsText) {
    Model model;
    std::istringstream in(opsText);
    OpsFileReader reader(in, "ops");
    OffsetOperation op;
    std::string error;
    while (reader.Next(op, error) == OpsFileReader::Status::Operation) {
        Apply(model, op);
    }
    return model;
}

std::vector<OffsetOperation> Generate(const GeneratorSettings& settings,
                                      const std::map<Guid, int64>& last = {}) {
    Generator gen(settings, last);
    std::vector<OffsetOperation> ops;
    OffsetOperation op;
    std::string error;
    while (gen.Next(op, error)) {
        ops.push_back(op);
    }
    EXPECT_EQ(error, "");
    return ops;
}

std::string OpsText(const std::vector<OffsetOperation>& ops) {
    std::string text = "# generated\n";
    for (std::size_t i = 0; i < ops.size(); ++i) {
        text += tool::FormatOpsLine(ops[i]) + (i % 7 == 0 ? "  # seventh\n\n" : "\n");
    }
    return text;
}

// ---------------------------------------------------------------------------

TEST(OpsFileParsing, ReadsFieldsAroundBlanksCommentsAndCarriageReturns) {
    ParsedLine p =
        tool::ParseOpsLine(" 0123abcd-0000-4000-8000-00000000002A , 17,\t42, 0aFF ,-9 # note\r");
    ASSERT_EQ(p.kind, ParsedLine::Kind::Operation) << p.error;
    EXPECT_EQ(ToString(p.op.site), "0123abcd-0000-4000-8000-00000000002a");
    EXPECT_EQ(p.op.t, 17);
    EXPECT_EQ(tool::FieldIdText(p.op.field), "#42/0aff");
    EXPECT_EQ(p.op.offset, -9);
    EXPECT_EQ(tool::FormatOpsLine(p.op), "0123abcd-0000-4000-8000-00000000002a,17,42,0aff,-9");

    ParsedLine empty = tool::ParseOpsLine("00000000-0000-4000-8000-000000000001,0,1,,+5");
    ASSERT_EQ(empty.kind, ParsedLine::Kind::Operation) << empty.error;
    EXPECT_TRUE(empty.op.field.path.empty());
    EXPECT_EQ(empty.op.offset, 5);
    EXPECT_EQ(tool::ParseOpsLine("   # only a comment").kind, ParsedLine::Kind::Nothing);
    EXPECT_EQ(tool::ParseOpsLine(" \t\r").kind, ParsedLine::Kind::Nothing);
}

TEST(OpsFileParsing, SaysWhatIsWrongWithALine) {
    const std::string site = "00000000-0000-4000-8000-000000000001";
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
        EXPECT_TRUE(Mentions(p.error, expected)) << line << " -> " << p.error;
    }
    EXPECT_EQ(
        tool::ParseOpsLine(site + ",4294967295,18446744073709551615,,-9223372036854775808").kind,
        ParsedLine::Kind::Operation);
}

TEST(OpsFileParsing, ReaderNumbersEveryLineIncludingSkippedOnes) {
    std::istringstream in(
        "# header\n\n00000000-0000-4000-8000-000000000001,1,2,,3\n\n  bad line\nnot reached\n");
    OpsFileReader reader(in, "f");
    OffsetOperation op;
    std::string error;
    EXPECT_EQ(reader.Next(op, error), OpsFileReader::Status::Operation);
    EXPECT_EQ(reader.LineNumber(), 3);
    EXPECT_EQ(reader.Next(op, error), OpsFileReader::Status::Error);
    EXPECT_EQ(reader.LineNumber(), 5);
    EXPECT_TRUE(Mentions(error, "expected 5 comma-separated fields")) << error;
}

TEST(OpsFileParsing, FieldKeysInTheirTextForm) {
    std::string error;
    EXPECT_EQ(tool::FieldIdText(*tool::ParseFieldId("#12/0a0b", &error)), "#12/0a0b");
    EXPECT_EQ(tool::FieldIdText(*tool::ParseFieldId("12/", &error)), "#12/");
    EXPECT_EQ(tool::FieldIdText(*tool::ParseFieldId("12", &error)), "#12/");
    EXPECT_FALSE(tool::ParseFieldId("#0/00", &error));
    EXPECT_FALSE(tool::ParseFieldId("#12/0", &error));
    EXPECT_TRUE(Mentions(error, "expected OID/PATH")) << error;
}

// ---------------------------------------------------------------------------

TEST(OffsetOpsGenerator, IsAFunctionOfItsSeedAndNeverLowersASitesStamp) {
    GeneratorSettings s{5000, 300, 3, 7};
    std::vector<OffsetOperation> a = Generate(s);
    std::vector<OffsetOperation> b = Generate(s);
    ASSERT_EQ(a.size(), 5000u);
    std::map<Guid, int64> last;
    std::set<FieldId> fields;
    for (std::size_t i = 0; i < a.size(); ++i) {
        EXPECT_EQ(tool::FormatOpsLine(a[i]), tool::FormatOpsLine(b[i]));
        auto [it, added] = last.emplace(a[i].site, a[i].t);
        EXPECT_GE(a[i].t, added ? 1 : it->second);
        it->second = a[i].t;
        fields.insert(a[i].field);
        EXPECT_LE(std::abs(a[i].offset), 1000);
    }
    EXPECT_EQ(last.size(), 3u);
    EXPECT_GT(fields.size(), 250u);
    EXPECT_LE(fields.size(), 300u);
    s.seed = 8;
    EXPECT_NE(tool::FormatOpsLine(Generate(s)[0]) + tool::FormatOpsLine(Generate(s)[1]),
              tool::FormatOpsLine(a[0]) + tool::FormatOpsLine(a[1]));
}

TEST(OffsetOpsGenerator, StartsAfterStoredStampsAndStopsWhenTheyRunOut) {
    std::map<Guid, int64> stored{{Generator::SiteGuid(1), 500}};
    for (const OffsetOperation& op : Generate({200, 10, 2, 1}, stored)) {
        if (op.site == Generator::SiteGuid(1)) {
            EXPECT_GT(op.t, 500);
        }
    }
    Generator gen({10, 10, 1, 1}, {{Generator::SiteGuid(1), tool::kMaxTimeStamp}});
    OffsetOperation op;
    std::string error;
    EXPECT_FALSE(gen.Next(op, error));
    EXPECT_TRUE(Mentions(error, "has no time stamps left")) << error;
}

// ---------------------------------------------------------------------------

TEST(ToolRoundTrip, RecordShowValidateStatsAndDumpInSeparateProcesses) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    std::vector<OffsetOperation> first = Generate({3000, 400, 3, 11});
    Model model;
    for (const OffsetOperation& op : first) {
        Apply(model, op);
    }
    ToolRun rec = Tool({"record", "--store", store, "--ops", dir.Write("a.ops", OpsText(first)),
                        "--commit-every", "25"});
    ASSERT_EQ(rec.status, 0) << rec.err;
    EXPECT_EQ(RowValue(rec.out, "operations"), "3000");
    EXPECT_EQ(RowValue(rec.out, "fields"), std::to_string(model.size()));
    EXPECT_EQ(RowValue(rec.out, "height"), "1");

    EXPECT_EQ(Tool({"show", "--store", store}).out, ShowText(model));
    const auto& [someField, someSites] = *std::next(model.begin(), 17);
    Model one{{someField, someSites}};
    ToolRun single = Tool({"show", "--store", store, "--field", tool::FieldIdText(someField)});
    EXPECT_EQ(single.status, 0);
    EXPECT_EQ(single.out, ShowText(one));
    ToolRun absent = Tool({"show", "--store", store, "--field", "#999999/"});
    EXPECT_EQ(absent.status, 1);
    EXPECT_TRUE(OneLine(absent.err));

    ToolRun valid = Tool({"validate", "--store", store});
    EXPECT_EQ(valid.status, 0) << valid.out << valid.err;
    EXPECT_TRUE(Mentions(valid.out, "valid\n"));
    ToolRun stats = Tool({"stats", "--store", store});
    EXPECT_EQ(stats.status, 0);
    EXPECT_EQ(RowValue(stats.out, "fields"), std::to_string(model.size()));
    EXPECT_EQ(RowValue(stats.out, "sites"), "3");
    ToolRun dump = Tool({"dump", "--store", store});
    EXPECT_EQ(dump.status, 0);
    EXPECT_EQ(dump.out.rfind("Height = 1\n{\n", 0), 0u) << dump.out.substr(0, 40);

    // A second run appends to the same record; its input comes from stdin.
    std::map<Guid, int64> last;
    for (const auto& [field, sites] : model) {
        for (const auto& [site, so] : sites) {
            last[site] = std::max(last[site], so.t);
        }
    }
    std::vector<OffsetOperation> second = Generate({500, 400, 3, 12}, last);
    for (const OffsetOperation& op : second) {
        Apply(model, op);
    }
    ToolRun more = Tool({"record", "--store", store, "--ops", "-"}, OpsText(second));
    ASSERT_EQ(more.status, 0) << more.err;
    EXPECT_EQ(Tool({"show", "--store", store}).out, ShowText(model));
}

TEST(ToolRoundTrip, ClearLeavesAnEmptyRecordThatTakesOldStampsAgain) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    ASSERT_EQ(Tool({"record", "--store", store, "--generate", "4000", "--fields", "2000"}).status,
              0);
    ToolRun clear = Tool({"clear", "--store", store});
    ASSERT_EQ(clear.status, 0) << clear.err;
    EXPECT_TRUE(Mentions(clear.out, "cleared ")) << clear.out;
    EXPECT_EQ(Tool({"show", "--store", store}).out, "");
    ToolRun stats = Tool({"stats", "--store", store});
    EXPECT_EQ(RowValue(stats.out, "images"), "2");  // the record and the map header
    EXPECT_EQ(RowValue(stats.out, "height"), "-1");
    EXPECT_EQ(Tool({"validate", "--store", store}).status, 0);
    const std::string line = "00000000-0000-4000-8000-000000000001,1,5,,3\n";
    EXPECT_EQ(Tool({"record", "--store", store, "--ops", "-"}, line).status, 0);
    EXPECT_EQ(Tool({"show", "--store", store}).out, ShowText(ModelOf(line)));
}

// ---------------------------------------------------------------------------

const std::string kSiteA = "00000000-0000-4000-8000-00000000000a";
const std::string kSiteB = "00000000-0000-4000-8000-00000000000b";

TEST(ToolInput, MalformedLineStopsTheRunKeepingEverythingBeforeIt) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string good =
        kSiteA + ",1,5,0a,3\n" + kSiteB + ",2,5,0a,4\n# comment\n" + kSiteA + ",2,6,,-1\n";
    const std::string ops =
        dir.Write("ops.txt", good + kSiteA + ",3,6,0g,1\n" + kSiteA + ",4,7,,1\n");
    ToolRun run = Tool({"record", "--store", store, "--ops", ops, "--commit-every", "2"});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(OneLine(run.err));
    EXPECT_TRUE(Mentions(run.err, "ops.txt:5: path '0g' is not hex")) << run.err;
    EXPECT_TRUE(Mentions(run.err, "the 3 operations of this run before it are committed"))
        << run.err;
    EXPECT_EQ(run.out, "");
    EXPECT_EQ(ReadStore(store), ModelOf(good));
    EXPECT_EQ(Tool({"validate", "--store", store}).status, 0);
}

TEST(ToolInput, OlderTimeStampsAreRefusedNamingTheirLine) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string good = kSiteA + ",5,5,0a,3\n" + kSiteA + ",5,5,0a,4\n" + kSiteB +
                             ",1,5,0a,1\n" + kSiteA + ",1,6,,1\n";
    ToolRun run = Tool({"record", "--store", store, "--ops", "-"}, good + kSiteA + ",4,5,0a,1\n");
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(OneLine(run.err));
    EXPECT_TRUE(Mentions(run.err, "<stdin>:5: time stamp 4 of site " + kSiteA +
                                      " is older than 5, the one recorded for field #5/0a"))
        << run.err;
    EXPECT_EQ(ReadStore(store), ModelOf(good));

    // Also against what an earlier process stored.
    ToolRun later = Tool({"record", "--store", store, "--ops", "-"}, kSiteB + ",0,5,0a,1\n");
    EXPECT_EQ(later.status, 1);
    EXPECT_TRUE(Mentions(later.err, "<stdin>:1: time stamp 0 of site " + kSiteB)) << later.err;
    EXPECT_TRUE(Mentions(later.err, "the 0 operations")) << later.err;
    EXPECT_EQ(ReadStore(store), ModelOf(good));
}

TEST(ToolInput, StampsBeyond32BitsAndOverflowingSumsAreRefused) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string good =
        kSiteA + ",4294967295,5,,9223372036854775807\n" + kSiteB + ",0,5,,-9223372036854775808\n";
    ToolRun run =
        Tool({"record", "--store", store, "--ops", "-"}, good + kSiteA + ",4294967296,6,,1\n");
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(Mentions(run.err,
                         ":3: time stamp 4294967296 is outside 0..4294967295 (time "
                         "stamps are stored as 32-bit values)"))
        << run.err;
    ToolRun sum = Tool({"record", "--store", store, "--ops", "-"}, kSiteA + ",4294967295,5,,1\n");
    EXPECT_EQ(sum.status, 1);
    EXPECT_TRUE(Mentions(sum.err, ":1: offset 1 would overflow the sum 9223372036854775807"))
        << sum.err;
    EXPECT_EQ(ReadStore(store), ModelOf(good));
    EXPECT_EQ(Tool({"show", "--store", store}).out, ShowText(ModelOf(good)));
}

TEST(ToolInput, AMissingOpsFileCreatesNoStore) {
    ScratchDir dir;
    ToolRun run = Tool({"record", "--store", dir.Sub("store"), "--ops", dir.Sub("none.ops")});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(OneLine(run.err));
    EXPECT_TRUE(Mentions(run.err, "cannot open ops file")) << run.err;
    EXPECT_FALSE(fs::exists(dir.Sub("store")));
}

TEST(ToolInput, GenerationContinuesAfterTheStoredStamps) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const GeneratorSettings first{3000, 500, 3, 1};
    const GeneratorSettings second{3000, 500, 3, 2};
    Model model;
    for (const OffsetOperation& op : Generate(first)) {
        Apply(model, op);
    }
    std::map<Guid, int64> last;
    for (const auto& [field, sites] : model) {
        for (const auto& [site, so] : sites) {
            last[site] = std::max(last[site], so.t);
        }
    }
    for (const OffsetOperation& op : Generate(second, last)) {
        Apply(model, op);
    }
    for (const char* seed : {"1", "2"}) {
        ToolRun run = Tool({"record", "--store", store, "--generate", "3000", "--fields", "500",
                            "--sites", "3", "--seed", seed, "--commit-every", "1000"});
        ASSERT_EQ(run.status, 0) << run.err;
    }
    EXPECT_EQ(Tool({"show", "--store", store}).out, ShowText(model));
}

// ---------------------------------------------------------------------------

TEST(ToolArguments, WrongArgumentsGiveOneLineAndStatusTwo) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string ops = dir.Write("ops", "");
    const std::vector<std::vector<std::string> > cases = {
        {},
        {"frobnicate"},
        {"record", "--store", store},
        {"record", "--ops", ops},
        {"record", "--store", store, "--ops", ops, "--generate", "5"},
        {"record", "--store", store, "--ops", ops, "--fields", "3"},
        {"record", "--store", store, "--generate", "-3"},
        {"record", "--store", store, "--generate", "3", "--commit-every", "0"},
        {"record", "--store", store, "--generate", "3", "--sites", "x"},
        {"show"},
        {"show", "--store", store, "--field", "xyz"},
        {"validate", "--store", store, "extra"},
    };
    for (const auto& args : cases) {
        ToolRun run = Tool(args);
        std::string joined;
        for (const auto& a : args) {
            joined += a + " ";
        }
        EXPECT_EQ(run.status, 2) << joined << run.err;
        EXPECT_TRUE(OneLine(run.err)) << joined;
        EXPECT_EQ(run.err.rfind("offsetops: ", 0), 0u) << run.err;
    }
    EXPECT_FALSE(fs::exists(store));
    ToolRun help = Tool({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_TRUE(Mentions(help.out, "record")) << help.out;
}

// ---------------------------------------------------------------------------

// Identities of a stored record's objects.
struct StoredTree {
    uint64 record = 0, map = 0, root = 0, firstLeaf = 0;
    ssize_t height = -1;
};

StoredTree TreeOf(const std::string& dir) {
    StoredTree ids;
    CSpace space(LmdbStore::Open(dir, OpenMode::ReadOnly));
    CSpaceGuard guard(space, LockMode::Shared);
    SpaceRef<OffsetOps> record(space, space.GetRoot(tool::kRecordRoot));
    const FieldIdToOffsetOpsOnInt64FieldMap& map = *record->m_map;
    ids.record = space.GetRoot(tool::kRecordRoot).value_;
    ids.map = record->m_map.m_oid.value_;
    ids.root = map.m_root.m_oid.value_;
    ids.firstLeaf = map.m_firstLeaf.m_oid.value_;
    ids.height = map.m_height;
    return ids;
}

std::string ImageKey(uint64 oid) {
    std::string key(8, '\0');
    for (int i = 0; i < 8; ++i) {
        key[i] = static_cast<char>(oid >> (56 - 8 * i));
    }
    return key;
}

// Rewrites the stored record of `oid` through LMDB itself, bypassing the
// store, to plant damage the store never writes.
void PatchRecord(const std::string& dir, uint64 oid,
                 const std::function<void(std::string&)>& patch) {
    MDB_env* env = nullptr;
    ASSERT_EQ(mdb_env_create(&env), 0);
    mdb_env_set_maxdbs(env, 4);
    ASSERT_EQ(mdb_env_open(env, dir.c_str(), 0, 0644), 0);
    MDB_txn* txn = nullptr;
    ASSERT_EQ(mdb_txn_begin(env, nullptr, 0, &txn), 0);
    MDB_dbi dbi = 0;
    ASSERT_EQ(mdb_dbi_open(txn, "images", 0, &dbi), 0);
    std::string key = ImageKey(oid);
    MDB_val k{key.size(), key.data()};
    MDB_val v;
    ASSERT_EQ(mdb_get(txn, dbi, &k, &v), 0);
    std::string record(static_cast<const char*>(v.mv_data), v.mv_size);
    patch(record);
    MDB_val nv{record.size(), record.data()};
    ASSERT_EQ(mdb_put(txn, dbi, &k, &nv, 0), 0);
    ASSERT_EQ(mdb_txn_commit(txn), 0);
    mdb_env_close(env);
}

// Stores `image` (class and bytes) under `oid` through the store, framed
// and checksummed as the store writes every image.
void PutImage(const std::string& dir, uint64 oid, const StoredImage& image) {
    auto store = LmdbStore::Open(dir, OpenMode::MustExist);
    CommitBatch batch;
    batch.writes.emplace_back(oid, image);
    batch.nextIdentity = std::max(store->NextIdentity(), oid + 1);
    store->Commit(batch);
}

StoredImage ImageOf(const std::string& dir, uint64 oid) {
    return *LmdbStore::Open(dir, OpenMode::ReadOnly)->Load(oid);
}

// Every command that reads the record fails with one line naming `expected`.
void ExpectEveryReaderFails(const std::string& store, const std::string& expected) {
    for (const char* cmd : {"show", "dump", "validate", "stats"}) {
        ToolRun run = Tool({cmd, "--store", store});
        EXPECT_EQ(run.status, 1) << cmd << ": " << run.err;
        EXPECT_TRUE(OneLine(run.err)) << cmd;
        if (std::string(cmd) == "validate") {
            EXPECT_TRUE(Mentions(run.out, expected)) << cmd << ": " << run.out;
        } else {
            EXPECT_TRUE(Mentions(run.err, expected)) << cmd << ": " << run.err;
        }
    }
}

class ToolStores : public ::testing::Test {
protected:
    void SetUp() override {
        store = dir.Sub("store");
        ToolRun run = Tool({"record", "--store", store, "--generate", "3000", "--fields", "1000"});
        ASSERT_EQ(run.status, 0) << run.err;
        tree = TreeOf(store);
        ASSERT_EQ(tree.height, 1);
    }

    ScratchDir dir;
    std::string store;
    StoredTree tree;
};

TEST_F(ToolStores, FlippedOrTruncatedImagesAreReportedNotCrashedOn) {
    PatchRecord(store, tree.firstLeaf, [](std::string& r) { r[r.size() / 2] ^= 0x10; });
    ExpectEveryReaderFails(store,
                           "image #" + std::to_string(tree.firstLeaf) + ": checksum mismatch");
    ToolRun rec = Tool({"record", "--store", store, "--generate", "10"});
    EXPECT_EQ(rec.status, 1);
    EXPECT_TRUE(Mentions(rec.err, "checksum mismatch")) << rec.err;

    PatchRecord(store, tree.root, [](std::string& r) { r.resize(r.size() - 9); });
    ExpectEveryReaderFails(store, "image #" + std::to_string(tree.root) + ": truncated record");
}

TEST_F(ToolStores, AnImageOfAnotherClassUnderTheRecordIsRefused) {
    PutImage(store, tree.record, ImageOf(store, tree.map));
    ExpectEveryReaderFails(store, "where 'tarn::OffsetOps' was expected");
    for (const char* cmd : {"record", "clear"}) {
        std::vector<std::string> args{cmd, "--store", store};
        if (std::string(cmd) == "record") {
            args.insert(args.end(), {"--generate", "1"});
        }
        ToolRun run = Tool(args);
        EXPECT_EQ(run.status, 1) << cmd;
        EXPECT_TRUE(Mentions(run.err, "where 'tarn::OffsetOps' was expected")) << run.err;
    }
}

TEST_F(ToolStores, ALeafWhereAnInternalNodeBelongsIsReported) {
    PutImage(store, tree.root, ImageOf(store, tree.firstLeaf));
    ExpectEveryReaderFails(store, "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode");
    ToolRun field = Tool({"show", "--store", store, "--field", "#1/"});
    EXPECT_EQ(field.status, 1);
    EXPECT_TRUE(OneLine(field.err));
}

TEST_F(ToolStores, ImagesNoRootReachesFailValidation) {
    const uint64 stray = 999999;
    PutImage(store, stray, ImageOf(store, tree.firstLeaf));
    ToolRun run = Tool({"validate", "--store", store});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(Mentions(run.out, "problem: 1 images that no root reaches: #999999")) << run.out;
    EXPECT_TRUE(OneLine(run.err));
    EXPECT_EQ(Tool({"show", "--store", store}).status, 0);  // the tables are intact
}

TEST(ToolMissingStores, ReadCommandsFailWithoutCreatingTheStore) {
    ScratchDir dir;
    const std::string missing = dir.Sub("missing");
    for (const char* cmd : {"show", "dump", "validate", "stats", "clear"}) {
        ToolRun run = Tool({cmd, "--store", missing});
        EXPECT_EQ(run.status, 1) << cmd;
        EXPECT_TRUE(OneLine(run.err)) << cmd;
        EXPECT_TRUE(Mentions(run.err, "directory does not exist")) << run.err;
    }
    EXPECT_FALSE(fs::exists(missing));

    const std::string empty = dir.Sub("empty");
    LmdbStore::Open(empty, OpenMode::CreateIfMissing).reset();
    ToolRun run = Tool({"show", "--store", empty});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(Mentions(run.err, "holds no offsets record")) << run.err;

    ToolRun foreign = Tool({"show", "--store", dir.Write("file", "not a store")});
    EXPECT_EQ(foreign.status, 1);
    EXPECT_TRUE(OneLine(foreign.err));
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

TEST(ToolCache, ABoundTooSmallForTheTreeIsAClearError) {
    ScratchDir dir;
    ToolRun run =
        Tool({"record", "--store", dir.Sub("s"), "--generate", "100", "--cache-nodes", "5"});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(OneLine(run.err));
    EXPECT_TRUE(Mentions(run.err, "--cache-nodes 5 is too small")) << run.err;
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
