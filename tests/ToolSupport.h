#pragma once

// Helpers of the offsetops tests: scratch directories, running the program as
// a child process, a model of what a store should hold, and reading a store
// back in-process.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "tnRuntime/CSpaceGuard.h"
#include "tnRuntime/LmdbStore.h"
#include "tnUtils/xostream.h"
#include "tools/Recorder.h"

namespace tarn::testing {

namespace fs = std::filesystem;

class ScratchDir {
public:
    ScratchDir() {
        std::string pattern = (fs::temp_directory_path() / "tarn-tool-XXXXXX").string();
        const char* made = ::mkdtemp(pattern.data());
        EXPECT_NE(made, nullptr);
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

inline std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

// What a run of the program gave: its exit status (128 + signal when killed)
// and everything it wrote.
struct ToolRun {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs the program at `program` with `args`, standard input from `input`.
inline ToolRun RunProgram(const std::string& program, const std::vector<std::string>& args,
                          const std::string& input = {}) {
    ScratchDir io;
    const std::string in = io.Write("in", input);
    const std::string out = io.Sub("out");
    const std::string err = io.Sub("err");
    std::vector<std::string> all{program};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (std::string& a : all) {
        argv.push_back(a.data());
    }
    argv.push_back(nullptr);
    const pid_t pid = ::fork();
    if (pid == 0) {
        const int fds[3] = {::open(in.c_str(), O_RDONLY),
                            ::open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644),
                            ::open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644)};
        for (int i = 0; i < 3; ++i) {
            ::dup2(fds[i], i);
        }
        ::execv(argv[0], argv.data());
        ::_exit(127);
    }
    ToolRun run;
    int status = 0;
    EXPECT_EQ(::waitpid(pid, &status, 0), pid);
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    run.out = ReadFile(out);
    run.err = ReadFile(err);
    return run;
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
        text += tool::FieldIdText(field) + " --> {";
        bool first = true;
        for (const auto& [site, so] : sites) {
            text += (first ? "(" : ",(") + ToString(site) + ",(" + std::to_string(so.t) + "," +
                    std::to_string(so.o) + "))";
            first = false;
        }
        text += "}\n";
    }
    return text;
}

// The tables of the store in `dir`, read in this process.
inline Model ReadStore(const std::string& dir) {
    Model model;
    CSpace space(LmdbStore::Open(dir, OpenMode::ReadOnly));
    CSpaceGuard guard(space, LockMode::Shared);
    OID root = space.GetRoot(tool::kRecordRoot);
    if (root.IsNull()) {
        return model;
    }
    SpaceRef<OffsetOps> record(space, root);
    const FieldIdToOffsetOpsOnInt64FieldMap& map = *record->m_map;
    for (auto it = map.begin(); it != map.end(); ++it) {
        model[it->first] = std::map<Guid, SiteOffset<int64>>(it->second.m_map.getmap().begin(),
                                                             it->second.m_map.getmap().end());
    }
    return model;
}

}  // namespace tarn::testing
