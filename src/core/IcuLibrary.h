// ICU, loaded on first use: most of the daemon's life formats no number and meets no text
// that is not plain ASCII, and the libraries cost more than a megabyte of resident memory
// from the moment they are mapped. The few functions used here, resolved once (under the
// versioned names the installed release exports). Thread-safe.
#pragma once

#include <unicode/unum.h>
#include <unicode/ustring.h>

#include <string>

namespace qax {

struct IcuLibrary {
    decltype(&u_strFromUTF8) strFromUTF8 = nullptr;
    decltype(&u_strFromUTF8WithSub) strFromUTF8WithSub = nullptr;
    decltype(&u_strToUTF8) strToUTF8 = nullptr;
    decltype(&unum_open) numberFormatOpen = nullptr;
    decltype(&unum_formatInt64) numberFormatInt64 = nullptr;
    decltype(&unum_close) numberFormatClose = nullptr;

    // The loaded library; none (with the reason in `error`) when it cannot be loaded.
    static const IcuLibrary* get(std::string* error = nullptr);
};

}  // namespace qax
