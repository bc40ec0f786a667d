#pragma once

// Persistent handles to one B+tree map object.
//
// btreeset<M> is a persistent reference to an M (a B+tree map class such as
// FieldIdToOffsetOpsOnInt64FieldMap) that forwards the container operations
// to the referenced object; btreemap<M> adds keyed access. A handle does not
// own the map: the object space does. A new handle is null until OnCreate
// creates and binds a map. Every forwarding operation reaches the map
// through operator*, which is GetNotNull: the reference must be set and its
// object loadable. Use on a thread that holds the map's space exclusively.

#include <utility>

#include "tnPersistStore/pref.h"

namespace tarn {

template <typename M>
class btreeset : public cref<M> {
public:
    using map_type = M;
    using key_type = typename M::key_type;
    using value_type = typename M::value_type;
    using size_type = typename M::size_type;
    using iterator = typename M::iterator;
    using const_iterator = typename M::const_iterator;
    using reverse_iterator = typename M::reverse_iterator;
    using const_reverse_iterator = typename M::const_reverse_iterator;

    btreeset() : cref<M>() {}
    ~btreeset() = default;

    // Creates a new, empty map object, registers it with the runtime and
    // makes this handle refer to it. The flag is accepted and not used.
    void OnCreate(bool /*local*/) { this->Set(DollarNew(new M())); }

    void clear() { (**this).clear(); }

    size_type size() const { return (**this).size(); }
    bool empty() const { return (**this).empty(); }
    size_type count(const key_type& key) const { return (**this).count(key); }

    iterator begin() { return (**this).begin(); }
    iterator end() { return (**this).end(); }
    const_iterator begin() const { return static_cast<const M&>(**this).begin(); }
    const_iterator end() const { return static_cast<const M&>(**this).end(); }
    reverse_iterator rbegin() { return (**this).rbegin(); }
    reverse_iterator rend() { return (**this).rend(); }
    const_reverse_iterator rbegin() const { return static_cast<const M&>(**this).rbegin(); }
    const_reverse_iterator rend() const { return static_cast<const M&>(**this).rend(); }

    iterator find(const key_type& key) { return (**this).find(key); }
    const_iterator find(const key_type& key) const {
        return static_cast<const M&>(**this).find(key);
    }
    iterator lower_bound(const key_type& key) { return (**this).lower_bound(key); }
    const_iterator lower_bound(const key_type& key) const {
        return static_cast<const M&>(**this).lower_bound(key);
    }
    iterator upper_bound(const key_type& key) { return (**this).upper_bound(key); }
    const_iterator upper_bound(const key_type& key) const {
        return static_cast<const M&>(**this).upper_bound(key);
    }

    std::pair<iterator, bool> insert(const value_type& x) { return (**this).insert(x); }
    size_type erase(const key_type& key) { return (**this).erase(key); }
    void erase(iterator pos) { (**this).erase(pos); }

    // Exchanges the contents of the two referenced maps (not the references).
    void swap(btreeset& rhs) { (**this).swap(*rhs); }
};

template <typename M>
class btreemap : public btreeset<M> {
public:
    using key_type = typename M::key_type;
    using mapped_type = typename M::mapped_type;

    btreemap() : btreeset<M>() {}
    ~btreemap() = default;

    // The value of `key`, created empty when absent; its node is marked dirty.
    mapped_type& operator[](const key_type& key) { return (**this)[key]; }
    // The value of `key`, or null.
    const mapped_type* find_2(const key_type& key) const {
        return static_cast<const M&>(**this).rFind(key);
    }
};

}  // namespace tarn
