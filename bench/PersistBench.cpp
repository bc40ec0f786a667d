// Persistence: commits of dirty leaves and reloads of the whole map, in the
// in-memory store and in the LMDB store, against a peer that keeps the same
// per-field tables straight in LMDB.
//
// Setup (outside the timing): a record of N = 65536 fields, two sites each,
// inserted in random order and committed once.
//
// Commit/<store>/leaves:M   M offsets recorded into M different leaves (one
//                           key of each), then one commit writing those M
//                           leaf images. items/s counts leaves written;
//                           bytes/s the image bytes written.
// Commit/direct_lmdb/...    the peer: the same M field tables changed in a
//                           std::map and written as M puts (key: field,
//                           value: the table's image) in one LMDB write
//                           transaction. It writes tables, not leaves.
// Reload/<store>            all residents dropped (outside the timing), then
//                           the whole map walked in key order, which loads
//                           the header and every node. items/s counts fields.
// Reload/direct_lmdb        the peer: one cursor pass over its database,
//                           decoding every table into a std::map.
// Stores: "memory" (MemoryStore), "lmdb" (LmdbStore, synced at commit) and
// "lmdb_nosync" (syncOnCommit off); the peer runs with the same two settings.

#include <benchmark/benchmark.h>

#include <memory>
#include <string>
#include <tuple>
#include <utility>

#include "bench/Subjects.h"
#include "tnBackends/MemoryStore.h"
#include "tnRuntime/SpaceRef.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"

#include <lmdb.h>

#include "tnBackends/LmdbStore.h"

namespace tarn::bench {
namespace {

constexpr uint64 kNumFields = 65536;
constexpr int kNumSites = 2;

enum StoreKind { kMemory = 0, kLmdbSync = 1, kLmdbNoSync = 2 };

// A store of the given kind; LMDB stores live in `dir`.
std::shared_ptr<IStore> MakeStore(StoreKind kind, const ScratchDir& dir) {
    if (kind != kMemory) {
        LmdbStoreOptions options;
        options.syncOnCommit = kind == kLmdbSync;
        return LmdbStore::Open(dir.Sub("store"), options);
    }
    return std::make_shared<MemoryStore>();
}

// The filled, committed record, and one key of every leaf.
struct CommittedMap {
    explicit CommittedMap(StoreKind kind)
        : dir("persist"), subject(MakeStore(kind, dir)), keys(MakeFields(kNumFields)) {
        Fill(subject, keys, MakeOrder(kNumFields, true), kNumSites);
        subject.Space().Commit();
        for (auto* leaf = subject.Map().m_firstLeaf.Get(); leaf != nullptr;
             leaf = leaf->m_next ? leaf->m_next.Get() : nullptr) {
            leafKeys.push_back(leaf->GetEntry(0).first);
        }
        Shuffle(leafKeys, 5);
    }

    // Average bytes of a leaf image in the store, framing included.
    double BytesPerImage() {
        const ImageCounts stats = subject.Space().GetStore().Stats();
        return stats.numImages == 0 ? 0.0
                                    : static_cast<double>(stats.numImageBytes) / stats.numImages;
    }

    ScratchDir dir;
    TarnSubject subject;
    std::vector<FieldId> keys;
    std::vector<FieldId> leafKeys;
};

void CommitLeaves(benchmark::State& state, StoreKind kind, std::size_t numLeaves) {
    CommittedMap m(kind);
    if (m.leafKeys.size() < numLeaves) {
        state.SkipWithError("fewer leaves than asked for");
        return;
    }
    const Guid site = MakeSite(1);
    int64 t = kNumSites;
    std::size_t next = 0;
    const int64 writtenBefore = m.subject.Space().Stats().numWritten;
    for (auto _ : state) {
        const Opid opid(site, ++t);
        for (std::size_t i = 0; i < numLeaves; ++i) {
            m.subject.Record(opid, m.leafKeys[next], 1);
            next = next + 1 == m.leafKeys.size() ? 0 : next + 1;
        }
        m.subject.Space().Commit();
    }
    const int64 written = m.subject.Space().Stats().numWritten - writtenBefore;
    state.counters["images_per_commit"] =
        static_cast<double>(written) / static_cast<double>(state.iterations());
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numLeaves));
    state.SetBytesProcessed(static_cast<int64>(static_cast<double>(written) * m.BytesPerImage()));
}

