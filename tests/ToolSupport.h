#pragma once

// Helpers of the offsetops tests: scratch directories, running the program as
// a child process, and a model of what a store should hold.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h"
#include "tools/Generator.h"
#include "tools/OpsFile.h"

namespace tarn::testing {

namespace fs = std::filesystem;

// A new directory under the system's temporary one, removed with its contents.
class ScratchDir {
public:
    ScratchDir() {
        std::string pattern = (fs::temp_directory_path() / "tarn-tool-XXXXXX").string();
        EXPECT_NE(::mkdtemp(pattern.data()), nullptr);
        m_path = pattern;
    }
    ~ScratchDir() {
        std::error_code ec;
        fs::remove_all(m_path, ec);
    }
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;

    std::string Sub(const std::string& name) const { return (m_path / name).string(); }

    std::string Write(const std::string& name, const std::string& text) const {
        std::ofstream(Sub(name), std::ios::binary) << text;
        return Sub(name);
    }

private:
    fs::path m_path;
};

// What a run of the program gave: its exit status (128 + signal when killed)
// and everything it wrote.
struct ToolRun {
    int status = -1;
    std::string out, err;
};

inline std::string ReadFile(const std::string& path) {
    std::ostringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

// The shell command that runs offsetops with `args` (none holds a quote),
// its output into files of `io`.
inline std::string Command(const std::vector<std::string>& args, const ScratchDir& io) {
    std::string command = OFFSETOPS_PATH;
    for (const std::string& a : args) {
        command += " '" + a + "'";
    }
    return command + " >" + io.Sub("out") + " 2>" + io.Sub("err");
}

inline ToolRun Result(int status, const ScratchDir& io) {
    return {WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status),
            ReadFile(io.Sub("out")), ReadFile(io.Sub("err"))};
}

// Runs offsetops with `args`, its standard input reading `input`.
inline ToolRun Tool(const std::vector<std::string>& args, const std::string& input = {}) {
    ScratchDir io;
    return Result(std::system((Command(args, io) + " <" + io.Write("in", input)).c_str()), io);
}

// Runs offsetops expecting success, which says nothing on standard error
// (nor does a sanitizer); what it printed on standard output.
inline std::string RunOk(const std::vector<std::string>& args, const std::string& input = {}) {
    ToolRun run = Tool(args, input);
    EXPECT_TRUE(run.status == 0 && run.err.empty())
        << ::testing::PrintToString(args) << ": status " << run.status << ", " << run.err;
    return run.out;
}

// Runs offsetops with `args`, its standard input a pipe that takes `input`,
// and calls `beside` once the child has read all of it but what the pipe
// holds (64 KiB); then ends the input and waits for the child's end.
inline ToolRun ToolBeside(const std::vector<std::string>& args, const std::string& input,
                          const std::function<void()>& beside) {
    ScratchDir io;
    ::signal(SIGPIPE, SIG_IGN);  // a child that died early fails the write instead
    FILE* pipe = ::popen(Command(args, io).c_str(), "w");
    EXPECT_TRUE(pipe != nullptr &&
                std::fwrite(input.data(), 1, input.size(), pipe) == input.size() &&
                std::fflush(pipe) == 0);
    beside();
    return Result(pipe == nullptr ? -1 : ::pclose(pipe), io);
}

// What `offsetops show` prints for the store in `dir`.
inline std::string Shown(const std::string& dir) {
    return RunOk({"show", "--store", dir});
}

// The tables a store should hold, in key order.
using Model = std::map<FieldId, std::map<Guid, SiteOffset<int64>>>;

inline void Apply(Model& model, const tool::OffsetOperation& op) {
    SiteOffset<int64>& so = model[op.field][op.site];
    so.t = op.t;
    so.o += op.offset;
}

// The model in the text of `offsetops show`, written out independently of
// the module's printing: "<field> --> {(<site>,(<t>,<o>)),...}" a line.
inline std::string ShowText(const Model& model) {
    std::string text;
    for (const auto& [field, sites] : model) {
        std::string table;
        for (const auto& [site, so] : sites) {
            table += (table.empty() ? "(" : ",(") + ToString(site) + ",(" + std::to_string(so.t) +
                     "," + std::to_string(so.o) + "))";
        }
        text += ToString(field) + " --> {" + table + "}\n";
    }
    return text;
}

// The program's error report: one line, naming `part`.
inline auto OneLineWith(const std::string& part) {
    return ::testing::AllOf(::testing::MatchesRegex("offsetops: [^\n]*\n"),
                            ::testing::HasSubstr(part));
}

// The value of a "label   value" row of the program's output.
inline std::string RowValue(const std::string& out, const std::string& label) {
    std::istringstream lines(out);
    for (std::string line; std::getline(lines, line);) {
        if (line.size() > label.size() && line.starts_with(label) && line[label.size()] == ' ') {
            return line.substr(line.find_first_not_of(' ', label.size()));
        }
    }
    return "";
}

// `model` after the operations of an ops text, read as the program reads a
// file.
inline Model ModelOf(const std::string& opsText, Model model = {}) {
    std::istringstream in(opsText);
    tool::OpsFileReader reader(in, "text");
    std::string error;
    for (tool::OffsetOperation op;
         reader.Next(op, error) == tool::OpsFileReader::Status::Operation;) {
        Apply(model, op);
    }
    return model;
}

// The generator's operations as an ops text, with comments and blank lines.
inline std::string Generated(const tool::GeneratorSettings& settings, const Model& stored = {}) {
    std::map<Guid, int64> last;  // each site's largest stored time stamp
    for (const auto& [field, sites] : stored) {
        for (const auto& [site, so] : sites) {
            last[site] = std::max(last[site], so.t);
        }
    }
    tool::Generator gen(settings, last);
    std::string text = "# generated\n";
    tool::OffsetOperation op;
    std::string error;
    while (gen.Next(op, error)) {
        text += tool::FormatOpsLine(op) + (gen.Made() % 7 == 0 ? "  # seventh\n\n" : "\n");
    }
    EXPECT_EQ(error, "");
    return text;
}

// Generated operations in runs of a hundred, seeds `firstSeed` up to
// `endSeed`, over `fields` fields from `sites` sites, continuing `model`:
// their ops text. `model` becomes the tables after them all, and
// `durablePoints` receives the show text after each hundred.
inline std::string HundredsAfter(Model& model, int64 fields, int64 sites, uint64 firstSeed,
                                 uint64 endSeed, std::set<std::string>& durablePoints) {
    std::string ops;
    for (uint64 seed = firstSeed; seed < endSeed; ++seed) {
        const std::string hundred = Generated({100, fields, sites, seed}, model);
        model = ModelOf(hundred, model);
        durablePoints.insert(ShowText(model));
        ops += hundred;
    }
    return ops;
}

}  // namespace tarn::testing
