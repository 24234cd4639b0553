// One key of the system's version file ("/etc.defaults/VERSION"), read into a zeroed
// buffer whose width each caller states: the widths differ by caller and bound what is
// read, so they stay visible where the key is used.  Internal header: not installed.
#ifndef KYTOINSTALLCPP_VERSION_FILE_H
#define KYTOINSTALLCPP_VERSION_FILE_H

#include <stddef.h>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"

namespace kyto {

template <size_t Width>
struct VersionKey {
    static_assert(Width > 1, "a value needs room for at least one character");
    // The value, NUL-terminated; "" when absent or unreadable.
    char text[Width] = {0};
    // What the key=value reader answered: > 0 found, 0 absent, < 0 error (the platform's
    // last error says which).
    int result;

    explicit VersionKey(const char* key)
        : result(KLIBCFileGetKeyValue(kVersionFile, key, text, Width, 0)) {}
};

}  // namespace kyto

#endif
