// The journal file: entries of every shape come back in order from any
// position, each kind of torn tail is dropped and cut, and damage anywhere is
// a RuntimeError that names the file.

#include "tnStore/Journal.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <xxhash.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "tnUtils/RuntimeError.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<octet_t>;
using Records = std::vector<std::vector<JournalEntry>>;

class TempDir {
public:
    TempDir() : m_path((fs::temp_directory_path() / "tarn-journal-XXXXXX").string()) {
        EXPECT_NE(::mkdtemp(m_path.data()), nullptr);
    }
    ~TempDir() { fs::remove_all(m_path); }
    const std::string& Path() const { return m_path; }
    std::string File() const { return m_path + "/journal"; }

private:
    std::string m_path;
};

Guid Site(uint8 n) {
    return Guid{0x01020300u + n, 0x0405, 0x0607, {8, 9, 10, 11, 12, 13, 14, n}};
}

JournalEntry Rec(uint8 site, int64 t, uint64 oid, const std::string& path, int64 offset) {
    return JournalEntry{JournalEntry::Kind::Record, Site(site), t,
                        FieldId(OID(Seid(oid)), tarn::Path(path.data(), ssize_t(path.size()))),
                        offset};
}

const JournalEntry kClear = [] {
    JournalEntry e;
    e.kind = JournalEntry::Kind::Clear;
    return e;
}();

bool Same(const JournalEntry& a, const JournalEntry& b) {
    return a.kind == b.kind && a.site == b.site && a.t == b.t && a.field == b.field &&
           a.offset == b.offset;
}

// Rewrites `file` through `edit`; its new size.
std::size_t Edit(const std::string& file, const std::function<void(Bytes&)>& edit) {
    std::ifstream in(file, std::ios::binary);
    Bytes b(std::istreambuf_iterator<char>(in), {});
    edit(b);
    std::ofstream(file, std::ios::binary | std::ios::trunc)
        .write(reinterpret_cast<const char*>(b.data()), std::streamsize(b.size()));
    return b.size();
}

// A fresh journal with base `base` holding `records`; the file size after each.
std::vector<uint64> Write(const TempDir& dir, uint64 base, const Records& records) {
    Journal::Reset(dir.Path(), base, false);
    Journal journal(dir.Path(), Journal::Scan(dir.File(), 0, {}), false);
    std::vector<uint64> ends{journal.FileBytes()};
    for (const auto& record : records) {
        for (const JournalEntry& e : record) {
            journal.Add(e);
        }
        journal.Commit();
        ends.push_back(journal.FileBytes());
    }
    return ends;
}

// The entries a scan from `from` applies, with their sequence numbers.
std::vector<std::pair<uint64, JournalEntry>> ScanAll(const std::string& file, uint64 from,
                                                     JournalScan& scan) {
    std::vector<std::pair<uint64, JournalEntry>> out;
    scan = Journal::Scan(file, from,
                         [&](uint64 seq, const JournalEntry& e) { out.emplace_back(seq, e); });
    return out;
}

// The message of the scan's RuntimeError; `applied` counts the entries applied before it.
std::string ScanError(const std::string& file, int& applied) {
    applied = 0;
    try {
        Journal::Scan(file, 0, [&](uint64, const JournalEntry&) { ++applied; });
    } catch (const RuntimeError& e) {
        return e.what();
    }
    return "(no error)";
}

const Records kRecords = {
    {Rec(1, 0, 1, "", 0),
     Rec(2, 4294967295, std::numeric_limits<uint64>::max(), std::string(300, 'p'),
         std::numeric_limits<int64>::min()),
     kClear, Rec(1, 5, 0, std::string("\0\x01", 2), std::numeric_limits<int64>::max()),
     Rec(3, 1, 2, std::string(16, '\xff'), -1)},
    {kClear},
    {Rec(2, 7, 1u << 20, "ab", -64), Rec(2, 8, 3, "ab", 64), Rec(1, 9, 3, "a", 1)},
};

