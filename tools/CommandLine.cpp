#include "tools/CommandLine.h"

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <charconv>
#include <map>
#include <new>
#include <vector>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnStore/OffsetOpsStore.h"
#include "tools/Commands.h"

namespace tarn::tool {

namespace {

constexpr int kUsageStatus = 2;

// The largest values the numeric options take.
constexpr uint64 kMaxGenerate = 1'000'000'000'000;
constexpr uint64 kMaxFields = 1'000'000'000;
constexpr uint64 kMaxSites = 1'000'000;
constexpr uint64 kMaxCommitEvery = 1'000'000'000;
constexpr uint64 kMaxCacheNodes = 1'000'000'000;
constexpr uint64 kMaxJournalMiB = uint64{1} << 20;
constexpr uint64 kMaxLimit = INT64_MAX;

const char* kCommands =
    "record, show, export, diff, backup, sites, merge, compact, dump, validate, stats or clear";

const char* kOpsHelp =
    "operations to record, one a line: site,t,oid,path,offset (site a Guid "
    "8-4-4-4-12, t 0..4294967295, oid decimal, path hex, offset signed decimal; "
    "'#' comments); '-' reads standard input";

// Wrong arguments: what is wrong, and whose help says more: the program's
// (""), a command's (its name), or none.
struct UsageError {
    std::string message;
    std::optional<std::string> help = std::nullopt;
};

int Usage(std::ostream& err, const UsageError& e) {
    err << "offsetops: " << e.message;
    if (e.help) {
        err << " (see 'offsetops " << *e.help << (e.help->empty() ? "" : " ") << "--help')";
    }
    err << '\n';
    return kUsageStatus;
}

// A number as the user wrote it: plain when it looks like one, quoted when not.
std::string Given(const std::string& text) {
    const bool integer = !text.empty() &&
                         std::all_of(text.begin() + (text[0] == '-' ? 1 : 0), text.end(),
                                     [](char c) { return c >= '0' && c <= '9'; }) &&
                         text != "-";
    return integer ? text : "'" + text + "'";
}

// A subcommand whose options are all taken as text and checked here, so that
// every message about them is ours.
class Command {
public:
    Command(CLI::App& app, const char* name, const char* help)
        : m_name(name), m_app(app.add_subcommand(name, help)) {
        m_app->allow_extras();
    }

    void Option(const std::string& name, const std::string& type, const std::string& help) {
        // One value an occurrence, every occurrence kept (Text refuses a
        // repeated option).
        m_app->add_option(name, m_values[name], help)
            ->allow_extra_args(false)
            ->expected(1)
            ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll)
            ->type_name(type);
    }
    void Flag(const std::string& name, const std::string& help) {
        m_app->add_flag(name, m_flags[name], help);
    }

    explicit operator bool() const { return static_cast<bool>(*m_app); }
    const std::string& Name() const { return m_name; }
    bool Has(const std::string& name) const { return !m_values.at(name).empty(); }
    bool Flagged(const std::string& name) const { return m_flags.at(name); }

    // Arguments the command does not take.
    void RefuseExtras() const {
        const std::vector<std::string> extras = m_app->remaining();
        if (!extras.empty()) {
            const std::string& first = extras.front();
            throw UsageError{(first.size() > 1 && first[0] == '-' ? "unknown option '"
                                                                  : "unexpected argument '") +
                                 first + "' for " + m_name,
                             m_name};
        }
    }

    // The option's text, if given (once).
    std::optional<std::string> Text(const std::string& name) const {
        const std::vector<std::string>& values = m_values.at(name);
        if (values.size() > 1) {
            throw UsageError{name + " is given " + std::to_string(values.size()) +
                             " times; give it once"};
        }
        return values.empty() ? std::nullopt : std::optional(values.front());
    }

    // The store directory every command needs.
    std::string Store() const {
        std::optional<std::string> dir = Text("--store");
        if (!dir || dir->empty()) {
            throw UsageError{m_name + " needs --store DIR, the store's directory", m_name};
        }
        return *dir;
    }

