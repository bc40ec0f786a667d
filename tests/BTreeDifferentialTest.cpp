// The persistent B+tree map driven side by side with std::map by the same
// random operations: keyed access, both insertions, deletion by key and by
// iterator, lookups, bounds and short iterator walks in both directions, over
// short (local) and long (heap) keys. Small trees are checked after every
// operation, large ones at regular checkpoints; large trees are also evicted
// and read back from the store while they change. Whole trees are deleted key
// by key in several orders down to the empty root leaf.
//
// Every node handed to deletion is followed: it is handed over once, is no
// longer reachable from the tree, stays resident until the next commit and is
// destroyed by exactly that commit.

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::MakeKey;
using testing::MakePayload;
using testing::MakeSite;

using Payload = OffsetOpsOnField<int64>;
using Model = std::map<FieldId, Payload>;

class BTreeModel : public testing::BTreeSpaceTest {
protected:
    int Pct() { return static_cast<int>(m_rng() % 100); }

    // A random key: oid 1..3, a path of 0..8 bytes (local buffer) or 17..24
    // bytes (heap buffer) drawn from a four-letter alphabet, so that keys
    // share prefixes and one path is often a proper prefix of another.
    FieldId RandomKey() {
        const uint64 len = m_rng() % 4 == 0 ? 17 + m_rng() % 8 : m_rng() % 9;
        std::string path;
        for (uint64 i = 0; i < len; ++i) {
            path.push_back(static_cast<char>('a' + m_rng() % 4));
        }
        return MakeKey(1 + m_rng() % 3, path);
    }

    // Records zero to two random offsets into the empty table `p`.
    void FillRandomly(Payload& p) {
        for (uint64 s = m_rng() % 3; s > 0; --s) {
            p.Insert(MakeSite(static_cast<uint32>(m_rng() % 5)), m_time++,
                     static_cast<int64>(m_rng() % 1000) - 500);
        }
    }

    void CheckSame(const Map::const_iterator& it, Model::const_iterator mit, bool payload) {
        ASSERT_EQ(it == map().end(), mit == m_model.end());
        if (mit != m_model.end()) {
            ASSERT_EQ(it->first, mit->first);
            ASSERT_TRUE(!payload || it->second == mit->second);
        }
    }

    // Compares a position, then a few steps forward or back from it, both
    // sides in lockstep (keys only: CheckAll compares every payload).
    void Walk(Map::const_iterator it, Model::const_iterator mit, bool forward, uint64 steps) {
        ASSERT_NO_FATAL_FAILURE(CheckSame(it, mit, true));
        for (uint64 s = 0; s < steps; ++s) {
            if (mit == (forward ? m_model.end() : m_model.begin())) {
                ASSERT_TRUE(it == (forward ? map().end() : map().begin()));
                return;
            }
            forward ? (void)(++it, ++mit) : (void)(--it, --mit);
            ASSERT_NO_FATAL_FAILURE(CheckSame(it, mit, false));
        }
    }

    // Adds or replaces `key` in one of the three ways.
    void Grow(const FieldId& key) {
        Payload p;
        FillRandomly(p);
        switch (m_rng() % 3) {
            case 0: {  // keyed access, then a change through the reference
                Payload& q = m_model[key];
                Payload& r = map()[key];
                ASSERT_EQ(r, q);
                const Guid site = MakeSite(static_cast<uint32>(m_rng() % 4));
                const ssize_t t = m_time++;
                r.Insert(site, t, 3);
                q.Insert(site, t, 3);
                break;
            }
            case 1: {
                auto [it, created] = testing::InsertEntry(map(), key, p);
                auto [mit, mcreated] = m_model.try_emplace(key);
                if (mcreated) {
                    mit->second = p;
                }
                ASSERT_EQ(created, mcreated);
                ASSERT_NO_FATAL_FAILURE(CheckSame(it, mit, true));
                break;
            }
            default: {
                const bool replace = m_rng() % 2 == 0;
                const bool created = m_model.count(key) == 0;
                ASSERT_EQ(map().Insert(key, p, replace), created);
                if (created || replace) {
                    m_model[key] = p;
                }
            }
        }
    }

