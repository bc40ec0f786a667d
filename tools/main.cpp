// offsetops: records offset operations into an on-disk store and inspects
// it. See tools/CommandLine.h for the commands and exit statuses.

#include <csignal>
#include <iostream>

#include "tools/CommandLine.h"

int main(int argc, char** argv) {
    // Output that cannot be written (a closed pipe, a full disk) is reported,
    // not a signal.
    std::signal(SIGPIPE, SIG_IGN);
    int status = tarn::tool::RunOffsetOps(argc, argv, std::cout, std::cerr);
    std::cout.flush();
    if (!std::cout) {
        std::cerr << "offsetops: cannot write the output (a closed pipe or a full disk)\n";
        status = 1;
    }
    return status;
}
