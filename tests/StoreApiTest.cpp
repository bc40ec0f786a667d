// The embedding API's own values and handles: cursors over the map (against
// a model, across batches, beside a writer), the categories of errors, the
// text form of fields, and handles that were moved from.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <random>

#include "tests/StoreTestDir.h"
#include "tnStore/FieldCursor.h"
#include "tnStore/OffsetOpsStore.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using Category = RuntimeError::Category;

using storetest::Site;

FieldId Field(uint64 oid, std::string_view path = "") {
    return FieldId(OID(Seid(oid)), Path(path.data(), static_cast<ssize_t>(path.size())));
}

using Model = std::map<FieldId, FieldTable>;

// `fields` fields, of objects 2, 4, 6, ... (odd ones stay free for keys
// between them), each with one record, into `store` and the model.
Model Fill(OffsetOpsStore& store, int fields) {
    Model model;
    for (int i = 0; i < fields; ++i) {
        const FieldId f = Field(2 * static_cast<uint64>(i / 2 + 1), i % 2 == 0 ? "" : "\x07");
        store.Record(Opid(Site(1 + static_cast<uint32>(i % 3)), i), f, i);
        model[f] = {{Site(1 + static_cast<uint32>(i % 3)), i, i}};
    }
    return model;
}

class TempStore : public ::testing::Test {
protected:
    void SetUp() override {
        m_dir = fs::path(::testing::TempDir()) /
                ("store-api-" + std::to_string(::getpid()) + "-" +
                 ::testing::UnitTest::GetInstance()->current_test_info()->name());
        fs::remove_all(m_dir);
    }
    void TearDown() override { fs::remove_all(m_dir); }
    fs::path m_dir;
};

// ---------------------------------------------------------------------------

// A thousand fields, some four batches: a fixed-seed random walk of Next,
// Prev, Seek and SeekToLast, with and without bounds, stands where the
// model's iterator stands at every step.
TEST(FieldCursors, WalkBothWaysAndSeekAsTheModelDoesAcrossBatches) {
    OffsetOpsStore store = OffsetOpsStore::OpenInMemory();
    const Model model = Fill(store, 1000);
    struct Range {
        FieldId from;
        std::optional<FieldId> to;
    };
    const std::vector<Range> ranges = {
        {FieldId(), std::nullopt},
        {Field(101), Field(700, "\x07")},  // from between keys, to a key
        {Field(300), Field(300)},          // one field
        {Field(5000), std::nullopt},       // nothing
        {Field(3), Field(3, "\x07")},      // between keys only: nothing
    };
    std::mt19937_64 random(7);
    for (const Range& range : ranges) {
        auto begin = model.lower_bound(range.from);
        auto end = range.to ? model.upper_bound(*range.to) : model.end();
        // The model's position for the first field not less than `key`.
        auto seek = [&](const FieldId& key) {
            auto it = model.lower_bound(std::max(key, range.from));
            return it == model.end() || (range.to && *range.to < it->first) ? end : it;
        };
        FieldCursor cursor(store, range.from, range.to);
        auto at = begin;  // `end`: the cursor is at its end
        for (int step = 0; step < 3000; ++step) {
            ASSERT_EQ(cursor.AtEnd(), at == end) << "step " << step;
            if (at != end) {
                ASSERT_EQ(cursor.Key(), at->first) << "step " << step;
                ASSERT_EQ(cursor.Table(), at->second) << "step " << step;
            }
            const uint64 move = random() % 100;
            if (move < 45) {
                cursor.Next();
                if (at != end) {
                    ++at;
                }
            } else if (move < 90) {
                cursor.Prev();
                if (at == end) {
                    at = begin == end ? end : std::prev(end);
                } else {
                    at = at == begin ? end : std::prev(at);
                }
            } else if (move < 97) {
                const FieldId key = Field(random() % 1100, random() % 2 == 0 ? "" : "\x07");
                cursor.Seek(key);
                at = seek(key);
            } else {
                cursor.SeekToLast();
                at = begin == end ? end : std::prev(end);
            }
        }
    }
}

