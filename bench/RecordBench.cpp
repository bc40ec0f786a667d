// The recording hot path: OffsetOps::RecordOffset against ordinary in-memory
// maps doing the same job (field key -> per-site table, same time-stamp rule).
//
// RecordNew    builds the whole structure per iteration: N fields, each
//              receiving one offset from each of S sites (site by site over
//              all fields), so the first round inserts and later rounds update.
//              Setup and teardown are outside the timing.
// RecordUpdate records one more round over N fields that are all present:
//              the steady state of a working set, no insertion.
// Keys come in ascending order (random:0) or shuffled (random:1).
// items/s counts RecordOffset calls.

#include <benchmark/benchmark.h>

#include <memory>

#include "bench/Subjects.h"

namespace tarn::bench {
namespace {

template <typename Subject>
void RecordNew(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    const auto numSites = static_cast<int>(state.range(1));
    const std::vector<FieldId> keys = MakeFields(numFields);
    const std::vector<uint64> order = MakeOrder(numFields, state.range(2) != 0);
    for (auto _ : state) {
        state.PauseTiming();
        auto subject = std::make_unique<Subject>();
        state.ResumeTiming();
        Fill(*subject, keys, order, numSites);
        state.PauseTiming();
        if (static_cast<uint64>(subject->Map().size()) != numFields) {
            state.SkipWithError("wrong number of fields");
        }
        subject.reset();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numFields) * numSites);
}

template <typename Subject>
void RecordUpdate(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    const std::vector<FieldId> keys = MakeFields(numFields);
    const std::vector<uint64> order = MakeOrder(numFields, state.range(1) != 0);
    Subject subject;
    Fill(subject, keys, order, 1);
    const Guid site = MakeSite(1);
    int64 t = 1;
    for (auto _ : state) {
        const Opid opid(site, ++t);
        for (uint64 i : order) {
            subject.Record(opid, keys[i], 1);
        }
    }
    benchmark::DoNotOptimize(subject.Map().size());
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(numFields));
}

void NewArgs(benchmark::internal::Benchmark* b) {
    b->ArgNames({"fields", "sites", "random"});
    for (int64 fields : {4096, 131072}) {
        for (int64 sites : {1, 4}) {
            for (int64 random : {0, 1}) {
                b->Args({fields, sites, random});
            }
        }
    }
    b->Unit(benchmark::kMillisecond)->MinTime(0.2);
}

void UpdateArgs(benchmark::internal::Benchmark* b) {
    b->ArgNames({"fields", "random"});
    for (int64 fields : {4096, 131072}) {
        for (int64 random : {0, 1}) {
            b->Args({fields, random});
        }
    }
    b->Unit(benchmark::kMicrosecond)->MinTime(0.2);
}

BENCHMARK_TEMPLATE(RecordNew, TarnSubject)->Name("RecordNew/tarn")->Apply(NewArgs);
BENCHMARK_TEMPLATE(RecordNew, PeerSubject<StdMapPeer>)->Name("RecordNew/std_map")->Apply(NewArgs);
#ifdef TARN_BENCH_HAVE_ABSL
BENCHMARK_TEMPLATE(RecordNew, PeerSubject<AbslBtreePeer>)
    ->Name("RecordNew/absl_btree")
    ->Apply(NewArgs);
#endif
BENCHMARK_TEMPLATE(RecordNew, PeerSubject<UnorderedMapPeer>)
    ->Name("RecordNew/unordered_map")
    ->Apply(NewArgs);

BENCHMARK_TEMPLATE(RecordUpdate, TarnSubject)->Name("RecordUpdate/tarn")->Apply(UpdateArgs);
BENCHMARK_TEMPLATE(RecordUpdate, PeerSubject<StdMapPeer>)
    ->Name("RecordUpdate/std_map")
    ->Apply(UpdateArgs);
#ifdef TARN_BENCH_HAVE_ABSL
BENCHMARK_TEMPLATE(RecordUpdate, PeerSubject<AbslBtreePeer>)
    ->Name("RecordUpdate/absl_btree")
    ->Apply(UpdateArgs);
#endif
BENCHMARK_TEMPLATE(RecordUpdate, PeerSubject<UnorderedMapPeer>)
    ->Name("RecordUpdate/unordered_map")
    ->Apply(UpdateArgs);

}  // namespace
}  // namespace tarn::bench

BENCHMARK_MAIN();
