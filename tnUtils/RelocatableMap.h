#pragma once

// An ordered map held through one owning heap pointer.
//
// A B+tree leaf keeps its entries in raw storage and moves them with plain
// byte copies, running no constructor or destructor. A std::map may point
// into its own object (its header node), so it must never move; this wrapper
// keeps the map on the heap and is itself only that one pointer wide, which
// may be copied to any address as bytes (the old bytes are then abandoned,
// never destroyed).
//
// Ownership: the wrapper alone owns *m_map and frees it in its destructor or
// when an assignment replaces it. After construction m_map is never null;
// the destructor still tolerates null. Every copy (construction or
// assignment) makes a map of its own, sharing nothing with the source.
// Not thread-safe; it follows the rules of the object that contains it.

#include <map>
#include <type_traits>
#include <utility>

namespace tarn {

class Archive;
class InputArchive;
class xostream;

template <typename M>
class RelocatableMap {
public:
    using map_type = M;
    using key_type = typename M::key_type;
    using mapped_type = typename M::mapped_type;
    using value_type = typename M::value_type;
    using size_type = typename M::size_type;
    using difference_type = typename M::difference_type;
    using key_compare = typename M::key_compare;
    using value_compare = typename M::value_compare;
    using allocator_type = typename M::allocator_type;
    using reference = typename M::reference;
    using const_reference = typename M::const_reference;
    using iterator = typename M::iterator;
    using const_iterator = typename M::const_iterator;
    using reverse_iterator = typename M::reverse_iterator;
    using const_reverse_iterator = typename M::const_reverse_iterator;

    RelocatableMap() : m_map(new M) {}
    RelocatableMap(const RelocatableMap& rhs) : m_map(new M(*rhs.m_map)) {}
    explicit RelocatableMap(const M& m) : m_map(new M(m)) {}
    ~RelocatableMap() { delete m_map; }

    // The copy is made before the old map is released, so a failed
    // allocation leaves this wrapper as it was; assigning to itself is safe.
    RelocatableMap& operator=(const RelocatableMap& rhs) { return *this = *rhs.m_map; }
    RelocatableMap& operator=(const M& m) {
        M* copy = new M(m);
        delete m_map;
        m_map = copy;
        return *this;
    }

    void swap(RelocatableMap& rhs) noexcept { std::swap(m_map, rhs.m_map); }
    void swap(M& m) noexcept { m_map->swap(m); }

    iterator begin() { return m_map->begin(); }
    const_iterator begin() const { return m_map->begin(); }
    iterator end() { return m_map->end(); }
    const_iterator end() const { return m_map->end(); }
    reverse_iterator rbegin() { return m_map->rbegin(); }
    const_reverse_iterator rbegin() const { return m_map->rbegin(); }
    reverse_iterator rend() { return m_map->rend(); }
    const_reverse_iterator rend() const { return m_map->rend(); }

    size_type size() const { return m_map->size(); }
    size_type max_size() const { return m_map->max_size(); }
    size_type count(const key_type& k) const { return m_map->count(k); }
    bool empty() const { return m_map->empty(); }
    allocator_type get_allocator() const { return m_map->get_allocator(); }

    iterator lower_bound(const key_type& k) { return m_map->lower_bound(k); }
    const_iterator lower_bound(const key_type& k) const { return m_map->lower_bound(k); }
    iterator upper_bound(const key_type& k) { return m_map->upper_bound(k); }
    const_iterator upper_bound(const key_type& k) const { return m_map->upper_bound(k); }
    std::pair<iterator, iterator> equal_range(const key_type& k) { return m_map->equal_range(k); }
    std::pair<const_iterator, const_iterator> equal_range(const key_type& k) const {
        return m_map->equal_range(k);
    }
    iterator find(const key_type& k) { return m_map->find(k); }
    const_iterator find(const key_type& k) const { return m_map->find(k); }

    value_compare value_comp() const { return m_map->value_comp(); }
    key_compare key_comp() const { return m_map->key_comp(); }

    void clear() { m_map->clear(); }
    iterator erase(const_iterator pos) { return m_map->erase(pos); }
    iterator erase(iterator pos) { return m_map->erase(pos); }
    size_type erase(const key_type& k) { return m_map->erase(k); }
    iterator erase(const_iterator first, const_iterator last) { return m_map->erase(first, last); }
    std::pair<iterator, bool> insert(const value_type& v) { return m_map->insert(v); }
    iterator insert(const_iterator hint, const value_type& v) { return m_map->insert(hint, v); }

    // The value of `k`, inserted default-constructed first if absent.
    mapped_type& operator[](const key_type& k) { return (*m_map)[k]; }

    M& getmap() { return *m_map; }
    const M& getmap() const { return *m_map; }

    M* m_map;
};

// Same number of entries, and the entries pairwise equal in order (keys and
// values each with their own operator==).
template <typename M>
bool operator==(const RelocatableMap<M>& a, const RelocatableMap<M>& b) {
    if (a.size() != b.size()) {
        return false;
    }
    for (auto i = a.begin(), j = b.begin(); i != a.end(); ++i, ++j) {
        if (!(i->first == j->first) || !(i->second == j->second)) {
            return false;
        }
    }
    return true;
}

template <typename M>
void swap(RelocatableMap<M>& a, RelocatableMap<M>& b) noexcept {
    a.swap(b);
}

// Archiving and printing go through the owned map; the map's own operators
// are found at instantiation by argument-dependent lookup.
template <typename M>
void Serialise(Archive& ar, const RelocatableMap<M>& x) {
    ar << x.getmap();
}

template <typename M>
void Deserialise(InputArchive& ar, RelocatableMap<M>& x) {
    ar >> x.getmap();
}

template <typename M>
Archive& operator<<(Archive& ar, const RelocatableMap<M>& x) {
    Serialise(ar, x);
    return ar;
}

template <typename M>
InputArchive& operator>>(InputArchive& ar, RelocatableMap<M>& x) {
    Deserialise(ar, x);
    return ar;
}

template <typename M>
xostream& operator<<(xostream& os, const RelocatableMap<M>& x) {
    return os << x.getmap();
}

}  // namespace tarn
