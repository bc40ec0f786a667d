// The space's residents, loading and named roots. Commit is in
// CSpaceCommit.cpp, eviction in CSpaceEviction.cpp.

#include "tnRuntime/CSpace.h"

#include <string>

#include "tnBackends/MemoryStore.h"
#include "tnPersistStore/pref.h"
#include "tnRuntime/ClassRegistry.h"
#include "tnUtils/Archive.h"
#include "tnUtils/Assert.h"

namespace tarn {

namespace {

// Zero bytes appended to an image before its reader sees it, so that a
// reader that overruns a short image by a little reads zeros inside the
// buffer; the loader then reports the overrun.
constexpr std::size_t kReadSlack = 64;

std::string ObjectName(OID oid) {
    return "object " + ToString(oid);
}

// Destroys an object that never became resident (a failed load).
void DiscardUnregistered(ptr<IPersistable> obj) {
    ObjSysState& state = obj->GetSysState();
    state.ClearFlag(DBP_PO_DIRTY);
    state.m_cspace = nullptr;
    obj->Destroy();
}

}  // namespace

CSpace::CSpace(std::shared_ptr<IStore> store)
    : m_store(store != nullptr ? std::move(store) : std::make_shared<MemoryStore>()) {
    m_nextIdentity = m_store->NextIdentity();
    for (const auto& [name, oid] : m_store->Roots()) {
        if (oid != 0) {
            m_roots.emplace(name, oid);
        }
    }
}

CSpace::~CSpace() {
    TARN_ASSERT(GetThreadCSpace() != this);
    {
        std::lock_guard<std::mutex> lock(m_externalRefsMutex);
        for (SpaceRefLink* link : m_externalRefs) {
            link->ref->Unbind();
            link->space = nullptr;
        }
        m_externalRefs.clear();
    }
    // Uncommitted changes die with the space: clear the flags that forbid
    // destruction, then destroy every resident.
    for (auto& [oid, resident] : m_residents) {
        ObjSysState& state = resident.obj->GetSysState();
        state.ClearFlag(DBP_PO_DIRTY);
        state.m_cspace = nullptr;
    }
    for (auto& [oid, resident] : m_residents) {
        resident.obj->Destroy();
    }
}

void CSpace::RequireExclusive() const {
    TARN_ASSERT(GetRecordedLockStatus(this) > 0);
}

ssize_t CSpace::NumResidents() const {
    std::lock_guard<std::mutex> lock(m_residentsMutex);
    return static_cast<ssize_t>(m_residents.size());
}

ptr<IPersistable> CSpace::FindResident(OID oid) const {
    std::lock_guard<std::mutex> lock(m_residentsMutex);
    auto it = m_residents.find(oid.value_);
    return it == m_residents.end() ? ptr<IPersistable>() : it->second.obj;
}

namespace {

void CheckClass(ptr<IPersistable> obj, OID oid, const ReflectedClass* expected) {
    if (expected == nullptr) {
        return;
    }
    const ReflectedClass* actual = obj->GetReflectedClass();
    if (actual != expected) {
        throw RuntimeError(RuntimeError::Category::Damaged, ObjectName(oid) + " is of class '" +
                                                                actual->m_name + "', not '" +
                                                                expected->m_name + "'");
    }
}

}  // namespace

ptr<IPersistable> CSpace::Resolve(OID oid, const ReflectedClass* expected) {
    TARN_ASSERT(!oid.IsNull());
    ptr<IPersistable> found = FindResident(oid);
    if (found.m_self != nullptr) {
        CheckClass(found, oid, expected);
        return found;
    }
    // Load outside the mutex (the reader is the module's code), then enter
    // the object unless another shared holder entered it meanwhile.
    ptr<IPersistable> loaded = Load(oid, expected);
    if (m_loadCheck != nullptr) {
        try {
            m_loadCheck->Loaded(*this, oid, loaded, expected);
        } catch (...) {
            DiscardUnregistered(loaded);
            throw;
        }
    }
    std::lock_guard<std::mutex> lock(m_residentsMutex);
    auto it = m_residents.find(oid.value_);
    if (it != m_residents.end()) {
        DiscardUnregistered(loaded);
        return it->second.obj;
    }
    ObjSysState& state = loaded->GetSysState();
    state.m_cspace = this;
    state.m_lastTouchedTime = static_cast<int32>(m_tick);
    try {
        m_residents.emplace(oid.value_, Resident{loaded, m_tick++});
    } catch (...) {
        DiscardUnregistered(loaded);
        throw;
    }
    ++m_stats.numLoaded;
    return loaded;
}

// Loading an image:
//   1. the store's image of `oid` (none -> error);
//   2. the registered class of the image's class name (none, or not the
//      expected class -> error), and the class's image check, if it has one
//      (a malformed image -> error, before any reader sees it);
//   3. an empty instance from the class's creation function, asked for its
//      IPersistable interface (none -> error);
//   4. its Deserialise slot over the image (followed by kReadSlack zeros);
//   5. the reader must have consumed exactly the image (else error).
// The instance gets its identity; the caller makes it resident.
ptr<IPersistable> CSpace::Load(OID oid, const ReflectedClass* expected) {
    std::optional<StoredImage> image = m_store->Load(oid.value_);
    if (!image) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           ObjectName(oid) + " has no image in the store");
    }
    const ReflectedClass* rc = FindReflectedClass(image->className);
    if (rc == nullptr) {
        throw RuntimeError(
            RuntimeError::Category::Damaged,
            ObjectName(oid) + " has an image of unknown class '" + image->className + "'");
    }
    if (expected != nullptr && rc != expected) {
        throw RuntimeError(RuntimeError::Category::Damaged,
                           ObjectName(oid) + " has an image of class '" + image->className +
                               "' where '" + expected->m_name + "' was expected");
    }
    if (ImageCheckFn check = FindImageCheck(rc)) {
        std::string problem = check(image->bytes.data(), image->bytes.size());
        if (!problem.empty()) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               ObjectName(oid) + " has a malformed image of class '" +
                                   image->className + "': " + problem);
        }
    }
    ptr<IObject> created = rc->m_createFn != nullptr ? rc->m_createFn() : ptr<IObject>();
    if (created.m_self == nullptr) {
        throw RuntimeError("class '" + image->className + "' cannot create instances");
    }
    ptr<IPersistable> obj =
        ptr<IPersistable>::FromAny(created->QueryInterface(GetReflectedInterface<IPersistable>()));
    if (obj.m_self == nullptr) {
        created->Destroy();
        throw RuntimeError("class '" + image->className + "' is not persistable");
    }
    const std::size_t size = image->bytes.size();
    try {
        image->bytes.resize(size + kReadSlack, 0);
        InputArchive ar(image->bytes.data());
        obj->Deserialise(ar);
        const auto consumed = static_cast<std::size_t>(ar.ptr() - image->bytes.data());
        if (consumed != size) {
            throw RuntimeError(RuntimeError::Category::Damaged,
                               ObjectName(oid) + " of class '" + image->className +
                                   "': reading consumed " + std::to_string(consumed) + " of " +
                                   std::to_string(size) + " bytes");
        }
    } catch (...) {
        DiscardUnregistered(obj);
        throw;
    }
    obj->GetPersistObjState().m_oid = oid;
    return obj;
}

