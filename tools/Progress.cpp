#include "tools/Progress.h"

#include <cstdio>

namespace tarn::tool {

namespace {

constexpr auto kInterval = std::chrono::milliseconds(250);

}  // namespace

ProgressLine::ProgressLine(bool enabled, std::ostream& err, std::string label)
    : m_enabled(enabled), m_err(err), m_label(std::move(label)), m_start(Clock::now()) {}

void ProgressLine::Show(uint64 done, uint64 total, const std::string& text) {
    if (!m_enabled) {
        return;
    }
    const Clock::time_point now = Clock::now();
    if (now - m_last < kInterval) {
        return;
    }
    m_last = now;
    std::string line = m_label + ": ";
    if (total > 0) {
        const double share = std::min(1.0, static_cast<double>(done) / static_cast<double>(total));
        char percent[16];
        std::snprintf(percent, sizeof percent, "%.0f%%", share * 100);
        line += percent;
        line += " (" + text + ")";
        const double elapsed = std::chrono::duration<double>(now - m_start).count();
        if (share > 0 && elapsed >= 1) {
            line += ", " + DurationText(elapsed * (1 - share) / share) + " left";
        }
    } else {
        line += text;
    }
    // Blank out what a longer previous line left behind.
    const std::size_t width = line.size();
    if (width < m_width) {
        line.append(m_width - width, ' ');
    }
    m_width = width;
    m_err << '\r' << line << std::flush;
}

void ProgressLine::Finish() {
    if (m_width > 0) {
        m_err << '\r' << std::string(m_width, ' ') << '\r' << std::flush;
        m_width = 0;
    }
}

std::string DurationText(double seconds) {
    const auto s = static_cast<long long>(seconds + 0.5);
    char text[48];
    if (s < 60) {
        std::snprintf(text, sizeof text, "%lld s", s);
    } else if (s < 3600) {
        std::snprintf(text, sizeof text, "%lld min %02lld s", s / 60, s % 60);
    } else {
        std::snprintf(text, sizeof text, "%lld h %02lld min", s / 3600, s / 60 % 60);
    }
    return text;
}

std::string BytesText(uint64 bytes) {
    static const char* const kUnits[] = {"bytes", "KiB", "MiB", "GiB", "TiB"};
    double value = static_cast<double>(bytes);
    std::size_t unit = 0;
    while (value >= 1024 && unit + 1 < std::size(kUnits)) {
        value /= 1024;
        ++unit;
    }
    char text[32];
    if (unit == 0) {
        std::snprintf(text, sizeof text, "%llu bytes", static_cast<unsigned long long>(bytes));
    } else {
        std::snprintf(text, sizeof text, "%.1f %s", value, kUnits[unit]);
    }
    return text;
}

}  // namespace tarn::tool
