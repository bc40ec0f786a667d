#pragma once

#include <stdexcept>
#include <string>

namespace tarn {

// An error of the runtime or a store that the caller can report: an
// unreadable or corrupt store, an image of an unexpected class, a missing
// object. Never raised for a broken invariant of the module (those assert).
class RuntimeError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

}  // namespace tarn
