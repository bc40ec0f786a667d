#include "tnBackends/ImageRecord.h"

// The checksum comes from libxxhash, found together with LMDB.

#include <cstdio>
#include <cstring>
#include <string>

#include <xxhash.h>

#include "tnUtils/Assert.h"
#include "tnUtils/LittleEndian.h"
#include "tnUtils/RuntimeError.h"

namespace tarn {

namespace {

constexpr octet_t kMagic[4] = {'T', 'N', 'I', 'M'};
constexpr std::size_t kNameLengthOffset = 5;
constexpr std::size_t kNameOffset = 9;

uint64 Checksum(uint64 oid, const octet_t* bytes, std::size_t size) {
    return XXH3_64bits_withSeed(bytes, size, oid);
}

[[noreturn]] void Fail(uint64 oid, const std::string& what) {
    throw RuntimeError(RuntimeError::Category::Damaged,
                       "image #" + std::to_string(oid) + ": " + what);
}

std::string Hex(uint64 value) {
    char text[19];
    std::snprintf(text, sizeof text, "0x%016llx", static_cast<unsigned long long>(value));
    return text;
}

}  // namespace

std::size_t ImageRecordSize(const StoredImage& image) {
    return kImageRecordOverhead + image.className.size() + image.bytes.size();
}

void EncodeImageRecord(uint64 oid, const StoredImage& image, octet_t* out) {
    // A class name is a registered name, a few dozen bytes; 4 GiB would be a
    // caller's bug, not data.
    TARN_ASSERT(image.className.size() <= 0xffffffffu);
    const std::size_t n = image.className.size();
    const std::size_t m = image.bytes.size();
    std::memcpy(out, kMagic, sizeof kMagic);
    out[4] = kImageRecordVersion;
    PutLe(out + kNameLengthOffset, n, 4);
    std::memcpy(out + kNameOffset, image.className.data(), n);
    PutLe(out + kNameOffset + n, m, 8);
    if (m != 0) {
        std::memcpy(out + kNameOffset + n + 8, image.bytes.data(), m);
    }
    const std::size_t summed = kNameOffset + n + 8 + m;
    PutLe(out + summed, Checksum(oid, out, summed), 8);
}

std::vector<octet_t> EncodeImageRecord(uint64 oid, const StoredImage& image) {
    std::vector<octet_t> record(ImageRecordSize(image));
    EncodeImageRecord(oid, image, record.data());
    return record;
}

StoredImage DecodeImageRecord(uint64 oid, std::span<const octet_t> record) {
    const std::size_t size = record.size();
    const octet_t* in = record.data();
    // 1. The fixed part must be there before any field is read.
    if (size < kImageRecordOverhead) {
        Fail(oid, "truncated record: " + std::to_string(size) + " bytes, a record has at least " +
                      std::to_string(kImageRecordOverhead));
    }
    // 2. Magic and version say the bytes are a record this program reads.
    if (std::memcmp(in, kMagic, sizeof kMagic) != 0) {
        Fail(oid, "not an image record (bad magic)");
    }
    if (in[4] != kImageRecordVersion) {
        Fail(oid, "unknown record version " + std::to_string(in[4]) + " (this program reads " +
                      std::to_string(kImageRecordVersion) + ")");
    }
    // 3. The two lengths must account for the record's size exactly.
    const uint64 n = GetLe(in + kNameLengthOffset, 4);
    if (n > size - kImageRecordOverhead) {
        Fail(oid, "truncated record: class name of " + std::to_string(n) +
                      " bytes does not fit in a record of " + std::to_string(size) + " bytes");
    }
    const uint64 m = GetLe(in + kNameOffset + n, 8);
    const uint64 room = size - kImageRecordOverhead - n;
    if (m > room) {
        Fail(oid, "truncated record: image of " + std::to_string(m) + " bytes, record holds " +
                      std::to_string(room));
    }
    if (m < room) {
        Fail(oid, "record has " + std::to_string(room - m) + " unexpected bytes after the image");
    }
    // 4. The checksum covers everything before it.
    const std::size_t summed = size - 8;
    const uint64 stored = GetLe(in + summed, 8);
    const uint64 computed = Checksum(oid, in, summed);
    if (stored != computed) {
        Fail(oid, "checksum mismatch (stored " + Hex(stored) + ", computed " + Hex(computed) + ")");
    }
    StoredImage image;
    image.className.assign(reinterpret_cast<const char*>(in + kNameOffset), n);
    const octet_t* bytes = in + kNameOffset + n + 8;
    image.bytes.assign(bytes, bytes + m);
    return image;
}

}  // namespace tarn
