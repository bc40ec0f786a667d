#pragma once

// Checks of an LMDB store's files made before LMDB maps them, and the
// diagnosis of a failed write.
//
// LMDB maps data.mdb and lock.mdb and trusts what it finds: a page past the
// end of a truncated data.mdb raises SIGBUS when touched, and a lock file
// whose header is damaged is used as it is by an opener that is not alone.
// These checks turn such files into a RuntimeError (or, for a lock file
// nobody uses, a repair) before LMDB sees them. Every message starts with
// "LMDB store '<dir>': ", as the store's own do.

#include <optional>
#include <string>

namespace tarn {

// Checks data.mdb in `dir` against its meta pages: both readable and LMDB's,
// a plausible page size, the file as long as the last commit needs, and the
// branch and leaf pages of both meta pages' trees sound (see PageWalk in the
// .cpp). A missing data.mdb passes (LMDB makes a new one), and so does an
// empty one alone in the directory for a `writer` (a first opening cut short
// before LMDB wrote the meta pages: LMDB writes them again). A writer also checks the pages only
// it uses; a reader beside a writer looks again when a commit ends while it
// looks. Throws RuntimeError naming the directory and the fault.
void CheckLmdbDataFile(const std::string& dir, bool writer);

// Checks lock.mdb in `dir`: long enough for LMDB's lock header and one reader
// slot, with LMDB's magic and lock format and a reader count that fits. A
// damaged lock file that no other process uses (no writer holds the
// directory's flock, and no LMDB environment holds the lock file's own lock)
// is removed, for LMDB to make anew; otherwise throws RuntimeError. Returns
// the repair made, one line: lock.mdb removed as damaged, or found missing
// beside an existing data.mdb. `callerIsWriter`: the caller holds the
// directory's exclusive flock itself.
std::optional<std::string> CheckLmdbLockFile(const std::string& dir, bool callerIsWriter);

// The text for a failed LMDB call of the store in `dir` that returned `rc`
// (LMDB's code or an errno value) with LMDB's text `text`: for EIO or ENOSPC
// on a file system with (nearly) no space left for the caller, "no space left
// on device (<text>)"; otherwise `text`. LMDB reports a write the disk cut
// short as EIO.
std::string LmdbFailureText(const std::string& dir, int rc, const std::string& text);

}  // namespace tarn
