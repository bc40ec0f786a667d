// Lookups in a built map of N fields (two sites each, inserted in random
// order) against the same peers.
//
// Find        every present key once, in random order; reads the table.
// LowerBound  a key strictly between two stored keys, for every gap, in
//             random order (no hash-map row: it has no order).
// Iterate     the whole map in key order, reading every table.
// The B+tree map is read through its const interface, so nothing is marked
// dirty. items/s counts keys looked up or entries visited.

#include <benchmark/benchmark.h>

#include <string>

#include "bench/Subjects.h"

namespace tarn::bench {
namespace {

template <typename Subject>
void BuildRandom(Subject& subject, uint64 numFields) {
    Fill(subject, MakeFields(numFields), MakeOrder(numFields, true), 2);
}

template <typename Subject>
void Find(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    Subject subject;
    BuildRandom(subject, numFields);
    const auto& map = subject.Map();
    std::vector<FieldId> probes = MakeFields(numFields);
    Shuffle(probes, 7);
    for (auto _ : state) {
        std::size_t sites = 0;
        for (const FieldId& k : probes) {
            auto it = map.find(k);
            sites += NumSites(it->second);
        }
        benchmark::DoNotOptimize(sites);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numFields));
}

template <typename Subject>
void LowerBound(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    Subject subject;
    BuildRandom(subject, numFields);
    const auto& map = subject.Map();
    std::vector<FieldId> probes;
    for (uint64 i = 0; i + 1 < numFields; ++i) {
        probes.push_back(MakeFieldBetween(i));
    }
    Shuffle(probes, 7);
    for (auto _ : state) {
        std::size_t sites = 0;
        for (const FieldId& k : probes) {
            auto it = map.lower_bound(k);
            sites += NumSites(it->second);
        }
        benchmark::DoNotOptimize(sites);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(probes.size()));
}

template <typename Subject>
void Iterate(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    Subject subject;
    BuildRandom(subject, numFields);
    const auto& map = subject.Map();
    for (auto _ : state) {
        std::size_t sites = 0;
        for (auto it = map.begin(); it != map.end(); ++it) {
            sites += NumSites(it->second);
        }
        benchmark::DoNotOptimize(sites);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numFields));
}

void Sizes(benchmark::internal::Benchmark* b) {
    b->ArgNames({"fields"})->Arg(4096)->Arg(131072)->Unit(benchmark::kMicrosecond)->MinTime(0.2);
}

using BenchFn = void (*)(benchmark::State&);

void Register(const std::string& name, BenchFn fn) {
    benchmark::RegisterBenchmark(name.c_str(), fn)->Apply(Sizes);
}

// Rows grouped by operation, the B+tree map first, then its peers.
// A hash map has no order, so it takes part only in orderless operations.
template <template <typename> class Op, bool kWithHashMap>
void RegisterOperation(const std::string& op) {
    Register(op + "/tarn", Op<TarnSubject>::Run);
    Register(op + "/std_map", Op<PeerSubject<StdMapPeer>>::Run);
#ifdef TARN_BENCH_HAVE_ABSL
    Register(op + "/absl_btree", Op<PeerSubject<AbslBtreePeer>>::Run);
#endif
    if constexpr (kWithHashMap) {
        Register(op + "/unordered_map", Op<PeerSubject<UnorderedMapPeer>>::Run);
    }
}

template <typename Subject>
struct FindOp {
    static void Run(benchmark::State& state) { Find<Subject>(state); }
};
template <typename Subject>
struct LowerBoundOp {
    static void Run(benchmark::State& state) { LowerBound<Subject>(state); }
};
template <typename Subject>
struct IterateOp {
    static void Run(benchmark::State& state) { Iterate<Subject>(state); }
};

}  // namespace
}  // namespace tarn::bench

int main(int argc, char** argv) {
    using namespace tarn::bench;
    RegisterOperation<FindOp, true>("Find");
    RegisterOperation<LowerBoundOp, false>("LowerBound");
    RegisterOperation<IterateOp, true>("Iterate");
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