void Reload(benchmark::State& state, StoreKind kind) {
    CommittedMap m(kind);
    CSpace& space = m.subject.Space();
    const OID record = m.subject.RecordObject().GetPersistObjState().m_oid;
    for (auto _ : state) {
        state.PauseTiming();
        space.DropCleanResidents();
        state.ResumeTiming();
        SpaceRef<OffsetOps> rec(space, record);
        const FieldIdToOffsetOpsOnInt64FieldMap& map = *rec->m_map;
        std::size_t sites = 0;
        for (auto it = map.begin(); it != map.end(); ++it) {
            sites += NumSites(it->second);
        }
        if (sites != kNumFields * kNumSites) {
            state.SkipWithError("reloaded map differs");
        }
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kNumFields));
}

// The peer: one LMDB environment holding, in its main database, one record
// per field: key = oid (8 bytes big-endian) then the path bytes, so that
// LMDB's byte order is the map's key order; value = the table's image.
class LmdbDirect {
public:
    LmdbDirect(const std::string& dir, bool sync) {
        Check(mdb_env_create(&m_env));
        Check(mdb_env_set_mapsize(m_env, std::size_t{1} << 30));
        Check(mdb_env_open(m_env, dir.c_str(), MDB_NOTLS | MDB_NOSUBDIR | (sync ? 0 : MDB_NOSYNC),
                           0644));
        MDB_txn* txn = nullptr;
        Check(mdb_txn_begin(m_env, nullptr, 0, &txn));
        Check(mdb_dbi_open(txn, nullptr, 0, &m_dbi));
        Check(mdb_txn_commit(txn));
    }
    ~LmdbDirect() { mdb_env_close(m_env); }
    LmdbDirect(const LmdbDirect&) = delete;
    LmdbDirect& operator=(const LmdbDirect&) = delete;

    // Writes the tables of `keys` from `model` in one transaction.
    void Put(const std::vector<const FieldId*>& keys, const StdMapPeer& model) {
        MDB_txn* txn = nullptr;
        Check(mdb_txn_begin(m_env, nullptr, 0, &txn));
        for (const FieldId* k : keys) {
            std::string key = KeyBytes(*k);
            m_image.clear();
            Archive ar(&m_image);
            ar << model.at(*k);
            ar.Flush();
            MDB_val kv{key.size(), key.data()};
            MDB_val vv{m_image.bytes().size(), const_cast<octet_t*>(m_image.bytes().data())};
            Check(mdb_put(txn, m_dbi, &kv, &vv, 0));
        }
        Check(mdb_txn_commit(txn));
    }

    // Decodes every stored table into `out`, in key order.
    void ReadAll(StdMapPeer& out) {
        MDB_txn* txn = nullptr;
        Check(mdb_txn_begin(m_env, nullptr, MDB_RDONLY, &txn));
        MDB_cursor* cursor = nullptr;
        Check(mdb_cursor_open(txn, m_dbi, &cursor));
        MDB_val kv;
        MDB_val vv;
        for (int rc = mdb_cursor_get(cursor, &kv, &vv, MDB_FIRST); rc == 0;
             rc = mdb_cursor_get(cursor, &kv, &vv, MDB_NEXT)) {
            const auto* k = static_cast<const octet_t*>(kv.mv_data);
            uint64 oid = 0;
            for (int b = 0; b < 8; ++b) {
                oid = (oid << 8) | k[b];
            }
            FieldId f(OID(Seid(oid)), Path(k + 8, static_cast<ssize_t>(kv.mv_size) - 8));
            auto it = out.emplace_hint(out.end(), std::piecewise_construct,
                                       std::forward_as_tuple(f), std::forward_as_tuple());
            InputArchive in(static_cast<const octet_t*>(vv.mv_data));
            in >> it->second;
        }
        mdb_cursor_close(cursor);
        mdb_txn_abort(txn);
    }

private:
    static std::string KeyBytes(const FieldId& f) {
        std::string key(8, '\0');
        for (int b = 0; b < 8; ++b) {
            key[static_cast<std::size_t>(b)] = static_cast<char>(f.oid.value_ >> (8 * (7 - b)));
        }
        key.append(reinterpret_cast<const char*>(f.path.data()),
                   static_cast<std::size_t>(f.path.size()));
        return key;
    }
    static void Check(int rc) {
        if (rc != MDB_SUCCESS) {
            throw RuntimeError(std::string("lmdb: ") + mdb_strerror(rc));
        }
    }

