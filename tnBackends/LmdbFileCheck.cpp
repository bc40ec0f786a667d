#include "tnBackends/LmdbFileCheck.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <span>
#include <utility>
#include <vector>

#include "tnUtils/FileIo.h"
#include "tnUtils/RuntimeError.h"
#include "tnUtils/Types.h"
#include "tnUtils/UniqueFd.h"

namespace tarn {

namespace {

// LMDB 0.9's data file on a 64-bit host starts with two meta pages, page 0
// at offset 0 and page 1 at offset `page size`. Each is a 16-byte page header
// (page number 8, pad 2, flags 2, lower/upper 4) followed by the meta record:
//   magic 4, version 4, address 8, map size 8,
//   two database records of 48 bytes (pad 4, flags 2, depth 2, branch pages 8,
//   leaf pages 8, overflow pages 8, entries 8, root 8), the free database's
//   first (its pad holds the page size), the main database's second,
//   last page number 8, transaction id 8.
constexpr std::size_t kPageHeaderBytes = 16;
constexpr std::size_t kPageFlagsOffset = 10;
constexpr std::size_t kPageLowerOffset = 12;  // an overflow page's page count (4 bytes)
constexpr std::size_t kPageUpperOffset = 14;
constexpr uint64 kBranchPage = 0x01;
constexpr uint64 kLeafPage = 0x02;
constexpr uint64 kOverflowPage = 0x04;
constexpr uint64 kMetaPage = 0x08;
constexpr std::size_t kMagicOffset = 16;
constexpr std::size_t kVersionOffset = 20;
constexpr std::size_t kMapSizeOffset = 32;
constexpr std::size_t kPageSizeOffset = 40;
constexpr std::size_t kFreeDbOffset = 40;
constexpr std::size_t kMainDbOffset = 88;
constexpr std::size_t kDbRecordBytes = 48;
constexpr std::size_t kDbFlagsOffset = 4;
constexpr std::size_t kDbDepthOffset = 6;
constexpr std::size_t kDbRootOffset = 40;
constexpr std::size_t kLastPageOffset = 136;
constexpr std::size_t kTxnIdOffset = 144;
constexpr std::size_t kMetaBytes = 152;
constexpr uint32 kLmdbMagic = 0xBEEFC0DE;
constexpr uint32 kDataVersion = 1;
constexpr uint32 kMinPageSize = 512;
constexpr uint32 kMaxPageSize = 65536;
// Branch and leaf pages hold, after the header, 2-byte offsets of their
// nodes, which sit at the page's end. A node: 2 + 2 bytes (a leaf's data size,
// or the low 32 bits of a branch's child page number), flags 2 (a branch: the
// child's high 16 bits), key size 2, the key, then a leaf's data: in place,
// or (big data) the 8-byte number of the first of its overflow pages, or
// (a named database in the main database) its 48-byte database record.
constexpr std::size_t kNodeHeaderBytes = 8;
constexpr uint64 kBigData = 0x01;
constexpr uint64 kSubData = 0x02;
constexpr uint64 kMaxKeyBytes = 511;
constexpr uint64 kIntegerKeyDb = 0x08;  // the free-page database's flags
constexpr uint64 kNoPage = ~uint64{0};  // the root of an empty database
constexpr uint64 kMaxDepth = 32;        // LMDB's cursors hold no deeper trees
// Beyond the address space of any 64-bit host.
constexpr uint64 kMaxMapBytes = uint64{1} << 48;

// LMDB 0.9's lock file on Linux: a 128-byte header (magic 4, lock format 4,
// the reader mutex, the last transaction id 8 at offset 48, the number of
// reader slots in use 4 at offset 56, padded to a cache line; then the writer
// mutex, padded to a cache line), then reader slots of 64 bytes. The format
// is the lock version (1) plus 1 << 16 for process-id locking.
constexpr std::size_t kLockHeaderBytes = 128;
constexpr std::size_t kReaderSlotBytes = 64;
constexpr std::size_t kLockFormatOffset = 4;
constexpr std::size_t kNumReadersOffset = 56;
constexpr uint32 kLockFormat = 0x00010001;

// A reader looks at most this many times while a writer commits.
constexpr int kReaderAttempts = 5;

// A failed write is blamed on a full disk when less than this is left.
constexpr uint64 kNearlyFullBytes = uint64{1} << 20;

[[noreturn]] void Fail(const std::string& dir, const std::string& what,
                       RuntimeError::Category category = RuntimeError::Category::Damaged) {
    throw RuntimeError(category, "store '" + dir + "': " + what);
}

// After a failed File::ReadAt of `name`.
[[noreturn]] void FailReading(const std::string& dir, const std::string& name) {
    Fail(dir,
         "cannot read " + name + ": " +
             (errno != 0 ? std::strerror(errno) : "it ended while being read"),
         errno != 0 ? RuntimeError::CategoryOfErrno(errno) : RuntimeError::Category::Io);
}

uint64 GetLe(const octet_t* in, std::size_t width) {
    uint64 value = 0;
    for (std::size_t i = width; i-- > 0;) {
        value = (value << 8) | in[i];
    }
    return value;
}

std::string Hex(uint64 value) {
    char text[24];
    std::snprintf(text, sizeof text, "0x%llx", static_cast<unsigned long long>(value));
    return text;
}

// An open file, closed when the scope ends.
class File {
public:
    explicit File(const std::string& path) : m_fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC)) {}