    // A whole number in decimal digits, from `min` to `max`; `fallback` when
    // the option is not given. `allowed` describes the values for the message.
    uint64 Number(const std::string& name, uint64 min, uint64 max, uint64 fallback,
                  const std::string& allowed = {}) const {
        const std::optional<std::string> text = Text(name);
        if (!text) {
            return fallback;
        }
        uint64 value = 0;
        const char* end = text->data() + text->size();
        const bool digits = !text->empty() && std::all_of(text->begin(), text->end(), [](char c) {
            return c >= '0' && c <= '9';
        });
        if (!digits || std::from_chars(text->data(), end, value).ec != std::errc{} || value < min ||
            value > max) {
            throw UsageError{name + " must be " +
                             (allowed.empty() ? "a whole number from " + std::to_string(min) +
                                                    " to " + std::to_string(max)
                                              : allowed) +
                             ", got " + Given(*text)};
        }
        return value;
    }

private:
    std::string m_name;
    CLI::App* m_app;
    std::map<std::string, std::vector<std::string>> m_values;
    std::map<std::string, bool> m_flags;
};

// The message of what CLI11 itself still refuses: with every option taken as
// text, that is an option without its value, or a flag given one.
UsageError Translate(const CLI::ParseError& e) {
    const std::string what = e.what();
    const std::size_t colon = what.find(':');
    if (dynamic_cast<const CLI::ArgumentMismatch*>(&e) != nullptr && colon != std::string::npos) {
        return {what.substr(0, colon) + " needs a value"};
    }
    // "Could not convert: --no-sync = foo"
    const std::size_t name = what.find("--"), equals = what.find(" = ");
    if (dynamic_cast<const CLI::ConversionError*>(&e) != nullptr && name < equals &&
        equals != std::string::npos) {
        return {what.substr(name, equals - name) + " is a flag and takes no value"};
    }
    return {what, ""};
}

bool ProgressWanted(const Command& cmd) {
    return !cmd.Flagged("--no-progress") && isatty(STDERR_FILENO) != 0;
}

WalkSettings WalkSettingsOf(const Command& cmd) {
    WalkSettings settings;
    settings.cacheObjects = static_cast<ssize_t>(cmd.Number(
        "--cache-nodes", 0, kMaxCacheNodes, static_cast<uint64>(kDefaultWalkCacheObjects),
        "0 (no bound) or a whole number up to " + std::to_string(kMaxCacheNodes)));
    settings.progress = ProgressWanted(cmd);
    return settings;
}

std::optional<FieldId> FieldOption(const Command& cmd, const std::string& name) {
    const std::optional<std::string> text = cmd.Text(name);
    if (!text) {
        return std::nullopt;
    }
    std::string error;
    std::optional<FieldId> field = ParseFieldId(*text, &error);
    if (!field) {
        throw UsageError{name + ": " + error};
    }
    return field;
}

ShowQuery ShowQueryOf(const Command& show) {
    ShowQuery query;
    query.field = FieldOption(show, "--field");
    query.from = FieldOption(show, "--from");
    query.to = FieldOption(show, "--to");
    if (show.Has("--oid")) {
        query.oid = OID(Seid(show.Number("--oid", 1, UINT64_MAX, 0)));
    }
    const int given =
        (query.field ? 1 : 0) + (query.oid ? 1 : 0) + (query.from || query.to ? 1 : 0);
    if (given > 1) {
        throw UsageError{"show takes one of --field, --oid, or --from/--to", "show"};
    }
    if (query.from && query.to && CompareKeys(*query.from, *query.to) > 0) {
        throw UsageError{"--from " + ToString(*query.from) + " comes after --to " +
                         ToString(*query.to)};
    }
    if (show.Has("--limit")) {  // with --field: one field at most anyway
        query.limit = static_cast<int64>(show.Number("--limit", 0, kMaxLimit, 0));
    }
    return query;
}

}  // namespace

