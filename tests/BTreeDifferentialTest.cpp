// The persistent B+tree map driven side by side with std::map by the same
// random operations: keyed access, both insertions, lookups, bounds and short
// iterator walks in both directions, over short (local) and long (heap) keys,
// with the tree checker run at regular checkpoints. Rounds use key pools of
// different sizes so that trees of height 0 to 2 are grown, cleared and
// grown again.

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "tests/BTreeCheck.h"

namespace tarn {
namespace {

using testing::CheckBTree;
using testing::MakeKey;
using testing::MakeSite;

using Payload = OffsetOpsOnField<int64>;
using Model = std::map<FieldId, Payload>;

class BTreeDifferential : public testing::BTreeSpaceTest {
protected:
    // A random key: oid 1..3, a path of 0..8 bytes (local buffer) or 17..24
    // bytes (heap buffer) drawn from a four-letter alphabet, so that keys
    // share prefixes and one path is often a proper prefix of another.
    FieldId RandomKey() {
        std::uniform_int_distribution<int> oid(1, 3);
        std::uniform_int_distribution<int> longPath(0, 3);
        std::uniform_int_distribution<int> shortLen(0, 8);
        std::uniform_int_distribution<int> longLen(17, 24);
        std::uniform_int_distribution<int> letter(0, 3);
        int len = longPath(m_rng) == 0 ? longLen(m_rng) : shortLen(m_rng);
        std::string path;
        for (int i = 0; i < len; ++i) {
            path.push_back(static_cast<char>('a' + letter(m_rng)));
        }
        return MakeKey(static_cast<uint64>(oid(m_rng)), path);
    }

    const FieldId& Pick() {
        std::uniform_int_distribution<std::size_t> i(0, m_pool.size() - 1);
        return m_pool[i(m_rng)];
    }

    Payload RandomPayload() {
        Payload p;
        std::uniform_int_distribution<int> sites(0, 2);
        for (int s = sites(m_rng); s > 0; --s) {
            p.Insert(MakeSite(static_cast<uint32>(m_rng() % 5)), m_time++,
                     static_cast<int64>(m_rng() % 1000) - 500);
        }
        return p;
    }

    void CheckSame(const Map::const_iterator& it, Model::const_iterator mit) {
        if (mit == m_model.end()) {
            ASSERT_TRUE(it == map().end());
        } else {
            ASSERT_FALSE(it == map().end());
            ASSERT_EQ(it->first, mit->first);
            ASSERT_EQ(it->second, mit->second);
        }
    }

    // A few steps forward or back from a position, both sides in lockstep.
    void Walk(Map::const_iterator it, Model::const_iterator mit, bool forward, int steps) {
        for (int s = 0; s < steps; ++s) {
            if (forward) {
                if (mit == m_model.end()) {
                    ASSERT_TRUE(it == map().end());
                    return;
                }
                ++it;
                ++mit;
            } else {
                if (mit == m_model.begin()) {
                    ASSERT_TRUE(it == map().begin());
                    return;
                }
                --it;
                --mit;
            }
            CheckSame(it, mit);
        }
    }