    int Fd() const { return m_fd.Get(); }

    // Reads `size` bytes at `offset`; false when the file ends before (errno
    // 0) or reading fails.
    bool ReadAt(octet_t* out, std::size_t size, uint64 offset) const {
        const ssize_t n = tarn::ReadAt(m_fd.Get(), out, size, offset);
        if (n >= 0) {
            errno = 0;  // the file ended
        }
        return n == static_cast<ssize_t>(size);
    }

private:
    UniqueFd m_fd;
};

bool PlausiblePageSize(uint64 size) {
    return size >= kMinPageSize && size <= kMaxPageSize && (size & (size - 1)) == 0;
}

// A database record of a meta page, or of the main database's entry for a
// named database.
struct DbRecord {
    uint64 flags = 0;
    uint64 depth = 0;
    uint64 root = 0;
};

DbRecord ParseDb(const octet_t* record) {
    return {GetLe(record + kDbFlagsOffset, 2), GetLe(record + kDbDepthOffset, 2),
            GetLe(record + kDbRootOffset, 8)};
}

struct Meta {
    uint64 pageSize = 0;
    uint64 lastPage = 0;
    uint64 txnId = 0;
    DbRecord free, main;
    std::string problem;  // empty: a meta page LMDB accepts
    bool magic = false;   // carries LMDB's magic
};

Meta ParseMeta(const octet_t* page) {
    Meta meta;
    meta.magic = GetLe(page + kMagicOffset, 4) == kLmdbMagic;
    meta.pageSize = GetLe(page + kPageSizeOffset, 4);
    meta.lastPage = GetLe(page + kLastPageOffset, 8);
    meta.txnId = GetLe(page + kTxnIdOffset, 8);
    meta.free = ParseDb(page + kFreeDbOffset);
    meta.main = ParseDb(page + kMainDbOffset);
    const uint64 mapSize = GetLe(page + kMapSizeOffset, 8);
    const uint64 version = GetLe(page + kVersionOffset, 4);
    if (!meta.magic) {
        meta.problem = "has no LMDB magic";
    } else if ((GetLe(page + kPageFlagsOffset, 2) & kMetaPage) == 0) {
        meta.problem = "is not marked as a meta page";
    } else if (version != kDataVersion) {
        meta.problem = "has data version " + std::to_string(version) + ", LMDB 0.9 writes " +
                       std::to_string(kDataVersion);
    } else if (!PlausiblePageSize(meta.pageSize)) {
        meta.problem = "has an implausible page size " + std::to_string(meta.pageSize);
    } else if (mapSize > kMaxMapBytes) {
        meta.problem = "has an implausible map size " + std::to_string(mapSize);
    } else if (meta.lastPage < 1 || meta.lastPage > kMaxMapBytes / meta.pageSize) {
        meta.problem = "has an implausible last page number " + std::to_string(meta.lastPage);
    }
    return meta;
}

// Damage found by the page walk below.
struct PageDamage {
    std::string what;
};

