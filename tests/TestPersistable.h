#pragma once

// A small persistable class for the object model and runtime tests, with its
// own reflection record, registered in the "tests" target.
//
// TestNode image:
//   schema    varint   1
//   m_value   8 bytes  little-endian
//   m_left    8 bytes  identity, 0 when empty
//   m_right   8 bytes  identity
// Both references are tree edges (VisitObjects and VisitPrefs report them).

#include "tnObject/IObject.h"
#include "tnObject/IObjectVisitor.h"
#include "tnPersistStore/IPersistable.h"
#include "tnPersistStore/IPrefVisitor.h"
#include "tnPersistStore/PersistableReflection.h"
#include "tnPersistStore/pref.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnUtils/Archive.h"
#include "tnUtils/Assert.h"

namespace tarn::testing {

class TestNode : public PersistableMixin<IObjectBaseMixin<TestNode, EmptyBase>> {
public:
    TestNode() { ++s_live; }
    explicit TestNode(int64 value) : m_value(value) { ++s_live; }
    TestNode(const TestNode& rhs)
        : PersistableMixin(rhs), m_value(rhs.m_value), m_left(rhs.m_left), m_right(rhs.m_right) {
        ++s_live;
    }
    TestNode& operator=(const TestNode&) = default;
    ~TestNode() { --s_live; }

    void VisitObjects(IObjectVisitor& v) const { v << m_left << m_right; }
    void VisitPrefs(IPrefVisitor& v) const { v << m_left << m_right; }
    void Serialise(Archive& ar) const {
        SerialiseSchema(ar, 1);
        ar << m_value << m_left << m_right;
    }
    void Deserialise(InputArchive& ar) {
        schema_t schema;
        DeserialiseSchema(ar, 1, schema);
        ar >> m_value >> m_left >> m_right;
    }
    void OnCreate(bool local) { m_onCreateArg = local ? 1 : 0; }

    int64 m_value = 0;
    cref<TestNode> m_left;
    cref<TestNode> m_right;
    int m_onCreateArg = -1;  // not stored: -1 until OnCreate runs

    static inline int s_live = 0;  // instances alive
};

inline const ReflectedClass& _GetReflected(const TestNode*) {
    static const ReflectedClass record = MakePersistableReflectedClass<TestNode>(
        "tarn::testing::TestNode", CopyableTypeOps<TestNode>());
    return record;
}

// Registers the class once per process.
inline void RegisterTestClasses() {
    static const bool registered = [] {
        TARN_ASSERT(RegisterReflectedClass(&_GetReflected((TestNode*)0), GetXTarget("tests")) ==
                    NSE_OK);
        return true;
    }();
    (void)registered;
}

}  // namespace tarn::testing
