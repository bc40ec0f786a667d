#include "tools/Interrupt.h"

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <mutex>
#include <thread>

namespace tarn::tool {

namespace {

namespace fs = std::filesystem;

volatile std::sig_atomic_t g_stopSignal = 0;

void OnStopSignal(int signal) {
    g_stopSignal = signal;
}

}  // namespace

void CatchStopSignals() {
    struct sigaction action {};
    action.sa_handler = OnStopSignal;
    sigemptyset(&action.sa_mask);
    // No SA_RESTART: a blocking read returns, so that the reader can look.
    // SA_RESETHAND: the next signal does what it does by default.
    action.sa_flags = SA_RESETHAND;
    ::sigaction(SIGINT, &action, nullptr);
    ::sigaction(SIGTERM, &action, nullptr);
}

int StopSignal() {
    return g_stopSignal;
}

std::string SignalName(int signal) {
    switch (signal) {
        case SIGINT:
            return "SIGINT";
        case SIGTERM:
            return "SIGTERM";
        default:
            return "signal " + std::to_string(signal);
    }
}

void RemoveStalePartials(const fs::path& target, const std::string& prefix,
                         const std::string& suffix) {
    const fs::path dir = target.has_parent_path() ? target.parent_path() : fs::path(".");
    const std::string stem = prefix + target.filename().string() + suffix;
    std::error_code ec;
    for (fs::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
        const std::string name = it->path().filename().string();
        if (!name.starts_with(stem) || name.size() == stem.size()) {
            continue;
        }
        const std::string_view digits = std::string_view(name).substr(stem.size());
        pid_t pid = 0;
        const auto [last, parsed] =
            std::from_chars(digits.data(), digits.data() + digits.size(), pid);
        if (parsed != std::errc{} || last != digits.data() + digits.size() || pid <= 0 ||
            pid == ::getpid()) {
            continue;
        }
        if (::kill(pid, 0) != 0 && errno == ESRCH) {
            std::error_code ignored;
            fs::remove_all(it->path(), ignored);
        }
    }
}

struct StopWatch::State {
    std::function<void()> cleanup;
    std::mutex mutex;
    std::condition_variable wake;
    bool done = false;
    std::thread thread;
};

StopWatch::StopWatch(std::function<void()> cleanup) : m_state(std::make_unique<State>()) {
    m_state->cleanup = std::move(cleanup);
    m_state->thread = std::thread([state = m_state.get()] {
        std::unique_lock lock(state->mutex);
        while (!state->wake.wait_for(lock, std::chrono::milliseconds(20),
                                     [state] { return state->done; })) {
            if (const int signal = StopSignal()) {
                state->cleanup();
                ::_exit(StoppedStatus(signal));
            }
        }
    });
}

StopWatch::~StopWatch() {
    {
        std::lock_guard lock(m_state->mutex);
        m_state->done = true;
    }
    m_state->wake.notify_one();
    m_state->thread.join();
}

}  // namespace tarn::tool
