#include "tools/OpsSource.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <streambuf>
#include <vector>

#include "tnUtils/RuntimeError.h"
#include "tools/Interrupt.h"

namespace tarn::tool {

namespace {

// A stream buffer over a file descriptor whose reads a stop signal may
// interrupt: then it ends, and says so.
class StoppableReadBuffer : public std::streambuf {
public:
    explicit StoppableReadBuffer(int fd) : m_fd(fd), m_buffer(1 << 16) {}
    ~StoppableReadBuffer() override {
        if (m_fd != STDIN_FILENO) {
            ::close(m_fd);
        }
    }
    StoppableReadBuffer(const StoppableReadBuffer&) = delete;
    StoppableReadBuffer& operator=(const StoppableReadBuffer&) = delete;

    bool Stopped() const { return m_stopped; }
    int Error() const { return m_error; }

protected:
    int_type underflow() override {
        while (!m_stopped) {
            const ssize_t got = ::read(m_fd, m_buffer.data(), m_buffer.size());
            if (got > 0) {
                setg(m_buffer.data(), m_buffer.data(), m_buffer.data() + got);
                return traits_type::to_int_type(m_buffer[0]);
            }
            if (got == 0) {
                return traits_type::eof();
            }
            if (errno != EINTR) {
                m_error = errno;
                return traits_type::eof();
            }
            if (StopSignal() != 0) {
                m_stopped = true;
            }
        }
        return traits_type::eof();
    }

private:
    int m_fd;
    std::vector<char> m_buffer;
    bool m_stopped = false;
    int m_error = 0;
};

class FileSource final : public OpsSource {
public:
    FileSource(int fd, std::string path, uint64 bytes)
        : m_path(std::move(path)),
          m_bytes(bytes),
          m_buffer(fd),
          m_stream(&m_buffer),
          m_reader(m_stream, m_path == "-" ? "<stdin>" : m_path) {}

    void Skip(int64 lines) {
        const int64 skipped = m_reader.Skip(lines);
        m_partial = CutByStop();
        if (skipped < lines && !m_buffer.Stopped()) {
            throw RuntimeError(
                "--skip " + std::to_string(lines) + " passes the end of " +
                (m_path == "-" ? std::string("standard input") : "ops file '" + m_path + "'") +
                ", which has " + std::to_string(skipped) + (skipped == 1 ? " line" : " lines"));
        }
    }

    Status Next(OffsetOperation& op, std::string& error) override {
        const OpsFileReader::Status status = m_reader.Next(op, error);
        if (CutByStop()) {
            // The line read last is only what came before the signal: it
            // is neither taken nor counted.
            m_partial = true;
            return Status::Stopped;
        }
        switch (status) {
            case OpsFileReader::Status::Operation:
                return Status::Operation;
            case OpsFileReader::Status::Error:
                return Status::Error;
            case OpsFileReader::Status::End:
                break;
        }
        if (m_buffer.Stopped()) {
            return Status::Stopped;
        }
        if (m_buffer.Error() != 0) {
            error = std::string("cannot read it: ") + std::strerror(m_buffer.Error());
            return Status::Error;
        }
        return Status::End;
    }

    std::string Position() const override {
        return m_reader.Name() + ":" + std::to_string(m_reader.LineNumber());
    }
    std::pair<uint64, uint64> Share(int64) const override {
        return {m_reader.BytesRead(), m_bytes};
    }
    std::optional<std::string> OpsArgument() const override { return m_path; }
    int64 LinesRead() const override { return m_reader.LineNumber() - (m_partial ? 1 : 0); }

private:
    bool CutByStop() const { return m_buffer.Stopped() && !m_reader.LastLineComplete(); }

    std::string m_path;
    uint64 m_bytes;  // of a file; 0 for a pipe
    StoppableReadBuffer m_buffer;
    std::istream m_stream;
    OpsFileReader m_reader;
    bool m_partial = false;  // the line read last was cut by a stop signal
};

class GeneratedSource final : public OpsSource {
public:
    GeneratedSource(const GeneratorSettings& settings, const std::map<Guid, int64>& newest)
        : m_count(settings.count), m_generator(settings, newest) {}

    Status Next(OffsetOperation& op, std::string& error) override {
        ++m_asked;
        if (m_generator.Next(op, error)) {
            return Status::Operation;
        }
        return error.empty() ? Status::End : Status::Error;
    }
    std::string Position() const override {
        return "generated operation " + std::to_string(m_asked);
    }
    std::pair<uint64, uint64> Share(int64 recorded) const override {
        return {static_cast<uint64>(recorded), static_cast<uint64>(m_count)};
    }

private:
    int64 m_count;
    int64 m_asked = 0;  // operations asked for, the one read last included
    Generator m_generator;
};

}  // namespace

std::unique_ptr<OpsSource> OpenOpsSource(const std::string& path, int64 skip) {
    int fd = STDIN_FILENO;
    uint64 bytes = 0;
    if (path != "-") {
        fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) {
            const int error = errno;
            throw RuntimeError(RuntimeError::CategoryOfErrno(error),
                               "cannot open ops file '" + path + "': " + std::strerror(error));
        }
        struct stat st;
        if (::fstat(fd, &st) == 0 && S_ISDIR(st.st_mode)) {
            ::close(fd);
            throw RuntimeError("ops file '" + path + "' is a directory");
        }
        bytes = ::fstat(fd, &st) == 0 && S_ISREG(st.st_mode) ? static_cast<uint64>(st.st_size) : 0;
    }
    auto source = std::make_unique<FileSource>(fd, path, bytes);
    source->Skip(skip);
    return source;
}

std::unique_ptr<OpsSource> GeneratedOps(const GeneratorSettings& settings,
                                        const std::map<Guid, int64>& newest) {
    return std::make_unique<GeneratedSource>(settings, newest);
}

}  // namespace tarn::tool
