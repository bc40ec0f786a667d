#pragma once

// Checks of an LMDB store's files made before LMDB maps them, the walk of
// its pages for whole-store validation, and the diagnosis of a failed write.
//
// LMDB maps data.mdb and lock.mdb and trusts what it finds: a page past the
// end of a truncated data.mdb raises SIGBUS when touched, and a lock file
// whose header is damaged is used as it is by an opener that is not alone.
// The checks made at every opening cost a few reads whatever the file's size
// and turn such files into a RuntimeError (or, for a lock file nobody uses, a
// repair) before LMDB sees them. The branch and leaf pages are not read at
// opening: CheckLmdbPages reads them all, for callers that validate a whole
// store or a copy of it. Every message starts with "store '<dir>': ", as
// the store's own do.

#include <optional>
#include <string>

namespace tarn {

// Checks data.mdb in `dir` against its meta pages: both readable and LMDB's,
// a plausible page size, and the file as long as the last commit needs. Reads
// the two meta pages only. A missing data.mdb passes (LMDB makes a new one),
// and so does an empty one alone in the directory for a `writer` (a first
// opening cut short before LMDB wrote the meta pages: LMDB writes them
// again). A reader beside a writer looks again when a commit ends while it
// looks. Throws RuntimeError naming the directory and the fault.
void CheckLmdbDataFile(const std::string& dir, bool writer);

// The checks of CheckLmdbDataFile, then a walk of every branch and leaf page
// of both meta pages' trees (see PageWalk in the .cpp): each page's header
// and nodes within the page, child and overflow page numbers within the file,
// each image's run of overflow pages with a sound first header and
// overlapping no other page, and the newest commit's free-page lists naming
// no page it uses. Reads every branch and leaf page and the first header of
// each run, not the images: a cost in proportion to the number of images. A
// missing or empty data.mdb is a fault. May run beside a writer (it looks
// again when a commit ends while it looks). Throws RuntimeError naming the
// directory and the first fault.
void CheckLmdbPages(const std::string& dir);

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
