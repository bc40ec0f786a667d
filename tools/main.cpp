// offsetops: records offset operations into an on-disk store and inspects
// it. See tools/CommandLine.h for the commands and exit statuses.

#include <iostream>

#include "tools/CommandLine.h"

int main(int argc, char** argv) {
    const int status = tarn::tool::RunOffsetOps(argc, argv, std::cout, std::cerr);
    std::cout.flush();
    return status;
}
