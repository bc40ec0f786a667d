#include "tnRuntime/OverlayStore.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace tarn {

namespace {

std::string TempDirectory() {
    const char* dir = std::getenv("TMPDIR");
    return dir != nullptr && *dir != '\0' ? dir : "/tmp";
}

[[noreturn]] void Failed(const std::string& doing, int error) {
    throw RuntimeError(doing + ": " +
                       (error == ENOSPC || error == EDQUOT ? std::string("no space left on device")
                                                           : std::strerror(error)));
}

}  // namespace

OverlayStore::OverlayStore(std::shared_ptr<IStore> base) : m_base(std::move(base)) {
    std::string path = TempDirectory() + "/tarn-overlay-XXXXXX";
    m_fd = ::mkostemp(path.data(), O_CLOEXEC);
    if (m_fd < 0) {
        Failed("making a temporary file in '" + TempDirectory() + "'", errno);
    }
    ::unlink(path.c_str());
}

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

void OverlayStore::WriteAt(uint64 offset, const std::vector<octet_t>& bytes) {
    for (std::size_t done = 0; done < bytes.size();) {
        const ssize_t n = ::pwrite(m_fd, bytes.data() + done, bytes.size() - done,
                                   static_cast<off_t>(offset + done));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            Failed("writing the overlay's temporary file", errno);
        }
        done += static_cast<std::size_t>(n);
    }
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
            for (std::size_t done = 0; done < image.bytes.size();) {
                const ssize_t n =
                    ::pread(m_fd, image.bytes.data() + done, image.bytes.size() - done,
                            static_cast<off_t>(it->second.offset + done));
                if (n <= 0) {
                    if (n < 0 && errno == EINTR) {
                        continue;
                    }
                    Failed("reading the overlay's temporary file", n < 0 ? errno : EIO);
                }
                done += static_cast<std::size_t>(n);
            }
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
    for (const auto& [oid, image] : batch.writes) {
        WriteAt(end, image.bytes);
        written.emplace_back(oid, Extent{end, image.bytes.size(), ClassIndex(image.className)});
        end += image.bytes.size();
    }
    m_end = end;
    for (const auto& [oid, extent] : written) {
        m_images[oid] = extent;
        m_deleted.erase(oid);
    }
    for (uint64 oid : batch.deletes) {
        m_images.erase(oid);
        m_deleted.insert(oid);
    }
    for (const auto& [name, oid] : batch.roots) {
        m_roots[name] = oid;
    }
    for (const auto& [name, value] : batch.counters) {
        m_counters[name] = value;
    }
    m_nextIdentity = batch.nextIdentity;
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

StoreStats OverlayStore::Stats() {
    return m_base->Stats();
}

uint64 OverlayStore::FileBytes() {
    std::lock_guard lock(m_mutex);
    return m_end;
}

}  // namespace tarn
