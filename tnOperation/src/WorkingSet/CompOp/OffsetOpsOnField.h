#pragma once

// The per-site offset table of one field.
//
// For every site (SiteNum) that has recorded an offset into the field, the
// table keeps a SiteOffset: the time stamp of the site's latest offset and
// the sum of all its offsets. The table is the payload of each entry of the
// offset-operations B+tree; it lives inside a leaf node, is written and read
// as part of that leaf and has no identity or schema number of its own.
//
// A leaf moves its entries by raw byte copies, so the table holds its
// ordered map through a RelocatableMap: the table is one pointer wide and
// stays valid when its bytes are copied elsewhere and the old bytes are
// abandoned. Each table owns its map alone; copies share nothing.
//
// Not thread-safe: changed only by a thread that holds the object space
// exclusively, like the leaf that contains it.
//
// Byte image of a table (no schema number, nothing before or after):
//   n        varint    number of sites (low 32 bits)
//   n times, in ascending site order:
//     site   16 bytes  Guid: Data1 4 LE, Data2 2 LE, Data3 2 LE, Data4 8 bytes
//     t      varint    time stamp (low 32 bits; read back widened with zeros)
//     o      8 bytes   sum, little-endian two's complement
// Reading replaces the table's content; a site listed twice keeps its first
// record.
//
// Text form: {(site,(t,o)),...} in ascending site order, no spaces; an empty
// table prints {}.

#include <map>
#include <type_traits>
#include <utility>

#include "tnOperation/src/Util/VectorTime.h"
#include "tnUtils/Archive.h"
#include "tnUtils/ArchiveCollection.h"
#include "tnUtils/Assert.h"
#include "tnUtils/Guid.h"
#include "tnUtils/RelocatableMap.h"
#include "tnUtils/Types.h"
#include "tnUtils/VariableLengthSerialise.h"
#include "tnUtils/xostream.h"

namespace tarn {

// The record of one site: `t` is -1 until an offset has been recorded.
template <typename T>
struct SiteOffset {
    ssize_t t;
    T o;

    SiteOffset() : t(-1), o(0) {}
    SiteOffset(ssize_t time, const T& offset) : t(time), o(offset) {}

    bool operator==(const SiteOffset& rhs) const { return t == rhs.t && o == rhs.o; }
    bool operator!=(const SiteOffset& rhs) const { return !(*this == rhs); }
};

template <typename T>
class OffsetOpsOnField {
public:
    using MAP = RelocatableMap<std::map<Guid, SiteOffset<T>>>;

    OffsetOpsOnField() = default;
    // No copy constructor: a table is made empty and then assigned, as the
    // B+tree does with its payloads.
    OffsetOpsOnField(const OffsetOpsOnField& rhs) = delete;
    ~OffsetOpsOnField() = default;

    // Builds the copy before releasing the old records; self-assignment safe.
    OffsetOpsOnField& operator=(const OffsetOpsOnField& rhs) {
        m_map = rhs.m_map;
        return *this;
    }

    bool operator==(const OffsetOpsOnField& rhs) const { return m_map == rhs.m_map; }

    // Reconciliation against the store's vector time. Declared only: nothing
    // in this code base defines or calls them; they belong to the store's
    // reconciliation of sites, which is not part of this library.
    void GetRFactor(const VectorTime&, OffsetOpsOnField<T>&) const;
    bool Merge(const OffsetOpsOnField<T>&, T&);
    bool InExtent(const VectorTime&) const;

    // Records `offset` from site `s` with time stamp `t`. A site's time
    // stamps must not decrease; equal ones are accepted and their offsets
    // add up. The sum wraps around on overflow (two's complement).
    void Insert(const SiteNum& s, ssize_t t, const T& offset) {
        SiteOffset<T>& so = m_map[s];
        TARN_ASSERT(so.t <= t);
        so.t = t;
        if constexpr (std::is_integral_v<T> && std::is_signed_v<T>) {
            using U = std::make_unsigned_t<T>;
            so.o = static_cast<T>(static_cast<U>(so.o) + static_cast<U>(offset));
        } else {
            so.o += offset;
        }
    }