// The B-trees of a meta page, walked page by page with plain reads: LMDB
// trusts the offsets, sizes, flags and page numbers inside its pages, and one
// wrong byte there sends it to a wrong page, outside the page or outside the
// map. Every branch and leaf page is checked (header, free-space bounds, each
// node within the page, node flags a database of this store may hold, child
// and overflow page numbers within the file, leaves all at the tree's depth,
// no page used twice); the overflow pages holding the images are not read.
// Also checked is what only a writer uses: the overflow pages' headers (their
// page counts go into the free list when an image is replaced) and the newest
// commit's free-page lists, which must name no page that commit uses (LMDB
// would write over it).
class PageWalk {
public:
    PageWalk(const File& file, uint64 pageSize, uint64 pages)
        : m_file(file), m_pageSize(pageSize), m_pages(pages), m_seen(pages) {}

    // Walks the trees of `meta`: the newest commit's first, then the older.
    void Walk(const Meta& meta, bool newest) {
        if (meta.free.flags != kIntegerKeyDb || meta.main.flags != 0) {
            throw PageDamage{"a meta page has database flags LMDB did not write"};
        }
        Tree("main", meta.main, Kind::Main);
        if (newest) {
            Tree("free-page", meta.free, Kind::Free);
            for (const uint64 page : m_listedFree) {
                if (m_seen[page] != 0) {
                    throw PageDamage{"page " + std::to_string(page) +
                                     " is listed as free but in use"};
                }
            }
        }
    }

private:
    enum class Kind : uint8 { Main, Data, Free };
    static constexpr uint8 kOverflowMark = 255;

    void Tree(const std::string& name, const DbRecord& db, Kind kind) {
        if (db.root == kNoPage && db.depth == 0) {
            return;  // an empty database
        }
        if (db.depth < 1 || db.depth > kMaxDepth || db.root < 2 || db.root >= m_pages) {
            throw PageDamage{"the " + name + " database's root page " + std::to_string(db.root) +
                             " or depth " + std::to_string(db.depth) + " is impossible"};
        }
        Page(name, db.root, db.depth - 1, kind);
    }

    [[noreturn]] void Damaged(const std::string& name, uint64 pgno, const std::string& what) {
        throw PageDamage{"page " + std::to_string(pgno) + " (" + name + " database) " + what};
    }

    // Checks page `pgno` of database `name`, `height` levels above its leaves.
    void Page(const std::string& name, uint64 pgno, uint64 height, Kind kind) {
        // A page shared by the trees of both meta pages is checked once.
        const auto mark = static_cast<uint8>(1 + height + (kMaxDepth + 1) * static_cast<int>(kind));
        if (m_seen[pgno] == mark) {
            return;
        }
        if (m_seen[pgno] != 0) {
            Damaged(name, pgno, "is reached from two places of different kinds");
        }
        m_seen[pgno] = mark;
        std::vector<octet_t> page(m_pageSize);
        if (!m_file.ReadAt(page.data(), page.size(), pgno * m_pageSize)) {
            Damaged(name, pgno, "cannot be read");
        }
        const uint64 flags = GetLe(&page[kPageFlagsOffset], 2);
        const uint64 lower = GetLe(&page[kPageLowerOffset], 2);
        const uint64 upper = GetLe(&page[kPageUpperOffset], 2);
        if (GetLe(page.data(), 8) != pgno) {
            Damaged(name, pgno, "carries the page number " + std::to_string(GetLe(page.data(), 8)));
        }
        if (flags != (height > 0 ? kBranchPage : kLeafPage)) {
            Damaged(name, pgno,
                    "has flags " + Hex(flags) + " where a " + (height > 0 ? "branch" : "leaf") +
                        " page belongs");
        }
        if (lower < kPageHeaderBytes + 2 || (lower - kPageHeaderBytes) % 2 != 0 || upper < lower ||
            upper > m_pageSize) {
            Damaged(name, pgno,
                    "has free-space bounds " + std::to_string(lower) + ".." +
                        std::to_string(upper) + " outside the page");
        }
        const uint64 nodes = (lower - kPageHeaderBytes) / 2;
        for (uint64 i = 0; i < nodes; ++i) {
            const uint64 at = GetLe(&page[kPageHeaderBytes + 2 * i], 2);
            if (at < upper || at + kNodeHeaderBytes > m_pageSize) {
                Damaged(name, pgno, "has node " + std::to_string(i) + " outside its nodes' area");
            }
            const octet_t* node = &page[at];
            const uint64 low = GetLe(node, 2) | (GetLe(node + 2, 2) << 16);
            const uint64 nodeFlags = GetLe(node + 4, 2);
            const uint64 keyBytes = GetLe(node + 6, 2);
            if (keyBytes > kMaxKeyBytes) {
                Damaged(name, pgno,
                        "has node " + std::to_string(i) + " with a key of " +
                            std::to_string(keyBytes) + " bytes");
            }
            const uint64 end = at + kNodeHeaderBytes + keyBytes;
            if (height > 0) {
                const uint64 child = low | (nodeFlags << 32);
                if (end > m_pageSize || child < 2 || child >= m_pages) {
                    Damaged(name, pgno,
                            "has node " + std::to_string(i) + " out of bounds (child page " +
                                std::to_string(child) + ")");
                }
                Page(name, child, height - 1, kind);
                continue;
            }
            Leaf(name, pgno, i, std::span(node, m_pageSize - at), low, nodeFlags, keyBytes, kind);
        }
    }

