#include "tools/CommandLine.h"

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <new>

#include "tnUtils/RuntimeError.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

constexpr int kUsageStatus = 2;

const char* kOpsHelp =
    "operations to record, one a line: site,t,oid,path,offset (site a Guid "
    "8-4-4-4-12, t 0..4294967295, oid decimal, path hex, offset signed decimal; "
    "'#' comments); '-' reads standard input";

int Usage(std::ostream& err, const std::string& message) {
    err << "offsetops: " << message << " (see 'offsetops --help')\n";
    return kUsageStatus;
}

}  // namespace

int RunOffsetOps(int argc, const char* const* argv, std::ostream& out, std::ostream& err) {
    CLI::App app{"Records offset operations into an on-disk store and inspects it.", "offsetops"};
    app.require_subcommand(1);

    RecordCommand record;
    GeneratorSettings generate;
    bool noSync = false;
    bool noProgress = false;
    CLI::App* recordCmd = app.add_subcommand(
        "record", "record operations from a file or generated ones; creates the store if needed");
    recordCmd->add_option("--store", record.store, "store directory")->required();
    CLI::Option* opsOpt = recordCmd->add_option("--ops", record.opsFile, kOpsHelp);
    CLI::Option* genOpt =
        recordCmd->add_option("--generate", generate.count, "generate this many operations instead")
            ->check(CLI::NonNegativeNumber);
    opsOpt->excludes(genOpt);
    recordCmd->add_option("--fields", generate.fields, "generated: number of fields")
        ->check(CLI::PositiveNumber)
        ->needs(genOpt);
    recordCmd->add_option("--sites", generate.sites, "generated: number of sites")
        ->check(CLI::Range(int64{1}, int64{1000000}))
        ->needs(genOpt);
    recordCmd->add_option("--seed", generate.seed, "generated: random seed")->needs(genOpt);
    recordCmd
        ->add_option("--commit-every", record.settings.commitEvery,
                     "commit after this many operations (default 10000)")
        ->check(CLI::PositiveNumber);
    recordCmd
        ->add_option("--cache-nodes", record.settings.cacheNodes,
                     "keep at most this many objects in memory (0: no bound)")
        ->check(CLI::NonNegativeNumber);
    recordCmd->add_flag("--no-sync", noSync,
                        "do not sync commits to disk (scratch stores: a machine crash may lose "
                        "the latest commits)");
    recordCmd->add_flag("--no-progress", noProgress, "no progress line on a terminal");

    std::string store;
    std::string fieldText;
    CLI::App* showCmd =
        app.add_subcommand("show", "print one field's table, or every field's in key order");
    showCmd->add_option("--store", store, "store directory")->required();
    showCmd->add_option("--field", fieldText, "the field, OID/PATH (e.g. #12/0a0b)");
    int64 limit = -1;
    showCmd->add_option("--limit", limit, "print at most this many fields, then how many there are")
        ->check(CLI::NonNegativeNumber);
    CLI::App* dumpCmd = app.add_subcommand("dump", "print the map's tree, level by level");
    CLI::App* validateCmd = app.add_subcommand(
        "validate", "check the tree and the store; exit status 0 only when all holds");
    CLI::App* statsCmd = app.add_subcommand("stats", "print counts of the store and the tree");
    CLI::App* clearCmd = app.add_subcommand("clear", "remove every field's table and commit");
    for (CLI::App* cmd : {dumpCmd, validateCmd, statsCmd, clearCmd}) {
        cmd->add_option("--store", store, "store directory")->required();
    }

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        if (e.get_exit_code() == 0) {
            return app.exit(e, out, err);  // --help
        }
        return Usage(err, e.what());
    }

    try {
        if (*recordCmd) {
            if (opsOpt->count() == 0 && genOpt->count() == 0) {
                return Usage(err, "record needs --ops FILE or --generate N");
            }
            if (genOpt->count() != 0) {
                record.generate = generate;
            }
            record.sync = !noSync;
            record.progress = !noProgress && isatty(STDERR_FILENO) != 0;
            return RunRecord(record, out, err);
        }
        if (*showCmd) {
            std::optional<FieldId> field;
            if (!fieldText.empty()) {
                std::string error;
                field = ParseFieldId(fieldText, &error);
                if (!field) {
                    return Usage(err, error);
                }
            }
            return RunShow(store, field, limit, out, err);
        }
        if (*dumpCmd) {
            return RunDump(store, out, err);
        }
        if (*validateCmd) {
            return RunValidate(store, out, err);
        }
        if (*statsCmd) {
            return RunStats(store, out, err);
        }
        return RunClear(store, out, err);
    } catch (const RuntimeError& e) {
        err << "offsetops: " << e.what() << '\n';
    } catch (const std::bad_alloc&) {
        err << "offsetops: out of memory\n";
    } catch (const std::exception& e) {
        err << "offsetops: error: " << e.what() << '\n';
    }
    return 1;
}

}  // namespace tarn::tool
