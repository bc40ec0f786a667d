#pragma once

// Where `offsetops record` takes its operations from: an ops file, standard
// input, or the generator, behind one interface, so that one recording loop
// (tools/RecordCommand.cpp) serves them all.

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "tools/Generator.h"
#include "tools/OpsFile.h"

namespace tarn::tool {

class OpsSource {
public:
    enum class Status {
        Operation,  // one more in `op`
        End,        // no more
        Error,      // the input is malformed: `error` says how
        Stopped,    // a stop signal interrupted the wait for input
    };

    virtual ~OpsSource() = default;

    virtual Status Next(OffsetOperation& op, std::string& error) = 0;
    // Where the operation read last is, for messages: "ops.txt:12",
    // "generated operation 5".
    virtual std::string Position() const = 0;
    // How far it is: done and total (total 0 when not known), for the
    // progress line.
    virtual std::pair<uint64, uint64> Share(int64 recorded) const = 0;

    // A source a later run can go on with: what its --ops takes ("-" for
    // standard input), and the lines read so far, every line counted (what
    // --skip takes to go on after them). Nothing for generated operations.
    virtual std::optional<std::string> OpsArgument() const { return std::nullopt; }
    virtual int64 LinesRead() const { return 0; }
};

// The operations of the ops file `path` ("-": standard input) after its
// first `skip` lines. Throws RuntimeError when the file cannot be read, or
// has fewer than `skip` lines.
std::unique_ptr<OpsSource> OpenOpsSource(const std::string& path, int64 skip);

// Generated operations, continuing each site's newest stamp in `newest`.
std::unique_ptr<OpsSource> GeneratedOps(const GeneratorSettings& settings,
                                        const std::map<Guid, int64>& newest);

}  // namespace tarn::tool
