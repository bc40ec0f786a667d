// offsetops export: every table as ops lines that `record --ops` loads back.

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Interrupt.h"
#include "tools/OpsFile.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

namespace fs = std::filesystem;

constexpr const char* kPartialSuffix = ".partial-";

// The export file while it is written: a sibling under a name of its own
// (FILE.partial-PID), renamed to the file's name once complete, removed
// otherwise. Messages name the file the user asked for.
class ExportFile {
public:
    explicit ExportFile(const std::string& path)
        : m_path(path), m_temp(path + kPartialSuffix + std::to_string(::getpid())) {
        RemoveStalePartials(path, "", kPartialSuffix);
        m_stream.open(m_temp, std::ios::out | std::ios::trunc);
        if (!m_stream) {
            const int error = errno;
            throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                               "cannot write '" + m_path + "': " + std::strerror(error));
        }
    }
    ~ExportFile() {
        if (!m_done) {
            m_stream.close();
            std::error_code ec;
            fs::remove(m_temp, ec);
        }
    }
    ExportFile(const ExportFile&) = delete;
    ExportFile& operator=(const ExportFile&) = delete;

    std::ostream& Stream() { return m_stream; }

    void Finish() {
        m_stream.flush();
        const bool written = static_cast<bool>(m_stream);
        m_stream.close();
        if (!written || m_stream.fail()) {
            const bool full = NoSpace();
            throw RuntimeError(
                full ? RuntimeError::Category::NoSpace : RuntimeError::Category::Io,
                "writing '" + m_path + "' failed" + (full ? ": no space left on device" : ""));
        }
        if (std::rename(m_temp.c_str(), m_path.c_str()) != 0) {
            const int error = errno;
            throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                               "cannot write '" + m_path + "': " + std::strerror(error));
        }
        m_done = true;
    }

private:
    // Streams do not say why a write failed; a full disk is the usual cause.
    bool NoSpace() const {
        std::error_code ec;
        const fs::path parent = fs::path(m_temp).parent_path();
        const fs::space_info space = fs::space(parent.empty() ? fs::path(".") : parent, ec);
        return !ec && space.available < (uint64{1} << 20);
    }

    std::string m_path;
    std::string m_temp;
    std::ofstream m_stream;
    bool m_done = false;
};

int RunExport(const Arguments& args, Io& io) {
    CatchStopSignals();
    const std::string dir = args.Store();
    const std::string outFile = args.Text("--out").value_or("");
    if (args.Has("--out") && outFile.empty()) {
        throw UsageError{"--out needs a file name, or '-' for standard output"};
    }
    const ssize_t cacheObjects = args.CacheNodes(kDefaultWalkCacheObjects);
    const bool progressWanted = args.Progress();
    std::optional<OffsetOpsStore> store = OpenForWalk(dir, cacheObjects, io.err);
    if (!store) {
        return kUsageStatus;
    }
    std::optional<ExportFile> file;
    if (!outFile.empty() && outFile != "-") {
        file.emplace(outFile);
    }
    std::ostream& sink = file ? file->Stream() : io.out;
    const int64 fields = store->Size();
    sink << "# offsetops export of store '" << dir << "': " << Counted(fields, "field", "fields")
         << ", a line per site of each: site,t,oid,path,offset; 'offsetops record "
            "--ops FILE' loads it into an empty store\n";

    ProgressLine progress(progressWanted, io.err, "export");
    int64 done = 0;
    OffsetOperation op;
    store->ForEach([&](const FieldId& field, const FieldTable& table) {
        if (StopSignal() != 0) {
            return false;
        }
        op.field = field;
        for (const SiteRecord& r : table) {
            op.site = r.site;
            op.t = r.t;
            op.offset = r.o;
            sink << FormatOpsLine(op) << '\n';
        }
        ++done;
        if (progress.Enabled()) {
            progress.Show(static_cast<uint64>(done), static_cast<uint64>(fields),
                          std::to_string(done) + " of " + Counted(fields, "field", "fields"));
        }
        return static_cast<bool>(sink);
    });
    progress.Finish();
    if (const int signal = StopSignal()) {
        file.reset();  // removes what was written
        Fail(io.err,
             "export stopped by " + SignalName(signal) +
                 (outFile.empty() || outFile == "-" ? std::string()
                                                    : "; '" + outFile + "' was not written"));
        return StoppedStatus(signal);
    }
    if (file) {
        file->Finish();
        io.err << "offsetops: exported " << Counted(done, "field", "fields") << " to '" << outFile
               << "'\n";
    } else if (!sink.flush()) {
        return OutputFailed(io.err, kFailed);
    }
    return 0;
}

}  // namespace

CommandDecl ExportCommand() {
    return {
        "export",
        "--store DIR [--out FILE] [--cache-nodes C] [--no-progress]",
        "print every table as ops lines, which 'record --ops' loads back",
        {
            StoreOption(),
            {"--out", "FILE",
             "write to FILE (made as FILE.partial-PID, then renamed) instead of standard output"},
            CacheOption(),
            NoProgressOption(),
        },
        RunExport,
    };
}

}  // namespace tarn::tool