// What the header promises of a cursor beside a writer: the batch it holds
// stays as read, later batches show the store as it is then, and no field
// comes twice.
TEST(FieldCursors, SeeChangesBeyondTheirBatchAndNoFieldTwice) {
    OffsetOpsStore store = OffsetOpsStore::OpenInMemory();
    Fill(store, 1000);
    FieldCursor cursor(store);
    const FieldId first = cursor.Key();
    store.Record(Opid(Site(9), 5000), first, 5);        // in the batch held
    store.Record(Opid(Site(9), 5000), Field(801), 1);   // far ahead, a new key
    store.Record(Opid(Site(9), 5000), Field(1001), 1);  // after the last key
    EXPECT_EQ(cursor.Table().size(), 1u);
    std::vector<FieldId> seen;
    for (; !cursor.AtEnd(); cursor.Next()) {
        ASSERT_TRUE(seen.empty() || seen.back() < cursor.Key());
        seen.push_back(cursor.Key());
    }
    EXPECT_EQ(seen.size(), 1002u);
    EXPECT_EQ(std::count(seen.begin(), seen.end(), Field(801)), 1);
    EXPECT_EQ(seen.back(), Field(1001));
    // A new cursor reads the table as it is now.
    EXPECT_EQ(FieldCursor(store).Table().size(), 2u);
    // Clearing the store under a cursor: its next batch is empty.
    FieldCursor late(store, Field(600));
    store.Clear();
    for (int i = 0; i < 300 && !late.AtEnd(); ++i) {
        late.Next();
    }
    EXPECT_TRUE(late.AtEnd());
}

// ---------------------------------------------------------------------------

// The kinds of failure a program branches on, raised where they happen.
TEST_F(TempStore, ErrorsCarryTheirCategory) {
    auto categoryOf = [](const std::function<void()>& call) {
        try {
            call();
        } catch (const RuntimeError& e) {
            return e.GetCategory();
        }
        ADD_FAILURE() << "no error";
        return Category::Other;
    };
    StoreOptions existing;
    existing.mode = StoreMode::WriteExisting;
    StoreOptions reading;
    reading.mode = StoreMode::Read;
    EXPECT_EQ(categoryOf([&] { OffsetOpsStore::Open(m_dir, existing); }), Category::NotFound);
    EXPECT_EQ(categoryOf([&] { OffsetOpsStore::Open(m_dir, reading); }), Category::NotFound);
    {
        OffsetOpsStore writer = OffsetOpsStore::Open(m_dir);
        writer.Record(Opid(Site(1), 5), Field(1), 1);
        EXPECT_EQ(categoryOf([&] { OffsetOpsStore::Open(m_dir); }), Category::InUse);
        EXPECT_EQ(categoryOf([&] { writer.Record(Opid(Site(1), 4), Field(1), 1); }),
                  Category::Refused);
        EXPECT_EQ(categoryOf([&] { writer.Merge(m_dir); }), Category::Refused);
        EXPECT_EQ(categoryOf([&] { writer.Backup(m_dir / "inside"); }), Category::Refused);
        EXPECT_EQ(categoryOf([&] { writer.Backup(""); }), Category::Refused);
        // A target under a file cannot be made: the file system's own answer.
        const fs::path plain = m_dir.string() + "-plain-file";
        std::ofstream(plain) << "x";
        EXPECT_EQ(categoryOf([&] { writer.Backup(plain / "copy"); }), Category::NotFound);
        fs::remove(plain);
    }
    EXPECT_EQ(categoryOf([&] { OffsetOpsStore::OpenInMemory().Backup(m_dir / "copy"); }),
              Category::Refused);
    {
        OffsetOpsStore reader = OffsetOpsStore::Open(m_dir, reading);
        EXPECT_EQ(categoryOf([&] { reader.Record(Opid(Site(1), 6), Field(1), 1); }),
                  Category::ReadOnly);
    }
    StoreOptions tiny;
    tiny.cacheObjects = 3;
    EXPECT_EQ(categoryOf([&] {
                  OffsetOpsStore store = OffsetOpsStore::OpenInMemory(tiny);
                  store.Record(Opid(Site(1), 1), Field(1), 1);
              }),
              Category::Refused);
    // A journal record damaged in the middle of the file.
    const fs::path journal = m_dir / "journal";
    {
        OffsetOpsStore writer = OffsetOpsStore::Open(m_dir);
        for (int i = 10; i < 20; ++i) {
            writer.Record(Opid(Site(1), i), Field(1), 1);
            writer.Sync();
        }
        // Ends without a checkpoint: the journal keeps its records.
        std::ofstream(m_dir / "copy-of-journal", std::ios::binary)
            << std::ifstream(journal, std::ios::binary).rdbuf();
    }
    fs::copy_file(m_dir / "copy-of-journal", journal, fs::copy_options::overwrite_existing);
    {
        std::fstream file(journal, std::ios::in | std::ios::out | std::ios::binary);
        file.seekp(static_cast<std::streamoff>(fs::file_size(journal) / 2));
        file.put('\x55').put('\x55').put('\x55');
    }
    EXPECT_EQ(categoryOf([&] { OffsetOpsStore::Open(m_dir, reading); }), Category::Damaged);
    // A data file that is not one.
    fs::remove(journal);
    std::ofstream(m_dir / "data.mdb", std::ios::binary | std::ios::trunc) << std::string(8192, 'x');
    EXPECT_EQ(categoryOf([&] { OffsetOpsStore::Open(m_dir, reading); }), Category::Damaged);
}

