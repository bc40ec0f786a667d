// Copies of a store through offsetops: export loaded back by record, diff
// between replicas, backups beside a running writer, and the narrower show
// queries.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolCopyTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <gmock/gmock.h>

#include <algorithm>
#include <set>
#include <sstream>

#include "tests/ToolSupport.h"

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

const std::string kSite = "00000000-0000-4000-8000-00000000000a";

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        lines.push_back(line);
    }
    return lines;
}

// The operation lines of an ops text, each site's in their order, sites one
// after the other: another interleaving of the same operations.
std::string SiteBySite(const std::string& opsText) {
    std::vector<std::string> ops;
    for (const std::string& line : Lines(opsText)) {
        if (!line.empty() && line[0] != '#') {
            ops.push_back(line.substr(0, line.find(' ')));
        }
    }
    std::stable_sort(ops.begin(), ops.end(), [](const std::string& a, const std::string& b) {
        return a.substr(0, 36) < b.substr(0, 36);
    });
    std::string text;
    for (const std::string& op : ops) {
        text += op + "\n";
    }
    return text;
}

// The text of `field`'s table in `model`, as show prints it.
std::string TableText(const Model& model, const FieldId& field) {
    const std::string line = ShowText({{field, model.at(field)}});
    const std::size_t start = line.find(" --> ") + 5;
    return line.substr(start, line.size() - start - 1);
}

TEST(ToolCopies, ExportLoadsBackAndDiffNamesEveryFieldThatDiffers) {
    ScratchDir dir;
    const std::string a = dir.Sub("a"), b = dir.Sub("b"), c = dir.Sub("c");
    const std::string ops = Generated({3000, 400, 3, 21});
    const Model model = ModelOf(ops);
    RunOk({"record", "--store", a, "--ops", dir.Write("a.ops", ops)});

    // The export: a comment line, then one line per site of each field; the
    // same with a cache bound far below the tree's size.
    const std::string exported = RunOk({"export", "--store", a});
    std::size_t sites = 0;
    for (const auto& [field, table] : model) {
        sites += table.size();
    }
    EXPECT_THAT(exported, StartsWith("# offsetops export of store"));
    EXPECT_EQ(Lines(exported).size(), 1 + sites);
    EXPECT_EQ(ModelOf(exported), model);
    EXPECT_EQ(RunOk({"export", "--store", a, "--cache-nodes", "16"}), exported);
    const ToolRun toFile = Tool({"export", "--store", a, "--out", dir.Sub("a.export")});
    EXPECT_EQ(toFile.status, 0) << toFile.err;
    EXPECT_EQ(ReadFile(dir.Sub("a.export")), exported);

    RunOk({"record", "--store", b, "--ops", dir.Sub("a.export")});
    EXPECT_EQ(Shown(b), ShowText(model));
    EXPECT_EQ(RunOk({"diff", "--store", a, "--with", b}), "");

    // Another interleaving that keeps each site's order gives an equal map.
    RunOk({"record", "--store", c, "--ops", "-"}, SiteBySite(ops));
    EXPECT_EQ(RunOk({"diff", "--store", a, "--with", c, "--cache-nodes", "16"}), "");

    // One operation more on an existing field, and one on a new field.
    const FieldId changed = std::next(model.begin(), 100)->first;
    const tool::OffsetOperation op{*ParseGuid(kSite), 1, changed, 5};
    const std::string more = tool::FormatOpsLine(op) + "\n" + kSite + ",1,99999,,7\n";
    RunOk({"record", "--store", c, "--ops", "-"}, more);
    const Model after = ModelOf(more, model);
    const ToolRun diff = Tool({"diff", "--store", a, "--with", c});
    EXPECT_EQ(diff.status, 1) << diff.err;
    EXPECT_EQ(diff.out, "! " + ToString(changed) + " --> " + TableText(model, changed) + " " +
                            TableText(after, changed) + "\n> " + ShowText({*after.rbegin()}));
    const ToolRun reversed = Tool({"diff", "--store", c, "--with", a});
    EXPECT_EQ(reversed.status, 1);
    EXPECT_THAT(reversed.out, HasSubstr("< " + ShowText({*after.rbegin()})));

    // Errors are status 2, as diff(1) has it.
    EXPECT_EQ(Tool({"diff", "--store", a, "--with", dir.Sub("missing")}).status, 2);
    EXPECT_EQ(Tool({"diff", "--store", a}).status, 2);
}

