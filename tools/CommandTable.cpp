#include "tools/CommandTable.h"

#include <unistd.h>

#include <algorithm>
#include <charconv>

#include "tnStore/FieldIdText.h"
#include "tools/Commands.h"

namespace tarn::tool {

const OptionDecl* CommandDecl::Option(std::string_view name) const {
    for (const OptionDecl& option : options) {
        if (option.name == name) {
            return &option;
        }
    }
    return nullptr;
}

const std::vector<CommandDecl>& Commands() {
    static const std::vector<CommandDecl> table = {
        RecordCommand(), ShowCommand(),     ExportCommand(), DiffCommand(),
        BackupCommand(), SitesCommand(),    MergeCommand(),  CompactCommand(),
        DumpCommand(),   ValidateCommand(), StatsCommand(),  ClearCommand(),
    };
    return table;
}

const CommandDecl* FindCommand(std::string_view name) {
    for (const CommandDecl& command : Commands()) {
        if (command.name == name) {
            return &command;
        }
    }
    return nullptr;
}

OptionDecl StoreOption(const std::string& help) {
    return {"--store", "DIR", help};
}

OptionDecl CacheOption(const std::string& extra) {
    return {"--cache-nodes", "C",
            "keep at most C tree objects in memory (0: no bound; default " +
                std::to_string(kDefaultWalkCacheObjects) + ")" + extra};
}

OptionDecl FormatOption() {
    return {"--format", "FORMAT", "text (the default), json (one document) or csv"};
}

OptionDecl NoProgressOption() {
    return {"--no-progress", "", "no progress line on a terminal"};
}

namespace {

std::string Given(const std::string& text) {
    const bool integer = !text.empty() && text != "-" &&
                         std::all_of(text.begin() + (text[0] == '-' ? 1 : 0), text.end(),
                                     [](char c) { return c >= '0' && c <= '9'; });
    return integer ? text : "'" + text + "'";
}

// Optimal string alignment distance: changes, additions, removals and swaps
// of two neighbours, one each.
std::size_t EditDistance(std::string_view a, std::string_view b) {
    std::vector<std::vector<std::size_t>> d(a.size() + 1, std::vector<std::size_t>(b.size() + 1));
    for (std::size_t i = 0; i <= a.size(); ++i) {
        d[i][0] = i;
    }
    for (std::size_t j = 0; j <= b.size(); ++j) {
        d[0][j] = j;
    }
    for (std::size_t i = 1; i <= a.size(); ++i) {
        for (std::size_t j = 1; j <= b.size(); ++j) {
            const std::size_t change = a[i - 1] == b[j - 1] ? 0 : 1;
            d[i][j] = std::min({d[i - 1][j] + 1, d[i][j - 1] + 1, d[i - 1][j - 1] + change});
            if (i > 1 && j > 1 && a[i - 1] == b[j - 2] && a[i - 2] == b[j - 1]) {
                d[i][j] = std::min(d[i][j], d[i - 2][j - 2] + 1);
            }
        }
    }
    return d[a.size()][b.size()];
}

}  // namespace

std::optional<std::string> Suggestion(std::string_view given,
                                      const std::vector<std::string>& candidates) {
    // Options are compared without their dashes.
    auto bare = [](std::string_view s) {
        while (s.starts_with('-')) {
            s.remove_prefix(1);
        }
        return s;
    };
    const std::string_view word = bare(given);
    std::optional<std::string> best;
    std::size_t bestDistance = 0;
    for (const std::string& candidate : candidates) {
        const std::size_t distance = EditDistance(word, bare(candidate));
        // One slip in a short word, two in a longer one; never the whole word.
        const std::size_t allowed = word.size() <= 4 ? 1 : 2;
        if (distance <= allowed && distance < word.size() && (!best || distance < bestDistance)) {
            best = candidate;
            bestDistance = distance;
        }
    }
    return best;
}

Arguments::Arguments(const CommandDecl& command, const std::vector<std::string>& args)
    : m_command(&command) {
    const std::string& name = command.name;
    for (std::size_t i = 0; i < args.size(); ++i) {
        const std::string& arg = args[i];
        if (arg == "--help" || arg == "-h") {
            m_help = true;
            continue;
        }
        const bool looksLikeOption = arg.size() > 1 && arg[0] == '-';
        if (!looksLikeOption) {
            throw UsageError{"unexpected argument '" + arg + "' for " + name, name};
        }
        const std::size_t equals = arg.find('=');
        const std::string option = arg.substr(0, equals);
        const OptionDecl* declared = command.Option(option);
        if (declared == nullptr) {
            std::vector<std::string> names;
            for (const OptionDecl& o : command.options) {
                names.push_back(o.name);
            }
            const std::optional<std::string> near = Suggestion(option, names);
            throw UsageError{"unknown option '" + option + "' for " + name +
                                 (near ? ": did you mean '" + *near + "'?" : std::string()),
                             name};
        }
        if (declared->IsFlag()) {
            if (equals != std::string::npos) {
                throw UsageError{option + " is a flag and takes no value"};
            }
            m_flags.push_back(option);
            continue;
        }
        if (equals != std::string::npos) {
            m_values.emplace_back(option, arg.substr(equals + 1));
        } else if (i + 1 < args.size() &&
                   !(args[i + 1].starts_with("--") && args[i + 1].size() > 2)) {
            m_values.emplace_back(option, args[++i]);
        } else {
            throw UsageError{option + " needs a value (" + declared->value + ")", name};
        }
    }
}

bool Arguments::Has(std::string_view option) const {
    return std::any_of(m_values.begin(), m_values.end(),
                       [&](const auto& v) { return v.first == option; });
}

bool Arguments::Flag(std::string_view option) const {
    return std::find(m_flags.begin(), m_flags.end(), option) != m_flags.end();
}

std::optional<std::string> Arguments::Text(std::string_view option) const {
    std::optional<std::string> text;
    int times = 0;
    for (const auto& [name, value] : m_values) {
        if (name == option) {
            text = value;
            ++times;
        }
    }
    if (times > 1) {
        throw UsageError{std::string(option) + " is given " + std::to_string(times) +
                         " times; give it once"};
    }
    return text;
}

std::string Arguments::Required(std::string_view option, std::string_view what) const {
    const std::optional<std::string> text = Text(option);
    if (!text || text->empty()) {
        const OptionDecl* declared = m_command->Option(option);
        throw UsageError{m_command->name + " needs " + std::string(option) + " " +
                             (declared != nullptr ? declared->value : std::string("VALUE")) + ", " +
                             std::string(what),
                         m_command->name};
    }
    return *text;
}

uint64 Arguments::Number(std::string_view option, uint64 min, uint64 max, uint64 fallback,
                         const std::string& allowed) const {
    const std::optional<std::string> text = Text(option);
    if (!text) {
        return fallback;
    }
    uint64 value = 0;
    const bool digits = !text->empty() && std::all_of(text->begin(), text->end(),
                                                      [](char c) { return c >= '0' && c <= '9'; });
    if (!digits ||
        std::from_chars(text->data(), text->data() + text->size(), value).ec != std::errc{} ||
        value < min || value > max) {
        throw UsageError{std::string(option) + " must be " +
                         (allowed.empty() ? "a whole number from " + std::to_string(min) + " to " +
                                                std::to_string(max)
                                          : allowed) +
                         ", got " + Given(*text)};
    }
    return value;
}

ssize_t Arguments::CacheNodes(uint64 fallback) const {
    return static_cast<ssize_t>(
        Number("--cache-nodes", 0, kMaxCacheNodes, fallback,
               "0 (no bound) or a whole number up to " + std::to_string(kMaxCacheNodes)));
}

std::optional<FieldId> Arguments::Field(std::string_view option) const {
    const std::optional<std::string> text = Text(option);
    if (!text) {
        return std::nullopt;
    }
    std::string error;
    std::optional<FieldId> field = ParseFieldId(*text, &error);
    if (!field) {
        throw UsageError{std::string(option) + ": " + error};
    }
    return field;
}

Format Arguments::OutputFormat() const {
    const std::optional<std::string> text = Text("--format");
    if (!text || *text == "text") {
        return Format::Text;
    }
    if (*text == "json") {
        return Format::Json;
    }
    if (*text == "csv") {
        return Format::Csv;
    }
    const std::optional<std::string> near = Suggestion(*text, {"text", "json", "csv"});
    throw UsageError{"--format must be text, json or csv, got '" + *text + "'" +
                     (near ? ": did you mean '" + *near + "'?" : std::string())};
}

bool Arguments::Progress() const {
    return !Flag("--no-progress") && ::isatty(STDERR_FILENO) != 0;
}

std::string VersionText() {
    return std::string("offsetops ") + OFFSETOPS_VERSION;
}

void PrintHelp(std::ostream& out, const CommandDecl* command) {
    if (command == nullptr) {
        out << VersionText()
            << ": records offset operations into an on-disk store and inspects it.\n\n"
               "Usage: offsetops COMMAND [OPTIONS]\n"
               "       offsetops help [COMMAND]\n"
               "       offsetops --version\n\n"
               "Commands:\n";
        for (const CommandDecl& c : Commands()) {
            out << "  " << c.name << std::string(10 - std::min<std::size_t>(c.name.size(), 9), ' ')
                << c.summary << '\n';
        }
        out << "\n'offsetops help COMMAND' (or 'offsetops COMMAND --help') describes a command "
               "and its options.\n"
               "Exit status: 0 success, 1 failure, 2 wrong arguments; diff and merge: 0 equal "
               "or merged,\n1 different or conflicts, 2 any error. Stopped by SIGINT or "
               "SIGTERM: 130 or 143.\n";
        return;
    }
    out << "Usage: offsetops " << command->name << ' ' << command->usage << "\n\n"
        << command->summary << "\n\nOptions:\n";
    std::size_t width = 0;
    for (const OptionDecl& o : command->options) {
        width = std::max(width, o.name.size() + (o.IsFlag() ? 0 : o.value.size() + 1));
    }
    for (const OptionDecl& o : command->options) {
        const std::string left = o.name + (o.IsFlag() ? "" : " " + o.value);
        out << "  " << left << std::string(width + 2 - left.size(), ' ') << o.help << '\n';
    }
}

}  // namespace tarn::tool
