// The record the LMDB store keeps per image: its layout, and that every
// truncation and every changed byte is reported with the identity and fault.

#include "tnBackends/ImageRecord.h"

#include <gtest/gtest.h>

#include <string>

namespace tarn {
namespace {

using Bytes = std::vector<octet_t>;

StoredImage SampleImage() {
    StoredImage image{"tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode", {}};
    for (int i = 0; i < 300; ++i) {
        image.bytes.push_back(static_cast<octet_t>(i * 7));
    }
    return image;
}

// The message of the RuntimeError `record` raises when decoded as `oid`.
std::string DecodeError(uint64 oid, const Bytes& record) {
    try {
        DecodeImageRecord(oid, record);
    } catch (const RuntimeError& e) {
        return e.what();
    }
    return "(decoded without error)";
}

TEST(ImageRecordFormat, HeaderThenNameThenBytesAndBackOfAnyLength) {
    const Bytes record = EncodeImageRecord(1, StoredImage{"C", {0xAB}});
    const Bytes head = {'T', 'N', 'I', 'M', 1, 1, 0, 0, 0, 'C', 1, 0, 0, 0, 0, 0, 0, 0, 0xAB};
    EXPECT_EQ(Bytes(record.begin(), record.begin() + 19), head);
    for (const StoredImage& image : {StoredImage{}, SampleImage()}) {
        const Bytes encoded = EncodeImageRecord(42, image);
        EXPECT_EQ(encoded.size(), 25 + image.className.size() + image.bytes.size());
        const StoredImage back = DecodeImageRecord(42, encoded);
        EXPECT_EQ(back.className, image.className);
        EXPECT_EQ(back.bytes, image.bytes);
    }
}

TEST(ImageRecordChecks, EveryTruncationAndChangedByteIsReported) {
    const Bytes record = EncodeImageRecord(7, SampleImage());
    for (std::size_t size = 0; size < record.size(); ++size) {
        const std::string error = DecodeError(7, Bytes(record.begin(), record.begin() + size));
        EXPECT_NE(error.find("image #7: truncated record"), std::string::npos) << size << error;
    }
    for (std::size_t at = 0; at < record.size(); ++at) {
        Bytes bad = record;
        bad[at] ^= 0x10;
        EXPECT_EQ(DecodeError(7, bad).rfind("image #7: ", 0), 0u) << at << DecodeError(7, bad);
    }
    const struct {
        std::size_t at;
        octet_t value;
        const char* error;
    } faults[] = {{100, static_cast<octet_t>(record[100] ^ 1), "image #7: checksum mismatch"},
                  {4, 9, "unknown record version 9"},
                  {0, 'X', "bad magic"}};
    for (const auto& f : faults) {
        Bytes bad = record;
        bad[f.at] = f.value;
        EXPECT_NE(DecodeError(7, bad).find(f.error), std::string::npos) << DecodeError(7, bad);
    }
    Bytes longer = record;
    longer.push_back(0);
    EXPECT_NE(DecodeError(7, longer).find("1 unexpected bytes"), std::string::npos);
    // A record moved under another identity fails its checksum.
    EXPECT_NE(DecodeError(8, record).find("image #8: checksum mismatch"), std::string::npos);
}

}  // namespace
}  // namespace tarn