TEST(JournalRoundTrip, EntriesComeBackInOrderFromAnyPosition) {
    TempDir dir;
    const std::vector<uint64> ends = Write(dir, 100, kRecords);
    std::vector<JournalEntry> all;
    for (const auto& record : kRecords) {
        all.insert(all.end(), record.begin(), record.end());
    }
    JournalScan scan;
    for (uint64 from : {0, 100, 102, 104, 105, 106, 108, 109, 500}) {
        const auto got = ScanAll(dir.File(), from, scan);
        const std::size_t skip = std::min<std::size_t>(from < 100 ? 0 : from - 100, all.size());
        ASSERT_EQ(got.size(), all.size() - skip) << from;
        for (std::size_t i = 0; i < got.size(); ++i) {
            EXPECT_EQ(got[i].first, 100 + skip + i) << from;
            EXPECT_TRUE(Same(got[i].second, all[skip + i])) << from << " " << i;
        }
        EXPECT_EQ(scan.base, 100u);
        EXPECT_EQ(scan.end, 109u);
        EXPECT_EQ(scan.validBytes, ends.back());
        EXPECT_FALSE(scan.tornTail());
    }
    {
        Journal journal(dir.Path(), scan, false);
        journal.Commit();  // nothing pending: nothing written
        EXPECT_EQ(fs::file_size(dir.File()), ends.back());
        EXPECT_EQ(journal.End(), 109u);
    }
    Journal::Reset(dir.Path(), 777, true);
    EXPECT_TRUE(ScanAll(dir.File(), 0, scan).empty());
    EXPECT_EQ(scan.base, 777u);
    EXPECT_EQ(scan.end, 777u);
    EXPECT_EQ(scan.fileBytes, Journal::kHeaderBytes);
    EXPECT_FALSE(fs::exists(dir.File() + ".new"));
    int applied;
    EXPECT_EQ(ScanError(dir.Path() + "/none", applied),
              "journal '" + dir.Path() + "/none' does not exist");
}

TEST(JournalTornTail, EachKindIsDroppedThenCutSoThatAppendingContinues) {
    const struct {
        const char* kind;
        std::function<void(Bytes&, std::size_t last)> tear;
    } cases[] = {
        {"(a) shorter than a header", [](Bytes& b, std::size_t last) { b.resize(last + 31); }},
        {"(b) zeros", [](Bytes& b, std::size_t last) { std::fill(b.begin() + last, b.end(), 0); }},
        {"(b) bad header, zeros after",
         [](Bytes& b, std::size_t last) {
             std::fill(b.begin() + last + 32, b.end(), 0);
             b[last + 9] ^= 1;
         }},
        {"(c) payload past the end", [](Bytes& b, std::size_t) { b.pop_back(); }},
        {"(d) last payload fails", [](Bytes& b, std::size_t last) { b[last + 40] ^= 0x80; }},
    };
    for (const auto& c : cases) {
        TempDir dir;
        const std::vector<uint64> ends = Write(dir, 10, kRecords);
        const std::size_t size = Edit(dir.File(), [&](Bytes& b) { c.tear(b, ends[2]); });
        JournalScan scan;
        EXPECT_EQ(ScanAll(dir.File(), 0, scan).size(), 6u) << c.kind;
        EXPECT_EQ(scan.end, 16u) << c.kind;
        EXPECT_EQ(scan.validBytes, ends[2]) << c.kind;
        EXPECT_EQ(scan.fileBytes, size) << c.kind;
        {
            Journal journal(dir.Path(), scan, false);
            EXPECT_EQ(fs::file_size(dir.File()), ends[2]) << c.kind;
            journal.Add(Rec(4, 3, 3, "x", 3));
            journal.Commit();
        }
        const auto got = ScanAll(dir.File(), 16, scan);
        ASSERT_EQ(got.size(), 1u) << c.kind;
        EXPECT_EQ(got[0].first, 16u) << c.kind;
        EXPECT_TRUE(Same(got[0].second, Rec(4, 3, 3, "x", 3))) << c.kind;
        EXPECT_FALSE(scan.tornTail()) << c.kind;
    }
}

// A record with the given header fields and payload, its checksums correct.
Bytes RawRecord(uint64 first, uint32 count, const Bytes& payload) {
    Bytes r(32);
    auto put = [&](std::size_t at, uint64 v, int width) {
        for (int i = 0; i < width; ++i) {
            r[at + i] = octet_t(v >> (8 * i));
        }
    };
    std::copy_n("TJR1", 4, r.begin());
    put(4, payload.size(), 4);
    put(8, first, 8);
    put(16, count, 4);
    put(20, uint32(XXH3_64bits(r.data(), 20)), 4);
    put(24, XXH3_64bits_withSeed(payload.data(), payload.size(), first), 8);
    r.insert(r.end(), payload.begin(), payload.end());
    return r;
}