    // Checks node `i` of leaf `pgno`: `node` runs to the end of the page,
    // `dataBytes` and `flags` are the node's.
    void Leaf(const std::string& name, uint64 pgno, uint64 i, std::span<const octet_t> node,
              uint64 dataBytes, uint64 flags, uint64 keyBytes, Kind kind) {
        const std::string which = "has node " + std::to_string(i);
        const uint64 allowed = kind == Kind::Main ? (kBigData | kSubData) : kBigData;
        if ((flags & ~allowed) != 0) {
            Damaged(name, pgno, which + " with flags " + Hex(flags));
        }
        const bool big = (flags & kBigData) != 0;
        const uint64 inPage = big ? 8 : dataBytes;
        if (kNodeHeaderBytes + keyBytes + inPage > node.size()) {
            Damaged(name, pgno, which + " running past the page");
        }
        const octet_t* data = node.data() + kNodeHeaderBytes + keyBytes;
        std::vector<octet_t> overflowData;
        if (big) {
            const uint64 first = GetLe(data, 8);
            const uint64 count = (kPageHeaderBytes - 1 + dataBytes) / m_pageSize + 1;
            if (first < 2 || first >= m_pages || count > m_pages - first) {
                Damaged(name, pgno,
                        which + " whose " + std::to_string(dataBytes) + " bytes on overflow page " +
                            std::to_string(first) + " run past the file");
            }
            Overflow(name, pgno, first, count);
            {
                octet_t header[kPageHeaderBytes];
                if (!m_file.ReadAt(header, sizeof header, first * m_pageSize) ||
                    GetLe(header, 8) != first ||
                    GetLe(header + kPageFlagsOffset, 2) != kOverflowPage ||
                    // (LMDB may rewrite a smaller image into a longer run)
                    GetLe(header + kPageLowerOffset, 4) < count ||
                    GetLe(header + kPageLowerOffset, 4) > m_pages - first) {
                    Damaged(name, pgno,
                            which + " whose overflow page " + std::to_string(first) +
                                " has a damaged header");
                }
            }
            if (kind == Kind::Free) {
                overflowData.resize(dataBytes);
                if (!m_file.ReadAt(overflowData.data(), dataBytes,
                                   first * m_pageSize + kPageHeaderBytes)) {
                    Damaged(name, pgno, which + " whose overflow pages cannot be read");
                }
                data = overflowData.data();
            }
        }
        if ((flags & kSubData) != 0) {
            // A named database: its record, then its tree.
            if (big || dataBytes != kDbRecordBytes || GetLe(data + kDbFlagsOffset, 2) != 0) {
                Damaged(name, pgno, which + " with a damaged database record");
            }
            const std::string sub(reinterpret_cast<const char*>(node.data()) + kNodeHeaderBytes,
                                  keyBytes);
            Tree("'" + sub + "'", ParseDb(data), Kind::Data);
        } else if (kind == Kind::Free) {
            // A list of free pages: its length, then the page numbers.
            if (dataBytes < 8 || dataBytes % 8 != 0 || GetLe(data, 8) != dataBytes / 8 - 1) {
                Damaged(name, pgno, which + " holding a damaged free-page list");
            }
            for (uint64 k = 1; k < dataBytes / 8; ++k) {
                const uint64 free = GetLe(data + 8 * k, 8);
                if (free < 2 || free >= m_pages) {
                    Damaged(name, pgno,
                            which + " listing page " + std::to_string(free) +
                                " as free, outside the file");
                }
                m_listedFree.push_back(free);
            }
        }
    }

