// The meta record: its codec (the layout is in LmdbStore.h), reading it (or
// a format-1 store's keys) from a transaction, and writing it.

#include <xxhash.h>

#include <algorithm>
#include <vector>

#include "tnUtils/Assert.h"
#include "tnUtils/LittleEndian.h"

#include "tnBackends/LmdbInternal.h"

namespace tarn {

namespace {

constexpr std::string_view kStateKey = "state";

constexpr std::string_view kFormatMagic = "TARNSTOR";

// The meta record's layout (see LmdbStore.h): magic 8, version 4, identity
// counter 8, image bytes 8, then the roots and the counters, each a count 4
// and per entry a name length 2, the name and a value 8; the checksum 8 last.
constexpr std::size_t kStateVersionOffset = 8;

constexpr std::size_t kStateBodyOffset = 12;

constexpr std::size_t kChecksumBytes = 8;

constexpr std::size_t kEmptyStateBytes = kStateBodyOffset + 8 + 8 + 4 + 4 + kChecksumBytes;

constexpr std::string_view kFormatKey = "format";

constexpr std::string_view kNextIdentityKey = "next-identity";

constexpr std::string_view kRootPrefix = "root:";

constexpr std::string_view kCounterPrefix = "counter:";

// A name in the meta record; the caller adds what it names.
void PutName(std::string& out, std::string_view name) {
    TARN_ASSERT(name.size() <= kMaxNameBytes);
    octet_t length[2];
    PutLe(length, name.size(), 2);
    out.append(reinterpret_cast<const char*>(length), 2);
    out += name;
}

void PutValue(std::string& out, uint64 value, std::size_t width) {
    octet_t bytes[8];
    PutLe(bytes, value, width);
    out.append(reinterpret_cast<const char*>(bytes), width);
}

// A meta record that does not parse; what is wrong.
struct Unparsable {
    std::string what;
};

// Reads a meta record's body front to back.
class StateReader {
public:
    explicit StateReader(std::span<const octet_t> body) : m_body(body) {}

    uint64 Value(std::size_t width, const char* what) {
        return GetLe(Take(width, what).data(), width);
    }

    // The named values of one section (roots or counters), in strictly
    // increasing name order.
    void Section(std::map<std::string, uint64, std::less<>>& into, const char* what) {
        const uint64 count = Value(4, what);
        for (uint64 i = 0; i < count; ++i) {
            const std::size_t length = Value(2, what);
            if (length > kMaxNameBytes) {
                throw Unparsable{std::string("a name of the ") + what + " has " +
                                 std::to_string(length) + " bytes"};
            }
            const std::span<const octet_t> name = Take(length, what);
            std::string key(reinterpret_cast<const char*>(name.data()), name.size());
            if (!into.empty() && !(into.rbegin()->first < key)) {
                throw Unparsable{std::string("the ") + what + " are out of order"};
            }
            const uint64 value = Value(8, what);
            into.emplace_hint(into.end(), std::move(key), value);
        }
    }

    std::size_t Left() const { return m_body.size() - m_at; }

private:
    std::span<const octet_t> Take(std::size_t size, const char* what) {
        if (size > Left()) {
            throw Unparsable{std::string("the record ends inside the ") + what};
        }
        const std::span<const octet_t> taken = m_body.subspan(m_at, size);
        m_at += size;
        return taken;
    }

