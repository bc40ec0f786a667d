#pragma once

// Shared pieces of the benchmarks: the key and site series, the peer
// containers the B+tree map is measured against, and scratch directories.
//
// Keys. Field i of a series belongs to object 1 + i/8 and has a 4-byte path
// holding i%8 big-endian, so that keys order as their numbers and every path
// sits in Path's local buffer (the common case of a field path).
//
// Peers. Every peer stores, per field, a table of site -> SiteOffset with the
// same time-stamp rule as OffsetOpsOnField<int64>::Insert:
//   - std::map and std::unordered_map hold OffsetOpsOnField<int64> itself
//     (node-based containers never move a value);
//   - absl::btree_map moves values between slots on every insertion and
//     split, which OffsetOpsOnField (one owning pointer, assignable but with
//     neither a copy nor a move constructor) does not allow; its peer payload
//     is MovableTable, a plain movable std::map with the same Insert.

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <random>
#include <string>
#include <string_view>
#include <system_error>
#include <unordered_map>
#include <utility>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnOperation/src/Util/Opid.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tnUtils/Assert.h"
#include "tnUtils/Guid.h"
#include "tnUtils/IOutputStream.h"

#ifdef TARN_BENCH_HAVE_ABSL
#include <absl/container/btree_map.h>
#endif

namespace tarn::bench {

inline FieldId MakeField(uint64 i) {
    const uint32 field = static_cast<uint32>(i % 8);
    const octet_t path[4] = {static_cast<octet_t>(field >> 24), static_cast<octet_t>(field >> 16),
                             static_cast<octet_t>(field >> 8), static_cast<octet_t>(field)};
    return FieldId(OID(Seid(1 + i / 8)), Path(path, 4));
}

// A key that falls strictly between field i and field i+1 (its path is one
// byte longer), so lower_bound searches miss every stored key.
inline FieldId MakeFieldBetween(uint64 i) {
    FieldId f = MakeField(i);
    const octet_t extra = 0x80;
    f.path.Append(&extra, 1);
    return f;
}

inline Guid MakeSite(uint32 n) {
    Guid g{};
    g.Data1 = n;
    g.Data2 = static_cast<uint16>(n * 7919u);
    g.Data3 = 0x4000;
    for (int b = 0; b < 8; ++b) {
        g.Data4[b] = static_cast<uint8>(n * 31u + static_cast<uint32>(b));
    }
    return g;
}

inline std::vector<FieldId> MakeFields(uint64 n) {
    std::vector<FieldId> keys;
    keys.reserve(n);
    for (uint64 i = 0; i < n; ++i) {
        keys.push_back(MakeField(i));
    }
    return keys;
}

template <typename T>
void Shuffle(std::vector<T>& v, uint64 seed = 42) {
    std::mt19937_64 rng(seed);
    std::shuffle(v.begin(), v.end(), rng);
}

// A permutation of 0..n-1: ascending, or shuffled with a fixed seed.
inline std::vector<uint64> MakeOrder(uint64 n, bool random) {
    std::vector<uint64> order(n);
    for (uint64 i = 0; i < n; ++i) {
        order[i] = i;
    }
    if (random) {
        Shuffle(order);
    }
    return order;
}

struct FieldIdHash {
    std::size_t operator()(const FieldId& f) const noexcept {
        const std::string_view bytes(reinterpret_cast<const char*>(f.path.data()),
                                     static_cast<std::size_t>(f.path.size()));
        return std::hash<std::string_view>()(bytes) ^ (f.oid.value_ * 0x9e3779b97f4a7c15ull);
    }
};

// The per-site table for peers that move their values.
struct MovableTable {
    std::map<Guid, SiteOffset<int64>> m_map;

    void Insert(const SiteNum& s, ssize_t t, int64 offset) {
        SiteOffset<int64>& so = m_map[s];
        TARN_ASSERT(so.t <= t);
        so.t = t;
        so.o = static_cast<int64>(static_cast<uint64>(so.o) + static_cast<uint64>(offset));
    }
    std::size_t NumSites() const { return m_map.size(); }
};

inline std::size_t NumSites(const OffsetOpsOnField<int64>& t) {
    return t.m_map.size();
}
inline std::size_t NumSites(const MovableTable& t) {
    return t.NumSites();
}

using StdMapPeer = std::map<FieldId, OffsetOpsOnField<int64>>;
using UnorderedMapPeer = std::unordered_map<FieldId, OffsetOpsOnField<int64>, FieldIdHash>;
#ifdef TARN_BENCH_HAVE_ABSL
using AbslBtreePeer = absl::btree_map<FieldId, MovableTable>;
#endif

// An output stream that only counts: archives write into it when the bytes
// themselves are not the subject.
class CountingOutputStream final : public IOutputStream {
public:
    void WriteStream(const void* /*bytes*/, ssize_t n) override { m_count += n; }
    void FlushStream() override {}
    int64 Count() const { return m_count; }

private:
    int64 m_count = 0;
};

// A fresh directory under the system's temporary directory, removed with
// everything in it when the object goes away.
class ScratchDir {
public:
    explicit ScratchDir(const std::string& tag) {
        std::string pattern =
            (std::filesystem::temp_directory_path() / ("tarn-bench-" + tag + "-XXXXXX")).string();
        if (::mkdtemp(pattern.data()) == nullptr) {
            std::abort();
        }
        m_path = pattern;
    }
    ~ScratchDir() {
        std::error_code ec;
        std::filesystem::remove_all(m_path, ec);
    }
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;

    const std::string& Dir() const { return m_path; }
    // A name inside the directory.
    std::string Sub(const std::string& name) const { return m_path + "/" + name; }

private:
    std::string m_path;
};

}  // namespace tarn::bench