using Damage = std::function<void(Bytes&, const std::vector<uint64>& ends)>;

// Replaces record `index` on with one record of the given fields and payload.
Damage From(std::size_t index, uint64 first, uint32 count, const Bytes& payload) {
    return [=](Bytes& b, const std::vector<uint64>& ends) {
        const Bytes r = RawRecord(first, count, payload);
        b.resize(ends[index]);
        b.insert(b.end(), r.begin(), r.end());
    };
}

Damage Only(uint32 count, const Bytes& payload) {
    return From(0, 10, count, payload);
}

// A record entry with a new site (all sevens), then `tail`.
Bytes Entry(const Bytes& tail) {
    Bytes e(18 + tail.size(), 7);
    e[0] = 1;
    e[1] = 0;
    std::copy(tail.begin(), tail.end(), e.begin() + 18);
    return e;
}

TEST(JournalDamage, IsARuntimeErrorNamingTheFileAndWhereAndStopsTheScan) {
    const struct {
        const char* what;
        Damage damage;
        int applied;  // entries of the records before the damaged one
        const char* says;
    } cases[] = {
        {"middle payload", [](Bytes& b, auto& e) { b[e[1] + 32] ^= 4; }, 5, "payload checksum"},
        {"middle header", [](Bytes& b, auto& e) { b[e[1] + 12] ^= 4; }, 5, "header checksum"},
        {"zeroed header, record after",
         [](Bytes& b, auto& e) { std::fill_n(b.begin() + e[1], 32, 0); }, 5, "header checksum"},
        {"torn-looking last payload, bytes after",
         [](Bytes& b, auto& e) {
             b[e[2] + 40] ^= 1;
             b.push_back(0);
         },
         6, "payload checksum"},
        {"continuity", From(2, 99, 1, {2}), 6, "starts at entry 99, expected 16"},
        {"file magic", [](Bytes& b, auto&) { b[0] = 'X'; }, 0, "at byte 0: not a journal"},
        {"file version", [](Bytes& b, auto&) { b[8] = 2; }, 0, "unknown version 2"},
        {"file base", [](Bytes& b, auto&) { b[17] ^= 1; }, 0, "header checksum"},
        {"short file", [](Bytes& b, auto&) { b.resize(20); }, 0, "shorter than its header"},
        {"no entries", Only(0, {2}), 0, "at byte 32: record holds no entries"},
        {"unknown kind after a good entry", Only(2, {2, 3}), 0, "at byte 65: unknown entry kind 3"},
        {"site index past the list", Only(1, {1, 1}), 0, "site index 1 beyond the record's 0"},
        {"site cut short", Only(1, {1, 0, 7, 7}), 0, "site runs past"},
        {"time stamp over 32 bits", Only(1, Entry({0x80, 0x80, 0x80, 0x80, 0x10, 0, 0, 0})), 0,
         "out of range"},
        {"endless varint", Only(1, Entry(Bytes(11, 0xff))), 0, "damaged time stamp varint"},
        {"varint over 64 bits",
         Only(1, Entry({1, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 2})), 0,
         "damaged oid varint"},
        {"path past the payload", Only(1, Entry({5, 6, 3, 1, 2})), 0, "path of 3 bytes runs past"},
        {"bytes after the entries", Only(1, {2, 2}), 0, "1 bytes after the record's 1 entries"},
        {"second entry missing", Only(2, Entry({5, 6, 0, 2})), 0, "entry runs past the end"},
    };
    TempDir dir;
    for (const auto& c : cases) {
        const std::vector<uint64> ends = Write(dir, 10, kRecords);
        Edit(dir.File(), [&](Bytes& b) { c.damage(b, ends); });
        int applied;
        const std::string error = ScanError(dir.File(), applied);
        EXPECT_EQ(error.rfind("journal '" + dir.File() + "' is damaged at byte ", 0), 0u) << error;
        EXPECT_NE(error.find(c.says), std::string::npos) << c.what << ": " << error;
        EXPECT_EQ(applied, c.applied) << c.what;
    }
}

}  // namespace
}  // namespace tarn
