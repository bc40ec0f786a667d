#include "tools/CommandLine.h"

#include <new>
#include <string>
#include <vector>

#include "tnUtils/RuntimeError.h"
#include "tools/CommandTable.h"

namespace tarn::tool {

namespace {

std::string CommandList() {
    std::string list;
    const std::vector<CommandDecl>& commands = Commands();
    for (std::size_t i = 0; i < commands.size(); ++i) {
        list += (i == 0 ? "" : i + 1 == commands.size() ? " or " : ", ") + commands[i].name;
    }
    return list;
}

UsageError UnknownCommand(const std::string& given) {
    std::vector<std::string> names;
    for (const CommandDecl& command : Commands()) {
        names.push_back(command.name);
    }
    names.push_back("help");
    const std::optional<std::string> near = Suggestion(given, names);
    return {"unknown command '" + given +
                "': " + (near ? "did you mean '" + *near + "'?" : "use " + CommandList()),
            ""};
}

int Usage(std::ostream& err, const UsageError& e) {
    err << "offsetops: " << e.message;
    if (e.help) {
        err << " (see 'offsetops " << *e.help << (e.help->empty() ? "" : " ") << "--help')";
    }
    err << '\n';
    return kUsageStatus;
}

// Runs what the arguments ask for; throws UsageError for wrong ones.
int Dispatch(const std::vector<std::string>& args, const CommandDecl*& command, Io& io) {
    if (args.empty()) {
        throw UsageError{"a command is needed: " + CommandList(), ""};
    }
    const std::string& first = args.front();
    const std::vector<std::string> rest(args.begin() + 1, args.end());
    if (first == "--version" || first == "--help" || first == "-h" || first == "help") {
        const CommandDecl* about = nullptr;
        if (first == "help" && !rest.empty()) {
            about = FindCommand(rest.front());
            if (about == nullptr) {
                throw UnknownCommand(rest.front());
            }
        }
        if (rest.size() > (first == "help" ? 1u : 0u)) {
            throw UsageError{"unexpected argument '" + rest.back() + "' after " + first, ""};
        }
        if (first == "--version") {
            io.out << VersionText() << '\n';
        } else {
            PrintHelp(io.out, about);
        }
        return 0;
    }
    if (first.size() > 1 && first[0] == '-') {
        throw UsageError{"unknown option '" + first + "': options follow the command", ""};
    }
    command = FindCommand(first);
    if (command == nullptr) {
        throw UnknownCommand(first);
    }
    const Arguments parsed(*command, rest);
    if (parsed.HelpAsked()) {
        PrintHelp(io.out, command);
        return 0;
    }
    return command->run(parsed, io);
}

}  // namespace

int RunOffsetOps(int argc, const char* const* argv, std::ostream& out, std::ostream& err) {
    const std::vector<std::string> args(argv + (argc > 0 ? 1 : 0), argv + argc);
    const CommandDecl* command = nullptr;
    Io io{out, err};
    try {
        return Dispatch(args, command, io);
    } catch (const UsageError& e) {
        return Usage(err, e);
    } catch (const RuntimeError& e) {
        err << "offsetops: " << e.what() << '\n';
    } catch (const std::bad_alloc&) {
        err << "offsetops: out of memory\n";
    } catch (const std::exception& e) {
        err << "offsetops: error: " << e.what() << '\n';
    }
    return command != nullptr ? command->failureStatus : kFailed;
}

}  // namespace tarn::tool
