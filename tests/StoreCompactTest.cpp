// Compaction: the data file rewritten without the free pages that
// checkpoints leave behind, never under another process's feet.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "tests/StoreTables.h"
#include "tests/StoreTestDir.h"
#include "tnStore/OffsetOpsStore.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

using storetest::Site;

FieldId Field(uint64 n) {
    return FieldId(OID(Seid(1 + n)), Path("\x02", 1));
}

class StoreCompact : public storetest::StoreDirTest {
protected:
    // Rounds over every field, each checkpointed: every checkpoint rewrites
    // the whole tree on new pages. Returns the tables.
    Tables Fill(OffsetOpsStore& store, int rounds, int first = 0) {
        for (int round = first; round < first + rounds; ++round) {
            for (uint64 i = 0; i < 20000; ++i) {
                store.Record(Opid(Site(1 + i % 3), round), Field(i), 1);
            }
            store.Checkpoint();
        }
        return AllTables(store);
    }

    int64 FileBytes() const { return static_cast<int64>(fs::file_size(m_dir + "/data.mdb")); }
};

// Closing a store whose checkpoints left more free pages than the share
// compacts it; the tables stay, the store validates and takes more.
TEST_F(StoreCompact, CloseCompactsAStoreMostlyFreePages) {
    Tables tables;
    int64 before = 0;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir);
        tables = Fill(store, 6);
        before = FileBytes();
        store.Close();
    }
    const int64 after = FileBytes();
    EXPECT_LT(after * 3, before * 2) << before << " bytes before closing, " << after << " after";
    OffsetOpsStore reopened = OffsetOpsStore::Open(m_dir);
    EXPECT_EQ(AllTables(reopened), tables);
    EXPECT_TRUE(reopened.Validate().Ok());
    reopened.Record(Opid(Site(7), 1), Field(1), 5);
    reopened.Close();

    // With the share at 0 nothing is compacted.
    StoreOptions never;
    never.compactFreeShare = 0;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir, never);
        Fill(store, 6, 10);
        before = FileBytes();
    }
    EXPECT_GE(FileBytes(), before);
}

// While another process has the store open, Compact changes nothing and says
// so; once it has gone, Compact shrinks the file.
TEST_F(StoreCompact, ExplicitCompactWaitsForOtherProcessesToClose) {
    StoreOptions never;
    never.compactFreeShare = 0;
    {
        OffsetOpsStore store = OffsetOpsStore::Open(m_dir, never);
        Fill(store, 4);
    }
    int ready[2];
    int release[2];
    ASSERT_EQ(::pipe(ready), 0);
    ASSERT_EQ(::pipe(release), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        StoreOptions reading;
        reading.mode = StoreMode::Read;
        OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, reading);
        char c = 1;
        (void)!::write(ready[1], &c, 1);
        (void)!::read(release[0], &c, 1);
        // The file under the reader is the one it opened.
        ::_exit(reader.Find(Field(5)).has_value() && reader.Validate().Ok() ? 0 : 1);
    }
    char c;
    ASSERT_EQ(::read(ready[0], &c, 1), 1);
    OffsetOpsStore writer = OffsetOpsStore::Open(m_dir, never);
    const Tables tables = AllTables(writer);
    const CompactResult refused = writer.Compact();
    EXPECT_FALSE(refused.compacted);
    EXPECT_EQ(refused.bytesAfter, refused.bytesBefore);
    c = 1;
    ASSERT_EQ(::write(release[1], &c, 1), 1);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    const CompactResult done = writer.Compact();
    EXPECT_TRUE(done.compacted);
    EXPECT_LT(done.bytesAfter * 3, done.bytesBefore * 2);
    EXPECT_EQ(AllTables(writer), tables);
    writer.Record(Opid(Site(9), 1), Field(2), 1);  // the handle goes on, on the new file
    writer.Close();
    StoreOptions reading;
    reading.mode = StoreMode::Read;
    OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, reading);
    EXPECT_TRUE(reader.Validate().Ok());
    EXPECT_EQ(reader.Find(Field(2))->size(), 2u);
}

// The README tells users when Close compacts: its figure is the default's.
TEST(CompactionDocs, TheReadmeStatesTheDefaultFreeShare) {
    std::ifstream in(std::string(TARN_TEST_DATA_DIR) + "/../../README.md");
    ASSERT_TRUE(in.good());
    std::ostringstream text;
    text << in.rdbuf();
    const std::string readme = text.str();
    const std::string lead = "`StoreOptions::compactFreeShare`, ";
    const std::size_t at = readme.find(lead);
    ASSERT_NE(at, std::string::npos);
    const std::size_t end = readme.find(" by default", at);
    ASSERT_NE(end, std::string::npos);
    EXPECT_EQ(std::stod(readme.substr(at + lead.size(), end - at - lead.size())),
              StoreOptions().compactFreeShare);
}

}  // namespace
}  // namespace tarn
