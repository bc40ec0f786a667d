#pragma once

// Synthetic offset operations for `offsetops record --generate N`.
//
// The stream is a pure function of its settings and of the time stamps it
// starts from, so two runs with the same seed over the same store state give
// the same operations.
//
// Shape of the stream:
// - Sites: site i (1..sites) is the Guid 00000000-0000-4000-8000-<i as 12 hex
//   digits>. Each operation comes from a site drawn uniformly.
// - Fields: field j (0..fields-1) belongs to object j/4 + 1; its path is
//   empty (j%4 == 0), one byte (1), four bytes (2) or twenty bytes (3, a path
//   longer than a Path's local buffer). All keys differ.
// - Locality: operations come in runs on one object, as the edits of one
//   object arrive together; a run continues with probability 7/8 (mean length
//   8), each operation of it picks one of the object's fields uniformly. The
//   run's object is drawn uniformly.
// - Time stamps: each site has its own counter, starting one past the largest
//   time stamp the store already holds for that site (1 for a site it does
//   not know). An operation takes the counter, which then advances with
//   probability 3/4, so equal stamps of one site occur too. Stamps never pass
//   kMaxTimeStamp: the generator stops with an error instead.
// - Offsets: uniform in -1000..1000.
//
// Not thread-safe; owns only its own state.

#include <map>
#include <string>
#include <vector>

#include "tools/OpsFile.h"

namespace tarn::tool {

struct GeneratorSettings {
    int64 count = 0;  // operations to make
    int64 fields = 10000;
    int64 sites = 4;
    uint64 seed = 1;
};

class Generator {
public:
    // `lastStamps`: for each site, the largest time stamp already recorded.
    // Settings must hold count >= 0, fields >= 1 and sites >= 1.
    Generator(const GeneratorSettings& settings, const std::map<Guid, int64>& lastStamps);

    // The next operation into `op`; false when `count` operations have been
    // made, or (with `error` set) when a site's time stamps are exhausted.
    bool Next(OffsetOperation& op, std::string& error);

    int64 Made() const { return m_made; }

    static Guid SiteGuid(int64 site);
    static FieldId FieldKey(int64 field);

private:
    uint64 Random();
    // Uniform in 0..n-1 (n >= 1).
    int64 Below(int64 n);

    GeneratorSettings m_settings;
    uint64 m_state;
    std::vector<int64> m_nextStamp;  // per site, the stamp its next operation takes
    int64 m_made = 0;
    int64 m_runObject = -1;  // the current run's object index, -1 before the first
};

}  // namespace tarn::tool
