// A shared library loaded on first use (dlopen): opened for the life of the process, its
// functions resolved by name. Each step records the first failure in `error`.
#pragma once

#include <dlfcn.h>

#include <string>

namespace qax {

// The library's handle; none (with the reason in `error`) when it cannot be opened.
void* openLibrary(const char* name, std::string& error);

// Resolves `name` in `handle` (opened as `library`) into `out`; false, with the reason in
// `error`, when it is not there.
template <typename F>
bool resolveFunction(void* handle, const char* library, const char* name, F& out,
                     std::string& error) {
    out = handle ? reinterpret_cast<F>(dlsym(handle, name)) : nullptr;
    if (!out && error.empty()) {
        error = std::string(library) + " has no " + name;
    }
    return out != nullptr;
}

}  // namespace qax
