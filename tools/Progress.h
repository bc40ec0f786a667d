#pragma once

// The progress line of a long command on a terminal: how much is done, the
// share and the time left, rewritten in place at most four times a second.
// Disabled (standard error is not a terminal, or the user asked for none), it
// prints nothing at all.

#include <chrono>
#include <ostream>
#include <string>

#include "tnUtils/Types.h"

namespace tarn::tool {

class ProgressLine {
public:
    // `label` starts the line ("export").
    ProgressLine(bool enabled, std::ostream& err, std::string label);
    ~ProgressLine() { Finish(); }
    ProgressLine(const ProgressLine&) = delete;
    ProgressLine& operator=(const ProgressLine&) = delete;

    bool Enabled() const { return m_enabled; }
    // Shows `text` (what is done, e.g. "1200 of 5000 fields") with the share
    // `done`/`total` and the time left at the rate so far; without either
    // when `total` is 0 (not known). Cheap when called again too soon.
    void Show(uint64 done, uint64 total, const std::string& text);
    // Ends the line, if one was shown, so that what follows starts afresh.
    void Finish();

private:
    using Clock = std::chrono::steady_clock;

    bool m_enabled;
    std::ostream& m_err;
    std::string m_label;
    Clock::time_point m_start;
    Clock::time_point m_last{};
    std::size_t m_width = 0;  // of the line shown last
};

// "3 s", "2 min 05 s", "1 h 02 min".
std::string DurationText(double seconds);

// "12.3 MiB" and the like.
std::string BytesText(uint64 bytes);

}  // namespace tarn::tool