    // Removes `key` by Delete, erase of the key or erase of its iterator; an
    // absent key changes nothing.
    void Remove(const FieldId& key) {
        const int64 before = Log().numAsyncDeleteObject;
        const ssize_t dirty = m_space.NumDirty();
        const bool present = m_model.erase(key) == 1;
        switch (m_rng() % 3) {
            case 0:
                ASSERT_EQ(map().Delete(key), present);
                break;
            case 1:
                ASSERT_EQ(map().erase(key), present ? 1 : 0);
                break;
            default: {
                auto it = map().find(key);
                ASSERT_EQ(it != map().end(), present);
                if (present) {
                    map().erase(it);
                }
            }
        }
        ASSERT_TRUE(present || m_space.NumDirty() == dirty);
        // A node just handed over is still in memory, empty, until commit.
        if (Log().numAsyncDeleteObject > before) {
            ASSERT_TRUE(m_space.IsResident(Log().lastDeleted->GetPersistObjState().m_oid));
        }
    }

    // A lookup through the const or the mutable interface, and a walk from it.
    void Query(const FieldId& key) {
        const Map& c = map();
        const bool viaMutable = m_rng() % 2 == 0;
        const bool forward = m_rng() % 2 == 0;
        const uint64 steps = 1 + m_rng() % 12;
        switch (m_rng() % 6) {
            case 0: {
                auto mit = m_model.find(key);
                Walk(viaMutable ? Map::const_iterator(map().find(key)) : c.find(key), mit, forward,
                     mit == m_model.end() ? 0 : steps);
                const Payload* r = c.rFind(key);
                ASSERT_EQ(r != nullptr, mit != m_model.end());
                ASSERT_TRUE(!r || *r == mit->second);
                ASSERT_EQ(c.count(key), r ? 1 : 0);
                break;
            }
            case 1:
            case 2:
                return Walk(
                    viaMutable ? Map::const_iterator(map().lower_bound(key)) : c.lower_bound(key),
                    m_model.lower_bound(key), forward, steps);
            case 3:
            case 4:
                return Walk(
                    viaMutable ? Map::const_iterator(map().upper_bound(key)) : c.upper_bound(key),
                    m_model.upper_bound(key), forward, steps);
            default: {
                ASSERT_NO_FATAL_FAILURE(Walk(c.begin(), m_model.begin(), true, steps));
                ASSERT_NO_FATAL_FAILURE(Walk(c.end(), m_model.end(), false, steps));
                auto rit = c.rbegin();
                auto mit = m_model.rbegin();
                for (uint64 s = 0; s < steps && mit != m_model.rend(); ++s, ++rit, ++mit) {
                    ASSERT_FALSE(rit == c.rend());
                    ASSERT_EQ(rit->first, mit->first);
                }
            }
        }
    }

    // One random operation; two thirds of them change the map. Insertions take
    // keys of the pool; lookups and deletions sometimes take a fresh key,
    // which is most likely absent.
    void Step() {
        const FieldId& pooled = m_pool[m_rng() % m_pool.size()];
        const FieldId key = Pct() < 90 ? pooled : RandomKey();
        if (Pct() < 67) {
            ++m_changes;
            if (Pct() < m_growPercent) {
                ASSERT_NO_FATAL_FAILURE(Grow(pooled));
            } else {
                ASSERT_NO_FATAL_FAILURE(Remove(key));
            }
        } else {
            ASSERT_NO_FATAL_FAILURE(Query(key));
        }
        ASSERT_EQ(map().size(), static_cast<ssize_t>(m_model.size()));
    }

    // Every invariant, and the nodes: exactly those registered and not yet
    // handed to deletion. (A node handed over is left empty, so the checker
    // would also report it if the tree still reached it.)
    void CheckTree() {
        ASSERT_BTREE_OK(map());
        ASSERT_EQ(map().GetNumNodes(), Log().numRegisterGcObject - Log().numAsyncDeleteObject);
    }

    // The above, the map's own validation and the whole content.
    void CheckAll() {
        ASSERT_NO_FATAL_FAILURE(CheckTree());
        map().Validate();
        auto it = static_cast<const Map&>(map()).begin();
        for (const auto& [k, v] : m_model) {
            ASSERT_FALSE(it == map().end());
            ASSERT_EQ(it->first, k);
            ASSERT_EQ(it->second, v);
            ++it;
        }
        ASSERT_TRUE(it == map().end());
    }

