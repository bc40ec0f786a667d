#pragma once

// The key of the offset-operations map: a field (`path`) of one persistent
// object (`oid`). Ordered by oid, then by path. Relocatable by byte copy.

#include <string>

#include "tnObject/Path.h"
#include "tnPersistStore/OID.h"

namespace tarn {

class Archive;
class InputArchive;
class xostream;

struct FieldId {
    OID oid;
    Path path;

    FieldId() = default;
    FieldId(const OID& o, const Path& p) : oid(o), path(p) {}
    FieldId(const FieldId& rhs) : oid(rhs.oid), path(rhs.path) {}
    FieldId& operator=(const FieldId& rhs) {
        oid = rhs.oid;
        path = rhs.path;
        return *this;
    }
    ~FieldId() = default;

    // True unless the key is the default one (null oid, empty path).
    explicit operator bool() const { return !oid.IsNull() || !path.empty(); }
};

inline bool operator<(const FieldId& a, const FieldId& b) {
    if (a.oid < b.oid) {
        return true;
    }
    return a.oid == b.oid && a.path < b.path;
}

inline bool operator==(const FieldId& a, const FieldId& b) {
    return a.oid == b.oid && a.path == b.path;
}

inline bool operator!=(const FieldId& a, const FieldId& b) {
    return !(a == b);
}

// Byte form: oid as 8 bytes little-endian, the path's length as a
// variable-length integer, then the path's bytes.
void Serialise(Archive& ar, const FieldId& f);
void Deserialise(InputArchive& ar, FieldId& f);
Archive& operator<<(Archive& ar, const FieldId& f);
InputArchive& operator>>(InputArchive& ar, FieldId& f);

// Text form: the oid text, '/', then the path in lower-case hex ("#12/0a0b").
xostream& operator<<(xostream& os, const FieldId& f);
std::string ToString(const FieldId& f);

}  // namespace tarn