    MAP m_map;
};

static_assert(sizeof(OffsetOpsOnField<int64>) == sizeof(void*),
              "a per-site table is one pointer wide, so that leaves can move it by byte copy");

// ---- Archiving -----------------------------------------------------------

template <typename T>
void Serialise(Archive& ar, const SiteOffset<T>& so) {
    SerialiseVariableLengthUint<int64>(ar, so.t);
    ar << so.o;
}

template <typename T>
void Deserialise(InputArchive& ar, SiteOffset<T>& so) {
    DeserialiseVariableLengthUint<int64>(ar, so.t);
    ar >> so.o;
}

template <typename T>
Archive& operator<<(Archive& ar, const SiteOffset<T>& so) {
    Serialise(ar, so);
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, SiteOffset<T>& so) {
    Deserialise(ar, so);
    return ar;
}

// A table entry: the site, then its record.
template <typename T>
void Serialise(Archive& ar, const std::pair<const Guid, SiteOffset<T>>& e) {
    ar << e.first << e.second;
}

template <typename T>
void Serialise(Archive& ar, const std::pair<Guid, SiteOffset<T>>& e) {
    ar << e.first << e.second;
}

template <typename T>
void Deserialise(InputArchive& ar, std::pair<Guid, SiteOffset<T>>& e) {
    ar >> e.first >> e.second;
}

template <typename T>
Archive& operator<<(Archive& ar, const std::pair<const Guid, SiteOffset<T>>& e) {
    Serialise(ar, e);
    return ar;
}

template <typename T>
Archive& operator<<(Archive& ar, const std::pair<Guid, SiteOffset<T>>& e) {
    Serialise(ar, e);
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, std::pair<Guid, SiteOffset<T>>& e) {
    Deserialise(ar, e);
    return ar;
}

// The ordered map of a table: a collection of its entries.
template <typename T>
void Serialise(Archive& ar, const std::map<Guid, SiteOffset<T>>& m) {
    SerialiseCollection<Archive>(ar, m);
}

template <typename T>
void Deserialise(InputArchive& ar, std::map<Guid, SiteOffset<T>>& m) {
    DeserialiseCollectionWithAppend<std::pair<Guid, SiteOffset<T>>, InputArchive>(ar, m);
}

template <typename T>
Archive& operator<<(Archive& ar, const std::map<Guid, SiteOffset<T>>& m) {
    Serialise(ar, m);
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, std::map<Guid, SiteOffset<T>>& m) {
    Deserialise(ar, m);
    return ar;
}

template <typename T>
void Serialise(Archive& ar, const OffsetOpsOnField<T>& x) {
    ar << x.m_map;
}

template <typename T>
void Deserialise(InputArchive& ar, OffsetOpsOnField<T>& x) {
    ar >> x.m_map;
}

template <typename T>
Archive& operator<<(Archive& ar, const OffsetOpsOnField<T>& x) {
    Serialise(ar, x);
    return ar;
}

template <typename T>
InputArchive& operator>>(InputArchive& ar, OffsetOpsOnField<T>& x) {
    Deserialise(ar, x);
    return ar;
}

// ---- Text ----------------------------------------------------------------

// "(t,o)"
template <typename T>
xostream& operator<<(xostream& os, const SiteOffset<T>& so) {
    return os << '(' << static_cast<long>(so.t) << ',' << so.o << ')';
}

// "(site,(t,o))"
template <typename T>
xostream& operator<<(xostream& os, const std::pair<const Guid, SiteOffset<T>>& e) {
    return os << '(' << e.first << ',' << e.second << ')';
}

// "{entry,entry,...}"
template <typename T>
xostream& operator<<(xostream& os, const std::map<Guid, SiteOffset<T>>& m) {
    return os << AsCurlyBracketed(AsCommaSeparatedList(m));
}

template <typename T>
xostream& operator<<(xostream& os, const OffsetOpsOnField<T>& x) {
    return os << x.m_map;
}

}  // namespace tarn
