#include "tnStore/Journal.h"

// The checksums come from libxxhash, found together with LMDB.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <xxhash.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <utility>

#include "tnUtils/Assert.h"
#include "tnUtils/FileIo.h"
#include "tnUtils/LittleEndian.h"
#include "tnUtils/RuntimeError.h"
#include "tnUtils/UniqueFd.h"

namespace tarn {

namespace {

constexpr octet_t kFileMagic[8] = {'T', 'A', 'R', 'N', 'J', 'R', 'N', 'L'};
constexpr octet_t kRecordMagic[4] = {'T', 'J', 'R', '1'};
constexpr uint32 kVersion = 1;
constexpr uint64 kMaxTimeStamp = 4294967295;
constexpr uint8 kKindRecord = 1;
constexpr uint8 kKindClear = 2;
constexpr std::size_t kGuidBytes = 16;
constexpr std::size_t kMaxVarintBytes = 10;
// Scans read the file this much at a time (more when one record is larger).
constexpr std::size_t kReadChunk = std::size_t{4} << 20;

octet_t* PutVarint(octet_t* out, uint64 value) {
    while (value >= 0x80) {
        *out++ = static_cast<octet_t>(value | 0x80);
        value >>= 7;
    }
    *out++ = static_cast<octet_t>(value);
    return out;
}

// False when the varint runs past `end`, is longer than ten bytes or does
// not fit 64 bits.
inline bool GetVarint(const octet_t*& p, const octet_t* end, uint64& value) {
    uint64 result = 0;
    for (unsigned shift = 0; shift < 7 * kMaxVarintBytes; shift += 7) {
        if (p == end) {
            return false;
        }
        const octet_t byte = *p++;
        if (shift == 63 && byte > 1) {
            return false;
        }
        result |= static_cast<uint64>(byte & 0x7f) << shift;
        if (byte < 0x80) {
            value = result;
            return true;
        }
    }
    return false;
}

std::string JoinPath(const std::string& dir, const char* name) {
    if (dir.empty()) {
        return name;
    }
    return dir.back() == '/' ? dir + name : dir + "/" + name;
}

[[noreturn]] void IoError(const std::string& path, const char* action, int error) {
    throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                       "journal '" + path + "': cannot " + action + ": " + SystemErrorText(error));
}

[[noreturn]] void Damage(const std::string& path, uint64 offset, const std::string& what) {
    throw RuntimeError(
        RuntimeError::Category::Damaged,
        "journal '" + path + "' is damaged at byte " + std::to_string(offset) + ": " + what);
}

void EncodeFileHeader(uint64 base, octet_t* out) {
    std::memcpy(out, kFileMagic, sizeof kFileMagic);
    PutLe(out + 8, kVersion, 4);
    PutLe(out + 12, 0, 4);
    PutLe(out + 16, base, 8);
    PutLe(out + 24, XXH3_64bits(out, 24), 8);
}

uint32 RecordHeaderChecksum(const octet_t* header) {
    return static_cast<uint32>(XXH3_64bits(header, 20));
}

void WriteAll(int fd, const octet_t* bytes, std::size_t size, uint64 at, const std::string& path) {
    if (const int error = WriteAt(fd, bytes, size, at)) {
        IoError(path, "write", error);
    }
}

// Reads a file front to back, up to the size it had when opened, keeping the
// bytes asked for in one buffer.
class FileReader {
public:
    FileReader(int fd, const std::string& path, uint64 size)
        : m_fd(fd), m_path(path), m_size(size) {}

    uint64 Size() const { return m_size; }