    // Marks the `count` overflow pages from `first` as used: by one image,
    // or by the same image in both commits.
    void Overflow(const std::string& name, uint64 pgno, uint64 first, uint64 count) {
        if (m_seen[first] == kOverflowMark) {
            return;
        }
        for (uint64 page = first; page < first + count; ++page) {
            if (m_seen[page] != 0) {
                Damaged(name, pgno,
                        "has an image on overflow pages " + std::to_string(first) + ".." +
                            std::to_string(first + count - 1) + ", which overlap other pages");
            }
            m_seen[page] = kOverflowMark;
        }
    }

    const File& m_file;
    uint64 m_pageSize;
    uint64 m_pages;             // the pages a commit may use: the newest meta page's last + 1
    std::vector<uint8> m_seen;  // per page: 0, or what it was checked as
    std::vector<uint64> m_listedFree;
};

// Both meta pages, read and checked; the file's size in `size`.
std::pair<Meta, Meta> ReadMetas(const std::string& dir, const File& file, uint64 size) {
    octet_t first[kMetaBytes] = {};
    if (!file.ReadAt(first, std::min<uint64>(size, kMetaBytes), 0)) {
        FailReading(dir, "data.mdb");
    }
    if (size >= kMagicOffset + 4 && GetLe(first + kMagicOffset, 4) != kLmdbMagic) {
        // Page 1 sits one page further; without page 0's page size, try the
        // host's.
        const uint64 pageSize = PlausiblePageSize(GetLe(first + kPageSizeOffset, 4))
                                    ? GetLe(first + kPageSizeOffset, 4)
                                    : static_cast<uint64>(::sysconf(_SC_PAGESIZE));
        octet_t second[kMetaBytes];
        if (!file.ReadAt(second, kMetaBytes, pageSize) || !ParseMeta(second).magic) {
            Fail(dir, "not a store: data.mdb is not an LMDB file");
        }
    }
    if (size < kMetaBytes) {
        Fail(dir,
             "data.mdb is " + std::to_string(size) + " bytes, too short for LMDB's two meta pages");
    }
    const Meta meta0 = ParseMeta(first);
    if (!meta0.problem.empty() && !PlausiblePageSize(meta0.pageSize)) {
        Fail(dir, "data.mdb is damaged: meta page 0 " + meta0.problem);
    }
    // The rule: both meta pages lie within the file.
    if (size < 2 * meta0.pageSize) {
        Fail(dir, "data.mdb is " + std::to_string(size) + " bytes, shorter than LMDB's two meta " +
                      "pages of " + std::to_string(meta0.pageSize) + " bytes");
    }
    octet_t second[kMetaBytes];
    if (!file.ReadAt(second, kMetaBytes, meta0.pageSize)) {
        FailReading(dir, "data.mdb");
    }
    const Meta meta1 = ParseMeta(second);
    // LMDB refuses a file with either meta page damaged; it is named here.
    if (!meta0.problem.empty() || !meta1.problem.empty()) {
        std::string what = "data.mdb is damaged:";
        if (!meta0.problem.empty()) {
            what += " meta page 0 " + meta0.problem;
        }
        if (!meta1.problem.empty()) {
            what += std::string(meta0.problem.empty() ? "" : ";") + " meta page 1 " + meta1.problem;
        }
        Fail(dir, what);
    }
    if (meta0.pageSize != meta1.pageSize) {
        Fail(dir, "data.mdb is damaged: its meta pages disagree on the page size (" +
                      std::to_string(meta0.pageSize) + " and " + std::to_string(meta1.pageSize) +
                      ")");
    }
    return {meta0, meta1};
}

// Whether `dir` holds nothing but LMDB's two files.
bool OnlyLmdbFiles(const std::string& dir) {
    std::error_code ec;
    for (std::filesystem::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
        const std::string name = it->path().filename().string();
        if (name != "data.mdb" && name != "lock.mdb") {
            return false;
        }
    }
    return !ec;
}

