#pragma once

// Shared pieces of the job programs (MainJob, GrowthJob, RecoveryJob,
// OpenJob): plain programs that run every case in a child process of its
// own, so that the peak resident memory and the bytes written to disk belong
// to that case alone, and that print tables rather than Google Benchmark
// output.
//
//   Now()               seconds on the steady clock
//   WriteBytes()        /proc/self/io write_bytes: bytes this process caused
//                       to be written to the storage layer (page-cache pages
//                       it dirtied, all threads included)
//   CurrentRssKiB()     VmRSS of /proc/self/status
//   CpuSeconds()        getrusage(RUSAGE_SELF) user + system time
//   PeakRssKiB()        getrusage(RUSAGE_SELF).ru_maxrss
//   DirBytes(dir)       the sum of the sizes of the regular files under dir
//   RemoveDir(dir)      removes dir and everything in it
//   FileSystemKind()    the kind of file system a path lies on, and
//   MachineLine()       the machine's cores and load: the tables' headers
//   DefaultStoreRoot()  where stores go unless a --dir says otherwise
//   RunInChild(fn)      forks; the child runs fn and sends its trivially
//                       copyable result (or the error that ended it) back
//                       through a pipe
//   OpStream            the generated stream of offset operations
//   Thousands(), MiB()  figures as the tables show them
//   MakeSites(n)        the n site identities of a stream
//   SplitList, ParseCount, NextCountArgument, Usage
//                       reading the programs' arguments
//   RunJob()            a program's main: an exception becomes one line and
//                       status 1
//
// A forked child starts with the parent's resident set as its peak, so the
// parents of these programs keep their memory small (nothing big is built
// before forking; every child generates its own input).

#include <sys/resource.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <sstream>
#include <string>
#include <system_error>
#include <type_traits>
#include <vector>

#include "bench/BenchSupport.h"
#include "tnOperation/FieldId.h"
#include "tnOperation/src/Util/Opid.h"
#include "tnUtils/Guid.h"

namespace tarn::bench {

// ---- Measuring ---------------------------------------------------------------

inline double Now() {
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

// A field of /proc/self/io, or -1 when it cannot be read.
inline int64 ProcIo(const char* name) {
    std::ifstream in("/proc/self/io");
    std::string key;
    int64 value = 0;
    while (in >> key >> value) {
        if (key.size() == std::strlen(name) + 1 && key.compare(0, key.size() - 1, name) == 0) {
            return value;
        }
    }
    return -1;
}

inline int64 WriteBytes() {
    return ProcIo("write_bytes");
}

// The resident set now (VmRSS of /proc/self/status), or -1.
inline int64 CurrentRssKiB() {
    std::ifstream in("/proc/self/status");
    std::string line;
    while (std::getline(in, line)) {
        if (line.rfind("VmRSS:", 0) == 0) {
            return std::atoll(line.c_str() + 6);
        }
    }
    return -1;
}

// User plus system CPU seconds of this process, all threads.
inline double CpuSeconds() {
    rusage usage{};
    ::getrusage(RUSAGE_SELF, &usage);
    return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
           static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) * 1e-6;
}

inline int64 PeakRssKiB() {
    rusage usage{};
    ::getrusage(RUSAGE_SELF, &usage);
    return usage.ru_maxrss;
}

inline int64 DirBytes(const std::string& dir) {
    std::error_code ec;
    int64 total = 0;
    for (auto it = std::filesystem::recursive_directory_iterator(dir, ec);
         !ec && it != std::filesystem::recursive_directory_iterator(); it.increment(ec)) {
        std::error_code fileEc;
        if (it->is_regular_file(fileEc)) {
            const auto size = it->file_size(fileEc);
            if (!fileEc) {
                total += static_cast<int64>(size);
            }
        }
    }
    return total;
}

inline void RemoveDir(const std::string& dir) {
    std::error_code ec;
    std::filesystem::remove_all(dir, ec);
}

// The file system type of `path` as text ("ext4", "tmpfs", ...), from statfs.
inline std::string FileSystemKind(const std::string& path) {
    struct statfs fs {};
    if (::statfs(path.c_str(), &fs) != 0) {
        return "unknown";
    }
    switch (static_cast<unsigned long>(fs.f_type)) {
        case 0x01021994ul:
            return "tmpfs";
        case 0xEF53ul:
            return "ext2/3/4";
        case 0x58465342ul:
            return "xfs";
        case 0x9123683Eul:
            return "btrfs";
        case 0x794c7630ul:
            return "overlayfs";
        default: {
            char buf[32];
            std::snprintf(buf, sizeof buf, "0x%lx", static_cast<unsigned long>(fs.f_type));
            return buf;
        }
    }
}

// A one-line description of the machine and its load right now.
inline std::string MachineLine() {
    std::ostringstream out;
    out << "cores " << ::sysconf(_SC_NPROCESSORS_ONLN);
    std::ifstream load("/proc/loadavg");
    double l1 = 0, l5 = 0, l15 = 0;
    if (load >> l1 >> l5 >> l15) {
        out << ", load average " << l1 << " " << l5 << " " << l15;
    }
    return out.str();
}

// A directory for stores next to the running program (that is, in the
// build tree); the caller makes it.
inline std::string DefaultStoreRoot(const char* leaf) {
    std::error_code ec;
    std::filesystem::path exe = std::filesystem::read_symlink("/proc/self/exe", ec);
    std::filesystem::path root =
        ec ? std::filesystem::current_path() / leaf : exe.parent_path() / leaf;
    return root.string();
}

// ---- Figures in the tables ---------------------------------------------------

// "1,234,567": a whole number with thousands separated.
inline std::string Thousands(double v) {
    char buf[64];
    std::snprintf(buf, sizeof buf, "%.0f", v);
    std::string digits = buf;
    std::string out;
    const std::size_t start = digits[0] == '-' ? 1 : 0;
    for (std::size_t i = 0; i < digits.size(); ++i) {
        if (i > start && (digits.size() - i) % 3 == 0) {
            out += ',';
        }
        out += digits[i];
    }
    return out;
}

// "12.3 MiB".
inline std::string MiB(double bytes) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.1f MiB", bytes / (1024.0 * 1024.0));
    return buf;
}

