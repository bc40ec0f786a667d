#include "tnUtils/FileIo.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace tarn {

ssize_t ReadAt(int fd, void* out, std::size_t size, uint64 offset) {
    auto* bytes = static_cast<char*>(out);
    std::size_t done = 0;
    while (done < size) {
        const ssize_t n = ::pread(fd, bytes + done, size - done, static_cast<off_t>(offset + done));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return -1;
        }
        if (n == 0) {
            break;
        }
        done += static_cast<std::size_t>(n);
    }
    return static_cast<ssize_t>(done);
}

int WriteAt(int fd, const void* bytes, std::size_t size, uint64 offset) {
    const auto* data = static_cast<const char*>(bytes);
    std::size_t done = 0;
    while (done < size) {
        const ssize_t n = ::pwrite(fd, data + done, size - done, static_cast<off_t>(offset + done));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return n < 0 ? errno : EIO;
        }
        done += static_cast<std::size_t>(n);
    }
    return 0;
}

std::string SystemErrorText(int error) {
    if (error == ENOSPC || error == EDQUOT) {
        return "no space left on device";
    }
    return std::strerror(error);
}

}  // namespace tarn
