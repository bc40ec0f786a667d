#pragma once

// The commands of `offsetops` as a table: each command's name, usage,
// summary, options and the function that runs it. The parser, `help`, the
// suggestions for near misses, the man page's and the completion's lists
// all follow the table (tools/offsetops.1 and tools/offsetops.bash-completion
// are checked against it by the tests).

#include <cstddef>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "tnOperation/FieldId.h"
#include "tnUtils/Types.h"
#include "tools/Report.h"

namespace tarn::tool {

// Exit statuses.
inline constexpr int kFailed = 1;
inline constexpr int kUsageStatus = 2;

// Wrong arguments: what is wrong, and whose help says more: the program's
// (""), a command's (its name), or none.
struct UsageError {
    std::string message;
    std::optional<std::string> help = std::nullopt;
};

struct OptionDecl {
    std::string name;   // "--store"
    std::string value;  // what it takes ("DIR"); empty for a flag
    std::string help;
    bool IsFlag() const { return value.empty(); }
};

class Arguments;

// Where a command writes: results to `out`, messages to `err`.
struct Io {
    std::ostream& out;
    std::ostream& err;
};

struct CommandDecl {
    std::string name;
    std::string usage;    // after "offsetops NAME "
    std::string summary;  // one line
    std::vector<OptionDecl> options;
    int (*run)(const Arguments& args, Io& io) = nullptr;
    // The status of a failure: 1, or 2 for the commands whose 1 means
    // something else (diff: the stores differ; merge: conflicts).
    int failureStatus = kFailed;

    const OptionDecl* Option(std::string_view name) const;
};

// Every command, in the order help lists them.
const std::vector<CommandDecl>& Commands();
const CommandDecl* FindCommand(std::string_view name);

// The options several commands share.
OptionDecl StoreOption(const std::string& help = "the store's directory");
OptionDecl CacheOption(const std::string& extra = "");
OptionDecl FormatOption();
OptionDecl NoProgressOption();

// The largest cache bound any command takes.
inline constexpr uint64 kMaxCacheNodes = 1'000'000'000;
// The walks over whole stores keep at most this many tree objects in memory
// unless told otherwise.
inline constexpr uint64 kDefaultWalkCacheObjects = 4096;

// A command's arguments, parsed: every option's values as text, checked
// when a command asks for them, so that every message about them is ours.
class Arguments {
public:
    // Throws UsageError for an option the command does not take, one without
    // its value, a flag given one, or an argument that is no option.
    Arguments(const CommandDecl& command, const std::vector<std::string>& args);

    const CommandDecl& Command() const { return *m_command; }
    bool HelpAsked() const { return m_help; }

    bool Has(std::string_view option) const;
    bool Flag(std::string_view option) const;
    // The option's text, if given (once; twice is a UsageError).
    std::optional<std::string> Text(std::string_view option) const;
    // The option's text, which must be given and not empty; `what` says
    // what it names ("the store's directory").
    std::string Required(std::string_view option, std::string_view what) const;
    // --store DIR, which every command needs.
    std::string Store() const { return Required("--store", "the store's directory"); }
    // A whole number in decimal digits from `min` to `max`; `fallback` when
    // the option is not given. `allowed` describes the values for the message.
    uint64 Number(std::string_view option, uint64 min, uint64 max, uint64 fallback,
                  const std::string& allowed = {}) const;
    // --cache-nodes C: 0 (no bound) up to kMaxCacheNodes.
    ssize_t CacheNodes(uint64 fallback) const;
    // A field key in its text form.
    std::optional<FieldId> Field(std::string_view option) const;
    // --format text|json|csv (text when not given).
    Format OutputFormat() const;
    // A progress line: standard error is a terminal and --no-progress is not given.
    bool Progress() const;

private:
    const CommandDecl* m_command;
    std::vector<std::pair<std::string, std::string>> m_values;  // option, value
    std::vector<std::string> m_flags;
    bool m_help = false;
};

// The candidate nearest to `given` by edit distance (a letter changed, added,
// dropped, or two swapped), if it is near enough to be a likely slip.
std::optional<std::string> Suggestion(std::string_view given,
                                      const std::vector<std::string>& candidates);

// The program's help (command null) or a command's.
void PrintHelp(std::ostream& out, const CommandDecl* command);

// "offsetops 0.2.0".
std::string VersionText();

}  // namespace tarn::tool