ptr<IPersistable> CSpace::CreateObject(std::string_view className) {
    RequireExclusive();
    const ReflectedClass* rc = FindReflectedClass(className);
    if (rc == nullptr || rc->m_createFn == nullptr) {
        throw RuntimeError("unknown class '" + std::string(className) + "'");
    }
    ptr<IObject> created = rc->m_createFn();
    ptr<IPersistable> obj =
        ptr<IPersistable>::FromAny(created->QueryInterface(GetReflectedInterface<IPersistable>()));
    if (obj.m_self == nullptr) {
        created->Destroy();
        throw RuntimeError("class '" + std::string(className) + "' is not persistable");
    }
    try {
        RegisterGcObject(created);
    } catch (...) {
        created->Destroy();
        throw;
    }
    obj->OnCreate(true);
    return obj;
}

void CSpace::AdoptNew(ptr<IPersistable> obj) {
    RequireExclusive();
    ObjSysState& state = obj->GetSysState();
    PersistObjState& pstate = obj->GetPersistObjState();
    TARN_ASSERT(state.m_cspace == nullptr && pstate.m_oid.IsNull());
    const OID oid{Seid(m_nextIdentity)};
    m_dirty.push_back(Queued{oid.value_, m_tick});
    try {
        std::lock_guard<std::mutex> lock(m_residentsMutex);
        m_residents.emplace(oid.value_, Resident{obj, m_tick});
    } catch (...) {
        m_dirty.pop_back();
        throw;
    }
    ++m_nextIdentity;
    pstate.m_oid = oid;
    state.m_cspace = this;
    state.m_lastTouchedTime = static_cast<int32>(m_tick++);
    state.SetFlag(DBP_GC_NOT_REGISTERED_IN_EXTENT);
    state.SetFlag(DBP_PO_DIRTY);
    ++m_numDirty;
    ++m_stats.numRegistered;
    ++m_populationDelta[obj->GetReflectedClass()->m_name];
}

void CSpace::QueueDirty(ptr<IPersistable> obj) {
    RequireExclusive();
    ObjSysState& state = obj->GetSysState();
    if (state.GetFlag(DBP_PO_DIRTY)) {
        return;
    }
    m_dirty.push_back(EntryOf(obj));
    state.SetFlag(DBP_PO_DIRTY);
    ++m_numDirty;
}