// ---- Child processes ---------------------------------------------------------

// What a child sends back: its result, or the one-line error that ended it.
template <typename R>
struct ChildOutcome {
    std::optional<R> result;
    std::string error;
};

template <typename R>
ChildOutcome<R> RunInChild(const std::function<R()>& fn) {
    static_assert(std::is_trivially_copyable_v<R>);
    struct Message {
        bool ok;
        R result;
        char error[512];
    };
    ChildOutcome<R> outcome;
    int fds[2];
    if (::pipe(fds) != 0) {
        outcome.error = "pipe failed";
        return outcome;
    }
    std::fflush(nullptr);
    const pid_t pid = ::fork();
    if (pid < 0) {
        ::close(fds[0]);
        ::close(fds[1]);
        outcome.error = "fork failed";
        return outcome;
    }
    if (pid == 0) {
        ::close(fds[0]);
        Message message{};
        try {
            message.result = fn();
            message.ok = true;
        } catch (const std::exception& e) {
            std::snprintf(message.error, sizeof message.error, "%s", e.what());
        }
        const char* p = reinterpret_cast<const char*>(&message);
        std::size_t left = sizeof message;
        while (left > 0) {
            const ssize_t n = ::write(fds[1], p, left);
            if (n <= 0) {
                break;
            }
            p += n;
            left -= static_cast<std::size_t>(n);
        }
        std::fflush(nullptr);
        ::_exit(0);
    }
    ::close(fds[1]);
    Message message{};
    char* p = reinterpret_cast<char*>(&message);
    std::size_t got = 0;
    while (got < sizeof message) {
        const ssize_t n = ::read(fds[0], p + got, sizeof message - got);
        if (n <= 0) {
            break;
        }
        got += static_cast<std::size_t>(n);
    }
    ::close(fds[0]);
    int status = 0;
    ::waitpid(pid, &status, 0);
    if (got == sizeof message && message.ok) {
        outcome.result = message.result;
    } else if (got == sizeof message) {
        outcome.error = message.error;
    } else if (WIFSIGNALED(status)) {
        outcome.error = "child killed by signal " + std::to_string(WTERMSIG(status));
    } else {
        outcome.error = "child ended without a result";
    }
    return outcome;
}

// ---- The operation stream ------------------------------------------------------

// One generated offset operation, in plain bytes: every subject builds its
// own key and value from it.
struct RawOp {
    uint64 oid;
    int64 t;
    int64 offset;
    uint32 site;  // 0 .. sites-1
    uint8 pathLen;
    octet_t path[3];
};

