#pragma once

// A handle on a piece of reflection byte code: the compiled description of a
// type's fields that the runtime interprets when it converts between a type
// and a self-describing variable. Opaque to the classes that carry it; none
// of the store's classes provides byte code, so every handle they see is
// null.

#include "tnUtils/Types.h"

namespace tarn {

struct ReflectionByteCode {
    const octet_t* m_code = nullptr;

    explicit operator bool() const { return m_code != nullptr; }
};

}  // namespace tarn