// The larger transaction id of the two meta pages, or 0 when unreadable.
uint64 NewestTxnId(const File& file) {
    octet_t bytes[8];
    if (!file.ReadAt(bytes, 4, kPageSizeOffset)) {
        return 0;
    }
    const uint64 pageSize = GetLe(bytes, 4);
    uint64 newest = 0;
    for (const uint64 page : {uint64{0}, pageSize}) {
        if (PlausiblePageSize(pageSize) && file.ReadAt(bytes, 8, page + kTxnIdOffset)) {
            newest = std::max(newest, GetLe(bytes, 8));
        }
    }
    return newest;
}

// Checks data.mdb once: the meta pages and the file's length (a few reads,
// whatever the file's size) and, when `walkPages`, every branch and leaf page
// of both meta pages' trees. `writer`: an empty data.mdb alone in the
// directory passes.
void CheckDataFileOnce(const std::string& dir, const File& file, bool writer, bool walkPages) {
    struct stat st;
    if (::fstat(file.Fd(), &st) != 0) {
        Fail(dir, "cannot examine data.mdb: " + std::string(std::strerror(errno)),
             RuntimeError::CategoryOfErrno(errno));
    }
    const auto size = static_cast<uint64>(st.st_size);
    if (size == 0) {
        // LMDB writes the meta pages of a new file when it opens it. Empty and
        // alone, the file is a store whose making was cut short, which a
        // writer makes again; beside other files it has lost its contents.
        if (writer && OnlyLmdbFiles(dir)) {
            return;
        }
        Fail(dir, "data.mdb is empty (a copy that lost its contents?)");
    }
    const auto [meta0, meta1] = ReadMetas(dir, file, size);
    // The rule: the newest meta page (LMDB takes the one with the larger
    // transaction id) names the last page its commit uses; the file must
    // reach to the end of that page, or LMDB faults on touching it.
    const Meta& newest = meta1.txnId > meta0.txnId ? meta1 : meta0;
    const uint64 needed = (newest.lastPage + 1) * newest.pageSize;
    if (size < needed) {
        Fail(dir, "data.mdb is " + std::to_string(size) + " bytes, shorter than the " +
                      std::to_string(needed) +
                      " its last commit needs (a partial copy, or a copy onto a full disk?)");
    }
    if (!walkPages) {
        return;
    }
    // Both meta pages' trees: a reader picks its meta page by the lock file's
    // transaction id, which may name the older one. The older commit's pages
    // stay untouched until the commit after the next.
    PageWalk walk(file, newest.pageSize, newest.lastPage + 1);
    try {
        walk.Walk(newest, true);
        walk.Walk(&newest == &meta0 ? meta1 : meta0, false);
    } catch (const PageDamage& damage) {
        Fail(dir, "data.mdb is damaged: " + damage.what);
    }
}

// CheckDataFileOnce, for a caller that may look while a writer commits (any
// caller but the writer itself, which `writer` names): what it found counts
// when no commit ended meanwhile (the pages it read were then untouched).
// Otherwise it looks again; a writer that never pauses leaves its newest
// pages unchecked, pages it wrote itself.
void CheckDataFile(const std::string& dir, const File& file, bool writer, bool walkPages) {
    if (writer) {
        CheckDataFileOnce(dir, file, writer, walkPages);
        return;
    }
    for (int attempt = 0; attempt < kReaderAttempts; ++attempt) {
        const uint64 before = NewestTxnId(file);
        try {
            CheckDataFileOnce(dir, file, writer, walkPages);
        } catch (const RuntimeError&) {
            if (NewestTxnId(file) == before) {
                throw;
            }
            continue;
        }
        if (NewestTxnId(file) == before) {
            return;
        }
    }
}

// Whether any process other than the caller uses the store: a writer holding
// the directory's flock, or an LMDB environment holding the lock file's lock
// (every environment keeps a shared lock on its first byte while open).
bool InUse(const std::string& dir, int lockFd, bool callerIsWriter) {
    if (!callerIsWriter) {
        const int dirFd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        if (dirFd >= 0) {
            const bool held = ::flock(dirFd, LOCK_EX | LOCK_NB) != 0 && errno == EWOULDBLOCK;
            ::close(dirFd);  // releases the flock, if taken
            if (held) {
                return true;
            }
        }
    }
    struct flock query = {};
    query.l_type = F_WRLCK;
    query.l_whence = SEEK_SET;
    query.l_start = 0;
    query.l_len = 1;
    // An open-file-description query sees the locks of every process; the
    // classic one (for kernels without it) those of the others.
    if (::fcntl(lockFd, F_OFD_GETLK, &query) != 0) {
        query = {};
        query.l_type = F_WRLCK;
        query.l_whence = SEEK_SET;
        query.l_len = 1;
        if (::fcntl(lockFd, F_GETLK, &query) != 0) {
            return true;  // cannot tell: assume the worst
        }
    }
    return query.l_type != F_UNLCK;
}

}  // namespace

