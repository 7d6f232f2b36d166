#include "core/DynamicLibrary.h"

namespace qax {

void* openLibrary(const char* name, std::string& error) {
    // Never closed: handles and callbacks point into it.
    void* handle = dlopen(name, RTLD_NOW | RTLD_LOCAL);
    if (!handle && error.empty()) {
        const char* reason = dlerror();
        error = std::string("cannot load ") + name + ": " + (reason ? reason : "");
    }
    return handle;
}

}  // namespace qax
