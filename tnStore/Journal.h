#pragma once

// The journal: the operations of a store since its last checkpoint, in the
// file "journal" of the store directory, appended at every durable point.
//
// Positions are operation sequence numbers: the n-th journaled entry since
// the store was made has number n (0-based). A checkpoint stores the number
// of entries it covers; opening replays the entries from that number on.
//
// File layout (all integers little-endian):
//   header, 32 bytes:
//     magic       8 bytes  "TARNJRNL"
//     version     4 bytes  1
//     reserved    4 bytes  0
//     base        8 bytes  sequence number of the file's first entry
//     checksum    8 bytes  XXH3-64 of the 24 bytes above
//   then records, each one durable point:
//     magic       4 bytes  "TJR1"
//     length      4 bytes  payload bytes, at most kMaxPayload
//     first       8 bytes  sequence number of the record's first entry
//     count       4 bytes  entries in the payload, at least 1
//     hchecksum   4 bytes  low 32 bits of XXH3-64 of the 20 bytes above
//     checksum    8 bytes  XXH3-64 of the payload, seeded with `first`
//     payload     `length` bytes: `count` entries
//   Records follow each other without gaps: a record's `first` is the
//   previous record's first + count, the first record's is `base`.
//
// Entry encoding (varint: LEB128 of an unsigned 64-bit value, at most 10
// bytes; zigzag: (v << 1) ^ (v >> 63)):
//   kind        1 byte   1 = record an offset, 2 = clear
//   for kind 1:
//     site      varint   index into the record's site list; an index equal
//                        to the list's length adds a site, whose 16 bytes
//                        (Data1 LE, Data2 LE, Data3 LE, Data4) follow
//     t         varint   0..4294967295
//     oid       varint
//     pathlen   varint   0..kMaxPathBytes
//     path      pathlen bytes
//     offset    zigzag varint
//
// Torn tails. A process that dies while appending leaves a prefix of its
// last record; a machine that crashes may leave zeros or stale bytes in it.
// A torn tail is what follows the last complete record when it is either
// (a) shorter than a record header, (b) a record header that fails its
// checksum and is followed by zeros only, (c) a record whose header holds but
// whose payload runs past the end of the file, or (d) the file's last record,
// ending exactly at the end of the file, whose payload fails its checksum.
// A writer drops a torn tail (truncates the file) and reports the repair; a
// reader stops before it. Anything else that fails a check is damage: a
// clear RuntimeError naming the file, the byte offset and what is wrong, and
// nothing after it is replayed.

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn {

struct JournalEntry {
    enum class Kind : uint8 { Record = 1, Clear = 2 };
    Kind kind = Kind::Record;
    Guid site{};
    int64 t = 0;
    FieldId field;
    int64 offset = 0;
};

// What a scan of a journal file found.
struct JournalScan {
    uint64 base = 0;        // sequence number of the first entry of the file
    uint64 end = 0;         // sequence number after the last complete record
    uint64 validBytes = 0;  // file bytes up to the end of the last complete record
    uint64 fileBytes = 0;   // the file's size
    bool tornTail() const { return fileBytes > validBytes; }
};

class Journal {
public:
    static constexpr const char* kFileName = "journal";
    static constexpr std::size_t kHeaderBytes = 32;
    static constexpr std::size_t kRecordHeaderBytes = 32;
    static constexpr uint32 kMaxPayload = uint32{1} << 30;
    static constexpr std::size_t kMaxPathBytes = 1 << 20;

    using EntryFn = std::function<void(uint64 seq, const JournalEntry&)>;

    // Reads the journal file `path` from its start and calls `apply` for
    // every entry whose sequence number is `from` or more, in order. Entries
    // of a record are decoded and checked completely before the first of them
    // is applied. Throws RuntimeError for a missing or unreadable file and for
    // damage (see above); a torn tail ends the scan.
    static JournalScan Scan(const std::string& path, uint64 from, const EntryFn& apply);
    // The same on a journal opened with OpenForReading; `path` names it in
    // messages. The descriptor's file position is not used.
    static JournalScan Scan(int fd, const std::string& path, uint64 from, const EntryFn& apply);
    // Opens the journal file `path` for Scan; the caller closes the
    // descriptor. Throws RuntimeError when it is missing or unreadable.
    static int OpenForReading(const std::string& path);

    // Makes `dir`/journal an empty journal whose base is `base`, atomically:
    // written to "journal.new", synced (when `sync`), renamed over the
    // journal, and the directory synced.
    static void Reset(const std::string& dir, uint64 base, bool sync);

    // Opens the journal of `dir` for appending after a Scan of it: cuts the
    // torn tail the scan found, if any, and appends after the last complete
    // record.
    Journal(const std::string& dir, const JournalScan& scan, bool sync);
    ~Journal();
    Journal(const Journal&) = delete;
    Journal& operator=(const Journal&) = delete;

    // Encodes an entry into the pending record (memory only).
    void Add(const JournalEntry& entry);
    void AddRecord(const Guid& site, int64 t, const FieldId& field, int64 offset);
    void AddClear();
    // Appends the pending entries as one record and syncs the file (when
    // `sync`). Nothing pending: nothing written. On failure (a full disk,
    // an I/O error) the file is cut back to its previous end where possible,
    // the pending entries are kept, and a RuntimeError says what happened
    // ("no space left on device" for a full disk).
    void Commit();

    uint64 PendingEntries() const { return m_pendingCount; }
    uint64 End() const { return m_end; }  // sequence number after the last appended entry
    uint64 FileBytes() const { return m_fileBytes; }
    const std::string& Path() const { return m_path; }

private:
    std::string m_path;
    bool m_sync;
    int m_fd = -1;
    uint64 m_end = 0;
    uint64 m_fileBytes = 0;
    std::vector<octet_t> m_payload;
    std::vector<Guid> m_sites;  // the pending record's site list
    uint64 m_pendingCount = 0;
};

}  // namespace tarn
