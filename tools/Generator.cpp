#include "tools/Generator.h"

#include <algorithm>

#include "tnUtils/Assert.h"

namespace tarn::tool {

namespace {

constexpr int64 kFieldsPerObject = 4;
constexpr int64 kLongPathBytes = 20;
constexpr int64 kMaxOffset = 1000;

}  // namespace

Generator::Generator(const GeneratorSettings& settings, const std::map<Guid, int64>& lastStamps)
    : m_settings(settings), m_state(settings.seed) {
    TARN_ASSERT(settings.count >= 0 && settings.fields >= 1 && settings.sites >= 1);
    m_nextStamp.resize(static_cast<std::size_t>(settings.sites), 1);
    for (int64 s = 0; s < settings.sites; ++s) {
        auto it = lastStamps.find(SiteGuid(s + 1));
        if (it != lastStamps.end()) {
            m_nextStamp[static_cast<std::size_t>(s)] = std::max<int64>(it->second + 1, 1);
        }
    }
}

Guid Generator::SiteGuid(int64 site) {
    Guid g{};
    g.Data3 = 0x4000;
    g.Data4[0] = 0x80;
    for (int i = 0; i < 6; ++i) {
        g.Data4[7 - i] = static_cast<uint8>(static_cast<uint64>(site) >> (8 * i));
    }
    return g;
}

FieldId Generator::FieldKey(int64 field) {
    const OID oid(Seid(static_cast<uint64>(field / kFieldsPerObject + 1)));
    const auto low = static_cast<uint32>(field);
    Path path;
    switch (field % kFieldsPerObject) {
        case 0:
            break;
        case 1: {
            const octet_t b = 1;
            path = Path(&b, 1);
            break;
        }
        case 2:
            path.AppendUint32(low);
            break;
        default:
            for (int64 i = 0; i < kLongPathBytes; ++i) {
                const auto b = static_cast<octet_t>(low >> (8 * (i % 4)));
                path.Append(&b, 1);
            }
            break;
    }
    return FieldId(oid, path);
}

// splitmix64: small, fast and the same on every platform.
uint64 Generator::Random() {
    uint64 z = (m_state += 0x9e3779b97f4a7c15ULL);
    z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ULL;
    z = (z ^ (z >> 27)) * 0x94d049bb133111ebULL;
    return z ^ (z >> 31);
}

int64 Generator::Below(int64 n) {
    return static_cast<int64>(Random() % static_cast<uint64>(n));
}

bool Generator::Next(OffsetOperation& op, std::string& error) {
    if (m_made >= m_settings.count) {
        return false;
    }
    const int64 objects = (m_settings.fields + kFieldsPerObject - 1) / kFieldsPerObject;
    if (m_runObject < 0 || Below(8) == 0) {
        m_runObject = Below(objects);
    }
    const int64 first = m_runObject * kFieldsPerObject;
    const int64 inObject = std::min(kFieldsPerObject, m_settings.fields - first);
    const int64 site = Below(m_settings.sites);
    int64& stamp = m_nextStamp[static_cast<std::size_t>(site)];
    if (stamp > kMaxTimeStamp) {
        error = "site " + ToString(SiteGuid(site + 1)) +
                " has no time stamps left (the largest is " + std::to_string(kMaxTimeStamp) + ")";
        return false;
    }
    op.site = SiteGuid(site + 1);
    op.t = stamp;
    op.field = FieldKey(first + Below(inObject));
    op.offset = Below(2 * kMaxOffset + 1) - kMaxOffset;
    if (Below(4) != 0) {
        ++stamp;
    }
    ++m_made;
    return true;
}

}  // namespace tarn::tool
