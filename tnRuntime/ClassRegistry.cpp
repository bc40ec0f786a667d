#include "tnRuntime/ClassRegistry.h"

#include <map>
#include <memory>
#include <mutex>

namespace tarn {

namespace {

struct Registry {
    std::mutex mutex;
    std::map<std::string, std::unique_ptr<XTarget>, std::less<>> targets;
    std::map<std::string, const ReflectedClass*, std::less<>> classes;
    std::map<const ReflectedClass*, ImageCheckFn> imageChecks;
};

Registry& TheRegistry() {
    static Registry* registry = new Registry();  // never destroyed: used until exit
    return *registry;
}

bool IsIdentifierStart(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_';
}

bool IsIdentifierChar(char c) {
    return IsIdentifierStart(c) || (c >= '0' && c <= '9');
}

}  // namespace

std::vector<const ReflectedClass*> XTarget::Classes() const {
    std::lock_guard<std::mutex> lock(TheRegistry().mutex);
    return m_classes;
}

ENameSpaceError CheckClassName(std::string_view name) {
    std::size_t i = 0;
    for (;;) {
        if (i >= name.size() || !IsIdentifierStart(name[i])) {
            return NSE_IDENTIFIER_EXPECTED;
        }
        while (i < name.size() && IsIdentifierChar(name[i])) {
            ++i;
        }
        if (i == name.size()) {
            return NSE_OK;
        }
        if (name[i] != ':' || i + 1 >= name.size() || name[i + 1] != ':') {
            return NSE_COLON_EXPECTED;
        }
        i += 2;
    }
}

XTarget* GetXTarget(std::string_view library) {
    Registry& r = TheRegistry();
    std::lock_guard<std::mutex> lock(r.mutex);
    auto it = r.targets.find(library);
    if (it == r.targets.end()) {
        it =
            r.targets.emplace(std::string(library), std::make_unique<XTarget>(std::string(library)))
                .first;
    }
    return it->second.get();
}

XTarget* Tarn_tnOperation_GetXTarget() {
    static XTarget* target = GetXTarget("tnOperation");
    return target;
}

ENameSpaceError RegisterReflectedClass(const ReflectedClass* rc, XTarget* target) {
    if (rc == nullptr || rc->m_name == nullptr || target == nullptr) {
        return NSE_IDENTIFIER_EXPECTED;
    }
    std::string_view name(rc->m_name);
    ENameSpaceError form = CheckClassName(name);
    if (form != NSE_OK) {
        return form;
    }
    Registry& r = TheRegistry();
    std::lock_guard<std::mutex> lock(r.mutex);
    if (r.classes.find(name) != r.classes.end()) {
        return NSE_NAME_ALREADY_IN_USE;
    }
    auto it = r.classes.emplace(std::string(name), rc).first;
    try {
        target->m_classes.push_back(rc);
    } catch (...) {
        r.classes.erase(it);
        throw;
    }
    return NSE_OK;
}

const ReflectedClass* FindReflectedClass(std::string_view name) {
    Registry& r = TheRegistry();
    std::lock_guard<std::mutex> lock(r.mutex);
    auto it = r.classes.find(name);
    return it == r.classes.end() ? nullptr : it->second;
}

void RegisterImageCheck(const ReflectedClass* rc, ImageCheckFn check) {
    Registry& r = TheRegistry();
    std::lock_guard<std::mutex> lock(r.mutex);
    r.imageChecks[rc] = check;
}

ImageCheckFn FindImageCheck(const ReflectedClass* rc) {
    Registry& r = TheRegistry();
    std::lock_guard<std::mutex> lock(r.mutex);
    auto it = r.imageChecks.find(rc);
    return it == r.imageChecks.end() ? nullptr : it->second;
}

}  // namespace tarn