void CheckLmdbDataFile(const std::string& dir, bool writer) {
    const File file(dir + "/data.mdb");
    if (file.Fd() < 0) {
        if (errno == ENOENT) {
            return;
        }
        Fail(dir, "cannot open data.mdb: " + std::string(std::strerror(errno)),
             RuntimeError::CategoryOfErrno(errno));
    }
    CheckDataFile(dir, file, writer, false);
}

void CheckLmdbPages(const std::string& dir) {
    const File file(dir + "/data.mdb");
    if (file.Fd() < 0) {
        Fail(dir, "cannot open data.mdb: " + std::string(std::strerror(errno)));
    }
    CheckDataFile(dir, file, false, true);
}

std::optional<std::string> CheckLmdbLockFile(const std::string& dir, bool callerIsWriter) {
    const std::string path = dir + "/lock.mdb";
    File file(path);
    if (file.Fd() < 0) {
        if (errno != ENOENT) {
            Fail(dir, "cannot open lock.mdb: " + std::string(std::strerror(errno)),
                 RuntimeError::CategoryOfErrno(errno));
        }
        struct stat st;
        if (::stat((dir + "/data.mdb").c_str(), &st) == 0 && st.st_size > 0) {
            return "lock.mdb was missing; made anew";
        }
        return std::nullopt;
    }
    struct stat st;
    if (::fstat(file.Fd(), &st) != 0) {
        Fail(dir, "cannot examine lock.mdb: " + std::string(std::strerror(errno)),
             RuntimeError::CategoryOfErrno(errno));
    }
    const auto size = static_cast<uint64>(st.st_size);
    std::string problem;
    octet_t header[kLockHeaderBytes];
    // The rule: the header and at least one reader slot, since LMDB counts
    // its reader slots from the file's length.
    if (size < kLockHeaderBytes + kReaderSlotBytes) {
        problem = "it is " + std::to_string(size) + " bytes, shorter than LMDB's lock header";
    } else if (!file.ReadAt(header, sizeof header, 0)) {
        FailReading(dir, "lock.mdb");
    } else if (GetLe(header, 4) != kLmdbMagic) {
        problem = "bad magic " + Hex(GetLe(header, 4));
    } else if (GetLe(header + kLockFormatOffset, 4) != kLockFormat) {
        problem = "lock format " + Hex(GetLe(header + kLockFormatOffset, 4)) + ", expected " +
                  Hex(kLockFormat);
    } else if (const uint64 readers = GetLe(header + kNumReadersOffset, 4);
               readers > (size - kLockHeaderBytes) / kReaderSlotBytes) {
        problem = std::to_string(readers) + " readers in a file with room for " +
                  std::to_string((size - kLockHeaderBytes) / kReaderSlotBytes);
    }
    if (problem.empty()) {
        return std::nullopt;
    }
    if (InUse(dir, file.Fd(), callerIsWriter)) {
        Fail(dir, "lock.mdb is damaged (" + problem +
                      ") and another process has the store open; it is made anew by the next "
                      "opener once no other process uses the store");
    }
    if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
        Fail(dir, "lock.mdb is damaged (" + problem +
                      ") and cannot be removed: " + std::strerror(errno));
    }
    return "lock.mdb was damaged (" + problem + "); made anew";
}

std::string LmdbFailureText(const std::string& dir, int rc, const std::string& text) {
    if (rc == ENOSPC || rc == EDQUOT) {
        return SystemErrorText(rc);
    }
    if (rc != EIO) {
        return text;
    }
    struct statvfs fs;
    if (::statvfs(dir.c_str(), &fs) != 0) {
        return text;
    }
    // Blocks the caller may still use: root may use the reserved ones too.
    const uint64 blocks = ::geteuid() == 0 ? fs.f_bfree : fs.f_bavail;
    if (static_cast<uint64>(blocks) * fs.f_frsize >= kNearlyFullBytes) {
        return text;
    }
    return "no space left on device (" + text + ")";
}

}  // namespace tarn
