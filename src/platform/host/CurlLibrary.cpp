#include "platform/host/CurlLibrary.h"

#include <mutex>

#include "core/DynamicLibrary.h"

namespace qax {
namespace {

// The library's stable ABI name (the one its development package links against).
constexpr const char* kLibraryName = "libcurl.so.4";

struct Loaded {
    CurlLibrary functions;
    bool ok = false;
    std::string error;
};

Loaded load() {
    Loaded loaded;
    void* handle = openLibrary(kLibraryName, loaded.error);
    if (!handle) {
        return loaded;
    }
    CurlLibrary& f = loaded.functions;
    std::string& e = loaded.error;
    decltype(&curl_global_init) globalInit = nullptr;
    bool ok = resolveFunction(handle, kLibraryName, "curl_global_init", globalInit, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_easy_init", f.easy_init, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_easy_cleanup", f.easy_cleanup, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_easy_setopt", f.easy_setopt, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_easy_getinfo", f.easy_getinfo, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_easy_strerror", f.easy_strerror, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_init", f.multi_init, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_cleanup", f.multi_cleanup, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_add_handle", f.multi_add_handle, e);
    ok &=
        resolveFunction(handle, kLibraryName, "curl_multi_remove_handle", f.multi_remove_handle, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_perform", f.multi_perform, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_poll", f.multi_poll, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_wakeup", f.multi_wakeup, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_multi_info_read", f.multi_info_read, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_slist_append", f.slist_append, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_slist_free_all", f.slist_free_all, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_url", f.url, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_url_cleanup", f.url_cleanup, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_url_set", f.url_set, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_url_get", f.url_get, e);
    ok &= resolveFunction(handle, kLibraryName, "curl_free", f.free, e);
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
