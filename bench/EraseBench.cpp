// Erasure of random keys: a map of N fields (one site each, inserted in
// random order) is rebuilt outside the timing, then half of its keys, chosen
// at random, are erased one by one. For the B+tree map this runs the full
// deletion path (borrowing, merging, root collapse) and queues emptied nodes
// for the space's deferred deletion; no commit runs. items/s counts erased
// keys.

#include <benchmark/benchmark.h>

#include <memory>

#include "bench/Subjects.h"

namespace tarn::bench {
namespace {

template <typename Subject>
void EraseRandomHalf(benchmark::State& state) {
    const auto numFields = static_cast<uint64>(state.range(0));
    const std::vector<FieldId> keys = MakeFields(numFields);
    const std::vector<uint64> insertOrder = MakeOrder(numFields, true);
    std::vector<FieldId> victims = keys;
    Shuffle(victims, 11);
    victims.resize(numFields / 2);
    for (auto _ : state) {
        state.PauseTiming();
        auto subject = std::make_unique<Subject>();
        Fill(*subject, keys, insertOrder, 1);
        state.ResumeTiming();
        auto& map = subject->Map();
        for (const FieldId& k : victims) {
            map.erase(k);
        }
        state.PauseTiming();
        if (static_cast<uint64>(map.size()) != numFields - victims.size()) {
            state.SkipWithError("wrong number of fields after erasing");
        }
        subject.reset();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(victims.size()));
}

void Sizes(benchmark::internal::Benchmark* b) {
    b->ArgNames({"fields"})->Arg(4096)->Arg(131072)->Unit(benchmark::kMicrosecond)->MinTime(0.2);
}

BENCHMARK_TEMPLATE(EraseRandomHalf, TarnSubject)->Name("EraseRandomHalf/tarn")->Apply(Sizes);
BENCHMARK_TEMPLATE(EraseRandomHalf, PeerSubject<StdMapPeer>)
    ->Name("EraseRandomHalf/std_map")
    ->Apply(Sizes);
#ifdef TARN_BENCH_HAVE_ABSL
BENCHMARK_TEMPLATE(EraseRandomHalf, PeerSubject<AbslBtreePeer>)
    ->Name("EraseRandomHalf/absl_btree")
    ->Apply(Sizes);
#endif
BENCHMARK_TEMPLATE(EraseRandomHalf, PeerSubject<UnorderedMapPeer>)
    ->Name("EraseRandomHalf/unordered_map")
    ->Apply(Sizes);

}  // namespace
}  // namespace tarn::bench

BENCHMARK_MAIN();
