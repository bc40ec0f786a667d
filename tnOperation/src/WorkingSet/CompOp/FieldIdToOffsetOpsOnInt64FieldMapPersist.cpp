// Byte images and reference visits of the B+tree map header and its nodes.
//
// Each object is written as an image of its own; no image carries a length,
// checksum or end marker. References are in the runtime's form (prefbase
// Serialise with the flag false); variable-length integers carry 32 bits.
//
// Map header image:
//   schema       varint     always 1
//   m_size       varint     number of keys
//   m_firstLeaf  reference  0 when the map has no root
//   m_lastLeaf   reference
//   m_root       reference  leaf at height 0, internal node above
//   m_height+1   varint     0 for a map without root, 1 for a root leaf, ...
//
// Internal node image:
//   schema       varint     always 1
//   m_ptr        reference  leftmost child
//   count        varint     0..100
//   entries      count x (key: FieldId, child: reference)
//
// Leaf image:
//   schema       varint     always 1
//   m_prev       reference  0 for the first leaf
//   m_next       reference  0 for the last leaf
//   count        varint     0..100
//   entries      count x (key: FieldId, per-site table)
//
// Child references are untyped: the level (from m_height down to 0 at the
// leaves) says whether a child is a leaf or an internal node.

#include "tnOperation/src/WorkingSet/CompOp/FieldIdToOffsetOpsOnInt64FieldMap.h"
#include "tnUtils/Archive.h"
#include "tnUtils/Assert.h"
#include "tnUtils/VariableLengthSerialise.h"

namespace tarn {

// ---- Map header ---------------------------------------------------------------

void FieldIdToOffsetOpsOnInt64FieldMap::Serialise(Archive& ar) const {
    SerialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMap_SCHEMA);
    SerialiseVariableLengthUint<ssize_t>(ar, m_size);
    ar << m_firstLeaf << m_lastLeaf << m_root;
    SerialiseVariableLengthUint<ssize_t>(ar, m_height + 1);
}

// Checks only the two counts; the tree's consistency is Validate's subject.
void FieldIdToOffsetOpsOnInt64FieldMap::Deserialise(InputArchive& ar) {
    schema_t schema;
    DeserialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMap_SCHEMA, schema);
    DeserialiseVariableLengthUint<ssize_t>(ar, m_size);
    ar >> m_firstLeaf >> m_lastLeaf >> m_root;
    ssize_t storedHeight;
    DeserialiseVariableLengthUint<ssize_t>(ar, storedHeight);
    m_height = storedHeight - 1;
    TARN_ASSERT(m_size >= 0);
    TARN_ASSERT(m_height >= -1);
}

void FieldIdToOffsetOpsOnInt64FieldMap::VisitObjects(IObjectVisitor& v) const {
    v << m_firstLeaf << m_lastLeaf << m_root;
}

// Only the tree edge: the first and last leaf are shortcuts, not edges.
void FieldIdToOffsetOpsOnInt64FieldMap::VisitPrefs(IPrefVisitor& v) const {
    v << m_root;
}

// ---- Internal node -----------------------------------------------------------------

void FieldIdToOffsetOpsOnInt64FieldMapInternalNode::Serialise(Archive& ar) const {
    SerialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMapInternalNode_SCHEMA);
    ar << m_ptr;
    SerialiseVariableLengthUint<ssize_t>(ar, m_numKeyEntrys);
    for (ssize_t i = 0; i < m_numKeyEntrys; ++i) {
        const Entry& e = GetEntry(i);
        ar << e.m_key << e.m_ptr;
    }
}

// Reads into a node holding any number of entries: the live run is resized
// to the image's count before the entries are read over it.
void FieldIdToOffsetOpsOnInt64FieldMapInternalNode::Deserialise(InputArchive& ar) {
    schema_t schema;
    DeserialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMapInternalNode_SCHEMA, schema);
    ar >> m_ptr;
    ssize_t n;
    DeserialiseVariableLengthUint<ssize_t>(ar, n);
    TARN_ASSERT(0 <= n && n <= 100);
    ResizeArrayElements(&GetEntry(0), m_numKeyEntrys, n);
    m_numKeyEntrys = n;
    for (ssize_t i = 0; i < n; ++i) {
        Entry& e = GetEntry(i);
        ar >> e.m_key >> e.m_ptr;
    }
}

void FieldIdToOffsetOpsOnInt64FieldMapInternalNode::VisitObjects(IObjectVisitor& v) const {
    v << m_ptr;
    for (ssize_t i = 0; i < m_numKeyEntrys; ++i) {
        v << GetEntry(i).m_ptr;
    }
}

void FieldIdToOffsetOpsOnInt64FieldMapInternalNode::VisitPrefs(IPrefVisitor& v) const {
    v << m_ptr;
    for (ssize_t i = 0; i < m_numKeyEntrys; ++i) {
        v << GetEntry(i).m_ptr;
    }
}

// ---- Leaf ------------------------------------------------------------------------------

void FieldIdToOffsetOpsOnInt64FieldMapLeafNode::Serialise(Archive& ar) const {
    SerialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMapLeafNode_SCHEMA);
    ar << m_prev << m_next;
    SerialiseVariableLengthUint<ssize_t>(ar, m_numKeyEntrys);
    for (ssize_t i = 0; i < m_numKeyEntrys; ++i) {
        const Entry& e = GetEntry(i);
        ar << e.first << e.second;
    }
}

void FieldIdToOffsetOpsOnInt64FieldMapLeafNode::Deserialise(InputArchive& ar) {
    schema_t schema;
    DeserialiseSchema(ar, FieldIdToOffsetOpsOnInt64FieldMapLeafNode_SCHEMA, schema);
    ar >> m_prev >> m_next;
    ssize_t n;
    DeserialiseVariableLengthUint<ssize_t>(ar, n);
    TARN_ASSERT(0 <= n && n <= 100);
    ResizeArrayElements(&GetEntry(0), m_numKeyEntrys, n);
    m_numKeyEntrys = n;
    for (ssize_t i = 0; i < n; ++i) {
        Entry& e = GetEntry(i);
        ar >> e.first >> e.second;
    }
}

// The leaf chain is reported for reachability in memory only.
void FieldIdToOffsetOpsOnInt64FieldMapLeafNode::VisitObjects(IObjectVisitor& v) const {
    v << m_prev << m_next;
}

// A leaf is not a parent of anything in the tree of references.
void FieldIdToOffsetOpsOnInt64FieldMapLeafNode::VisitPrefs(IPrefVisitor& /*v*/) const {}

}  // namespace tarn
