#pragma once

// A store that passes every call to another store: the base of stores that
// watch or change a few calls (counting what commits write, failing a commit
// on purpose) and leave the rest alone. Shares the store it forwards to;
// thread-safety is that store's.

#include <memory>

#include "tnBackends/IStore.h"

namespace tarn {

class ForwardingStore : public IStore {
public:
    explicit ForwardingStore(std::shared_ptr<IStore> inner) : m_inner(std::move(inner)) {}

    std::optional<StoredImage> Load(uint64 oid) override { return m_inner->Load(oid); }
    std::optional<uint64> FindRoot(std::string_view name) override {
        return m_inner->FindRoot(name);
    }
    std::map<std::string, uint64> Roots() override { return m_inner->Roots(); }
    std::optional<uint64> FindCounter(std::string_view name) override {
        return m_inner->FindCounter(name);
    }
    std::map<std::string, uint64> Counters() override { return m_inner->Counters(); }
    uint64 NextIdentity() override { return m_inner->NextIdentity(); }
    void Commit(const CommitBatch& batch) override { m_inner->Commit(batch); }
    void ForEachIdentity(const std::function<void(uint64)>& fn) override {
        m_inner->ForEachIdentity(fn);
    }
    std::optional<uint64> LargestIdentity() override { return m_inner->LargestIdentity(); }
    ImageCounts Stats() override { return m_inner->Stats(); }

protected:
    IStore& Inner() { return *m_inner; }

private:
    std::shared_ptr<IStore> m_inner;
};

}  // namespace tarn
