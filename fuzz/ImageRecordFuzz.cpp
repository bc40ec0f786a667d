// The framed image record decoder on arbitrary bytes.
//
// Input: the bytes of one record, as an on-disk store would hand them over
// for identity 7 (the checksum is seeded with the identity, so seeds are
// records written for identity 7).
// Properties:
//   - DecodeImageRecord either returns an image or throws RuntimeError;
//     nothing else escapes and nothing crashes;
//   - a record it accepts is exactly the record EncodeImageRecord writes for
//     the image it returned.

#include <cstddef>
#include <cstdint>
#include <span>

#include "fuzz/FuzzStore.h"

namespace {

constexpr tarn::uint64 kIdentity = 7;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::span<const tarn::octet_t> record(data, size);
    tarn::StoredImage image;
    try {
        image = tarn::DecodeImageRecord(kIdentity, record);
    } catch (const tarn::RuntimeError& e) {
        tarn::fuzz::Expected(e);
        return 0;
    }
    const std::vector<tarn::octet_t> again = tarn::EncodeImageRecord(kIdentity, image);
    if (!std::equal(again.begin(), again.end(), record.begin(), record.end())) {
        tarn::fuzz::PropertyFailed("an accepted record is not the encoding of its image");
    }
    return 0;
}