    void Step() {
        const Map& cmap = map();
        std::uniform_int_distribution<int> op(0, 99);
        int o = op(m_rng);
        const FieldId& key = op(m_rng) < 90 ? Pick() : (m_fresh = RandomKey());
        if (o < 20) {
            // Keyed access, then a change through the returned reference.
            Payload& p = map()[key];
            Payload& q = m_model[key];
            ASSERT_EQ(p, q);
            if (op(m_rng) < 50) {
                Guid site = MakeSite(static_cast<uint32>(m_rng() % 4));
                ssize_t t = m_time++;
                p.Insert(site, t, 3);
                q.Insert(site, t, 3);
            }
        } else if (o < 35) {
            Payload p = RandomPayload();
            auto [it, created] = map().insert({key, p});
            auto [mit, mcreated] = m_model.insert({key, p});
            ASSERT_EQ(created, mcreated);
            CheckSame(Map::const_iterator(it), mit);
        } else if (o < 50) {
            Payload p = RandomPayload();
            bool replace = op(m_rng) < 50;
            bool created = map().Insert(key, p, replace);
            auto mit = m_model.find(key);
            ASSERT_EQ(created, mit == m_model.end());
            if (created || replace) {
                m_model[key] = p;
            }
        } else if (o < 65) {
            CheckSame(cmap.find(key), m_model.find(key));
            const Payload* r = cmap.rFind(key);
            auto mit = m_model.find(key);
            ASSERT_EQ(r != nullptr, mit != m_model.end());
            if (r) {
                ASSERT_EQ(*r, mit->second);
            }
            ASSERT_EQ(cmap.count(key), static_cast<ssize_t>(m_model.count(key)));
        } else if (o < 80) {
            auto it = cmap.lower_bound(key);
            auto mit = m_model.lower_bound(key);
            CheckSame(it, mit);
            Walk(it, mit, op(m_rng) < 50, 1 + op(m_rng) % 12);
        } else if (o < 95) {
            auto it = cmap.upper_bound(key);
            auto mit = m_model.upper_bound(key);
            CheckSame(it, mit);
            Walk(it, mit, op(m_rng) < 50, 1 + op(m_rng) % 12);
        } else if (o < 98) {
            Walk(cmap.begin(), m_model.begin(), true, 1 + op(m_rng) % 30);
            Walk(cmap.end(), m_model.end(), false, 1 + op(m_rng) % 30);
        } else {
            auto rit = cmap.rbegin();
            auto mit = m_model.rbegin();
            for (int s = 0; s < 10 && mit != m_model.rend(); ++s, ++rit, ++mit) {
                ASSERT_FALSE(rit == cmap.rend());
                ASSERT_EQ(rit->first, mit->first);
            }
        }
        ASSERT_EQ(map().size(), static_cast<ssize_t>(m_model.size()));
    }

    // The whole content, both ways, and every invariant.
    void Checkpoint() {
        ASSERT_BTREE_OK(map());
        map().Validate();
        const Map& cmap = map();
        auto it = cmap.begin();
        for (const auto& [k, v] : m_model) {
            ASSERT_FALSE(it == cmap.end());
            ASSERT_EQ(it->first, k);
            ASSERT_EQ(it->second, v);
            ++it;
        }
        ASSERT_TRUE(it == cmap.end());
        auto rit = cmap.rbegin();
        for (auto mit = m_model.rbegin(); mit != m_model.rend(); ++mit, ++rit) {
            ASSERT_EQ(rit->first, mit->first);
        }
        ASSERT_TRUE(rit == cmap.rend());
    }

    std::mt19937_64 m_rng{20240601};
    std::vector<FieldId> m_pool;
    FieldId m_fresh;
    Model m_model;
    ssize_t m_time = 0;
};

TEST_F(BTreeDifferential, MillionRandomOperationsMatchStdMap) {
    // (pool size, operations): small pools keep a root leaf or one level,
    // the large one grows height 2.
    const std::pair<std::size_t, int> rounds[] = {
        {60, 50000}, {150, 100000}, {2000, 200000}, {12000, 350000}, {400, 100000}, {30000, 250000},
    };
    int total = 0;
    ssize_t maxHeight = -1;
    for (const auto& [poolSize, ops] : rounds) {
        SCOPED_TRACE(poolSize);
        m_pool.clear();
        for (std::size_t i = 0; i < poolSize; ++i) {
            m_pool.push_back(RandomKey());
        }
        for (int i = 0; i < ops; ++i) {
            ASSERT_NO_FATAL_FAILURE(Step()) << "operation " << i;
            if (i % 25000 == 24999) {
                ASSERT_NO_FATAL_FAILURE(Checkpoint()) << "operation " << i;
                Commit();
            }
        }
        ASSERT_NO_FATAL_FAILURE(Checkpoint());
        maxHeight = std::max(maxHeight, map().m_height);
        total += ops;
        map().clear();
        m_model.clear();
        ASSERT_BTREE_OK(map());
        Commit();
    }
    EXPECT_GE(total, 1000000);
    EXPECT_EQ(maxHeight, 2);
}

}  // namespace
}  // namespace tarn