// A handle that was moved from says so on every call, and takes a store
// again by assignment.
TEST(StoreHandles, AMovedFromHandleThrowsAClearErrorAndCanBeAssignedAgain) {
    OffsetOpsStore first = OffsetOpsStore::OpenInMemory();
    first.Record(Opid(Site(1), 1), Field(1), 4);
    OffsetOpsStore second = std::move(first);
    const std::vector<std::function<void()>> calls = {
        [&] { first.Size(); },
        [&] { first.Find(Field(1)); },
        [&] { first.Record(Opid(Site(1), 2), Field(1), 1); },
        [&] { first.Sync(); },
        [&] { first.Checkpoint(); },
        [&] { first.ForEach([](const FieldId&, const FieldTable&) { return true; }); },
        [&] { FieldCursor cursor(first); },
        [&] { first.Stats(); },
        [&] { first.Sites(); },
        [&] { first.IsReader(); },
        [&] { first.Directory(); },
        [&] { first.Close(); },
    };
    for (const auto& call : calls) {
        try {
            call();
            ADD_FAILURE() << "a call on a moved-from handle succeeded";
        } catch (const RuntimeError& e) {
            EXPECT_STREQ(e.what(), "the store handle was moved from");
        }
    }
    EXPECT_EQ(second.Find(Field(1)), (FieldTable{{Site(1), 1, 4}}));
    first = OffsetOpsStore::OpenInMemory();
    EXPECT_EQ(first.Size(), 0);
}

// ---------------------------------------------------------------------------

TEST(FieldText, ParsesWhatItPrintsAndSaysWhatIsWrong) {
    for (const FieldId& f :
         {Field(1), Field(42, "\x01"), Field(18446744073709551615u, "\xab\x00\xff")}) {
        EXPECT_EQ(ParseFieldId(ToString(f)), f) << ToString(f);
    }
    EXPECT_EQ(ParseFieldId(" 12/0A0b "), Field(12, "\x0a\x0b"));
    EXPECT_EQ(ParseFieldId("12"), Field(12));
    const std::vector<std::pair<std::string, std::string>> wrong = {
        {"", "the oid is missing"},
        {"#0/01", "oid 0 names no object"},
        {"-3", "is not an unsigned decimal integer"},
        {"18446744073709551616", "does not fit in 64 bits"},
        {"12/0", "odd number of hex digits"},
        {"12/zz", "is not hex"},
    };
    for (const auto& [text, says] : wrong) {
        std::string error;
        EXPECT_EQ(ParseFieldId(text, &error), std::nullopt) << text;
        EXPECT_THAT(error, HasSubstr(says)) << text;
        EXPECT_THAT(error, HasSubstr("expected OID/PATH")) << text;
    }
    EXPECT_EQ(ToString(FieldTable{{Site(2), 3, -4}, {Site(5), 6, 7}}),
              "{(00000002-0000-0000-0000-000000000000,(3,-4)),"
              "(00000005-0000-0000-0000-000000000000,(6,7))}");
}

}  // namespace
}  // namespace tarn