void CSpace::QueueDeletion(ptr<IPersistable> obj, bool subTree) {
    RequireExclusive();
    ObjSysState& state = obj->GetSysState();
    const bool queued = state.GetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION);
    if (queued && !subTree) {
        return;
    }
    m_deletions.push_back(Deletion{EntryOf(obj), subTree});
    if (!queued) {
        state.SetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION);
        ++m_numDeletions;
        --m_populationDelta[obj->GetReflectedClass()->m_name];
    }
}

// Constant time: the queues' entries are checked at commit.
void CSpace::Detach(ptr<IPersistable> obj) {
    RequireExclusive();
    ObjSysState& state = obj->GetSysState();
    if (state.GetFlag(DBP_PO_DIRTY)) {
        state.ClearFlag(DBP_PO_DIRTY);
        --m_numDirty;
    }
    if (state.GetFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION)) {
        state.ClearFlag(DBP_PO_MARKED_DURING_ASYNC_DELETION);
        --m_numDeletions;
    }
    {
        std::lock_guard<std::mutex> lock(m_residentsMutex);
        auto it = m_residents.find(obj->GetPersistObjState().m_oid.value_);
        if (it != m_residents.end() && it->second.obj.m_self == obj.m_self) {
            m_residents.erase(it);
        }
    }
    state.m_cspace = nullptr;
}

CSpace::Queued CSpace::EntryOf(ptr<IPersistable> obj) const {
    const uint64 oid = obj->GetPersistObjState().m_oid.value_;
    std::lock_guard<std::mutex> lock(m_residentsMutex);
    auto it = m_residents.find(oid);
    TARN_ASSERT(it != m_residents.end() && it->second.obj.m_self == obj.m_self);
    return Queued{oid, it->second.tick};
}

ptr<IPersistable> CSpace::FlaggedResident(const Queued& entry, int flag) const {
    std::lock_guard<std::mutex> lock(m_residentsMutex);
    auto it = m_residents.find(entry.oid);
    if (it == m_residents.end() || it->second.tick != entry.tick ||
        !it->second.obj->GetSysState().GetFlag(flag)) {
        return ptr<IPersistable>();
    }
    return it->second.obj;
}

std::vector<OID> CSpace::DirtyInQueueOrder() const {
    RequireExclusive();
    std::vector<OID> order;
    for (const Queued& entry : m_dirty) {
        if (FlaggedResident(entry, DBP_PO_DIRTY).m_self != nullptr) {
            order.push_back(OID(Seid(entry.oid)));
        }
    }
    return order;
}

void CSpace::SetRoot(const std::string& name, OID oid) {
    RequireExclusive();
    m_changedRoots[name] = oid.value_;
    if (oid.IsNull()) {
        m_roots.erase(name);
    } else {
        m_roots[name] = oid.value_;
    }
}

void CSpace::SetRoot(const std::string& name, const prefbase& ref) {
    TARN_ASSERT(!ref.m_oid.IsNull() || !ref.IsBound());
    SetRoot(name, ref.m_oid);
}

OID CSpace::GetRoot(std::string_view name) const {
    auto it = m_roots.find(name);
    return it == m_roots.end() ? OID() : OID(Seid(it->second));
}

std::map<std::string, OID> CSpace::Roots() const {
    std::map<std::string, OID> roots;
    for (const auto& [name, oid] : m_roots) {
        roots.emplace(name, OID(Seid(oid)));
    }
    return roots;
}

void CSpace::SetCounter(const std::string& name, uint64 value) {
    RequireExclusive();
    m_pendingCounters[name] = value;
}

std::optional<uint64> CSpace::GetCounter(std::string_view name) const {
    auto it = m_pendingCounters.find(name);
    if (it != m_pendingCounters.end()) {
        return it->second;
    }
    return m_store->FindCounter(name);
}

std::map<std::string, uint64> CSpace::CountersWithPrefix(std::string_view prefix) const {
    std::map<std::string, uint64> found;
    for (const auto& [name, value] : m_store->Counters()) {
        if (name.starts_with(prefix)) {
            found.emplace(name, value);
        }
    }
    for (auto it = m_pendingCounters.lower_bound(prefix);
         it != m_pendingCounters.end() && it->first.starts_with(prefix); ++it) {
        found[it->first] = it->second;
    }
    return found;
}

std::string CSpace::PopulationCounter(std::string_view className) {
    return "population:" + std::string(className);
}

int64 CSpace::Population(std::string_view className) const {
    const int64 stored = static_cast<int64>(GetCounter(PopulationCounter(className)).value_or(0));
    auto it = m_populationDelta.find(className);
    return stored + (it == m_populationDelta.end() ? 0 : it->second);
}

void CSpace::AttachExternalRef(SpaceRefLink* link) {
    std::lock_guard<std::mutex> lock(m_externalRefsMutex);
    m_externalRefs.insert(link);
    link->space = this;
}

void CSpace::DetachExternalRef(SpaceRefLink* link) {
    std::lock_guard<std::mutex> lock(m_externalRefsMutex);
    m_externalRefs.erase(link);
    link->space = nullptr;
}

}  // namespace tarn
