#pragma once

// The 64-bit identity of a stored object. The two 32-bit halves and the whole
// value are views of the same 8 bytes; low_ lies at the lower address, so on
// little-endian targets value_ = high_ * 2^32 + low_. Zero is the null identity
// and orders before every other.

#include "tnUtils/Types.h"

namespace tarn {

using SeidPart = uint32;
using SeidLow = SeidPart;
using SeidHigh = SeidPart;

struct Seid {
    union {
        struct {
            SeidLow low_;
            SeidHigh high_;
        };
        uint64 value_;
    };

    Seid() : value_(0) {}
    Seid(SeidLow low, SeidHigh high) : value_((uint64{high} << 32) | low) {}
    explicit Seid(uint64 value) : value_(value) {}

    void SetNull() { value_ = 0; }
    bool IsNull() const { return value_ == 0; }
    explicit operator bool() const { return value_ != 0; }

    // Unsigned order of value_: high_ decides first, then low_.
    bool operator<(const Seid& rhs) const { return value_ < rhs.value_; }
    bool operator==(const Seid& rhs) const { return value_ == rhs.value_; }
    bool operator!=(const Seid& rhs) const { return value_ != rhs.value_; }
};

static_assert(sizeof(Seid) == 8, "a Seid is 8 bytes");

}  // namespace tarn