    // The bytes [pos, pos + n), n <= Size() - pos, where pos never goes below
    // an earlier call's. Null when the file turned out shorter (a writer
    // cut it meanwhile); Size() is then what was there.
    const octet_t* Get(uint64 pos, std::size_t n) {
        TARN_ASSERT(pos >= m_bufPos && n <= m_size - pos);
        if (pos + n <= m_bufPos + m_bufLen) {
            return m_buf.data() + (pos - m_bufPos);
        }
        const uint64 bufEnd = m_bufPos + m_bufLen;
        const std::size_t kept = pos < bufEnd ? static_cast<std::size_t>(bufEnd - pos) : 0;
        if (kept > 0) {
            std::memmove(m_buf.data(), m_buf.data() + (pos - m_bufPos), kept);
        }
        m_bufPos = pos;
        m_bufLen = kept;
        const std::size_t capacity = std::max<uint64>(n, std::min<uint64>(kReadChunk, m_size));
        if (m_buf.size() < capacity) {
            m_buf.resize(capacity);
        }
        while (m_bufLen < n) {
            const uint64 at = m_bufPos + m_bufLen;
            const std::size_t want = std::min<uint64>(m_buf.size() - m_bufLen, m_size - at);
            const ssize_t got =
                ::pread(m_fd, m_buf.data() + m_bufLen, want, static_cast<off_t>(at));
            if (got < 0 && errno == EINTR) {
                continue;
            }
            if (got < 0) {
                IoError(m_path, "read", errno);
            }
            if (got == 0) {
                m_size = at;
                return nullptr;
            }
            m_bufLen += static_cast<std::size_t>(got);
        }
        return m_buf.data();
    }

private:
    int m_fd;
    const std::string& m_path;
    uint64 m_size;
    std::vector<octet_t> m_buf;
    uint64 m_bufPos = 0;
    std::size_t m_bufLen = 0;
};

// Decodes the entries of one record payload, checking every bound.
class PayloadDecoder {
public:
    PayloadDecoder(const std::string& path, uint64 offset, const octet_t* payload, std::size_t size)
        : m_path(path), m_offset(offset), m_begin(payload), m_end(payload + size), m_p(payload) {}

    void Restart() {
        m_p = m_begin;
        m_sites.clear();
    }
    bool AtEnd() const { return m_p == m_end; }
    std::size_t Left() const { return static_cast<std::size_t>(m_end - m_p); }
    uint64 Offset() const { return m_offset + static_cast<uint64>(m_p - m_begin); }

    // Decodes the next entry, into `entry` when kFill.
    template <bool kFill>
    void Next(JournalEntry& entry) {
        if (m_p == m_end) {
            Fail("entry runs past the end of the record");
        }
        const octet_t kind = *m_p++;
        if (kind == kKindClear) {
            if constexpr (kFill) {
                entry.kind = JournalEntry::Kind::Clear;
                entry.site = Guid{};
                entry.t = 0;
                entry.field.oid = OID();
                entry.field.path.clear();
                entry.offset = 0;
            }
            return;
        }
        if (kind != kKindRecord) {
            --m_p;
            Fail("unknown entry kind " + std::to_string(kind));
        }
        const uint64 site = Varint("site index");
        if (site > m_sites.size()) {
            Fail("site index " + std::to_string(site) + " beyond the record's " +
                 std::to_string(m_sites.size()) + " sites");
        }
        if (site == m_sites.size()) {
            if (Left() < kGuidBytes) {
                Fail("site runs past the end of the record");
            }
            Guid g;
            g.Data1 = static_cast<uint32>(GetLe(m_p, 4));
            g.Data2 = static_cast<uint16>(GetLe(m_p + 4, 2));
            g.Data3 = static_cast<uint16>(GetLe(m_p + 6, 2));
            std::memcpy(g.Data4, m_p + 8, sizeof g.Data4);
            m_p += kGuidBytes;
            m_sites.push_back(g);
        }
        const uint64 t = Varint("time stamp");
        if (t > kMaxTimeStamp) {
            Fail("time stamp " + std::to_string(t) + " out of range");
        }
        const uint64 oid = Varint("oid");
        const uint64 pathLength = Varint("path length");
        if (pathLength > Journal::kMaxPathBytes || pathLength > Left()) {
            Fail("path of " + std::to_string(pathLength) +
                 " bytes runs past the end of the record");
        }
        const octet_t* pathBytes = m_p;
        m_p += pathLength;
        const uint64 zigzag = Varint("offset");
        if constexpr (kFill) {
            entry.kind = JournalEntry::Kind::Record;
            entry.site = m_sites[site];
            entry.t = static_cast<int64>(t);
            entry.field.oid = OID(Seid(oid));
            entry.field.path.clear();
            entry.field.path.Append(pathBytes, static_cast<ssize_t>(pathLength));
            entry.offset = static_cast<int64>((zigzag >> 1) ^ (~(zigzag & 1) + 1));
        }
    }

