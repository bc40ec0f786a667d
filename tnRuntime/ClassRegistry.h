#pragma once

// The class registry: where the runtime finds a class's reflection record by
// name, to create an instance when it loads an image stored under that name.
//
// Records are entered per registration target (one per library, created on
// first use and never destroyed), but class names are unique across all
// targets so that a stored class name designates one class. Registration and
// lookup are thread-safe; a record must outlive the process (records are
// function-local statics).

#include <string>
#include <string_view>
#include <vector>

#include "tnObject/IObject.h"

namespace tarn {

class XTarget {
public:
    explicit XTarget(std::string library) : m_library(std::move(library)) {}
    XTarget(const XTarget&) = delete;
    XTarget& operator=(const XTarget&) = delete;

    const std::string& Library() const { return m_library; }
    // The records entered into this target, in registration order.
    std::vector<const ReflectedClass*> Classes() const;

private:
    friend ENameSpaceError RegisterReflectedClass(const ReflectedClass* rc, XTarget* target);

    std::string m_library;
    std::vector<const ReflectedClass*> m_classes;
};

// The target of the library `library`, created on first use.
XTarget* GetXTarget(std::string_view library);

// The record registered under `name` in any target, or null.
const ReflectedClass* FindReflectedClass(std::string_view name);

// Checks an image of a class before the class's reader sees it. Readers of
// persistable classes trust their input and test no bounds, so a class whose
// images can come from outside (a store file) registers a check that walks
// the image with bounds: it returns "" for a well-formed image of exactly
// `size` bytes, otherwise what is wrong with it.
using ImageCheckFn = std::string (*)(const octet_t* image, std::size_t size);

// Enters (or replaces) the image check of `rc`.
void RegisterImageCheck(const ReflectedClass* rc, ImageCheckFn check);
// The image check of `rc`, or null when it has none.
ImageCheckFn FindImageCheck(const ReflectedClass* rc);

// Checks the form of a class name: identifiers (letters, digits, '_', not
// starting with a digit) joined by "::".
ENameSpaceError CheckClassName(std::string_view name);

}  // namespace tarn
