#pragma once

// The identity of a persistent object, as held in references and in each
// object's persistence state. Null (0) until the runtime assigns one.

#include <cstddef>
#include <string>

#include "tnLss/Seid.h"

namespace tarn {

class NullInterface;
class xostream;

struct OID : Seid {
    OID() : Seid() {}
    OID(const NullInterface&) : Seid() {}
    OID(std::nullptr_t) : Seid() {}
    OID(Seid s) : Seid(s) {}
    OID(SeidLow low, SeidHigh high) : Seid(low, high) {}

    bool operator<(const OID& rhs) const { return Seid::operator<(rhs); }
    bool operator==(const OID& rhs) const { return Seid::operator==(rhs); }
    bool operator!=(const OID& rhs) const { return Seid::operator!=(rhs); }
};

// Text form: '#' followed by the decimal identity ("#0" when null).
std::string ToString(const OID& oid);

xostream& operator<<(xostream& os, const OID& oid);

}  // namespace tarn