    [[noreturn]] void Fail(const std::string& what) const { Damage(m_path, Offset(), what); }

private:
    uint64 Varint(const char* what) {
        uint64 value = 0;
        const octet_t* start = m_p;
        if (!GetVarint(m_p, m_end, value)) {
            m_p = start;
            Fail(std::string("damaged ") + what + " varint");
        }
        return value;
    }

    const std::string& m_path;
    uint64 m_offset;
    const octet_t* m_begin;
    const octet_t* m_end;
    const octet_t* m_p;
    std::vector<Guid> m_sites;
};

bool AllZeros(FileReader& reader, uint64 pos, uint64 end) {
    while (pos < end) {
        const std::size_t n = std::min<uint64>(end - pos, kReadChunk);
        const octet_t* bytes = reader.Get(pos, n);
        if (bytes == nullptr) {
            return true;  // cut meanwhile: what was there held zeros only
        }
        for (std::size_t i = 0; i < n; ++i) {
            if (bytes[i] != 0) {
                return false;
            }
        }
        pos += n;
    }
    return true;
}

}  // namespace

int Journal::OpenForReading(const std::string& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.Get() < 0) {
        if (errno == ENOENT) {
            throw RuntimeError(RuntimeError::Category::NotFound,
                               "journal '" + path + "' does not exist");
        }
        IoError(path, "open", errno);
    }
    return fd.Release();
}

JournalScan Journal::Scan(const std::string& path, uint64 from, const EntryFn& apply) {
    UniqueFd fd(OpenForReading(path));
    return Scan(fd.Get(), path, from, apply);
}

