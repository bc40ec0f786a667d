#include "tnBackends/OverlayStore.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "tnUtils/FileIo.h"

namespace tarn {

namespace {

std::string TempDirectory() {
    const char* dir = std::getenv("TMPDIR");
    return dir != nullptr && *dir != '\0' ? dir : "/tmp";
}

[[noreturn]] void Failed(const std::string& doing, int error) {
    throw RuntimeError(RuntimeError::CategoryOfErrno(error), doing + ": " + SystemErrorText(error));
}

// An unlinked temporary file, open for reading and writing.
int MakeTempFile() {
    std::string path = TempDirectory() + "/tarn-overlay-XXXXXX";
    const int fd = ::mkostemp(path.data(), O_CLOEXEC);
    if (fd < 0) {
        Failed("making a temporary file in '" + TempDirectory() + "'", errno);
    }
    ::unlink(path.c_str());
    return fd;
}

void WriteAll(int fd, const octet_t* bytes, std::size_t size, uint64 offset) {
    if (const int error = WriteAt(fd, bytes, size, offset)) {
        Failed("writing the overlay's temporary file", error);
    }
}

void ReadAll(int fd, octet_t* bytes, std::size_t size, uint64 offset) {
    const ssize_t n = ReadAt(fd, bytes, size, offset);
    if (n != static_cast<ssize_t>(size)) {
        Failed("reading the overlay's temporary file", n < 0 ? errno : EIO);
    }
}

}  // namespace

OverlayStore::OverlayStore(std::shared_ptr<IStore> base, uint64 compactionFloor)
    : m_base(std::move(base)), m_compactionFloor(compactionFloor), m_fd(MakeTempFile()) {}

OverlayStore::~OverlayStore() {
    ::close(m_fd);
}

std::size_t OverlayStore::ClassIndex(const std::string& name) {
    auto it = std::find(m_classNames.begin(), m_classNames.end(), name);
    if (it == m_classNames.end()) {
        m_classNames.push_back(name);
        return m_classNames.size() - 1;
    }
    return static_cast<std::size_t>(it - m_classNames.begin());
}

// Rewrites the file with the live images only, in a new file that replaces
// it when complete; the old file stays in use if anything fails.
void OverlayStore::Compact() {
    const int fd = MakeTempFile();
    try {
        uint64 end = 0;
        std::vector<octet_t> bytes;
        std::unordered_map<uint64, Extent> moved;
        moved.reserve(m_images.size());
        for (const auto& [oid, extent] : m_images) {
            bytes.resize(extent.size);
            ReadAll(m_fd, bytes.data(), bytes.size(), extent.offset);
            WriteAll(fd, bytes.data(), bytes.size(), end);
            moved.emplace(oid, Extent{end, extent.size, extent.className});
            end += extent.size;
        }
        ::close(m_fd);
        m_fd = fd;
        m_end = end;
        m_images.swap(moved);
    } catch (...) {
        ::close(fd);
        throw;
    }
}

void OverlayStore::FlushIntoBase() {
    std::lock_guard lock(m_mutex);
    CommitBatch batch;
    batch.deletes.assign(m_deleted.begin(), m_deleted.end());
    batch.roots.insert(m_roots.begin(), m_roots.end());
    batch.counters.insert(m_counters.begin(), m_counters.end());
    batch.nextIdentity = m_nextIdentity ? *m_nextIdentity : m_base->NextIdentity();
    std::vector<uint64> order;
    order.reserve(m_images.size());
    for (const auto& [oid, extent] : m_images) {
        order.push_back(oid);
    }
    std::sort(order.begin(), order.end());
    batch.streamedWrites = [&](const CommitBatch::ImageSink& sink) {
        StoredImage image;
        for (uint64 oid : order) {
            const Extent& extent = m_images.at(oid);
            image.className = m_classNames[extent.className];
            image.bytes.resize(extent.size);
            ReadAll(m_fd, image.bytes.data(), image.bytes.size(), extent.offset);
            sink(oid, image);
        }
    };
    m_base->Commit(batch);
    m_images.clear();
    m_deleted.clear();
    m_roots.clear();
    m_counters.clear();
    m_nextIdentity.reset();
    m_end = 0;
    m_liveBytes = 0;
    // The file's old bytes are garbage now; giving them back is a courtesy.
    (void)::ftruncate(m_fd, 0);
}

std::optional<StoredImage> OverlayStore::Load(uint64 oid) {
    {
        std::lock_guard lock(m_mutex);
        if (m_deleted.count(oid) != 0) {
            return std::nullopt;
        }
        auto it = m_images.find(oid);
        if (it != m_images.end()) {
            StoredImage image;
            image.className = m_classNames[it->second.className];
            image.bytes.resize(it->second.size);
            ReadAll(m_fd, image.bytes.data(), image.bytes.size(), it->second.offset);
            return image;
        }
    }
    return m_base->Load(oid);
}

std::optional<uint64> OverlayStore::FindRoot(std::string_view name) {
    {
        std::lock_guard lock(m_mutex);
        auto it = m_roots.find(name);
        if (it != m_roots.end()) {
            return it->second;
        }
    }
    return m_base->FindRoot(name);
}

std::map<std::string, uint64> OverlayStore::Roots() {
    std::map<std::string, uint64> roots = m_base->Roots();
    std::lock_guard lock(m_mutex);
    for (const auto& [name, oid] : m_roots) {
        roots[name] = oid;
    }
    return roots;
}

std::optional<uint64> OverlayStore::FindCounter(std::string_view name) {
    {
        std::lock_guard lock(m_mutex);
        auto it = m_counters.find(name);
        if (it != m_counters.end()) {
            return it->second;
        }
    }
    return m_base->FindCounter(name);
}

std::map<std::string, uint64> OverlayStore::Counters() {
    std::map<std::string, uint64> counters = m_base->Counters();
    std::lock_guard lock(m_mutex);
    for (const auto& [name, value] : m_counters) {
        counters[name] = value;
    }
    return counters;
}

uint64 OverlayStore::NextIdentity() {
    {
        std::lock_guard lock(m_mutex);
        if (m_nextIdentity) {
            return *m_nextIdentity;
        }
    }
    return m_base->NextIdentity();
}

// The images are written first, at the end of the file, and entered only
// once all are there: a failed write changes nothing.
void OverlayStore::Commit(const CommitBatch& batch) {
    std::lock_guard lock(m_mutex);
    std::vector<std::pair<uint64, Extent>> written;
    written.reserve(batch.writes.size());
    uint64 end = m_end;
    const auto add = [&](uint64 oid, const StoredImage& image) {
        WriteAll(m_fd, image.bytes.data(), image.bytes.size(), end);
        written.emplace_back(oid, Extent{end, image.bytes.size(), ClassIndex(image.className)});
        end += image.bytes.size();
    };
    for (const auto& [oid, image] : batch.writes) {
        add(oid, image);
    }
    if (batch.streamedWrites) {
        batch.streamedWrites(add);
    }
    m_end = end;
    for (const auto& [oid, extent] : written) {
        auto [it, added] = m_images.try_emplace(oid, extent);
        if (!added) {
            m_liveBytes -= it->second.size;
            it->second = extent;
        }
        m_liveBytes += extent.size;
        m_deleted.erase(oid);
    }
    for (uint64 oid : batch.deletes) {
        auto it = m_images.find(oid);
        if (it != m_images.end()) {
            m_liveBytes -= it->second.size;
            m_images.erase(it);
        }
        m_deleted.insert(oid);
    }
    for (const auto& [name, oid] : batch.roots) {
        m_roots[name] = oid;
    }
    for (const auto& [name, value] : batch.counters) {
        m_counters[name] = value;
    }
    m_nextIdentity = batch.nextIdentity;
    // The batch is in. A compaction that fails (a full disk) leaves the file
    // as it was, only larger: nothing to report.
    if (m_end > m_compactionFloor && m_end > 2 * m_liveBytes) {
        try {
            Compact();
        } catch (const RuntimeError&) {
        }
    }
}

void OverlayStore::ForEachIdentity(const std::function<void(uint64)>& fn) {
    std::set<uint64> identities;
    std::set<uint64> deleted;
    {
        std::lock_guard lock(m_mutex);
        deleted = m_deleted;
        for (const auto& [oid, extent] : m_images) {
            identities.insert(oid);
        }
    }
    m_base->ForEachIdentity([&](uint64 oid) {
        if (deleted.count(oid) == 0) {
            identities.insert(oid);
        }
    });
    for (uint64 oid : identities) {
        fn(oid);
    }
}

ImageCounts OverlayStore::Stats() {
    return m_base->Stats();
}

uint64 OverlayStore::FileBytes() {
    std::lock_guard lock(m_mutex);
    return m_end;
}

}  // namespace tarn
