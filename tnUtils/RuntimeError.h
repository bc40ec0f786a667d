#pragma once

#include <cerrno>
#include <stdexcept>
#include <string>

namespace tarn {

// An error of the runtime or a store that the caller can report: an
// unreadable or corrupt store, an image of an unexpected class, a missing
// object. Never raised for a broken invariant of the module (those assert).
//
// Its category says what kind of failure it is, so that a program can
// branch on it without reading the message:
//   NotFound  the store (its directory, journal or record) is not there
//   InUse     another writer holds the store, or this process has it open
//   Damaged   a store file, image or node fails its checks
//   NoSpace   the disk (or the quota) is full
//   ReadOnly  the file system or the handle does not take writes
//   Refused   an operation or a setting the store must not take; nothing
//             changed (RecordRefused, a cache bound too small)
//   Io        any other failure of the system while reading or writing
//   Other     everything else (a closed or moved-from handle, misuse)
class RuntimeError : public std::runtime_error {
public:
    enum class Category { Other, NotFound, InUse, Damaged, NoSpace, ReadOnly, Refused, Io };

    explicit RuntimeError(const std::string& message)
        : std::runtime_error(message), m_category(Category::Other) {}
    RuntimeError(Category category, const std::string& message)
        : std::runtime_error(message), m_category(category) {}

    Category GetCategory() const { return m_category; }

    // The category of a failed system call's errno value.
    static Category CategoryOfErrno(int error) {
        switch (error) {
            case ENOENT:
            case ENOTDIR:
                return Category::NotFound;
            case ENOSPC:
            case EDQUOT:
                return Category::NoSpace;
            case EROFS:
            case EACCES:
            case EPERM:
                return Category::ReadOnly;
            default:
                return Category::Io;
        }
    }

private:
    Category m_category;
};

// "not-found", "in-use", ...: the category's name in messages and JSON.
inline const char* CategoryName(RuntimeError::Category category) {
    switch (category) {
        case RuntimeError::Category::NotFound:
            return "not-found";
        case RuntimeError::Category::InUse:
            return "in-use";
        case RuntimeError::Category::Damaged:
            return "damaged";
        case RuntimeError::Category::NoSpace:
            return "no-space";
        case RuntimeError::Category::ReadOnly:
            return "read-only";
        case RuntimeError::Category::Refused:
            return "refused";
        case RuntimeError::Category::Io:
            return "io";
        case RuntimeError::Category::Other:
            break;
    }
    return "other";
}

}  // namespace tarn
