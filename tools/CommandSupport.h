#pragma once

// What the commands of `offsetops` share: messages, opening a store, and
// the walks of the streaming commands.

#include <optional>
#include <ostream>
#include <string>

#include "tnStore/OffsetOpsStore.h"

namespace tarn::tool {

// Writes "offsetops: <message>" and returns 1.
int Fail(std::ostream& err, const std::string& message);

// "12 (10 leaves, 2 internal)".
std::string NodesText(const StoreStatistics& stats);

// Throws RuntimeError (NotFound) when nothing is at `dir`, saying so in the
// program's words.
void RequireStore(const std::string& dir);

// Opens the store and says on `err` what opening repaired. A store that is
// not there (for any mode but Write, which creates it) is a RuntimeError
// that says so in the program's words.
OffsetOpsStore OpenAndReport(const std::string& dir, const StoreOptions& options,
                             std::ostream& err);
OffsetOpsStore OpenAndReport(const std::string& dir, StoreMode mode, std::ostream& err);

// Refuses (RuntimeError) a tree that a walk over all of it could not take
// safely; the store refuses to walk one too, this says so before anything
// happens.
void RequireTreeCheckPasses(OffsetOpsStore& store);

// "--cache-nodes B is too small: a tree of height H needs at least N objects
// in memory".
std::string CacheTooSmall(ssize_t bound, ssize_t height);

// Opens a store as a reader for a walk over all of it within `cacheObjects`
// tree objects in memory (0: no bound); throws RuntimeError for a damaged
// tree, which the store refuses to walk. Returns nothing,
// having said why on `err`, when the bound is too small for the tree.
std::optional<OffsetOpsStore> OpenForWalk(const std::string& dir, ssize_t cacheObjects,
                                          std::ostream& err);

// `text` as one word of a shell command line: as it is when it needs no
// quoting, in single quotes otherwise.
std::string ShellWord(const std::string& text);

// Reports that writing the results failed: nothing when standard output is
// a closed pipe (the program then ends quietly), a message otherwise.
// Returns `status`.
int OutputFailed(std::ostream& err, int status);

}  // namespace tarn::tool
