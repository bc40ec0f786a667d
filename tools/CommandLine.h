#pragma once

// The command line of `offsetops`: finds the command in the table
// (tools/CommandTable.h), parses its arguments, runs it and turns every
// error into one line on `err` and a non-zero status. Never lets an
// exception out.
//
// Exit status: 0 success (and help, --version); 1 a failed command (bad
// input, missing or damaged store, failed validation, an error of the
// store); 2 wrong arguments; diff and merge: 1 for their own meaning, 2 for
// any error; 130 or 143 when stopped by SIGINT or SIGTERM.

#include <ostream>

namespace tarn::tool {

int RunOffsetOps(int argc, const char* const* argv, std::ostream& out, std::ostream& err);

}  // namespace tarn::tool
