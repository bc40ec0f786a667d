#pragma once

// The subcommands of `offsetops`, callable in-process (tests call them
// directly; tools/CommandLine.cpp parses arguments into these structures).
//
// Each command writes its results to `out`, its messages to `err`, and returns
// the process's exit status: 0 on success, 1 when the command failed (bad
// input, a damaged or missing store, a failed validation). Errors the store or
// the runtime raise (RuntimeError) propagate to the caller, which reports them.
//
// Stores: `record` creates the store directory on first use; every other
// command needs an existing store and never creates one. The read commands
// (show, dump, validate, stats) open the store read-only.

#include <optional>
#include <ostream>
#include <string>

#include "tools/Generator.h"
#include "tools/Recorder.h"

namespace tarn::tool {

struct RecordCommand {
    std::string store;
    std::string opsFile;                        // "-" is standard input
    std::optional<GeneratorSettings> generate;  // instead of opsFile
    RecordSettings settings;
    bool sync = true;       // sync each commit to disk
    bool progress = false;  // progress lines on `err`
};

// Records the operations in order. On a malformed line or a refused
// operation, everything before that line is committed, nothing from it on,
// and the message names the file, the line and how many operations of this
// run are committed. An error of the store while recording commits nothing
// more (the operation it interrupted may have half changed the tree in
// memory); its message says how many operations the last commit kept. Ends
// with a summary on `out`.
int RunRecord(const RecordCommand& cmd, std::ostream& out, std::ostream& err);

// Every field's table in key order, one line each, or only `field`'s:
//   #12/0a0b --> {(0123abcd-0000-4000-8000-00000000002a,(5,3)),...}
// A field without a table is reported on `err` (status 1). A `limit` of 0 or
// more prints at most that many fields and then how many there are.
int RunShow(const std::string& store, const std::optional<FieldId>& field, int64 limit,
            std::ostream& out, std::ostream& err);

// The map's dump (FieldIdToOffsetOpsOnInt64FieldMap::Write), after a check
// that the tree can be walked safely.
int RunDump(const std::string& store, std::ostream& out, std::ostream& err);

// The tree's invariants, the map's own Validate, and the images no root
// reaches. Status 0 only when all hold.
int RunValidate(const std::string& store, std::ostream& out, std::ostream& err);

// Counts of the store and the tree.
int RunStats(const std::string& store, std::ostream& out, std::ostream& err);

// Removes every field's table and commits.
int RunClear(const std::string& store, std::ostream& out, std::ostream& err);

}  // namespace tarn::tool
