#pragma once

// A file descriptor owned by one scope: closed when the owner goes away,
// unless released first.

#include <unistd.h>

#include <utility>

namespace tarn {

class UniqueFd {
public:
    explicit UniqueFd(int fd = -1) : m_fd(fd) {}
    ~UniqueFd() {
        if (m_fd >= 0) {
            ::close(m_fd);
        }
    }
    UniqueFd(const UniqueFd&) = delete;
    UniqueFd& operator=(const UniqueFd&) = delete;

    int Get() const { return m_fd; }
    // Hands the descriptor to the caller, who closes it.
    int Release() { return std::exchange(m_fd, -1); }

private:
    int m_fd;
};

}  // namespace tarn