    // The nodes handed over since the last commit are exactly the queued
    // deletions, and the commit destroys exactly them. Every `m_evictEvery`
    // commits, every resident is released, the header too, so that the next
    // operations load the nodes they touch (neighbours too); before that, and
    // before every commit when nothing is evicted, nothing may have changed
    // without a dirty mark.
    void CommitAndCheck(bool evict = false) {
        evict = evict || (m_evictEvery > 0 && ++m_commits % m_evictEvery == 0);
        if (evict || m_evictEvery == 0) {
            ASSERT_NO_FATAL_FAILURE(ExpectNoUnmarkedChange());
        }
        const int64 dropped = Log().numAsyncDeleteObject - m_droppedAtCommit;
        ASSERT_EQ(m_space.NumQueuedDeletions(), dropped);
        const int64 deletedBefore = m_space.Stats().numDeleted;
        m_space.Commit();
        ASSERT_EQ(m_space.Stats().numDeleted - deletedBefore, dropped);
        m_droppedAtCommit = Log().numAsyncDeleteObject;
        if (evict) {
            const OID mapId = m_map->GetPersistObjState().m_oid;
            m_space.DropCleanResidents();
            ASSERT_EQ(m_space.NumResidents(), 0);
            m_map = static_cast<Map*>(m_space.Resolve(mapId, nullptr).m_self);
            ASSERT_NE(m_map, nullptr);
        }
    }

    // Runs the phases (operations, percentage of changes that insert) over a
    // new pool of distinct keys, checking after each phase that the tree
    // reached the expected height; then reloads and clears the map.
    struct Phase {
        int ops;
        int growPercent;
        ssize_t height;
    };
    void Round(std::size_t poolSize, std::initializer_list<Phase> phases) {
        std::set<FieldId> distinct;
        while (distinct.size() < poolSize) {
            distinct.insert(RandomKey());
        }
        m_pool.assign(distinct.begin(), distinct.end());
        std::shuffle(m_pool.begin(), m_pool.end(), m_rng);
        for (const Phase& phase : phases) {
            m_growPercent = phase.growPercent;
            for (int op = 1; op <= phase.ops; ++op) {
                ASSERT_NO_FATAL_FAILURE(Step()) << "operation " << op;
                if (op % m_checkEvery == 0) {
                    ASSERT_NO_FATAL_FAILURE(CheckTree()) << "operation " << op;
                }
                if (op % m_commitEvery == 0) {
                    ASSERT_NO_FATAL_FAILURE(CheckAll()) << "operation " << op;
                    ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
                }
            }
            ASSERT_NO_FATAL_FAILURE(CheckAll());
            ASSERT_EQ(map().m_height, phase.height) << "pool " << poolSize;
        }
        // Everything committed and every resident dropped: reading the tree
        // back from the store loads the header and each node once.
        const int64 loadedBefore = m_space.Stats().numLoaded;
        ASSERT_NO_FATAL_FAILURE(CommitAndCheck(true));
        ASSERT_NO_FATAL_FAILURE(CheckAll());
        EXPECT_EQ(m_space.Stats().numLoaded - loadedBefore, map().GetNumNodes() + 1);
        map().clear();
        m_model.clear();
        ASSERT_BTREE_OK(map());
        m_space.Commit();
        Log() = RuntimeCallLog();
        m_droppedAtCommit = 0;
    }

    // Deletes every key of the model in `order`, then expects the empty root
    // leaf, which is the first leaf of before (every merge keeps its left node).
    void DeleteAll(const std::vector<FieldId>& order) {
        const OID first = map().m_firstLeaf.Get()->GetPersistObjState().m_oid;
        int op = 0;
        for (const FieldId& key : order) {
            ASSERT_NO_FATAL_FAILURE(Remove(key));
            if (++op % m_checkEvery == 0 || m_model.size() < 120) {
                ASSERT_NO_FATAL_FAILURE(CheckAll());
            }
            if (op % m_commitEvery == 0) {
                ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
            }
        }
        ASSERT_NO_FATAL_FAILURE(Remove(order.front()));  // absent from the empty root leaf
        ASSERT_EQ(map().m_height, 0);
        EXPECT_EQ(map().m_root.Get(), map().m_firstLeaf.Get());
        EXPECT_EQ(map().m_firstLeaf.Get()->GetPersistObjState().m_oid, first);
        EXPECT_EQ(map().m_firstLeaf.Get()->m_numKeyEntrys, 0);
        m_evictEvery = 0;
        ASSERT_NO_FATAL_FAILURE(CommitAndCheck());
        EXPECT_EQ(m_space.NumResidents(), 2);  // the header and the root leaf
    }

