#include "tnRuntime/ImageRecord.h"

#include <gtest/gtest.h>

#include <string>

#ifdef TARN_HAVE_LMDB

namespace tarn {
namespace {

StoredImage SampleImage() {
    StoredImage image;
    image.className = "tarn::FieldIdToOffsetOpsOnInt64FieldMapLeafNode";
    for (int i = 0; i < 300; ++i) {
        image.bytes.push_back(static_cast<octet_t>(i * 7));
    }
    return image;
}

// The message of the RuntimeError `record` raises when decoded as `oid`.
std::string DecodeError(uint64 oid, const std::vector<octet_t>& record) {
    try {
        DecodeImageRecord(oid, record);
    } catch (const RuntimeError& e) {
        return e.what();
    }
    return "(decoded without error)";
}

TEST(ImageRecordFormat, RoundTripsNamesAndBytesOfAnyLength) {
    const StoredImage empty;
    StoredImage sample = SampleImage();
    for (const StoredImage& image : {empty, sample}) {
        const std::vector<octet_t> record = EncodeImageRecord(42, image);
        ASSERT_EQ(record.size(), 25 + image.className.size() + image.bytes.size());
        const StoredImage back = DecodeImageRecord(42, record);
        EXPECT_EQ(back.className, image.className);
        EXPECT_EQ(back.bytes, image.bytes);
    }
}

TEST(ImageRecordFormat, HeaderFieldsSitWhereTheLayoutSays) {
    StoredImage image;
    image.className = "C";
    image.bytes = {0xAB};
    const std::vector<octet_t> record = EncodeImageRecord(1, image);
    const std::vector<octet_t> head = {'T', 'N', 'I', 'M', 1, 1, 0, 0, 0,   'C',
                                       1,   0,   0,   0,   0, 0, 0, 0, 0xAB};
    EXPECT_EQ(std::vector<octet_t>(record.begin(), record.begin() + 19), head);
}

TEST(ImageRecordChecks, EveryTruncationIsReportedAsTruncated) {
    const std::vector<octet_t> record = EncodeImageRecord(7, SampleImage());
    for (std::size_t size = 0; size < record.size(); ++size) {
        const std::string error =
            DecodeError(7, std::vector<octet_t>(record.begin(), record.begin() + size));
        EXPECT_NE(error.find("image #7: truncated record"), std::string::npos)
            << "size " << size << ": " << error;
    }
}

TEST(ImageRecordChecks, EveryFlippedByteIsRejected) {
    const std::vector<octet_t> record = EncodeImageRecord(7, SampleImage());
    for (std::size_t at = 0; at < record.size(); ++at) {
        std::vector<octet_t> bad = record;
        bad[at] ^= 0x10;
        const std::string error = DecodeError(7, bad);
        EXPECT_EQ(error.rfind("image #7: ", 0), 0u) << "byte " << at << ": " << error;
    }
}

TEST(ImageRecordChecks, NamesTheFault) {
    const std::vector<octet_t> record = EncodeImageRecord(7, SampleImage());
    std::vector<octet_t> payload = record;
    payload[100] ^= 1;
    EXPECT_NE(DecodeError(7, payload).find("checksum mismatch"), std::string::npos);
    std::vector<octet_t> version = record;
    version[4] = 9;
    EXPECT_NE(DecodeError(7, version).find("unknown record version 9"), std::string::npos);
    std::vector<octet_t> magic = record;
    magic[0] = 'X';
    EXPECT_NE(DecodeError(7, magic).find("bad magic"), std::string::npos);
    std::vector<octet_t> longer = record;
    longer.push_back(0);
    EXPECT_NE(DecodeError(7, longer).find("1 unexpected bytes"), std::string::npos);
    // A record moved under another identity fails its checksum.
    EXPECT_NE(DecodeError(8, record).find("image #8: checksum mismatch"), std::string::npos);
}

}  // namespace
}  // namespace tarn

#endif  // TARN_HAVE_LMDB
