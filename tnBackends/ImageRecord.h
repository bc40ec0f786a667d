#pragma once

// The framed form in which an on-disk store keeps one object image.
//
// The frame carries the class name, the image length and a checksum, so that
// a reader can tell a damaged or foreign record from a good one before any
// byte of the image reaches the class's Deserialise slot.
//
// Record layout (all integers little-endian):
//   offset    size  field
//   0         4     magic "TNIM"
//   4         1     record version, 1
//   5         4     class-name length n
//   9         n     class name (the registered name, raw bytes)
//   9+n       8     image length m
//   17+n      m     image bytes, as the class's Serialise slot wrote them
//   17+n+m    8     XXH3-64 of bytes [0, 17+n+m), seeded with the identity
// Total: 25 + n + m bytes. Seeding the checksum with the identity means a
// record found under another identity than its own fails the check too.

#include <cstddef>
#include <span>
#include <vector>

#include "tnBackends/IStore.h"
#include "tnUtils/Types.h"

namespace tarn {

inline constexpr std::size_t kImageRecordOverhead = 25;
inline constexpr octet_t kImageRecordVersion = 1;

// Size in bytes of the record of `image`.
std::size_t ImageRecordSize(const StoredImage& image);

// Writes the record of `image`, stored under identity `oid`, into
// out[0, ImageRecordSize(image)).
void EncodeImageRecord(uint64 oid, const StoredImage& image, octet_t* out);
std::vector<octet_t> EncodeImageRecord(uint64 oid, const StoredImage& image);

// Checks `record` (magic, version, lengths against the record's size, then
// the checksum) and returns the image it holds. Throws RuntimeError naming the
// identity and the fault: "image #<oid>: truncated ...", "... checksum
// mismatch ...", "... unknown record version ...", and so on.
StoredImage DecodeImageRecord(uint64 oid, std::span<const octet_t> record);

}  // namespace tarn
