// offsetops export: every table as ops lines that `record --ops` loads back.

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/OpsFile.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

namespace fs = std::filesystem;

// The export file while it is written: a sibling under a temporary name,
// renamed to the file's name once complete, removed otherwise.
class ExportFile {
public:
    explicit ExportFile(const std::string& path)
        : m_path(path), m_temp(path + ".partial-" + std::to_string(::getpid())) {
        m_stream.open(m_temp, std::ios::out | std::ios::trunc);
        if (!m_stream) {
            throw RuntimeError("cannot write '" + m_temp + "': " + std::strerror(errno));
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
            throw RuntimeError("writing '" + m_temp + "' failed" + WhyNoSpace());
        }
        if (std::rename(m_temp.c_str(), m_path.c_str()) != 0) {
            throw RuntimeError("cannot rename '" + m_temp + "' to '" + m_path +
                               "': " + std::strerror(errno));
        }
        m_done = true;
    }

private:
    // Streams do not say why a write failed; a full disk is the usual cause.
    std::string WhyNoSpace() const {
        std::error_code ec;
        const fs::space_info space = fs::space(
            fs::path(m_temp).parent_path().empty() ? fs::path(".") : fs::path(m_temp).parent_path(),
            ec);
        return !ec && space.available < (uint64{1} << 20) ? ": no space left on device" : "";
    }

    std::string m_path;
    std::string m_temp;
    std::ofstream m_stream;
    bool m_done = false;
};

}  // namespace

int RunExport(const std::string& store, const std::string& outFile, const WalkSettings& settings,
              std::ostream& out, std::ostream& err) {
    std::optional<OffsetOpsStore> opened = OpenForWalk(store, settings.cacheObjects, err);
    if (!opened) {
        return 2;
    }
    std::optional<ExportFile> file;
    if (!outFile.empty() && outFile != "-") {
        file.emplace(outFile);
    }
    std::ostream& sink = file ? file->Stream() : out;
    const int64 fields = opened->Size();
    sink << "# offsetops export of store '" << store << "': " << fields
         << " fields, a line per site of each: site,t,oid,path,offset; 'offsetops record "
            "--ops FILE' loads it into an empty store\n";

    ProgressLine progress(settings.progress, err, "export");
    int64 done = 0;
    OffsetOperation op;
    opened->ForEach([&](const FieldId& field, const FieldTable& table) {
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
                          std::to_string(done) + " of " + std::to_string(fields) + " fields");
        }
        return static_cast<bool>(sink);
    });
    progress.Finish();
    if (file) {
        file->Finish();
        err << "offsetops: exported " << done << " fields to '" << outFile << "'\n";
    } else if (!sink.flush()) {
        return Fail(err, "writing the export failed");
    }
    return 0;
}

}  // namespace tarn::tool