namespace {

// The fields of a record header that passed its checksum and magic.
struct RecordHeader {
    uint64 length = 0;
    uint64 first = 0;
    uint64 count = 0;
    uint64 checksum = 0;
};

// What reading a record at a position found.
enum class RecordRead {
    Whole,        // a complete record whose checksums hold
    TornTail,     // the torn tail: the scan ends here
    CutMeanwhile  // the file was cut while read: look again at what is left
};

// Checks the file header; returns the sequence number of the first entry.
uint64 ReadFileHeader(FileReader& reader, const std::string& path) {
    if (reader.Size() < Journal::kHeaderBytes) {
        Damage(path, 0,
               "the file is " + std::to_string(reader.Size()) + " bytes, shorter than its header");
    }
    const octet_t* header = reader.Get(0, Journal::kHeaderBytes);
    if (header == nullptr) {
        Damage(path, 0, "the file was cut while being read");
    }
    if (std::memcmp(header, kFileMagic, sizeof kFileMagic) != 0) {
        Damage(path, 0, "not a journal (bad magic)");
    }
    const uint64 version = GetLe(header + 8, 4);
    if (version != kVersion) {
        Damage(path, 8, "unknown version " + std::to_string(version));
    }
    if (GetLe(header + 24, 8) != XXH3_64bits(header, 24)) {
        Damage(path, 24, "header checksum mismatch");
    }
    return GetLe(header + 16, 8);
}

// The fields of the record header `h` at `pos`, checked against the limits
// and against `expectedFirst`, the entry that must come next.
RecordHeader CheckRecordHeader(const octet_t* h, const std::string& path, uint64 pos,
                               uint64 expectedFirst) {
    if (std::memcmp(h, kRecordMagic, sizeof kRecordMagic) != 0) {
        Damage(path, pos, "bad record magic");
    }
    const RecordHeader header{GetLe(h + 4, 4), GetLe(h + 8, 8), GetLe(h + 16, 4), GetLe(h + 24, 8)};
    if (header.length > Journal::kMaxPayload) {
        Damage(path, pos,
               "record payload of " + std::to_string(header.length) + " bytes over the limit");
    }
    if (header.count == 0) {
        Damage(path, pos, "record holds no entries");
    }
    if (header.first != expectedFirst) {
        Damage(path, pos,
               "record starts at entry " + std::to_string(header.first) + ", expected " +
                   std::to_string(expectedFirst));
    }
    if (header.count > std::numeric_limits<uint64>::max() - header.first) {
        Damage(path, pos, "record's entry numbers overflow");
    }
    return header;
}

// Reads the record at `pos` into `header` and `payload`, telling a torn tail
// (see Journal.h) from damage, which throws.
RecordRead ReadRecord(FileReader& reader, const std::string& path, uint64 pos, uint64 expectedFirst,
                      RecordHeader& header, const octet_t*& payload) {
    const uint64 left = reader.Size() - pos;
    if (left < Journal::kRecordHeaderBytes) {
        return RecordRead::TornTail;  // shorter than a record header
    }
    const octet_t* h = reader.Get(pos, Journal::kRecordHeaderBytes);
    if (h == nullptr) {
        return RecordRead::CutMeanwhile;
    }
    if (GetLe(h + 20, 4) != RecordHeaderChecksum(h)) {
        if (AllZeros(reader, pos + Journal::kRecordHeaderBytes, reader.Size())) {
            return RecordRead::TornTail;  // a header that never made it, zeros after it
        }
        Damage(path, pos, "record header checksum mismatch");
    }
    header = CheckRecordHeader(h, path, pos, expectedFirst);
    if (header.length > left - Journal::kRecordHeaderBytes) {
        return RecordRead::TornTail;  // the payload runs past the end of the file
    }
    const octet_t* record = reader.Get(pos, Journal::kRecordHeaderBytes + header.length);
    if (record == nullptr) {
        return RecordRead::CutMeanwhile;
    }
    payload = record + Journal::kRecordHeaderBytes;
    if (XXH3_64bits_withSeed(payload, header.length, header.first) != header.checksum) {
        if (header.length == left - Journal::kRecordHeaderBytes) {
            return RecordRead::TornTail;  // the last record, its payload not all written
        }
        Damage(path, pos + Journal::kRecordHeaderBytes, "record payload checksum mismatch");
    }
    return RecordRead::Whole;
}

// Decodes and checks every entry of a whole record, then applies those
// numbered `from` or later.
void ApplyRecord(const std::string& path, uint64 payloadPos, const RecordHeader& header,
                 const octet_t* payload, uint64 from, const Journal::EntryFn& apply) {
    JournalEntry entry;
    PayloadDecoder decoder(path, payloadPos, payload, header.length);
    for (uint64 i = 0; i < header.count; ++i) {
        decoder.Next<false>(entry);
    }
    if (!decoder.AtEnd()) {
        decoder.Fail(std::to_string(decoder.Left()) + " bytes after the record's " +
                     std::to_string(header.count) + " entries");
    }
    if (from >= header.first + header.count) {
        return;
    }
    decoder.Restart();
    for (uint64 i = 0; i < header.count; ++i) {
        if (header.first + i < from) {
            decoder.Next<false>(entry);
        } else {
            decoder.Next<true>(entry);
            apply(header.first + i, entry);
        }
    }
}

}  // namespace

