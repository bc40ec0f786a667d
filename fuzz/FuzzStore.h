#pragma once

// The pieces the loader fuzzers share: a store whose records come straight
// from the fuzzer, read through the same record check as the on-disk store,
// and a bounded walk over a loaded record or map.
//
// FuzzStore keeps one framed record (tnBackends/ImageRecord.h) per identity
// and answers Load exactly as LmdbStore does after its database lookup:
// DecodeImageRecord, which throws RuntimeError for a damaged record. It is
// never committed to.

#include <cstdio>
#include <cstdlib>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "tnBackends/IStore.h"
#include "tnBackends/ImageRecord.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapCheck.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnRuntime/CSpace.h"
#include "tnRuntime/CSpaceGuard.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"

namespace tarn::fuzz {

// The registered names of the module's classes, in the order the fuzzers'
// class selectors use.
inline const char* const kClassNames[4] = {
    "tarn::OffsetOps",
    "tarn::FieldIdToOffsetOpsOnInt64FieldMap",
    "tarn::FieldIdToOffsetOpsOnInt64FieldMapInternalNode",
    "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode",
};

class FuzzStore final : public IStore {
public:
    std::optional<StoredImage> Load(uint64 oid) override {
        auto it = m_records.find(oid);
        if (it == m_records.end()) {
            return std::nullopt;
        }
        return DecodeImageRecord(oid, it->second);
    }
    std::optional<uint64> FindRoot(std::string_view) override { return std::nullopt; }
    std::map<std::string, uint64> Roots() override { return {}; }
    std::optional<uint64> FindCounter(std::string_view) override { return std::nullopt; }
    std::map<std::string, uint64> Counters() override { return {}; }
    uint64 NextIdentity() override { return 1u << 20; }
    void Commit(const CommitBatch&) override { std::abort(); }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        for (const auto& [oid, record] : m_records) {
            fn(oid);
        }
    }
    ImageCounts Stats() override { return {}; }

    std::map<uint64, std::vector<octet_t>> m_records;
};

// Reports an expected error when TARN_FUZZ_VERBOSE is set, to see what
// inputs a run reaches.
inline void Expected(const std::exception& e) {
    static const bool verbose = std::getenv("TARN_FUZZ_VERBOSE") != nullptr;
    if (verbose) {
        std::fprintf(stderr, "expected error: %s\n", e.what());
    }
}

// Stops the process with a message: a property the fuzzer checks is broken.
[[noreturn]] inline void PropertyFailed(const char* what) {
    std::fprintf(stderr, "fuzz property failed: %s\n", what);
    std::abort();
}

// Uses a loaded object the way the runtime and a reader would: writes its
// image again, and for a record or a map walks at most `maxSteps` entries in
// key order, loading nodes as it goes. Throws RuntimeError from the loader.
inline void Exercise(ptr<IPersistable> obj, int maxSteps) {
    MemoryOutputStream out;
    Archive ar(&out);
    obj->Serialise(ar);
    ar.Flush();

    const ReflectedClass* rc = obj->GetReflectedClass();
    const FieldIdToOffsetOpsOnInt64FieldMap* map = nullptr;
    if (rc == &GetReflectedClass<OffsetOps>()) {
        const auto* rec = static_cast<const OffsetOps*>(obj.m_self);
        if (!rec->m_map) {
            return;
        }
        map = rec->m_map.Get();
    } else if (rc == &GetReflectedClass<FieldIdToOffsetOpsOnInt64FieldMap>()) {
        map = static_cast<const FieldIdToOffsetOpsOnInt64FieldMap*>(obj.m_self);
    }
    if (map == nullptr || !FieldIdToOffsetOpsOnInt64FieldMapCheck(*map).Ok()) {
        return;
    }
    int steps = 0;
    for (auto it = map->begin(); it != map->end() && steps < maxSteps; ++it, ++steps) {
        const auto& entry = *it;
        if (entry.second.m_map.size() > (std::size_t{1} << 40)) {
            PropertyFailed("impossible table size");
        }
    }
}

}  // namespace tarn::fuzz
