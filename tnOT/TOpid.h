#pragma once

// The identifier of one operation: the site that generated it and its
// sequence number within that site's history.

namespace tarn {

template <typename S, typename T>
struct TOpid {
    S s;
    T t;

    TOpid() : s(), t() {}
    TOpid(const S& site, T time) : s(site), t(time) {}
};

}  // namespace tarn
