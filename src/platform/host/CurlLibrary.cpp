#include "platform/host/CurlLibrary.h"

#include <dlfcn.h>

#include <mutex>

namespace qax {
namespace {

// The library's stable ABI name (the one its development package links against).
constexpr const char* kLibraryName = "libcurl.so.4";

struct Loaded {
    CurlLibrary functions;
    bool ok = false;
    std::string error;
};

template <typename F>
bool resolve(void* handle, const char* name, F& out, std::string& error) {
    out = reinterpret_cast<F>(dlsym(handle, name));
    if (!out && error.empty()) {
        error = std::string("libcurl has no ") + name;
    }
    return out != nullptr;
}

Loaded load() {
    Loaded loaded;
    // Kept for the life of the process: handles and callbacks point into it.
    void* handle = dlopen(kLibraryName, RTLD_NOW | RTLD_LOCAL);
    if (!handle) {
        const char* reason = dlerror();
        loaded.error = std::string("cannot load ") + kLibraryName + ": " + (reason ? reason : "");
        return loaded;
    }
    CurlLibrary& f = loaded.functions;
    std::string& e = loaded.error;
    decltype(&curl_global_init) globalInit = nullptr;
    bool ok = resolve(handle, "curl_global_init", globalInit, e);
    ok &= resolve(handle, "curl_easy_init", f.easy_init, e);
    ok &= resolve(handle, "curl_easy_cleanup", f.easy_cleanup, e);
    ok &= resolve(handle, "curl_easy_setopt", f.easy_setopt, e);
    ok &= resolve(handle, "curl_easy_getinfo", f.easy_getinfo, e);
    ok &= resolve(handle, "curl_easy_strerror", f.easy_strerror, e);
    ok &= resolve(handle, "curl_multi_init", f.multi_init, e);
    ok &= resolve(handle, "curl_multi_cleanup", f.multi_cleanup, e);
    ok &= resolve(handle, "curl_multi_add_handle", f.multi_add_handle, e);
    ok &= resolve(handle, "curl_multi_remove_handle", f.multi_remove_handle, e);
    ok &= resolve(handle, "curl_multi_perform", f.multi_perform, e);
    ok &= resolve(handle, "curl_multi_poll", f.multi_poll, e);
    ok &= resolve(handle, "curl_multi_wakeup", f.multi_wakeup, e);
    ok &= resolve(handle, "curl_multi_info_read", f.multi_info_read, e);
    ok &= resolve(handle, "curl_slist_append", f.slist_append, e);
    ok &= resolve(handle, "curl_slist_free_all", f.slist_free_all, e);
    ok &= resolve(handle, "curl_url", f.url, e);
    ok &= resolve(handle, "curl_url_cleanup", f.url_cleanup, e);
    ok &= resolve(handle, "curl_url_set", f.url_set, e);
    ok &= resolve(handle, "curl_url_get", f.url_get, e);
    ok &= resolve(handle, "curl_free", f.free, e);
    if (!ok) {
        return loaded;
    }
    if (globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
        e = "libcurl could not be initialised";
        return loaded;
    }
    loaded.ok = true;
    return loaded;
}

}  // namespace

const CurlLibrary* CurlLibrary::get(std::string* error) {
    static const Loaded loaded = load();
    if (!loaded.ok && error) {
        *error = loaded.error;
    }
    return loaded.ok ? &loaded.functions : nullptr;
}

}  // namespace qax