// The generated stream: `ops` operations over `fields` fields of objects
// with kFieldsPerObject fields each (object j has oid 1 + j; its field k has
// a path of 1 + k%3 bytes, each k+1), from `sites` sites. Each operation
// picks its field and its site uniformly at random; a site's time stamp goes
// up by one with each of its operations, so time stamps never decrease per
// field and site. Offsets are uniform in -8..8. The same seed gives the
// same stream in every process.
class OpStream {
public:
    static constexpr uint64 kFieldsPerObject = 5;

    OpStream(uint64 fields, uint32 sites, uint64 seed)
        : m_fields(fields), m_sites(sites), m_state(seed), m_clock(sites, 0) {}

    RawOp Next() {
        RawOp op{};
        const uint64 field = Below(m_fields);
        op.site = static_cast<uint32>(Below(m_sites));
        op.t = ++m_clock[op.site];
        op.offset = static_cast<int64>(Below(17)) - 8;
        op.oid = 1 + field / kFieldsPerObject;
        const uint64 k = field % kFieldsPerObject;
        op.pathLen = static_cast<uint8>(1 + k % 3);
        for (int b = 0; b < op.pathLen; ++b) {
            op.path[b] = static_cast<octet_t>(k + 1);
        }
        return op;
    }

    static FieldId Field(const RawOp& op) {
        return FieldId(OID(Seid(op.oid)), Path(op.path, op.pathLen));
    }

private:
    // splitmix64
    uint64 Random() {
        uint64 z = (m_state += 0x9e3779b97f4a7c15ull);
        z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ull;
        z = (z ^ (z >> 27)) * 0x94d049bb133111ebull;
        return z ^ (z >> 31);
    }
    uint64 Below(uint64 n) { return static_cast<uint64>((__uint128_t(Random()) * n) >> 64); }

    uint64 m_fields;
    uint64 m_sites;
    uint64 m_state;
    std::vector<int64> m_clock;
};

// The site Guids of a stream, by index.
inline std::vector<Guid> MakeSites(uint32 n) {
    std::vector<Guid> sites;
    for (uint32 i = 0; i < n; ++i) {
        sites.push_back(MakeSite(i + 1));
    }
    return sites;
}

// ---- Arguments -------------------------------------------------------------------

inline std::vector<std::string> SplitList(const std::string& text) {
    std::vector<std::string> items;
    std::string item;
    std::istringstream in(text);
    while (std::getline(in, item, ',')) {
        if (!item.empty()) {
            items.push_back(item);
        }
    }
    return items;
}

// A non-negative count with optional digit separators and k/M suffixes
// ("1000000", "1,000,000" is not allowed since ',' separates lists; use
// "1M", "10k" or "1_000_000").
inline std::optional<uint64> ParseCount(std::string text) {
    uint64 scale = 1;
    if (!text.empty() && (text.back() == 'k' || text.back() == 'K')) {
        scale = 1000;
        text.pop_back();
    } else if (!text.empty() && text.back() == 'M') {
        scale = 1000000;
        text.pop_back();
    }
    if (text.empty()) {
        return std::nullopt;
    }
    uint64 value = 0;
    for (char c : text) {
        if (c == '_') {
            continue;
        }
        if (c < '0' || c > '9' || value > (uint64{1} << 56)) {
            return std::nullopt;
        }
        value = value * 10 + static_cast<uint64>(c - '0');
    }
    return value * scale;
}

[[noreturn]] inline void Usage(const char* text) {
    std::fputs(text, stderr);
    std::exit(2);
}

// The positive count that follows the option at argv[i], stepping i onto it;
// prints `usage` and exits when it is missing, not a count, or zero.
inline uint64 NextCountArgument(int argc, char** argv, int& i, const char* usage) {
    if (i + 1 >= argc) {
        Usage(usage);
    }
    const std::optional<uint64> v = ParseCount(argv[++i]);
    if (!v || *v == 0) {
        Usage(usage);
    }
    return *v;
}

// The whole of a job program's main: runs `job`, and reports an exception
// as one line on standard error and status 1.
inline int RunJob(const char* program, int (*job)(int, char**), int argc, char** argv) {
    try {
        return job(argc, argv);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s\n", program, e.what());
        return 1;
    }
}

}  // namespace tarn::bench
