#pragma once

// The subcommands of `offsetops`, callable in-process (tools/CommandLine.cpp
// parses arguments into these structures). Each works through the store's
// API (tnStore/OffsetOpsStore.h) and nothing else of the runtime.
//
// Each command writes its results to `out`, its messages to `err`, and returns
// the process's exit status: 0 on success, 1 when the command failed (bad
// input, a damaged or missing store, a failed validation), 2 for an argument
// that the store at hand cannot take. Errors of the store (RuntimeError)
// propagate to the caller, which reports them, unless a command says
// otherwise.
//
// Stores: `record` is the writer and creates the store on first use; `clear`
// is the writer of an existing store; the read commands (show, export, diff,
// dump, validate, stats) open the store as a reader, beside any writer, and
// `backup` copies its files beside any writer. `diff` keeps diff(1)'s exit
// statuses instead (0 equal, 1 different, 2 trouble).

#include <cstddef>
#include <optional>
#include <ostream>
#include <string>

#include "tnStore/OffsetOpsStore.h"
#include "tools/Generator.h"

namespace tarn::tool {

inline constexpr int64 kDefaultCommitEvery = 10000;

struct RecordCommand {
    std::string store;
    std::string opsFile;                        // "-" is standard input
    std::optional<GeneratorSettings> generate;  // instead of opsFile
    int64 commitEvery = kDefaultCommitEvery;    // a durable point after this many, >= 1
    ssize_t cacheObjects = 0;                   // 0: no bound
    std::size_t journalLimitBytes = StoreOptions{}.journalLimitBytes;
    bool sync = true;       // sync each durable point to disk
    bool progress = false;  // progress lines on `err`
};

// Records the operations in order, with a durable point every `commitEvery`
// of them, and closes the store (a durable point and a checkpoint). On a
// malformed line or a refused operation, everything before it is made
// durable, nothing from it on, and the message names the file, the line and
// how many operations of this run are durable. An error of the store while
// recording ends the run at once (status 1); the store keeps its last durable
// point, and the message says how many operations of this run that holds.
// A cache bound below what the tree needs is refused with status 2. Ends
// with a summary on `out`.
int RunRecord(const RecordCommand& cmd, std::ostream& out, std::ostream& err);

// What `show` prints: one field, every field of one object, the fields of a
// key range, or every field.
struct ShowQuery {
    std::optional<FieldId> field;  // only this field
    std::optional<OID> oid;        // every field of this object
    std::optional<FieldId> from;   // the fields from this one on ...
    std::optional<FieldId> to;     // ... up to and including this one
    int64 limit = -1;              // 0 or more: at most this many fields
};

// Tables in key order, one line each:
//   #12/0a0b --> {(0123abcd-0000-4000-8000-00000000002a,(5,3)),...}
// A field (or object) without a table is reported on `err` (status 1). With
// a limit, the last line says how many fields there are (a whole walk) or
// that more follow (a range).
int RunShow(const std::string& store, const ShowQuery& query, std::ostream& out, std::ostream& err);

// The walks over whole stores (export, diff) keep at most this many tree
// objects in memory unless told otherwise.
inline constexpr ssize_t kDefaultWalkCacheObjects = 4096;

struct WalkSettings {
    ssize_t cacheObjects = kDefaultWalkCacheObjects;  // 0: no bound
    bool progress = false;                            // a progress line on `err`
};

// Every table as ops lines (site,t,oid,path,offset: fields in key order,
// sites in table order) after a comment line, to `outFile` ("" or "-": to
// `out`). Recorded into an empty store, they give equal tables. A file is
// written under a temporary name and renamed when complete.
int RunExport(const std::string& store, const std::string& outFile, const WalkSettings& settings,
              std::ostream& out, std::ostream& err);

// Compares the maps of stores `a` and `b` field by field in key order and
// prints a line for each field that differs:
//   < FIELD --> TABLE            only in a
//   > FIELD --> TABLE            only in b
//   ! FIELD --> TABLE_A TABLE_B  in both, with other tables
// and nothing else (on a terminal, a count follows on `err`). Status 0 when
// the maps are equal, 1 when they differ, 2 on any error (diff(1)'s
// convention).
int RunDiff(const std::string& a, const std::string& b, const WalkSettings& settings,
            std::ostream& out, std::ostream& err);

// A consistent copy of `store` in the new or empty directory `to`, as of
// the latest durable point, made beside a running writer; `compact` leaves
// out free pages.
int RunBackup(const std::string& store, const std::string& to, bool compact, bool progress,
              std::ostream& out, std::ostream& err);

// The tree, node by node.
int RunDump(const std::string& store, std::ostream& out, std::ostream& err);

// The tree's invariants, the map's own validation, and the images no root
// reaches. Status 0 only when all hold.
int RunValidate(const std::string& store, const WalkSettings& settings, std::ostream& out,
                std::ostream& err);

// Each site's newest time stamp, one line each in site order:
//   SITE NEWEST-STAMP
int RunSites(const std::string& store, std::ostream& out, std::ostream& err);

struct MergeCommand {
    std::string store;  // merged into (its one writer)
    std::string from;   // merged from (read beside any writer)
    bool dryRun = false;
    ssize_t cacheObjects = kDefaultWalkCacheObjects;  // for each store; 0: no bound
    int64 commitEvery = 10000;                        // a durable point every K operations
    bool sync = true;
};

// Takes into `store`, for every field and site, the record of `from` whose
// stamp is later; prints each conflict (the same stamp with other sums,
// left as it is in `store`), one line each:
//   ! FIELD SITE (t,o-in-store) (t,o-in-from)
// and nothing else on `out`; a summary follows on `err`. Status 0 when
// merged without conflicts, 1 when there were conflicts (everything else
// merged), 2 on any error.
int RunMerge(const MergeCommand& cmd, std::ostream& out, std::ostream& err);

// Counts of the store, its journal and the tree.
int RunStats(const std::string& store, std::ostream& out, std::ostream& err);

// Rewrites the data file without its free pages, when no other process has
// the store open (status 1 otherwise, nothing changed).
int RunCompact(const std::string& store, std::ostream& out, std::ostream& err);

// Removes every field's table and closes the store (a checkpoint).
int RunClear(const std::string& store, std::ostream& out, std::ostream& err);

}  // namespace tarn::tool
