// offsetops diff: the fields whose tables two stores do not agree on.

#include <deque>
#include <filesystem>

#include "tnOperation/src/WorkingSet/CompOp/CompareKeys.h"
#include "tnStore/FieldCursor.h"
#include "tnUtils/OstreamOutputStream.h"
#include "tnUtils/xostream.h"
#include "tools/CommandSupport.h"
#include "tools/Commands.h"
#include "tools/Progress.h"

namespace tarn::tool {

namespace {

constexpr int kDiffer = 1;
constexpr int kTrouble = 2;

struct DiffCounts {
    int64 onlyA = 0;
    int64 onlyB = 0;
    int64 other = 0;
    int64 Total() const { return onlyA + onlyB + other; }
};

DiffCounts Compare(OffsetOpsStore& a, OffsetOpsStore& b, const WalkSettings& settings,
                   std::ostream& out, std::ostream& err) {
    OstreamOutputStream sink(out);
    xostream os(sink);
    const uint64 total = static_cast<uint64>(a.Size() + b.Size());
    ProgressLine progress(settings.progress, err, "diff");
    uint64 walked = 0;
    DiffCounts counts;
    FieldCursor x(a), y(b);
    while (!x.AtEnd() || !y.AtEnd()) {
        const int order = x.AtEnd() ? 1 : y.AtEnd() ? -1 : CompareKeys(x.Key(), y.Key());
        if (order < 0) {
            os << "< " << x.Key() << " --> " << ToString(x.Table()) << '\n';
            ++counts.onlyA;
            x.Next();
            ++walked;
        } else if (order > 0) {
            os << "> " << y.Key() << " --> " << ToString(y.Table()) << '\n';
            ++counts.onlyB;
            y.Next();
            ++walked;
        } else {
            if (!(x.Table() == y.Table())) {
                os << "! " << x.Key() << " --> " << ToString(x.Table()) << ' '
                   << ToString(y.Table()) << '\n';
                ++counts.other;
            }
            x.Next();
            y.Next();
            walked += 2;
        }
        if (progress.Enabled()) {
            progress.Show(walked, total,
                          std::to_string(walked) + " of " + std::to_string(total) + " fields");
        }
    }
    return counts;
}

}  // namespace

int RunDiff(const std::string& a, const std::string& b, const WalkSettings& settings,
            std::ostream& out, std::ostream& err) {
    try {
        std::optional<OffsetOpsStore> first = OpenForWalk(a, settings.cacheObjects, err);
        if (!first) {
            return kTrouble;
        }
        // A directory opens once per process; compared with itself it is equal.
        std::error_code ec;
        if (std::filesystem::equivalent(a, b, ec)) {
            return 0;
        }
        std::optional<OffsetOpsStore> second = OpenForWalk(b, settings.cacheObjects, err);
        if (!second) {
            return kTrouble;
        }
        const DiffCounts counts = Compare(*first, *second, settings, out, err);
        if (!out.flush()) {
            Fail(err, "writing the differences failed");
            return kTrouble;
        }
        if (counts.Total() == 0) {
            return 0;
        }
        // Standard output holds a line per field and nothing else; the count
        // is for a person at a terminal.
        if (settings.progress) {
            err << "offsetops: " << counts.Total()
                << (counts.Total() == 1 ? " field differs: " : " fields differ: ") << counts.onlyA
                << " only in '" << a << "', " << counts.onlyB << " only in '" << b << "', "
                << counts.other << " with other tables\n";
        }
        return kDiffer;
    } catch (const RuntimeError& e) {
        Fail(err, e.what());
    } catch (const std::bad_alloc&) {
        Fail(err, "out of memory");
    }
    return kTrouble;
}

}  // namespace tarn::tool
