#pragma once

// The command line of `offsetops`: parses the arguments, runs the subcommand
// (tools/Commands.h) and turns every error into one line on `err` and a
// non-zero status. Never lets an exception out.
//
// Exit status: 0 success (and --help); 1 a failed command (bad input,
// missing or damaged store, failed validation, an error of the store);
// 2 wrong arguments.

#include <ostream>

namespace tarn::tool {

int RunOffsetOps(int argc, const char* const* argv, std::ostream& out, std::ostream& err);

}  // namespace tarn::tool
