#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <limits>
#include <random>
#include <string>
#include <vector>

#include "tests/AssertDeath.h"
#include "tnOperation/FieldId.h"
#include "tnUtils/Archive.h"
#include "tnUtils/ArchiveCollection.h"
#include "tnUtils/MemoryOutputStream.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {
namespace {

using Bytes = std::vector<octet_t>;

// Puts `n` filler bytes into an empty archive's buffer without flushing.
void Fill(Archive& ar, ssize_t n) {
    Bytes filler(static_cast<std::size_t>(n), 0xab);
    ar.WriteBuffer(filler.data(), n);
}

// Everything an archive has produced: flushed bytes, then buffered ones.
Bytes Image(const MemoryOutputStream& os, const Archive& ar) {
    Bytes out = os.bytes();
    const octet_t* begin = ar.m_writeBuffer;
    const octet_t* end = ar.m_pos;
    out.insert(out.end(), begin, end);
    return out;
}

Bytes VarintBytes(uint32 v) {
    octet_t buf[MAX_VARIABLE_LENGTH_UINT_SIZE];
    octet_t* end = SerialiseVariableLengthUint32(buf, v);
    return Bytes(buf, end);
}

template <typename T>
Bytes ArchiveVarint(T v) {
    MemoryOutputStream os;
    Archive ar(&os);
    SerialiseVariableLengthUint<T>(ar, v);
    return Image(os, ar);
}

// A pointer value outside the buffer, made without pointer arithmetic.
octet_t* Outside(Archive& ar, std::intptr_t offset) {
    return reinterpret_cast<octet_t*>(reinterpret_cast<std::intptr_t>(ar.m_writeBuffer) + offset);
}

// ---- Flushing: a value is never split and a request that fits exactly does not flush.

struct FlushCase {
    ssize_t fill;
    bool flushes;
};

TEST(ArchiveFlush, Int64FitsUpToTheLastByte) {
    for (FlushCase c : {FlushCase{4088, false}, FlushCase{4089, true}}) {
        MemoryOutputStream os;
        Archive ar(&os);
        Fill(ar, c.fill);
        ar << int64{-2};
        EXPECT_EQ(os.NumWrites(), c.flushes ? 1 : 0) << c.fill;
        EXPECT_EQ(ar.NumBufferedWrites(), c.flushes ? 8 : 4096) << c.fill;
        EXPECT_EQ(ar.GetNumBytesWrittenToStream(), c.flushes ? c.fill : 0);
        EXPECT_EQ(ar.GetNumBytesWritten(), c.fill + 8);
    }
}

TEST(ArchiveFlush, GuidFitsUpToTheLastByte) {
    for (FlushCase c : {FlushCase{4080, false}, FlushCase{4081, true}}) {
        MemoryOutputStream os;
        Archive ar(&os);
        Fill(ar, c.fill);
        ar << Guid{1, 2, 3, {4, 5, 6, 7, 8, 9, 10, 11}};
        EXPECT_EQ(os.NumWrites(), c.flushes ? 1 : 0) << c.fill;
        EXPECT_EQ(ar.NumBufferedWrites(), c.flushes ? 16 : 4096) << c.fill;
    }
}

TEST(ArchiveFlush, BeginWriteReservesExactly) {
    for (FlushCase c : {FlushCase{4091, false}, FlushCase{4092, true}}) {
        MemoryOutputStream os;
        Archive ar(&os);
        Fill(ar, c.fill);
        octet_t* p = ar.BeginWrite(5);
        EXPECT_EQ(os.NumWrites(), c.flushes ? 1 : 0) << c.fill;
        EXPECT_EQ(p, c.flushes ? ar.m_writeBuffer : ar.m_writeBuffer + c.fill);
        ar.EndWrite(p);  // commits nothing
        EXPECT_EQ(ar.m_pos, p);
    }
    MemoryOutputStream os;
    Archive ar(&os);
    EXPECT_EQ(ar.BeginWrite(ARCHIVE_BUFSIZE), ar.m_writeBuffer);
    EXPECT_EQ(os.NumWrites(), 0);
    Fill(ar, 1);
    ar.BeginWrite(ARCHIVE_BUFSIZE);
    EXPECT_EQ(os.NumWrites(), 1);
}

TEST(ArchiveFlush, VarintReservesFiveBytesEvenForOneByteValues) {
    for (FlushCase c : {FlushCase{4091, false}, FlushCase{4092, true}}) {
        MemoryOutputStream os;
        Archive ar(&os);
        Fill(ar, c.fill);
        SerialiseVariableLengthUint<int64>(ar, 1);
        EXPECT_EQ(os.NumWrites(), c.flushes ? 1 : 0) << c.fill;
        EXPECT_EQ(ar.NumBufferedWrites(), c.flushes ? 1 : c.fill + 1);
    }
}

TEST(ArchiveFlush, FlushedAndBufferedBytesKeepTheirOrder) {
    MemoryOutputStream os;
    Archive ar(&os);
    Bytes expected;
    for (int64 i = 0; i < 1000; ++i) {
        ar << i;
        for (int b = 0; b < 8; ++b) {
            expected.push_back(static_cast<octet_t>(i >> (8 * b)));
        }
    }
    Bytes big(5000);
    for (std::size_t i = 0; i < big.size(); ++i) {
        big[i] = static_cast<octet_t>(i * 7);
    }
    ar.WriteBuffer(big.data(), ssize_t(big.size()));
    expected.insert(expected.end(), big.begin(), big.end());
    ar.Flush();
    EXPECT_EQ(os.bytes(), expected);
    EXPECT_EQ(ar.GetNumBytesWrittenToStream(), ssize_t(expected.size()));
    EXPECT_EQ(ar.NumBufferedWrites(), 0);
}

// ---- Assertions of the reservation protocol.

TEST(ArchiveAssertions, ReservationLargerThanTheBuffer) {
    MemoryOutputStream os;
    Archive ar(&os);
    EXPECT_TARN_ASSERT(ar.BeginWrite(ARCHIVE_BUFSIZE + 1), "reserveSize <= ARCHIVE_BUFSIZE");
}

TEST(ArchiveAssertions, WritePositionOutsideTheBuffer) {
    const char* text = "m_writeBuffer <= m_pos && m_pos <= m_writeBuffer+ARCHIVE_BUFSIZE";
    MemoryOutputStream os;
    Archive ar(&os);
    ar.m_pos = Outside(ar, ARCHIVE_BUFSIZE + 1);
    EXPECT_TARN_ASSERT(ar.BeginWrite(1), text);
    EXPECT_TARN_ASSERT(ar << int64{1}, text);
    ar.m_pos = Outside(ar, -1);
    EXPECT_TARN_ASSERT(ar.BeginWrite(1), text);
    EXPECT_TARN_ASSERT(ar << Guid{}, text);
}

TEST(ArchiveAssertions, EndWriteOutsideTheReservedRange) {
    const char* text =
        "m_writeBuffer <= m_pos && m_pos <= pos && pos <= m_writeBuffer+ARCHIVE_BUFSIZE";
    MemoryOutputStream os;
    Archive ar(&os);
    Fill(ar, 10);
    octet_t* p = ar.BeginWrite(5);
    EXPECT_TARN_ASSERT(ar.EndWrite(p - 1), text);
    EXPECT_TARN_ASSERT(ar.EndWrite(Outside(ar, ARCHIVE_BUFSIZE + 1)), text);
    ar.EndWrite(ar.m_writeBuffer + ARCHIVE_BUFSIZE);  // the very end is allowed
    EXPECT_EQ(ar.NumBufferedWrites(), ARCHIVE_BUFSIZE);
}

// ---- Fixed-width values and schema numbers.

TEST(ArchivePod, LittleEndianImages) {
    MemoryOutputStream os;
    Archive ar(&os);
    ar << int64{-2} << Guid{0x04030201, 0x0605, 0x0807, {9, 10, 11, 12, 13, 14, 15, 16}};
    Bytes expected = {0xfe, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff};
    for (int i = 1; i <= 16; ++i) {
        expected.push_back(static_cast<octet_t>(i));
    }
    Bytes image = Image(os, ar);
    EXPECT_EQ(image, expected);

    InputArchive in(image.data());
    int64 v = 0;
    Guid g{};
    in >> v >> g;
    EXPECT_EQ(v, -2);
    EXPECT_EQ(g, (Guid{0x04030201, 0x0605, 0x0807, {9, 10, 11, 12, 13, 14, 15, 16}}));
    EXPECT_EQ(in.ptr(), image.data() + image.size());
}

TEST(ArchiveSchema, WrittenAsVarintAndMustBePositive) {
    MemoryOutputStream os;
    Archive ar(&os);
    SerialiseSchema(ar, 1);
    SerialiseSchema(ar, 300);
    Bytes image = Image(os, ar);
    EXPECT_EQ(image, (Bytes{0x01, 0xac, 0x02}));

    InputArchive in(image.data());
    schema_t schema = 0;
    DeserialiseSchema(in, 1, schema);
    EXPECT_EQ(schema, 1);
    DeserialiseSchema(in, 300, schema);
    EXPECT_EQ(schema, 300);

    EXPECT_TARN_ASSERT(SerialiseSchema(ar, 0), "schema > 0");
    EXPECT_TARN_ASSERT(SerialiseSchema(ar, -1), "schema > 0");
    // An image from a newer program, or a zero schema, is not read.
    Bytes newer = {0x02};
    InputArchive newerIn(newer.data());
    EXPECT_TARN_ASSERT(DeserialiseSchema(newerIn, 1, schema),
                       "1 <= stored && stored <= currentSchema");
    Bytes zero = {0x00};
    InputArchive zeroIn(zero.data());
    EXPECT_TARN_ASSERT(DeserialiseSchema(zeroIn, 1, schema),
                       "1 <= stored && stored <= currentSchema");
}

// ---- Variable-length integers (LEB128 of the low 32 bits).

TEST(Varint, ExactLeb128Bytes) {
    struct Case {
        uint32 v;
        Bytes bytes;
    };
    const Case cases[] = {
        {0, {0x00}},
        {1, {0x01}},
        {127, {0x7f}},
        {128, {0x80, 0x01}},
        {300, {0xac, 0x02}},
        {16383, {0xff, 0x7f}},
        {16384, {0x80, 0x80, 0x01}},
        {(1u << 21) - 1, {0xff, 0xff, 0x7f}},
        {1u << 21, {0x80, 0x80, 0x80, 0x01}},
        {(1u << 28) - 1, {0xff, 0xff, 0xff, 0x7f}},
        {1u << 28, {0x80, 0x80, 0x80, 0x80, 0x01}},
        {4294967295u, {0xff, 0xff, 0xff, 0xff, 0x0f}},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(VarintBytes(c.v), c.bytes) << c.v;
        uint32 back = 0;
        const octet_t* end = DeserialiseVariableLengthUint32(c.bytes.data(), back);
        EXPECT_EQ(back, c.v);
        EXPECT_EQ(end, c.bytes.data() + c.bytes.size()) << c.v;
    }
}

TEST(Varint, DecoderInvertsEncoderOnRandomValues) {
    std::mt19937 rng(7);
    for (int i = 0; i < 20000; ++i) {
        // Spread over all byte lengths: a random value shifted right by 0..31.
        uint32 v = static_cast<uint32>(rng()) >> (rng() % 32);
        octet_t buf[MAX_VARIABLE_LENGTH_UINT_SIZE + 1];
        buf[MAX_VARIABLE_LENGTH_UINT_SIZE] = 0x5a;
        octet_t* end = SerialiseVariableLengthUint32(buf, v);
        ASSERT_LE(end - buf, MAX_VARIABLE_LENGTH_UINT_SIZE);
        uint32 back = ~v;
        ASSERT_EQ(DeserialiseVariableLengthUint32(buf, back), end);
        ASSERT_EQ(back, v);
    }
}

TEST(Varint, CarriesOnlyTheLow32Bits) {
    EXPECT_EQ(ArchiveVarint<int64>(int64{1} << 32), ArchiveVarint<int64>(0));
    EXPECT_EQ(ArchiveVarint<int64>(-1), ArchiveVarint<int64>(4294967295));
    EXPECT_EQ(ArchiveVarint<uint64>((uint64{5} << 32) | 7), ArchiveVarint<uint64>(7));
    EXPECT_EQ(ArchiveVarint<int>(-1), ArchiveVarint<int64>(4294967295));

    Bytes minusOne = ArchiveVarint<int64>(-1);
    InputArchive in(minusOne.data());
    int64 v = 0;
    DeserialiseVariableLengthUint<int64>(in, v);
    EXPECT_EQ(v, 4294967295);  // widened with zeros, not sign-extended
    EXPECT_EQ(in.ptr(), minusOne.data() + minusOne.size());
}

TEST(Varint, CompressedIntWritesUnsignedReadsSigned) {
    MemoryOutputStream os;
    Archive ar(&os);
    ar << AsCompressedInt<uint64>(300) << AsCompressedInt<int>(5);
    Bytes image = Image(os, ar);
    EXPECT_EQ(image, (Bytes{0xac, 0x02, 0x05}));
    InputArchive in(image.data());
    CompressedInt<int64> a(0), b(0);
    in >> a >> b;
    EXPECT_EQ(a.val, 300);
    EXPECT_EQ(b.val, 5);
}

// ---- Collections: a count, then the items.

TEST(ArchiveCollection, CountThenItemsAndReadingReplacesContent) {
    MemoryOutputStream os;
    Archive ar(&os);
    SerialiseCollection<Archive>(ar, std::vector<int64>{});
    SerialiseCollection<Archive>(ar, std::vector<int64>{7, -1});
    Bytes image = Image(os, ar);
    Bytes expected = {0x00, 0x02, 7,    0,    0,    0,    0,    0,    0,
                      0,    0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff};
    EXPECT_EQ(image, expected);

    InputArchive in(image.data());
    std::vector<int64> c = {1, 2, 3};
    DeserialiseCollectionWithAppend<int64, InputArchive>(in, c);
    EXPECT_TRUE(c.empty());
    c = {9};
    DeserialiseCollectionWithAppend<int64, InputArchive>(in, c);
    EXPECT_EQ(c, (std::vector<int64>{7, -1}));
    EXPECT_EQ(in.ptr(), image.data() + image.size());
}

// ---- Field keys: oid 8 bytes little-endian, path length varint, path bytes.

TEST(FieldIdImage, ExactBytesAndRoundTripAcrossFlushes) {
    std::string longPath(200, 'p');
    FieldId key(OID(Seid(0x0102030405060708u)), Path(longPath.data(), 200));
    MemoryOutputStream os;
    Archive ar(&os);
    ar << key;
    Bytes image = Image(os, ar);
    Bytes expected = {0x08, 0x07, 0x06, 0x05, 0x04, 0x03, 0x02, 0x01, 0xc8, 0x01};
    expected.insert(expected.end(), longPath.begin(), longPath.end());
    EXPECT_EQ(image, expected);

    // Many keys, short and on the heap, spread over several buffers.
    std::vector<FieldId> keys;
    for (int i = 0; i < 100; ++i) {
        std::string bytes(static_cast<std::size_t>(i * 3 % 70), static_cast<char>(i));
        keys.emplace_back(OID(Seid(uint64(i) * 0x100000001u)),
                          Path(bytes.data(), ssize_t(i * 3 % 70)));
    }
    MemoryOutputStream os2;
    Archive ar2(&os2);
    for (const FieldId& k : keys) {
        ar2 << k;
    }
    ar2.Flush();
    EXPECT_GT(os2.NumWrites(), 1);
    InputArchive in(os2.bytes().data());
    FieldId back(OID(Seid(99u)), Path(longPath.data(), 200));  // replaced by each read
    for (const FieldId& k : keys) {
        in >> back;
        ASSERT_EQ(back, k);
    }
    EXPECT_EQ(in.ptr(), os2.bytes().data() + os2.bytes().size());
}

}  // namespace
}  // namespace tarn
