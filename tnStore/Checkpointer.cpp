#include "tnStore/Checkpointer.h"

#include <utility>

#include "tnRuntime/CSpaceGuard.h"
#include "tnStore/TreeSummary.h"

namespace tarn {

Checkpointer::Checkpointer(TreeSpace& tree, MemoryBound& memory, Recorder& recorder,
                           std::string dir, bool sync)
    : m_tree(tree), m_memory(memory), m_recorder(recorder), m_dir(std::move(dir)), m_sync(sync) {}

void Checkpointer::Start(uint64 durable, uint64 checkpointed, std::unique_ptr<Journal> journal) {
    m_durable = durable;
    m_checkpointed = checkpointed;
    m_journal = std::move(journal);
    if (m_journal != nullptr) {
        m_journalBytes = m_journal->FileBytes();
    }
}

void Checkpointer::StartNewJournal(uint64 base) {
    Journal::Reset(m_dir, base, m_sync);
    m_journal = std::make_unique<Journal>(
        m_dir, JournalScan{base, base, Journal::kHeaderBytes, Journal::kHeaderBytes}, m_sync);
    CSpaceGuard guard(m_tree.Space(), LockMode::Exclusive);
    m_journalBytes = m_journal->FileBytes();
}

void Checkpointer::AddRecord(const Opid& opid, const FieldId& field, int64 offset) {
    if (m_journal != nullptr) {
        m_journal->AddRecord(opid.s, opid.t, field, offset);
    }
    ++m_pending;
}

void Checkpointer::AddClear() {
    if (m_journal != nullptr) {
        m_journal->AddClear();
    }
    ++m_pending;
}

void Checkpointer::Sync() {
    if (m_journal != nullptr) {
        m_journal->Commit();  // the append and the sync, readers not held up
    }
    CSpaceGuard guard(m_tree.Space(), LockMode::Exclusive);
    m_durable += static_cast<uint64>(m_pending);
    m_pending = 0;
    if (m_journal != nullptr) {
        m_journalBytes = m_journal->FileBytes();
    }
}

bool Checkpointer::JournalPast(std::size_t limit) const {
    return m_journal != nullptr && m_journal->FileBytes() > limit;
}

void Checkpointer::WriteCheckpoint() {
    {
        CSpaceGuard guard(m_tree.Space(), LockMode::Exclusive);
        m_recorder.ApplyDeferred();
        m_tree.Space().SetCounter(kJournalPositionCounter, m_durable);
        SetTreeSummary(m_tree.Space(), m_recorder.Bounds());
        m_tree.CommitToBackend();
        if (DiskStore* disk = m_tree.Disk()) {
            disk->FinishCheckpoint();
        }
        m_checkpointed = m_durable;
        ++m_count;
        m_memory.NotePeak();
        m_memory.Trim();
    }
    if (JournalPast(Journal::kHeaderBytes)) {
        StartNewJournal(m_durable);
    }
}

bool Checkpointer::HasWorkSinceCheckpoint() const {
    return m_tree.HasUncommittedChanges() || m_checkpointed != m_durable ||
           JournalPast(Journal::kHeaderBytes);
}

uint64 Checkpointer::JournalBytes() const {
    return m_journalBytes;
}

}  // namespace tarn