    std::span<const octet_t> m_body;
    std::size_t m_at = 0;
};

[[noreturn]] void FailUnsupported(const std::string& dir, uint64 version) {
    FailAt(dir, "store format version " + std::to_string(version) +
                    " is not supported (this program reads versions 1 and 2)");
}

std::string EncodeState(const LmdbStoreState& state) {
    std::string out(kFormatMagic);
    PutValue(out, kFormatVersion, 4);
    PutValue(out, state.nextIdentity, 8);
    PutValue(out, state.imageBytes, 8);
    for (const auto* section : {&state.roots, &state.counters}) {
        PutValue(out, section->size(), 4);
        for (const auto& [name, value] : *section) {
            PutName(out, name);
            PutValue(out, value, 8);
        }
    }
    PutValue(out, XXH3_64bits(out.data(), out.size()), 8);
    return out;
}

// The meta record `record` of the store in `dir`, verified: its length, its
// checksum, its magic and version, then its body.
LmdbStoreState DecodeState(const std::string& dir, std::span<const octet_t> record) {
    const std::string damaged = "damaged store: the meta record \"state\" ";
    if (record.size() < kEmptyStateBytes) {
        FailAt(dir,
               damaged + "has " + std::to_string(record.size()) + " bytes, fewer than the " +
                   std::to_string(kEmptyStateBytes) + " of the smallest (wrong length)",
               RuntimeError::Category::Damaged);
    }
    const std::size_t body = record.size() - kChecksumBytes;
    if (XXH3_64bits(record.data(), body) != GetLe(record.data() + body, kChecksumBytes)) {
        FailAt(dir, damaged + "does not match its checksum (checksum mismatch)",
               RuntimeError::Category::Damaged);
    }
    if (!std::equal(kFormatMagic.begin(), kFormatMagic.end(), record.begin())) {
        FailAt(dir, damaged + "lacks the magic \"TARNSTOR\"", RuntimeError::Category::Damaged);
    }
    if (const uint64 version = GetLe(record.data() + kStateVersionOffset, 4);
        version != kFormatVersion) {
        FailUnsupported(dir, version);
    }
    LmdbStoreState state;
    try {
        StateReader reader(record.subspan(kStateBodyOffset, body - kStateBodyOffset));
        state.nextIdentity = reader.Value(8, "identity counter");
        state.imageBytes = reader.Value(8, "image bytes");
        reader.Section(state.roots, "roots");
        reader.Section(state.counters, "counters");
        if (reader.Left() != 0) {
            throw Unparsable{std::to_string(reader.Left()) + " bytes follow the counters"};
        }
    } catch (const Unparsable& e) {
        FailAt(dir, damaged + "cannot be parsed: " + e.what, RuntimeError::Category::Damaged);
    }
    return state;
}

}  // namespace

// The meta values of the commit `txn` sees, verified, with the format found
// in `version`. A format-1 store's values are read from their keys, which
// `oldKeys` (when given) receives.
LmdbStoreState LmdbStore::ReadState(MDB_txn* txn, uint32* version,
                                    std::vector<std::string>* oldKeys) {
    MDB_val key = Val(kStateKey);
    MDB_val value;
    int rc = Get(txn, m_meta, &key, &value, "reading the meta record");
    if (rc == MDB_SUCCESS) {
        *version = kFormatVersion;
        return DecodeState(m_dir, Bytes(value));
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "reading the meta record");
    }
    // No meta record: a store of format 1, or one that lost its record.
    key = Val(kFormatKey);
    rc = Get(txn, m_meta, &key, &value, "reading the format marker");
    if (rc == MDB_NOTFOUND) {
        Fail(
            "damaged store: the meta record \"state\" is missing (and there is no format-1 "
            "marker)",
            RuntimeError::Category::Damaged);
    }
    Check(rc, "reading the format marker");
    const std::string_view marker = Text(value);
    if (marker.size() != kFormatMagic.size() + 4 || !marker.starts_with(kFormatMagic)) {
        Fail("not a store: unrecognised format marker");
    }
    const uint64 markerVersion = GetLe(Bytes(value).data() + kFormatMagic.size(), 4);
    if (markerVersion != kFormat1) {
        FailUnsupported(m_dir, markerVersion);
    }
    *version = kFormat1;
    return ReadFormat1(txn, oldKeys);
}

// A format-1 store's meta values, each under a key of its own. The image
// bytes were not kept: they are counted on demand (or at the upgrade).
LmdbStoreState LmdbStore::ReadFormat1(MDB_txn* txn, std::vector<std::string>* oldKeys) {
    LmdbStoreState state;
    state.imageBytesKnown = false;
    bool haveNext = false;
    Cursor cursor(*this, txn, m_meta, "reading the meta values");
    MDB_val key;
    MDB_val value;
    const auto touching = Cursor::Touching::KeyAndValue;
    int rc = 0;
    for (rc = cursor.Get(&key, &value, MDB_FIRST, touching); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT, touching)) {
        const std::string_view name = Text(key);
        const bool root = name.starts_with(kRootPrefix);
        const bool counter = name.starts_with(kCounterPrefix);
        const bool next = name == kNextIdentityKey;
        if (!root && !counter && !next) {
            if (name == kFormatKey && oldKeys != nullptr) {
                oldKeys->emplace_back(name);
            }
            continue;
        }
        if (value.mv_size != 8) {
            Fail("damaged store: meta entry '" + std::string(name) + "' has " +
                     std::to_string(value.mv_size) + " bytes, expected 8",
                 RuntimeError::Category::Damaged);
        }
        const uint64 number = GetLe(Bytes(value).data(), 8);
        if (next) {
            state.nextIdentity = number;
            haveNext = true;
        } else if (root) {
            state.roots.emplace(name.substr(kRootPrefix.size()), number);
        } else {
            state.counters.emplace(name.substr(kCounterPrefix.size()), number);
        }
        if (oldKeys != nullptr) {
            oldKeys->emplace_back(name);
        }
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "reading the meta values");
    }
    if (!haveNext) {
        Fail("damaged store: the identity counter is missing", RuntimeError::Category::Damaged);
    }
    return state;
}

void LmdbStore::WriteState(MDB_txn* txn, const LmdbStoreState& state) {
    const std::string record = EncodeState(state);
    MDB_val key = Val(kStateKey);
    MDB_val value = Val(record);
    CheckGuarded("writing the meta record",
                 [&]() noexcept { return mdb_put(txn, m_meta, &key, &value, 0); });
}

// The sum of the sizes of all image records, from a walk of the images'
// leaves (the records themselves are not read).
uint64 LmdbStore::SumImageBytes(MDB_txn* txn) {
    Cursor cursor(*this, txn, m_images, "measuring the images");
    MDB_val key;
    MDB_val value;
    uint64 bytes = 0;
    const auto touching = Cursor::Touching::Nothing;
    int rc = 0;
    for (rc = cursor.Get(&key, &value, MDB_FIRST, touching); rc == MDB_SUCCESS;
         rc = cursor.Get(&key, &value, MDB_NEXT, touching)) {
        bytes += value.mv_size;
    }
    if (rc != MDB_NOTFOUND) {
        Check(rc, "measuring the images");
    }
    return bytes;
}

}  // namespace tarn
