// Archives: when the write buffer flushes, the reservation protocol's
// assertions, schema numbers, exact images of values, and the variable-length
// integers.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <functional>
#include <iterator>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tnOperation/FieldId.h"
#include "tnUtils/Archive.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {
namespace {

using Bytes = std::vector<octet_t>;
using Write = std::function<void(Archive&)>;

// Everything `write` puts into a fresh archive.
Bytes Written(const Write& write) {
    MemoryOutputStream os;
    Archive ar(&os);
    write(ar);
    ar.Flush();
    return os.bytes();
}

void Fill(Archive& ar, ssize_t n) {
    const Bytes filler(static_cast<std::size_t>(n) + 1, 0xab);
    ar.WriteBuffer(filler.data(), n);
}

// A pointer value outside the buffer, made without pointer arithmetic.
octet_t* Outside(Archive& ar, std::intptr_t offset) {
    return reinterpret_cast<octet_t*>(reinterpret_cast<std::intptr_t>(ar.m_writeBuffer) + offset);
}

// A write that reserves `room` bytes fits after 4096 - room buffered bytes,
// and flushes them first after one more; it then holds its `size` bytes.
TEST(ArchiveFlush, AWriteFlushesExactlyWhenItsReservationDoesNotFit) {
    const struct {
        const char* what;
        ssize_t room;
        ssize_t size;
        Write write;
    } cases[] = {
        {"int64", 8, 8, [](Archive& ar) { ar << int64{-2}; }},
        {"Guid", 16, 16, [](Archive& ar) { ar << Guid{}; }},
        {"varint 1", 5, 1, [](Archive& ar) { SerialiseVariableLengthUint<int64>(ar, 1); }},
        {"BeginWrite(5)", 5, 0, [](Archive& ar) { ar.EndWrite(ar.BeginWrite(5)); }},
        {"BeginWrite(4096)", 4096, 0, [](Archive& ar) { ar.EndWrite(ar.BeginWrite(4096)); }},
    };
    for (const auto& c : cases) {
        for (const ssize_t fill : {ARCHIVE_BUFSIZE - c.room, ARCHIVE_BUFSIZE - c.room + 1}) {
            SCOPED_TRACE(std::string(c.what) + " after " + std::to_string(fill));
            const bool flushes = fill > ARCHIVE_BUFSIZE - c.room;
            MemoryOutputStream os;
            Archive ar(&os);
            Fill(ar, fill);
            c.write(ar);
            EXPECT_EQ(os.NumWrites(), flushes ? 1 : 0);
            EXPECT_EQ(ar.GetNumBytesWrittenToStream(), flushes ? fill : 0);
            EXPECT_EQ(ar.NumBufferedWrites(), (flushes ? 0 : fill) + c.size);
        }
    }
}

TEST(ArchiveFlush, FlushedAndBufferedBytesKeepTheirOrder) {
    std::vector<int64> ints(1000);
    std::iota(ints.begin(), ints.end(), 0);
    const auto* raw = reinterpret_cast<const octet_t*>(ints.data());
    Bytes expected(raw, raw + 8000);
    for (int i = 0; i < 5000; ++i) {
        expected.push_back(static_cast<octet_t>(i * 7));
    }
    const Bytes image = Written([&](Archive& ar) {
        for (const int64 i : ints) {
            ar << i;
        }
        ar.WriteBuffer(expected.data() + 8000, 5000);
    });
    EXPECT_EQ(image, expected);
}

TEST(ArchiveAssertions, ReservationsStayInsideTheBuffer) {
    const char* inside = "m_writeBuffer <= m_pos && m_pos <= m_writeBuffer+ARCHIVE_BUFSIZE";
    const char* endWrite =
        "m_writeBuffer <= m_pos && m_pos <= pos && pos <= m_writeBuffer+ARCHIVE_BUFSIZE";
    MemoryOutputStream os;
    Archive ar(&os);
    EXPECT_TARN_ASSERT(ar.BeginWrite(ARCHIVE_BUFSIZE + 1), "reserveSize <= ARCHIVE_BUFSIZE");
    Fill(ar, 10);
    octet_t* p = ar.BeginWrite(5);
    EXPECT_TARN_ASSERT(ar.EndWrite(p - 1), endWrite);
    EXPECT_TARN_ASSERT(ar.EndWrite(Outside(ar, ARCHIVE_BUFSIZE + 1)), endWrite);
    ar.EndWrite(ar.m_writeBuffer + ARCHIVE_BUFSIZE);  // the very end is allowed
    EXPECT_EQ(ar.NumBufferedWrites(), ARCHIVE_BUFSIZE);
    for (const std::intptr_t offset : {std::intptr_t{-1}, std::intptr_t{ARCHIVE_BUFSIZE + 1}}) {
        ar.m_pos = Outside(ar, offset);
        EXPECT_TARN_ASSERT(ar.BeginWrite(1), inside);
        EXPECT_TARN_ASSERT(ar << int64{1}, inside);
        EXPECT_TARN_ASSERT(ar << Guid{}, inside);
    }
}

TEST(ArchiveAssertions, SchemasArePositiveAndNotNewerThanTheReader) {
    MemoryOutputStream os;
    Archive ar(&os);
    for (const schema_t bad : {0, -1}) {
        EXPECT_TARN_ASSERT(SerialiseSchema(ar, bad), "schema > 0");
    }
    for (const octet_t stored : {0x00, 0x02}) {
        InputArchive in(&stored);
        schema_t schema = 0;
        EXPECT_TARN_ASSERT(DeserialiseSchema(in, 1, schema),
                           "1 <= stored && stored <= currentSchema");
    }
}

// Writing `value` gives exactly `bytes`; reading them into `back` gives the
// value again and ends at their end.
template <typename T>
void ExpectImage(const T& value, const Bytes& bytes, T back) {
    const Bytes image = Written([&](Archive& ar) { ar << value; });
    EXPECT_EQ(image, bytes);
    InputArchive in(image.data());
    in >> back;
    EXPECT_TRUE(back == value);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
}

TEST(ArchiveImage, ValuesAreExactAndReadBackToTheirEnd) {
    ExpectImage(int64{-2}, {0xfe, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}, int64{0});
    ExpectImage(Guid{0x04030201, 0x0605, 0x0807, {9, 10, 11, 12, 13, 14, 15, 16}},
                {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16}, Guid{});
    ExpectImage(AsCompressedInt<int64>(300), {0xac, 0x02}, CompressedInt<int64>(0));
    const std::string longPath(200, 'p');
    const octet_t head[] = {8, 7, 6, 5, 4, 3, 2, 1, 0xc8, 0x01};  // oid, path length
    Bytes keyBytes(sizeof head + longPath.size(), 'p');           // then the path bytes
    std::copy(std::begin(head), std::end(head), keyBytes.begin());
    ExpectImage(FieldId(OID(Seid(0x0102030405060708u)), Path(longPath.data(), 200)), keyBytes,
                FieldId(OID(Seid(9u)), Path(longPath.data(), 150)));
}

// Collections are tested with the per-site tables (OffsetOpsOnFieldTest).
TEST(ArchiveImage, SchemaIsAVarint) {
    const Bytes image = Written([](Archive& ar) { SerialiseSchema(ar, 300); });
    EXPECT_EQ(image, (Bytes{0xac, 0x02}));
    InputArchive in(image.data());
    schema_t schema = 0;
    DeserialiseSchema(in, 300, schema);
    EXPECT_EQ(schema, 300);
    EXPECT_EQ(in.ptr(), image.data() + image.size());
}

Bytes Varint32(uint32 v) {
    octet_t buf[MAX_VARIABLE_LENGTH_UINT_SIZE];
    return Bytes(buf, SerialiseVariableLengthUint32(buf, v));
}

// Exact bytes at a few values, the length at every boundary, and the
// decoder as the exact inverse everywhere.
TEST(Varint, Leb128BytesLengthsAndInverse) {
    EXPECT_EQ(Varint32(300), (Bytes{0xac, 0x02}));
    EXPECT_EQ(Varint32(16384), (Bytes{0x80, 0x80, 0x01}));
    EXPECT_EQ(Varint32(4294967295u), (Bytes{0xff, 0xff, 0xff, 0xff, 0x0f}));
    const uint32 boundaries[] = {
        0, 127, 128, 16383, 16384, (1u << 21) - 1, 1u << 21, (1u << 28) - 1, 1u << 28, 4294967295u};
    for (std::size_t i = 0; i < std::size(boundaries); ++i) {
        EXPECT_EQ(Varint32(boundaries[i]).size(), 1 + i / 2) << boundaries[i];
    }
    std::mt19937 rng(7);
    for (int i = 0; i < 20000; ++i) {
        const uint32 v = static_cast<uint32>(rng()) >> (rng() % 32);  // every length
        const Bytes bytes = Varint32(v);
        uint32 back = ~v;
        ASSERT_EQ(DeserialiseVariableLengthUint32(bytes.data(), back), bytes.data() + bytes.size());
        ASSERT_EQ(back, v);
    }
}

TEST(Varint, CarriesOnlyTheLow32BitsAndReadsThemBackWithoutSign) {
    auto varint = [](auto v) {
        return Written([&](Archive& ar) { SerialiseVariableLengthUint<decltype(v)>(ar, v); });
    };
    EXPECT_EQ(varint(int64{1} << 32), varint(int64{0}));
    EXPECT_EQ(varint((uint64{5} << 32) | 7), varint(uint64{7}));
    EXPECT_EQ(varint(-1), varint(int64{4294967295}));
    const Bytes minusOne = varint(int64{-1});
    InputArchive in(minusOne.data());
    int64 v = 0;
    DeserialiseVariableLengthUint<int64>(in, v);
    EXPECT_EQ(v, 4294967295);
    EXPECT_EQ(in.ptr(), minusOne.data() + minusOne.size());
}

}  // namespace
}  // namespace tarn
