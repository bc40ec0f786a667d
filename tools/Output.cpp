#include "tools/Output.h"

#include <poll.h>
#include <unistd.h>

namespace tarn::tool {

std::string Counted(int64 n, std::string_view one, std::string_view many) {
    return std::to_string(n) + " " + std::string(n == 1 ? one : many);
}

bool StandardOutputClosed() {
    pollfd fd{STDOUT_FILENO, POLLOUT, 0};
    return ::poll(&fd, 1, 0) == 1 && (fd.revents & POLLERR) != 0;
}

}  // namespace tarn::tool
