#pragma once

// SIGINT and SIGTERM ask offsetops to stop. In the commands that have
// something to finish or to remove (record, export, backup), the first one is
// caught and noted; they look at it at their safe points (record before each
// operation, and then makes what it recorded durable; export between fields;
// backup from a thread that watches) and end with status 128 + the signal:
// 130 for SIGINT, 143 for SIGTERM. A second one ends the program at once, as
// the signal does by default, and so does the first in every other command.
//
// A blocking read of standard input is interrupted by the first one (the
// handler is installed without SA_RESTART), so a record waiting on a pipe
// stops too.
//
// Partial files: `export --out FILE` writes FILE.partial-PID and `backup --to
// DIR` builds .DIR.backup-PID beside the target. What a run leaves behind
// when killed outright (SIGKILL, a crash) is removed by the next run for the
// same target once the process that made it is gone.

#include <filesystem>
#include <functional>
#include <memory>
#include <string>

namespace tarn::tool {

// Installs the handler of SIGINT and SIGTERM (by the commands that look).
void CatchStopSignals();

// The signal that asked to stop, or 0.
int StopSignal();

// The exit status for having been stopped by `signal`: 128 + signal.
inline int StoppedStatus(int signal) {
    return 128 + signal;
}

// "SIGINT", "SIGTERM".
std::string SignalName(int signal);

// Removes, beside `target`, the partial files (`prefix` + target's name +
// `suffix` + PID) whose process is gone (kill(pid, 0) fails with ESRCH).
// For export: prefix "", suffix ".partial-"; for backup: prefix ".",
// suffix ".backup-". Never fails: what cannot be removed stays.
void RemoveStalePartials(const std::filesystem::path& target, const std::string& prefix,
                         const std::string& suffix);

// While alive, watches for a stop request from a thread of its own and, on
// one, runs `cleanup` and ends the process with StoppedStatus at once. For
// work that cannot look at StopSignal() itself (a backup's copy).
class StopWatch {
public:
    explicit StopWatch(std::function<void()> cleanup);
    ~StopWatch();
    StopWatch(const StopWatch&) = delete;
    StopWatch& operator=(const StopWatch&) = delete;

private:
    struct State;
    std::unique_ptr<State> m_state;
};

}  // namespace tarn::tool
