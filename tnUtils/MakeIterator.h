#pragma once

// Bidirectional iterators built from a small policy object.
//
// A container describes one position with a policy type P that provides
//   typename P::value_type
//   P() and copies                     a position
//   void next(), void prev()           step forward / back
//   value_type& deref() const          the element, for change
//   const value_type& const_deref() const
//   bool operator==(const P&) const
// and gets `make_iterator<P>` and `make_const_iterator<P>` for free. The
// adaptors hold nothing but the policy and forward every operation to it;
// whatever the policy does on dereferencing (a persistent container marks the
// node dirty in `deref`) happens exactly once per `*` or `->`.
//
// Only bidirectional stepping is offered: positions in a B+tree have no
// cheap distance, so there is no iterator arithmetic.

#include <cstddef>
#include <iterator>

namespace tarn {

template <typename P>
class make_const_iterator;

template <typename P>
class make_iterator {
public:
    using policy_type = P;
    using iterator_category = std::bidirectional_iterator_tag;
    using value_type = typename P::value_type;
    using difference_type = std::ptrdiff_t;
    using pointer = value_type*;
    using reference = value_type&;

    make_iterator() = default;
    explicit make_iterator(const P& policy) : m_policy(policy) {}

    reference operator*() const { return m_policy.deref(); }
    pointer operator->() const { return &m_policy.deref(); }

    make_iterator& operator++() {
        m_policy.next();
        return *this;
    }
    make_iterator operator++(int) {
        make_iterator old = *this;
        m_policy.next();
        return old;
    }
    make_iterator& operator--() {
        m_policy.prev();
        return *this;
    }
    make_iterator operator--(int) {
        make_iterator old = *this;
        m_policy.prev();
        return old;
    }

    friend bool operator==(const make_iterator& a, const make_iterator& b) {
        return a.m_policy == b.m_policy;
    }
    friend bool operator!=(const make_iterator& a, const make_iterator& b) {
        return !(a.m_policy == b.m_policy);
    }

    const P& policy() const { return m_policy; }
    P& policy() { return m_policy; }

private:
    P m_policy;
};

template <typename P>
class make_const_iterator {
public:
    using policy_type = P;
    using iterator_category = std::bidirectional_iterator_tag;
    using value_type = typename P::value_type;
    using difference_type = std::ptrdiff_t;
    using pointer = const value_type*;
    using reference = const value_type&;

    make_const_iterator() = default;
    explicit make_const_iterator(const P& policy) : m_policy(policy) {}
    // The same position, read-only.
    make_const_iterator(const make_iterator<P>& it) : m_policy(it.policy()) {}

    reference operator*() const { return m_policy.const_deref(); }
    pointer operator->() const { return &m_policy.const_deref(); }

    make_const_iterator& operator++() {
        m_policy.next();
        return *this;
    }
    make_const_iterator operator++(int) {
        make_const_iterator old = *this;
        m_policy.next();
        return old;
    }
    make_const_iterator& operator--() {
        m_policy.prev();
        return *this;
    }
    make_const_iterator operator--(int) {
        make_const_iterator old = *this;
        m_policy.prev();
        return old;
    }

    friend bool operator==(const make_const_iterator& a, const make_const_iterator& b) {
        return a.m_policy == b.m_policy;
    }
    friend bool operator!=(const make_const_iterator& a, const make_const_iterator& b) {
        return !(a.m_policy == b.m_policy);
    }

    const P& policy() const { return m_policy; }
    P& policy() { return m_policy; }

private:
    P m_policy;
};

}  // namespace tarn