TEST(ToolCopies, ShowFindsOneObjectAndARangeOfFields) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string ops = Generated({2000, 3000, 2, 5});
    const Model model = ModelOf(ops);
    RunOk({"record", "--store", store, "--ops", "-"}, ops);

    const OID oid = std::next(model.begin(), 500)->first.oid;
    Model ofObject, range;
    for (const auto& entry : model) {
        if (entry.first.oid == oid) {
            ofObject.insert(entry);
        }
    }
    const FieldId from = std::next(model.begin(), 40)->first;
    const FieldId to = std::next(model.begin(), 240)->first;
    range.insert(model.find(from), std::next(model.find(to)));
    EXPECT_EQ(RunOk({"show", "--store", store, "--oid", std::to_string(oid.value_)}),
              ShowText(ofObject));
    EXPECT_EQ(RunOk({"show", "--store", store, "--from", ToString(from), "--to", ToString(to)}),
              ShowText(range));
    EXPECT_EQ(RunOk({"show", "--store", store, "--from", ToString(from), "--limit", "3"}),
              ShowText(Model(model.find(from), std::next(model.find(from), 3))) +
                  "(3 fields shown; more follow)\n");

    const ToolRun none = Tool({"show", "--store", store, "--oid", "18446744073709551615"});
    EXPECT_EQ(none.status, 1);
    EXPECT_THAT(none.err, OneLineWith("no offsets recorded for object"));
    EXPECT_EQ(Tool({"show", "--store", store, "--oid", "7", "--from", "#1"}).status, 2);
    EXPECT_EQ(Tool({"show", "--store", store, "--from", "#9", "--to", "#8"}).status, 2);
}

// Backups taken while a writer records and checkpoints at every durable
// point each hold one of its durable points, validate, and record further.
TEST(ToolCopies, BackupBesideARunningRecordHoldsADurablePoint) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    Model model = ModelOf(Generated({1000, 300, 3, 1}));
    RunOk({"record", "--store", store, "--generate", "1000", "--fields", "300", "--sites", "3",
           "--seed", "1"});
    std::set<std::string> durablePoints{ShowText(model)};
    const std::string ops = HundredsAfter(model, 300, 3, 2, 40, durablePoints);
    const ToolRun run = ToolBeside(
        {"record", "--store", store, "--ops", "-", "--commit-every", "100", "--journal-limit", "0"},
        ops, [&] {
            for (const char* name : {"beside", "beside-compact"}) {
                std::vector<std::string> args{"backup", "--store", store, "--to", dir.Sub(name)};
                if (std::string(name).ends_with("compact")) {
                    args.push_back("--compact");
                }
                EXPECT_THAT(RunOk(args), HasSubstr("durable operations"));
                EXPECT_EQ(durablePoints.count(Shown(dir.Sub(name))), 1u);
                EXPECT_THAT(RunOk({"validate", "--store", dir.Sub(name)}), HasSubstr("\nvalid\n"));
            }
        });
    EXPECT_EQ(run.status, 0) << run.err;

    // After the writer: the copy holds everything, and takes more.
    std::filesystem::create_directory(dir.Sub("after"));
    RunOk({"backup", "--store", store, "--to", dir.Sub("after"), "--compact"});
    EXPECT_EQ(Shown(dir.Sub("after")), ShowText(model));
    RunOk({"record", "--store", dir.Sub("after"), "--ops", "-"}, kSite + ",1,5,,3\n");
    EXPECT_EQ(Shown(store), ShowText(model));

    const ToolRun refused = Tool({"backup", "--store", store, "--to", dir.Sub("after")});
    EXPECT_EQ(refused.status, 1);
    EXPECT_THAT(refused.err, OneLineWith("exists and is not empty"));
    EXPECT_THAT(Tool({"backup", "--store", store, "--to", store + "/copy"}).err,
                OneLineWith("is inside the store"));
    EXPECT_EQ(Tool({"backup", "--store", dir.Sub("missing"), "--to", dir.Sub("x")}).status, 1);
    EXPECT_FALSE(std::filesystem::exists(dir.Sub("x")));
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
