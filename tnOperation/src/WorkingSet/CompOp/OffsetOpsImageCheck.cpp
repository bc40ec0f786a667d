#include "tnOperation/src/WorkingSet/CompOp/OffsetOpsImageCheck.h"

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodeRules.h"
#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMapNodes.h"
#include "tnOperation/src/WorkingSet/CompOp/OffsetOps.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {

namespace {

// A read position with an end. The first problem found sticks; every later
// read then reads nothing.
class ImageScanner {
public:
    ImageScanner(const octet_t* image, std::size_t size) : m_p(image), m_end(image + size) {}

    // A variable-length integer as the readers decode it: up to 5 bytes,
    // ending at the first byte without the high bit.
    uint32 Varint(const char* what) {
        for (int n = 0; n < MAX_VARIABLE_LENGTH_UINT_SIZE; ++n) {
            if (m_p + n >= m_end) {
                Fail(std::string("truncated ") + what);
                return 0;
            }
            if ((m_p[n] & 0x80) == 0 || n + 1 == MAX_VARIABLE_LENGTH_UINT_SIZE) {
                uint32 v;
                m_p = DeserialiseVariableLengthUint32(m_p, v);
                return v;
            }
        }
        return 0;
    }

    void Fixed(std::size_t n, const char* what) {
        if (!m_problem.empty()) {
            return;
        }
        if (static_cast<std::size_t>(m_end - m_p) < n) {
            Fail(std::string("truncated ") + what);
            return;
        }
        m_p += n;
    }

    void Schema(schema_t current) {
        uint32 schema = Varint("schema number");
        if (m_problem.empty() && (schema < 1 || schema > static_cast<uint32>(current))) {
            Fail("schema number " + std::to_string(schema) + " (this program reads up to " +
                 std::to_string(current) + ")");
        }
    }

    void Reference(const char* what) { Fixed(8, what); }

    void Key() {
        Fixed(8, "key identity");
        uint32 length = Varint("key path length");
        Fixed(length, "key path");
    }

    // A per-site table: count, then per site its Guid, t and o.
    void Table() {
        uint32 sites = Varint("site count");
        for (uint32 i = 0; i < sites && m_problem.empty(); ++i) {
            Fixed(sizeof(Guid), "site");
            Varint("time stamp");
            Fixed(sizeof(int64), "offset");
        }
    }

    uint32 EntryCount() {
        uint32 n = Varint("entry count");
        // The most a node may hold wherever it sits; its place is not known
        // here, and the load check tests the rest.
        const ssize_t most = FieldIdToOffsetOpsOnInt64FieldMapRuleAlone(false).maxEntries;
        if (m_problem.empty() && static_cast<ssize_t>(n) > most) {
            Fail("entry count " + std::to_string(n) + " exceeds " + std::to_string(most));
        }
        return m_problem.empty() ? n : 0;
    }

    std::string Finish() {
        if (m_problem.empty() && m_p != m_end) {
            Fail(std::to_string(m_end - m_p) + " bytes left over after the last item");
        }
        return m_problem;
    }

private:
    void Fail(std::string problem) {
        if (m_problem.empty()) {
            m_problem = std::move(problem);
        }
        m_p = m_end;
    }

    const octet_t* m_p;
    const octet_t* m_end;
    std::string m_problem;
};

}  // namespace

std::string CheckOffsetOpsImage(const octet_t* image, std::size_t size) {
    ImageScanner s(image, size);
    s.Schema(OffsetOps_SCHEMA);
    s.Reference("map reference");
    return s.Finish();
}

std::string CheckFieldIdToOffsetOpsOnInt64FieldMapImage(const octet_t* image, std::size_t size) {
    ImageScanner s(image, size);
    s.Schema(FieldIdToOffsetOpsOnInt64FieldMap_SCHEMA);
    s.Varint("size");
    s.Reference("first leaf reference");
    s.Reference("last leaf reference");
    s.Reference("root reference");
    s.Varint("height");
    return s.Finish();
}

std::string CheckFieldIdToOffsetOpsOnInt64FieldMapInternalNodeImage(const octet_t* image,
                                                                    std::size_t size) {
    ImageScanner s(image, size);
    s.Schema(FieldIdToOffsetOpsOnInt64FieldMapInternalNode_SCHEMA);
    s.Reference("leftmost child reference");
    uint32 n = s.EntryCount();
    for (uint32 i = 0; i < n; ++i) {
        s.Key();
        s.Reference("child reference");
    }
    return s.Finish();
}

std::string CheckFieldIdToOffsetOpsOnInt64FieldMapLeafNodeImage(const octet_t* image,
                                                                std::size_t size) {
    ImageScanner s(image, size);
    s.Schema(FieldIdToOffsetOpsOnInt64FieldMapLeafNode_SCHEMA);
    s.Reference("previous leaf reference");
    s.Reference("next leaf reference");
    uint32 n = s.EntryCount();
    for (uint32 i = 0; i < n; ++i) {
        s.Key();
        s.Table();
    }
    return s.Finish();
}

}  // namespace tarn
