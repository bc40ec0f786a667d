// Archive throughput: variable-length integers, fixed-width integers, field
// keys and whole leaf images, written through an Archive and read back
// through an InputArchive.
//
// Varint values are spread evenly over the five encoded lengths (1..5 bytes).
// Writes go to a stream that only counts, so the archive's buffer and its
// flushes are measured, not a copy into a container. items/s counts values
// (or leaf entries for the leaf rows); bytes/s counts encoded bytes.

#include <benchmark/benchmark.h>

#include <random>
#include <vector>

#include "bench/Subjects.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn::bench {
namespace {

constexpr std::size_t kNumValues = 4096;

std::vector<uint32> VarintValues() {
    std::mt19937 rng(3);
    std::vector<uint32> values(kNumValues);
    for (std::size_t i = 0; i < kNumValues; ++i) {
        const int bits = 7 * static_cast<int>(i % 5);  // lengths 1..5
        const uint32 low = bits == 0 ? 0 : (uint32{1} << bits);
        const uint32 high = bits == 28 ? 0xffffffffu : (uint32{1} << (bits + 7)) - 1;
        values[i] = std::uniform_int_distribution<uint32>(low, high)(rng);
    }
    Shuffle(values, 3);
    return values;
}

template <typename Write>
std::vector<octet_t> Encode(Write write) {
    MemoryOutputStream out;
    Archive ar(&out);
    write(ar);
    ar.Flush();
    return out.bytes();
}

void VarintEncode(benchmark::State& state) {
    const std::vector<uint32> values = VarintValues();
    CountingOutputStream out;
    Archive ar(&out);
    for (auto _ : state) {
        for (uint32 v : values) {
            SerialiseVariableLengthUint<uint32>(ar, v);
        }
        ar.FlushBuffer();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(values.size()));
    state.SetBytesProcessed(out.Count());
}
BENCHMARK(VarintEncode)->MinTime(0.2);

void VarintDecode(benchmark::State& state) {
    const std::vector<uint32> values = VarintValues();
    const std::vector<octet_t> bytes = Encode([&](Archive& ar) {
        for (uint32 v : values) {
            SerialiseVariableLengthUint<uint32>(ar, v);
        }
    });
    for (auto _ : state) {
        InputArchive in(bytes.data());
        uint32 sum = 0;
        for (std::size_t i = 0; i < values.size(); ++i) {
            uint32 v;
            DeserialiseVariableLengthUint<uint32>(in, v);
            sum += v;
        }
        benchmark::DoNotOptimize(sum);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(values.size()));
    state.SetBytesProcessed(state.iterations() * static_cast<int64>(bytes.size()));
}
BENCHMARK(VarintDecode)->MinTime(0.2);

void Int64Encode(benchmark::State& state) {
    CountingOutputStream out;
    Archive ar(&out);
    for (auto _ : state) {
        for (std::size_t i = 0; i < kNumValues; ++i) {
            ar << static_cast<int64>(i * 0x9e3779b97f4a7c15ull);
        }
        ar.FlushBuffer();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kNumValues));
    state.SetBytesProcessed(out.Count());
}
BENCHMARK(Int64Encode)->MinTime(0.2);

void Int64Decode(benchmark::State& state) {
    const std::vector<octet_t> bytes = Encode([](Archive& ar) {
        for (std::size_t i = 0; i < kNumValues; ++i) {
            ar << static_cast<int64>(i);
        }
    });
    for (auto _ : state) {
        InputArchive in(bytes.data());
        int64 sum = 0;
        for (std::size_t i = 0; i < kNumValues; ++i) {
            int64 v;
            in >> v;
            sum += v;
        }
        benchmark::DoNotOptimize(sum);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kNumValues));
    state.SetBytesProcessed(state.iterations() * static_cast<int64>(bytes.size()));
}
BENCHMARK(Int64Decode)->MinTime(0.2);

void FieldIdEncode(benchmark::State& state) {
    const std::vector<FieldId> keys = MakeFields(kNumValues);
    CountingOutputStream out;
    Archive ar(&out);
    for (auto _ : state) {
        for (const FieldId& k : keys) {
            ar << k;
        }
        ar.FlushBuffer();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(keys.size()));
    state.SetBytesProcessed(out.Count());
}
BENCHMARK(FieldIdEncode)->MinTime(0.2);

void FieldIdDecode(benchmark::State& state) {
    const std::vector<FieldId> keys = MakeFields(kNumValues);
    const std::vector<octet_t> bytes = Encode([&](Archive& ar) {
        for (const FieldId& k : keys) {
            ar << k;
        }
    });
    std::vector<FieldId> decoded(keys.size());
    for (auto _ : state) {
        InputArchive in(bytes.data());
        for (FieldId& k : decoded) {
            in >> k;
        }
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(keys.size()));
    state.SetBytesProcessed(state.iterations() * static_cast<int64>(bytes.size()));
}
BENCHMARK(FieldIdDecode)->MinTime(0.2);

// A full root leaf: 100 fields, two sites each.
constexpr uint64 kLeafEntries = 100;

void LeafEncode(benchmark::State& state) {
    TarnSubject subject;
    Fill(subject, MakeFields(kLeafEntries), MakeOrder(kLeafEntries, false), 2);
    const FieldIdToOffsetOpsOnInt64FieldMapLeafNode& leaf = *subject.Map().m_firstLeaf;
    CountingOutputStream out;
    Archive ar(&out);
    for (auto _ : state) {
        leaf.Serialise(ar);
        ar.FlushBuffer();
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kLeafEntries));
    state.SetBytesProcessed(out.Count());
}
BENCHMARK(LeafEncode)->MinTime(0.2);

void LeafDecode(benchmark::State& state) {
    TarnSubject subject;
    Fill(subject, MakeFields(kLeafEntries), MakeOrder(kLeafEntries, false), 2);
    const std::vector<octet_t> bytes =
        Encode([&](Archive& ar) { subject.Map().m_firstLeaf->Serialise(ar); });
    for (auto _ : state) {
        FieldIdToOffsetOpsOnInt64FieldMapLeafNode leaf;
        InputArchive in(bytes.data());
        leaf.Deserialise(in);
        benchmark::DoNotOptimize(leaf.m_numKeyEntrys);
    }
    state.SetItemsProcessed(state.iterations() * static_cast<int64>(kLeafEntries));
    state.SetBytesProcessed(state.iterations() * static_cast<int64>(bytes.size()));
}
BENCHMARK(LeafDecode)->MinTime(0.2);

}  // namespace
}  // namespace tarn::bench

BENCHMARK_MAIN();
