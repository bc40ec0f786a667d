#pragma once

// The commands of `offsetops`, one file each (tools/RecordCommand.cpp,
// tools/ShowCommand.cpp, ...). Each gives its row of the command table
// (tools/CommandTable.h): its name, usage, options, and the function that
// runs it through the store's API (tnStore/OffsetOpsStore.h) and nothing else
// of the runtime.
//
// A command writes its results to standard output (its reports, in the
// format of --format where it takes one, through tools/Report.h), its
// messages to standard error, and returns the exit status: 0 on success, 1
// when it failed (bad input, a damaged, missing or busy store, a failed
// validation), 2 for an argument the store at hand cannot take (a
// --cache-nodes bound too small for its tree; validate fails with 1 there
// too); diff and merge keep 1 for their own meaning and fail with 2. Errors
// of the store (RuntimeError) and wrong arguments (UsageError) propagate to
// the caller, which reports them.
//
// Stores: `record` is the writer and creates the store on first use;
// `clear`, `merge` and `compact` are the writers of an existing store; the
// read commands (show, export, diff, dump, validate, stats, sites) open the
// store as a reader, beside any writer, and `backup` copies its files beside
// any writer.

#include "tools/CommandTable.h"
#include "tools/Output.h"
#include "tools/Report.h"

namespace tarn::tool {

CommandDecl RecordCommand();
CommandDecl ShowCommand();
CommandDecl ExportCommand();
CommandDecl DiffCommand();
CommandDecl BackupCommand();
CommandDecl SitesCommand();
CommandDecl MergeCommand();
CommandDecl CompactCommand();
CommandDecl DumpCommand();
CommandDecl ValidateCommand();
CommandDecl StatsCommand();
CommandDecl ClearCommand();

}  // namespace tarn::tool
