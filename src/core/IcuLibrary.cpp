#include "core/IcuLibrary.h"

#include <unicode/uvernum.h>

#include "core/DynamicLibrary.h"

namespace qax {
namespace {

// The headers rename every entry point to its versioned symbol (u_strToUTF8 is u_strToUTF8_72):
// spelling the macro's expansion gives the name to look up.
#define QAX_ICU_NAME_OF(name) #name
#define QAX_ICU_SYMBOL(name) QAX_ICU_NAME_OF(name)

constexpr const char* kCommonLibrary = "libicuuc.so." U_ICU_VERSION_SHORT;
constexpr const char* kFormattingLibrary = "libicui18n.so." U_ICU_VERSION_SHORT;

struct Loaded {
    IcuLibrary functions;
    bool ok = false;
    std::string error;
};

Loaded load() {
    Loaded loaded;
    std::string& e = loaded.error;
    void* common = openLibrary(kCommonLibrary, e);
    void* formatting = openLibrary(kFormattingLibrary, e);
    IcuLibrary& f = loaded.functions;
    bool ok =
        resolveFunction(common, kCommonLibrary, QAX_ICU_SYMBOL(u_strFromUTF8), f.strFromUTF8, e);
    ok &= resolveFunction(common, kCommonLibrary, QAX_ICU_SYMBOL(u_strFromUTF8WithSub),
                          f.strFromUTF8WithSub, e);
    ok &= resolveFunction(common, kCommonLibrary, QAX_ICU_SYMBOL(u_strToUTF8), f.strToUTF8, e);
    ok &= resolveFunction(formatting, kFormattingLibrary, QAX_ICU_SYMBOL(unum_open),
                          f.numberFormatOpen, e);
    ok &= resolveFunction(formatting, kFormattingLibrary, QAX_ICU_SYMBOL(unum_formatInt64),
                          f.numberFormatInt64, e);
    ok &= resolveFunction(formatting, kFormattingLibrary, QAX_ICU_SYMBOL(unum_close),
                          f.numberFormatClose, e);
    loaded.ok = ok;
    return loaded;
}

}  // namespace

const IcuLibrary* IcuLibrary::get(std::string* error) {
    static const Loaded loaded = load();
    if (!loaded.ok && error) {
        *error = loaded.error;
    }
    return loaded.ok ? &loaded.functions : nullptr;
}

}  // namespace qax
