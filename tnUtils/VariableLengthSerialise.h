#pragma once

// Variable-length unsigned integers.
//
// Every variable-length value carries 32 bits: a wider or signed value is
// reduced to its low 32 bits when written, and read back widened with zeros,
// so it survives exactly when it lies in 0 .. 4294967295.
//
// Byte form (LEB128): 7 bits a byte, least significant group first, the high
// bit set on every byte but the last; 1 to 5 bytes.
//   0          -> 00
//   127        -> 7f
//   128        -> 80 01
//   4294967295 -> ff ff ff ff 0f

#include "tnUtils/Archive.h"
#include "tnUtils/Types.h"

namespace tarn {

constexpr ssize_t MAX_VARIABLE_LENGTH_UINT_SIZE = 5;

inline octet_t* SerialiseVariableLengthUint32(octet_t* p, uint32 v) {
    while (v >= 0x80) {
        *p++ = static_cast<octet_t>(v | 0x80);
        v >>= 7;
    }
    *p++ = static_cast<octet_t>(v);
    return p;
}

// The exact inverse of the encoder. Reads at most 5 bytes; bits beyond the
// 32nd in a fifth byte are dropped.
inline const octet_t* DeserialiseVariableLengthUint32(const octet_t* p, uint32& v) {
    uint32 result = 0;
    for (int shift = 0; shift < 35; shift += 7) {
        octet_t b = *p++;
        result |= static_cast<uint32>(b & 0x7f) << shift;
        if ((b & 0x80) == 0) {
            break;
        }
    }
    v = result;
    return p;
}

template <typename T>
octet_t* SerialiseVariableLengthInteger(octet_t* p, T v) {
    return SerialiseVariableLengthUint32(p, static_cast<uint32>(v));
}

template <typename T>
const octet_t* DeserialiseVariableLengthInteger(const octet_t* p, T& v) {
    uint32 x;
    const octet_t* end = DeserialiseVariableLengthUint32(p, x);
    v = static_cast<T>(x);
    return end;
}

template <typename T>
void SerialiseVariableLengthUint(Archive& ar, T v) {
    octet_t* p = ar.BeginWrite(MAX_VARIABLE_LENGTH_UINT_SIZE);
    p = SerialiseVariableLengthInteger<T>(p, v);
    ar.EndWrite(p);
}

template <typename T>
void DeserialiseVariableLengthUint(InputArchive& ar, T& v) {
    ar.SetPtr(DeserialiseVariableLengthInteger<T>(ar.ptr(), v));
}

// Marks a value for variable-length encoding.
template <typename T>
struct CompressedInt {
    T val;

    explicit CompressedInt(T v) : val(v) {}
    bool operator==(const CompressedInt& rhs) const { return val == rhs.val; }
    bool operator!=(const CompressedInt& rhs) const { return val != rhs.val; }
    bool operator<(const CompressedInt& rhs) const { return val < rhs.val; }
};

template <typename T>
CompressedInt<T> AsCompressedInt(T v) {
    return CompressedInt<T>(v);
}

template <typename T>
void Serialise(Archive& ar, CompressedInt<T> x) {
    SerialiseVariableLengthUint<T>(ar, x.val);
}

template <typename T>
void Deserialise(InputArchive& ar, CompressedInt<T>& x) {
    DeserialiseVariableLengthUint<T>(ar, x.val);
}

template <typename T>
Archive& operator<<(Archive& ar, const CompressedInt<T>& x) {
    Serialise(ar, x);
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, CompressedInt<T>& x) {
    Deserialise(ar, x);
    return ar;
}

}  // namespace tarn