JournalScan Journal::Scan(int fd, const std::string& path, uint64 from, const EntryFn& apply) {
    struct stat st;
    if (::fstat(fd, &st) != 0) {
        IoError(path, "stat", errno);
    }
    FileReader reader(fd, path, static_cast<uint64>(st.st_size));
    JournalScan scan;
    scan.base = ReadFileHeader(reader, path);
    scan.end = scan.base;
    uint64 pos = kHeaderBytes;
    while (pos < reader.Size()) {
        RecordHeader header;
        const octet_t* payload = nullptr;
        const RecordRead read = ReadRecord(reader, path, pos, scan.end, header, payload);
        if (read == RecordRead::TornTail) {
            break;
        }
        if (read == RecordRead::CutMeanwhile) {
            continue;
        }
        ApplyRecord(path, pos + kRecordHeaderBytes, header, payload, from, apply);
        pos += kRecordHeaderBytes + header.length;
        scan.end = header.first + header.count;
    }
    scan.validBytes = pos;
    scan.fileBytes = reader.Size();
    return scan;
}

void Journal::Reset(const std::string& dir, uint64 base, bool sync) {
    const std::string target = JoinPath(dir, kFileName);
    const std::string temp = target + ".new";
    octet_t header[kHeaderBytes];
    EncodeFileHeader(base, header);
    try {
        UniqueFd fd(::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
        if (fd.Get() < 0) {
            IoError(temp, "create", errno);
        }
        WriteAll(fd.Get(), header, sizeof header, 0, temp);
        if (sync && ::fsync(fd.Get()) != 0) {
            IoError(temp, "sync", errno);
        }
        if (::close(fd.Release()) != 0) {
            IoError(temp, "close", errno);
        }
        if (::rename(temp.c_str(), target.c_str()) != 0) {
            IoError(temp, ("rename to '" + target + "'").c_str(), errno);
        }
    } catch (...) {
        ::unlink(temp.c_str());
        throw;
    }
    if (sync) {
        const std::string where = dir.empty() ? "." : dir;
        UniqueFd dirFd(::open(where.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (dirFd.Get() < 0 || ::fsync(dirFd.Get()) != 0) {
            const int error = errno;
            throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                               "journal '" + target + "': cannot sync directory '" + where +
                                   "': " + SystemErrorText(error));
        }
    }
}

Journal::Journal(const std::string& dir, const JournalScan& scan, bool sync)
    : m_path(JoinPath(dir, kFileName)),
      m_sync(sync),
      m_end(scan.end),
      m_fileBytes(scan.validBytes) {
    // A scan always covers the file header; anything less would cut the file.
    TARN_ASSERT(scan.validBytes >= kHeaderBytes && scan.end >= scan.base);
    UniqueFd fd(::open(m_path.c_str(), O_WRONLY | O_CLOEXEC));
    if (fd.Get() < 0) {
        if (errno == ENOENT) {
            throw RuntimeError(RuntimeError::Category::NotFound,
                               "journal '" + m_path + "' does not exist");
        }
        IoError(m_path, "open for writing", errno);
    }
    struct stat st;
    if (::fstat(fd.Get(), &st) != 0) {
        IoError(m_path, "stat", errno);
    }
    const uint64 size = static_cast<uint64>(st.st_size);
    if (size < m_fileBytes) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           "journal '" + m_path + "' is " + std::to_string(size) +
                               " bytes, shorter than the " + std::to_string(m_fileBytes) +
                               " bytes it held when scanned");
    }
    if (size > m_fileBytes) {
        // Drop the torn tail so that the next record follows the last whole one.
        if (::ftruncate(fd.Get(), static_cast<off_t>(m_fileBytes)) != 0) {
            IoError(m_path, "cut its torn tail", errno);
        }
        if (m_sync && ::fdatasync(fd.Get()) != 0) {
            IoError(m_path, "sync", errno);
        }
    }
    m_payload.resize(kRecordHeaderBytes);
    m_fd = fd.Release();
}

