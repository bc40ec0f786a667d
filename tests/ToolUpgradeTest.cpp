// Stores written by the program before the store kept its tree's counts with
// every checkpoint and before its meta values carried a checksum (the fixture
// tests/data/store-format1.tar.xz, made by that program, with each store's
// export): they open with the same tables, readers change nothing, and the
// first writer upgrades them in place and takes more operations.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolUpgrade, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include "tests/ToolSupport.h"

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;

// The export without its first line, which names the store's directory.
std::string Body(const std::string& exported) {
    return exported.substr(exported.find('\n') + 1);
}

std::string Unpacked(const ScratchDir& dir) {
    const std::string to = dir.Sub("fixture");
    fs::create_directories(to);
    const std::string command =
        "tar -xJf '" + std::string(TARN_TEST_DATA_DIR) + "/store-format1.tar.xz' -C '" + to + "'";
    EXPECT_EQ(std::system(command.c_str()), 0) << command;
    return to;
}

TEST(ToolUpgrade, OldStoresKeepTheirTablesAndTakeMoreOperations) {
    ScratchDir dir;
    const std::string fixture = Unpacked(dir);
    // A site of its own, so that no stamp of the stores is older.
    const std::string more = dir.Write("more",
                                       "00000000-0000-4000-8000-000000000009,5,7,01,3\n"
                                       "00000000-0000-4000-8000-000000000009,6,700000,,-4\n");
    for (const std::string name : {"v1", "v1tail"}) {
        SCOPED_TRACE(name);
        const std::string store = fixture + "/" + name;
        const std::string expected = Body(ReadFile(fixture + "/" + name + ".export"));
        const std::string data = ReadFile(store + "/data.mdb");

        // Readers: the same tables, and the files as they were.
        EXPECT_EQ(Body(RunOk({"export", "--store", store})), expected);
        const std::string validated = RunOk({"validate", "--store", store});
        const std::string stats = RunOk({"stats", "--store", store});
        EXPECT_EQ(RowValue(stats, "fields"), name == "v1" ? "450" : "500");
        EXPECT_EQ(RowValue(stats, "fields"), RowValue(validated, "fields"));
        EXPECT_EQ(RowValue(stats, "nodes"), RowValue(validated, "nodes"));
        EXPECT_EQ(ReadFile(store + "/data.mdb"), data) << "a reader changed the store";

        // The first writer upgrades and records; the result equals a new
        // store given the same tables and operations.
        const ToolRun recorded = Tool({"record", "--store", store, "--ops", more});
        ASSERT_EQ(recorded.status, 0) << recorded.err;
        const std::string fresh = dir.Sub("fresh-" + name);
        RunOk({"record", "--store", fresh, "--ops", fixture + "/" + name + ".export"});
        RunOk({"record", "--store", fresh, "--ops", more});
        const ToolRun diff = Tool({"diff", "--store", store, "--with", fresh});
        EXPECT_EQ(diff.status, 0) << diff.out << diff.err;
        const ToolRun upgraded = Tool({"validate", "--store", store});
        EXPECT_EQ(upgraded.status, 0) << upgraded.out << upgraded.err;
        // Once upgraded, nothing more to repair.
        const ToolRun again = Tool({"record", "--store", store, "--ops", more});
        EXPECT_EQ(again.status, 0);
        EXPECT_THAT(again.err, ::testing::Not(HasSubstr("repaired")));
        EXPECT_EQ(RowValue(RunOk({"stats", "--store", store}), "nodes"),
                  RowValue(RunOk({"validate", "--store", store}), "nodes"));
    }
}

}  // namespace
}  // namespace tarn::testing

#endif