    // Keys 0..n-1 in ascending order; returns them.
    std::vector<FieldId> FillModel(uint64 n) {
        std::vector<FieldId> keys;
        for (uint64 i = 0; i < n; ++i) {
            keys.push_back(MakeKey(i));
            m_model[keys.back()] = MakePayload(int64(i * 3 + 1));
            map().Insert(keys.back(), m_model[keys.back()], false);
        }
        EXPECT_NO_FATAL_FAILURE(CheckAll());
        EXPECT_NO_FATAL_FAILURE(CommitAndCheck());
        return keys;
    }

    std::mt19937_64 m_rng{20240601};
    std::vector<FieldId> m_pool;
    Model m_model;
    ssize_t m_time = 0;
    int m_growPercent = 50;
    int m_checkEvery = 1;
    int m_commitEvery = 37;
    int m_evictEvery = 0;
    int m_commits = 0;
    int64 m_droppedAtCommit = 0;
    int64 m_changes = 0;
};

// Together the two random tests make over 1,000,000 changes (insertions and
// deletions) and half as many lookups and walks.
TEST_F(BTreeModel, SmallTreesCheckedAfterEveryOperation) {
    // Around the root leaf's split and the collapse back to it, then height 1
    // with a handful of leaves.
    for (int round = 0; round < 5; ++round) {
        ASSERT_NO_FATAL_FAILURE(Round(150, {{10000, 80, 1}, {10000, 20, 0}}));
    }
    for (int round = 0; round < 4; ++round) {
        ASSERT_NO_FATAL_FAILURE(Round(400, {{25000, 60, 1}, {25000, 40, 1}}));
    }
    EXPECT_GE(m_changes, 195000);
}

TEST_F(BTreeModel, LargeTreesGrowShrinkAndReloadFromTheStore) {
    m_checkEvery = 25000;
    m_commitEvery = 25000;
    m_evictEvery = 2;
    ASSERT_NO_FATAL_FAILURE(Round(2000, {{100000, 70, 1}}));
    ASSERT_NO_FATAL_FAILURE(Round(12000, {{200000, 85, 2}, {200000, 15, 1}}));
    ASSERT_NO_FATAL_FAILURE(Round(60000, {{350000, 75, 2}, {200000, 50, 2}, {200000, 30, 2}}));
    EXPECT_GE(m_changes, 810000);
}

TEST_F(BTreeModel, DeleteEveryKeyAscendingDescendingAndRandom) {
    m_checkEvery = 500;
    m_commitEvery = 1000;
    for (int order = 0; order < 3; ++order) {
        SCOPED_TRACE(order);
        std::vector<FieldId> keys = FillModel(12000);
        ASSERT_EQ(map().m_height, 2);
        if (order == 1) {
            std::reverse(keys.begin(), keys.end());
        } else if (order == 2) {
            std::shuffle(keys.begin(), keys.end(), m_rng);
        }
        ASSERT_NO_FATAL_FAILURE(DeleteAll(keys));
    }
}

// Height 3 (about 260,000 keys): internal nodes then have cousins, and an
// internal balance can rotate through an anchor above both parents.
TEST_F(BTreeModel, DeleteEveryKeyOfHeight3TreeInRandomOrder) {
    m_checkEvery = 60000;
    m_commitEvery = 30000;
    m_evictEvery = 2;
    std::vector<FieldId> keys = FillModel(265000);
    ASSERT_EQ(map().m_height, 3);
    std::shuffle(keys.begin(), keys.end(), m_rng);
    ASSERT_NO_FATAL_FAILURE(DeleteAll(keys));
}

}  // namespace
}  // namespace tarn
