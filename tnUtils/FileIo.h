#pragma once

// Whole reads and writes at a file offset, and the text of a system error,
// for the code that handles files by descriptor.

#include <sys/types.h>

#include <cstddef>
#include <string>

#include "tnUtils/Types.h"

namespace tarn {

// Reads `size` bytes at `offset` into `out`, going on after short and
// interrupted reads. Returns the bytes read, fewer than `size` only where
// the file ends, or -1 with errno set when reading fails.
ssize_t ReadAt(int fd, void* out, std::size_t size, uint64 offset);

// Writes all `size` bytes at `offset`, going on after short and interrupted
// writes. Returns 0, or the errno of the failure (EIO for a write that made
// no progress).
int WriteAt(int fd, const void* bytes, std::size_t size, uint64 offset);

// The text of an errno value; a full disk or an exhausted quota reads "no
// space left on device".
std::string SystemErrorText(int error);

}  // namespace tarn