    MDB_env* m_env = nullptr;
    MDB_dbi m_dbi = 0;
    MemoryOutputStream m_image;
};

// The peer with every table written, and the fields that stand for the
// leaves the map's benchmark dirties (one key out of every 64).
struct CommittedPeer {
    explicit CommittedPeer(bool sync) : dir("direct"), db(dir.Sub("data.mdb"), sync) {
        const std::vector<FieldId> keys = MakeFields(kNumFields);
        PeerSubject<StdMapPeer> subject;
        Fill(subject, keys, MakeOrder(kNumFields, true), kNumSites);
        model = std::move(subject.Map());
        std::vector<const FieldId*> all;
        for (const auto& [k, table] : model) {
            all.push_back(&k);
            if (all.size() % 64 == 1) {
                dirtyKeys.push_back(&k);
            }
        }
        db.Put(all, model);
        Shuffle(dirtyKeys, 5);
    }

    ScratchDir dir;
    LmdbDirect db;
    StdMapPeer model;
    std::vector<const FieldId*> dirtyKeys;
};

void CommitDirect(benchmark::State& state, StoreKind kind, std::size_t numTables) {
    CommittedPeer p(kind == kLmdbSync);
    const Guid site = MakeSite(1);
    int64 t = kNumSites;
    std::size_t next = 0;
    std::vector<const FieldId*> batch(numTables);
    for (auto _ : state) {
        ++t;
        for (std::size_t i = 0; i < numTables; ++i) {
            batch[i] = p.dirtyKeys[next];
            p.model.at(*batch[i]).Insert(site, t, 1);
            next = next + 1 == p.dirtyKeys.size() ? 0 : next + 1;
        }
        p.db.Put(batch, p.model);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numTables));
}

void ReloadDirect(benchmark::State& state, StoreKind kind) {
    CommittedPeer p(kind == kLmdbSync);
    for (auto _ : state) {
        StdMapPeer loaded;
        p.db.ReadAll(loaded);
        if (loaded.size() != kNumFields) {
            state.SkipWithError("reloaded map differs");
        }
        state.PauseTiming();
        loaded.clear();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kNumFields));
}

// Wall-clock time throughout: a synced commit spends most of its time
// waiting for the disk, which CPU time would not show.
void Timing(benchmark::internal::Benchmark* b, benchmark::TimeUnit unit) {
    b->Unit(unit)->MinTime(0.2)->UseRealTime();
}

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    using namespace tarn::bench;
    struct Kind {
        const char* name;
        StoreKind kind;
    };
    std::vector<Kind> kinds = {{"memory", kMemory}};
    kinds.push_back({"lmdb", kLmdbSync});
    kinds.push_back({"lmdb_nosync", kLmdbNoSync});
    for (const Kind& k : kinds) {
        for (std::size_t leaves : {1, 16, 256}) {
            const std::string name =
                std::string("Commit/") + k.name + "/leaves:" + std::to_string(leaves);
            Timing(benchmark::RegisterBenchmark(name.c_str(), CommitLeaves, k.kind, leaves),
                   benchmark::kMicrosecond);
        }
        if (k.kind != kMemory) {
            for (std::size_t tables : {1, 16, 256}) {
                const std::string name =
                    std::string("Commit/direct_") + k.name + "/tables:" + std::to_string(tables);
                Timing(benchmark::RegisterBenchmark(name.c_str(), CommitDirect, k.kind, tables),
                       benchmark::kMicrosecond);
            }
        }
    }
    for (const Kind& k : kinds) {
        Timing(
            benchmark::RegisterBenchmark((std::string("Reload/") + k.name).c_str(), Reload, k.kind),
            benchmark::kMillisecond);
    }
    Timing(benchmark::RegisterBenchmark("Reload/direct_lmdb", ReloadDirect, kLmdbNoSync),
           benchmark::kMillisecond);
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
