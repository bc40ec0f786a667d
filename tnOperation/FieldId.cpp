#include "tnOperation/FieldId.h"

#include "tnUtils/Archive.h"
#include "tnUtils/xostream.h"

namespace tarn {

void Serialise(Archive& ar, const FieldId& f) {
    ar.SerialisePod<uint64>(f.oid.value_);
    f.path.Serialise(ar);
}

void Deserialise(InputArchive& ar, FieldId& f) {
    uint64 value = 0;
    ar.DeserialisePod<uint64>(value);
    f.oid = OID(Seid(value));
    f.path.Deserialise(ar);
}

Archive& operator<<(Archive& ar, const FieldId& f) {
    Serialise(ar, f);
    return ar;
}

InputArchive& operator>>(InputArchive& ar, FieldId& f) {
    Deserialise(ar, f);
    return ar;
}

xostream& operator<<(xostream& os, const FieldId& f) {
    os << f.oid;
    os.put('/');
    f.path.Write(os);
    return os;
}

std::string ToString(const FieldId& f) {
    StringOutputStream text;
    {
        xostream os(text);
        os << f;
    }
    return text.str();
}

}  // namespace tarn