Journal::~Journal() {
    if (m_fd >= 0) {
        ::close(m_fd);
    }
}

void Journal::Add(const JournalEntry& entry) {
    if (entry.kind == JournalEntry::Kind::Clear) {
        AddClear();
        return;
    }
    TARN_ASSERT(entry.kind == JournalEntry::Kind::Record);
    AddRecord(entry.site, entry.t, entry.field, entry.offset);
}

void Journal::AddClear() {
    m_payload.push_back(kKindClear);
    ++m_pendingCount;
}

void Journal::AddRecord(const Guid& siteGuid, int64 t, const FieldId& field, int64 offset) {
    TARN_ASSERT(0 <= t && t <= 4294967295);
    const std::size_t pathLength = static_cast<std::size_t>(field.path.size());
    TARN_ASSERT(pathLength <= kMaxPathBytes);

    std::size_t site = 0;
    while (site < m_sites.size() && m_sites[site] != siteGuid) {
        ++site;
    }
    const std::size_t start = m_payload.size();
    m_payload.resize(start + 1 + kGuidBytes + 5 * kMaxVarintBytes + pathLength);
    octet_t* p = m_payload.data() + start;
    *p++ = kKindRecord;
    p = PutVarint(p, site);
    if (site == m_sites.size()) {
        m_sites.push_back(siteGuid);
        PutLe(p, siteGuid.Data1, 4);
        PutLe(p + 4, siteGuid.Data2, 2);
        PutLe(p + 6, siteGuid.Data3, 2);
        std::memcpy(p + 8, siteGuid.Data4, sizeof siteGuid.Data4);
        p += kGuidBytes;
    }
    p = PutVarint(p, static_cast<uint64>(t));
    p = PutVarint(p, field.oid.value_);
    p = PutVarint(p, pathLength);
    if (pathLength > 0) {
        std::memcpy(p, field.path.data(), pathLength);
        p += pathLength;
    }
    const uint64 bits = static_cast<uint64>(offset);
    p = PutVarint(p, (bits << 1) ^ (~(bits >> 63) + 1));
    m_payload.resize(static_cast<std::size_t>(p - m_payload.data()));
    ++m_pendingCount;
}

void Journal::Commit() {
    if (m_pendingCount == 0) {
        return;
    }
    const std::size_t length = m_payload.size() - kRecordHeaderBytes;
    if (length > kMaxPayload) {
        throw RuntimeError(RuntimeError::Category::Refused,
                           "journal '" + m_path + "': cannot write a record of " +
                               std::to_string(length) + " bytes, over the limit of " +
                               std::to_string(kMaxPayload));
    }
    octet_t* header = m_payload.data();
    const octet_t* payload = header + kRecordHeaderBytes;
    std::memcpy(header, kRecordMagic, sizeof kRecordMagic);
    PutLe(header + 4, length, 4);
    PutLe(header + 8, m_end, 8);
    PutLe(header + 16, m_pendingCount, 4);
    PutLe(header + 20, RecordHeaderChecksum(header), 4);
    PutLe(header + 24, XXH3_64bits_withSeed(payload, length, m_end), 8);
    try {
        // Written at the previous end rather than appended: a retry after a
        // failure overwrites whatever part of this record got there.
        WriteAll(m_fd, header, m_payload.size(), m_fileBytes, m_path);
        if (m_sync && ::fdatasync(m_fd) != 0) {
            IoError(m_path, "sync", errno);
        }
    } catch (...) {
        // Best effort: the next open drops what remains as a torn tail.
        if (::ftruncate(m_fd, static_cast<off_t>(m_fileBytes)) != 0) {
        }
        throw;
    }
    m_fileBytes += m_payload.size();
    m_end += m_pendingCount;
    m_pendingCount = 0;
    m_payload.resize(kRecordHeaderBytes);
    m_sites.clear();
}

}  // namespace tarn