int RunOffsetOps(int argc, const char* const* argv, std::ostream& out, std::ostream& err) {
    CLI::App app{"Records offset operations into an on-disk store and inspects it.", "offsetops"};
    app.allow_extras();
    app.require_subcommand(0, 1);

    Command record(app, "record",
                   "record operations from a file or generated ones; creates the store if needed");
    record.Option("--store", "DIR", "store directory");
    record.Option("--ops", "FILE", kOpsHelp);
    record.Option("--generate", "N",
                  "generate N operations instead (0 to " + std::to_string(kMaxGenerate) + ")");
    record.Option("--fields", "F",
                  "generated: over F fields (1 to " + std::to_string(kMaxFields) + ", default " +
                      std::to_string(GeneratorSettings{}.fields) + ")");
    record.Option("--sites", "S",
                  "generated: from S sites (1 to " + std::to_string(kMaxSites) + ", default " +
                      std::to_string(GeneratorSettings{}.sites) + ")");
    record.Option("--seed", "X",
                  "generated: random seed (0 to " + std::to_string(UINT64_MAX) + ", default " +
                      std::to_string(GeneratorSettings{}.seed) + ")");
    record.Option("--commit-every", "K",
                  "a durable point after every K operations (1 to " +
                      std::to_string(kMaxCommitEvery) + ", default " +
                      std::to_string(kDefaultCommitEvery) + ")");
    record.Option("--cache-nodes", "C",
                  "keep at most C tree objects in memory at durable points (0: no bound, the "
                  "default; at most " +
                      std::to_string(kMaxCacheNodes) + ")");
    const uint64 defaultJournalMiB = StoreOptions{}.journalLimitBytes >> 20;
    record.Option("--journal-limit", "MIB",
                  "checkpoint once the journal has grown past MIB mebibytes (0: at every durable "
                  "point; at most " +
                      std::to_string(kMaxJournalMiB) + ", default " +
                      std::to_string(defaultJournalMiB) + ")");
    record.Flag("--no-sync",
                "do not sync durable points to disk (scratch stores: a machine crash may lose "
                "the latest ones)");
    record.Flag("--no-progress", "no progress line on a terminal");

    Command show(app, "show",
                 "print one field's table, one object's, a range of fields', or every field's in "
                 "key order");
    show.Option("--store", "DIR", "store directory");
    show.Option("--field", "OID/PATH", "only this field (e.g. #12/0a0b)");
    show.Option("--oid", "N", "every field of object N");
    show.Option("--from", "OID/PATH", "the fields from this one on, in key order");
    show.Option("--to", "OID/PATH", "the fields up to and including this one");
    show.Option("--limit", "N", "print at most N fields, then how many there are");

    const std::string walkCache = "keep at most C tree objects in memory (0: no bound; default " +
                                  std::to_string(kDefaultWalkCacheObjects) + ")";
    Command exportCmd(app, "export",
                      "print every table as ops lines, which 'record --ops' loads back");
    exportCmd.Option("--store", "DIR", "store directory");
    exportCmd.Option("--out", "FILE",
                     "write to FILE (made under a temporary name, then renamed) "
                     "instead of standard output");
    exportCmd.Option("--cache-nodes", "C", walkCache);
    exportCmd.Flag("--no-progress", "no progress line on a terminal");

    Command diff(app, "diff",
                 "print the fields whose tables two stores do not agree on; exit status 0 when "
                 "the maps are equal, 1 when they differ, 2 on errors");
    diff.Option("--store", "A", "the first store's directory");
    diff.Option("--with", "B", "the second store's directory");
    diff.Option("--cache-nodes", "C", walkCache + ", per store");
    diff.Flag("--no-progress", "no progress line on a terminal");

    Command backup(app, "backup",
                   "copy a store, consistent as of its latest durable point, beside a running "
                   "record");
    backup.Option("--store", "DIR", "the store to copy");
    backup.Option("--to", "DIR", "the copy's directory: must not exist, or be empty");
    backup.Flag("--compact", "leave out free pages: the copy is as small as its contents");
    backup.Flag("--no-progress", "no progress line on a terminal");
    Command sites(app, "sites",
                  "print each site's newest time stamp: what the store has seen of each site");
    sites.Option("--store", "DIR", "store directory");
    Command merge(app, "merge",
                  "take another replica's records wherever its time stamps are later; exit "
                  "status 0 when merged, 1 when there were conflicts (left as they were), 2 on "
                  "errors");
    merge.Option("--store", "A", "the store merged into (its writer)");
    merge.Option("--from", "B", "the store merged from (read beside any writer of it)");
    merge.Flag("--dry-run", "print the conflicts and what would be taken; change nothing");
    merge.Option("--cache-nodes", "C", walkCache + ", per store");
    merge.Option("--commit-every", "K",
                 "a durable point after every K merged operations (1 to " +
                     std::to_string(kMaxCommitEvery) + ", default 10000)");
    merge.Flag("--no-sync", "do not sync durable points to disk (scratch stores)");
    Command compact(app, "compact",
                    "rewrite the data file without its free pages (no other process may have "
                    "the store open)");
    compact.Option("--store", "DIR", "store directory");
    Command dump(app, "dump", "print the map's tree, node by node");
    Command validate(app, "validate",
                     "check the tree and the store; exit status 0 only when all holds");
    Command stats(app, "stats", "print counts of the store, its journal and the tree");
    Command clear(app, "clear", "remove every field's table");
    for (Command* cmd : {&dump, &validate, &stats, &clear}) {
        cmd->Option("--store", "DIR", "store directory");
    }
    validate.Option("--cache-nodes", "C", walkCache);
    validate.Flag("--no-progress",
                  "accepted for symmetry with the other walks; validate shows none");

    try {
        try {
            app.parse(argc, argv);
        } catch (const CLI::ParseError& e) {
            if (e.get_exit_code() == 0) {
                return app.exit(e, out, err);  // --help
            }
            throw Translate(e);
        }
        const std::vector<std::string> extras = app.remaining();
        if (!extras.empty()) {
            const std::string& first = extras.front();
            throw UsageError{first.size() > 1 && first[0] == '-'
                                 ? "unknown option '" + first + "': options follow the command"
                                 : "unknown command '" + first + "': use " + kCommands,
                             ""};
        }
        if (app.get_subcommands().empty()) {
            throw UsageError{std::string("a command is needed: ") + kCommands, ""};
        }
        for (const Command* cmd : {&record, &show, &exportCmd, &diff, &backup, &sites, &merge,
                                   &compact, &dump, &validate, &stats, &clear}) {
            if (*cmd) {
                cmd->RefuseExtras();
            }
        }
    } catch (const UsageError& e) {
        return Usage(err, e);
    }

    try {
        if (record) {
            RecordCommand cmd;
            cmd.store = record.Store();
            const bool generate = record.Has("--generate");
            if (generate == record.Has("--ops")) {
                throw UsageError{generate ? "record takes --ops FILE or --generate N, not both"
                                          : "record needs --ops FILE or --generate N",
                                 "record"};
            }
            if (generate) {
                GeneratorSettings settings;
                settings.count =
                    static_cast<int64>(record.Number("--generate", 0, kMaxGenerate, 0));
                settings.fields = static_cast<int64>(
                    record.Number("--fields", 1, kMaxFields, static_cast<uint64>(settings.fields)));
                settings.sites = static_cast<int64>(
                    record.Number("--sites", 1, kMaxSites, static_cast<uint64>(settings.sites)));
                settings.seed = record.Number("--seed", 0, UINT64_MAX, settings.seed);
                cmd.generate = settings;
            } else {
                cmd.opsFile = *record.Text("--ops");
                if (cmd.opsFile.empty()) {
                    throw UsageError{"--ops needs a file name, or '-' for standard input"};
                }
                for (const char* option : {"--fields", "--sites", "--seed"}) {
                    if (record.Has(option)) {
                        throw UsageError{std::string(option) +
                                         " goes with --generate: it shapes generated operations"};
                    }
                }
            }
            cmd.commitEvery = static_cast<int64>(record.Number(
                "--commit-every", 1, kMaxCommitEvery, static_cast<uint64>(kDefaultCommitEvery)));
            cmd.cacheObjects = static_cast<ssize_t>(record.Number(
                "--cache-nodes", 0, kMaxCacheNodes, 0,
                "0 (no bound) or a whole number up to " + std::to_string(kMaxCacheNodes)));
            cmd.journalLimitBytes = static_cast<std::size_t>(record.Number(
                                        "--journal-limit", 0, kMaxJournalMiB, defaultJournalMiB))
                                    << 20;
            cmd.sync = !record.Flagged("--no-sync");
            cmd.progress = !record.Flagged("--no-progress") && isatty(STDERR_FILENO) != 0;
            return RunRecord(cmd, out, err);
        }
        if (show) {
            return RunShow(show.Store(), ShowQueryOf(show), out, err);
        }
        if (exportCmd) {
            const std::string store = exportCmd.Store();
            const std::string file = exportCmd.Text("--out").value_or("");
            if (exportCmd.Has("--out") && file.empty()) {
                throw UsageError{"--out needs a file name, or '-' for standard output"};
            }
            return RunExport(store, file, WalkSettingsOf(exportCmd), out, err);
        }
        if (diff) {
            const std::string a = diff.Store();
            const std::optional<std::string> b = diff.Text("--with");
            if (!b || b->empty()) {
                throw UsageError{"diff needs --with B, the directory of the store to compare with",
                                 "diff"};
            }
            return RunDiff(a, *b, WalkSettingsOf(diff), out, err);
        }
        if (backup) {
            const std::string store = backup.Store();
            const std::optional<std::string> to = backup.Text("--to");
            if (!to || to->empty()) {
                throw UsageError{"backup needs --to DIR, the copy's directory", "backup"};
            }
            return RunBackup(store, *to, backup.Flagged("--compact"), ProgressWanted(backup), out,
                             err);
        }
        if (sites) {
            return RunSites(sites.Store(), out, err);
        }
        if (merge) {
            MergeCommand cmd;
            cmd.store = merge.Store();
            const std::optional<std::string> from = merge.Text("--from");
            if (!from || from->empty()) {
                throw UsageError{"merge needs --from B, the directory of the store to merge from",
                                 "merge"};
            }
            cmd.from = *from;
            cmd.dryRun = merge.Flagged("--dry-run");
            cmd.cacheObjects = static_cast<ssize_t>(merge.Number(
                "--cache-nodes", 0, kMaxCacheNodes, static_cast<uint64>(kDefaultWalkCacheObjects),
                "0 (no bound) or a whole number up to " + std::to_string(kMaxCacheNodes)));
            cmd.commitEvery =
                static_cast<int64>(merge.Number("--commit-every", 1, kMaxCommitEvery, 10000));
            cmd.sync = !merge.Flagged("--no-sync");
            return RunMerge(cmd, out, err);
        }
        if (compact) {
            return RunCompact(compact.Store(), out, err);
        }
        if (dump) {
            return RunDump(dump.Store(), out, err);
        }
        if (validate) {
            return RunValidate(validate.Store(), WalkSettingsOf(validate), out, err);
        }
        if (stats) {
            return RunStats(stats.Store(), out, err);
        }
        return RunClear(clear.Store(), out, err);
    } catch (const UsageError& e) {
        return Usage(err, e);
    } catch (const RuntimeError& e) {
        err << "offsetops: " << e.what() << '\n';
    } catch (const std::bad_alloc&) {
        err << "offsetops: out of memory\n";
    } catch (const std::exception& e) {
        err << "offsetops: error: " << e.what() << '\n';
    }
    return diff || merge ? 2 : 1;  // diff(1)'s convention: 1 means "they differ"
}

}  // namespace tarn::tool
