// offsetops: records offset operations into an on-disk store and inspects
// it. See tools/CommandLine.h for the commands and exit statuses.

#include <csignal>
#include <iostream>

#include "tools/CommandLine.h"
#include "tools/Output.h"

int main(int argc, char** argv) {
    // A write to a closed pipe fails instead of killing the program in the
    // middle of its work (a merge, say); the program ends quietly below.
    std::signal(SIGPIPE, SIG_IGN);
    int status = tarn::tool::RunOffsetOps(argc, argv, std::cout, std::cerr);
    std::cout.flush();
    if (tarn::tool::StandardOutputClosed()) {
        // The reader has gone (`offsetops show | head -1`): end as a
        // program writing to it would, by SIGPIPE, with nothing said.
        std::signal(SIGPIPE, SIG_DFL);
        std::raise(SIGPIPE);
    }
    if (!std::cout) {
        std::cerr << "offsetops: cannot write the output (a full disk?)\n";
        status = status == 0 ? 1 : status;
    }
    return status;
}
