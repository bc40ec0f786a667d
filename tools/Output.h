#pragma once

// Small things of the program's output beside the formats (tools/Report.h):
// counted nouns, and telling a closed pipe from a failed write.

#include <string>
#include <string_view>

#include "tnUtils/Types.h"

namespace tarn::tool {

// "1 operation", "3 operations".
std::string Counted(int64 n, std::string_view one, std::string_view many);

// True when standard output is a pipe whose reader has gone: a program that
// stops reading (`offsetops show | head -1`) ends ours quietly.
bool StandardOutputClosed();

}  // namespace tarn::tool
