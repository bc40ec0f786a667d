#pragma once

#include "tnOperation/FieldId.h"

namespace tarn {

// Three-way comparison of field keys, the only order the B+tree uses:
// -1 if a < b, else 0 if a == b, else +1. `<` is evaluated first.
inline int CompareKeys(const FieldId& a, const FieldId& b) {
    if (a < b) {
        return -1;
    }
    if (a == b) {
        return 0;
    }
    return 1;
}

}  // namespace tarn
