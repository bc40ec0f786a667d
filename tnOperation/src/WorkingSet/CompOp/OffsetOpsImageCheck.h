#pragma once

// Bounds-checked walks over the images of the record, the map header and
// both node kinds. The classes' own readers trust their input; the runtime's
// loader runs these first on every image it reads from a store, so that a
// malformed image (one that passed the store's checksum but was written
// wrongly or by a newer program) is reported instead of being read past its
// end or tripping the readers' assertions.

#include <cstddef>
#include <string>

#include "tnUtils/Types.h"

namespace tarn {

// Each returns "" for a well-formed image of exactly `size` bytes, otherwise
// what is wrong with it.
std::string CheckOffsetOpsImage(const octet_t* image, std::size_t size);
std::string CheckFieldIdToOffsetOpsOnInt64FieldMapImage(const octet_t* image, std::size_t size);
std::string CheckFieldIdToOffsetOpsOnInt64FieldMapInternalNodeImage(const octet_t* image,
                                                                    std::size_t size);
std::string CheckFieldIdToOffsetOpsOnInt64FieldMapLeafNodeImage(const octet_t* image,
                                                                std::size_t size);

}  // namespace tarn
