// Growable lists of C strings.
#include <limits.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "platform_internal.h"

namespace {

// Bytes of a list object holding capacity pointers (0 on overflow).
size_t ListBytes(int capacity) {
    size_t header = offsetof(KLIBC_SZLIST, pszItem);
    size_t n = static_cast<size_t>(capacity);
    if (n > (SIZE_MAX - header) / sizeof(char*))
        return 0;
    return header + n * sizeof(char*);
}

}  // namespace

extern "C" {

PKLIBC_SZLIST KLIBCSzListAlloc(int capacity) noexcept try {
    if (capacity < 1) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return nullptr;
    }
    size_t bytes = ListBytes(capacity);
    PKLIBC_SZLIST list = bytes ? static_cast<PKLIBC_SZLIST>(calloc(1, bytes)) : nullptr;
    if (list == nullptr) {
        KYTO_FAIL(KYTO_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    list->nItem = 0;
    list->nAlloc = capacity;
    return list;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(static_cast<PKLIBC_SZLIST>(nullptr));
}

int KLIBCStrSep(const char* text, const char* delims, PKLIBC_SZLIST* list) noexcept try {
    // A capacity below 1 never comes from KLIBCSzListAlloc and could not be doubled.
    if (text == nullptr || delims == nullptr || list == nullptr || *list == nullptr ||
        (*list)->nAlloc < 1 || (*list)->nItem < 0 || (*list)->nItem > (*list)->nAlloc) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::vector<std::string> pieces;
    const char* p = text;
    for (;;) {
        size_t n = *delims ? strcspn(p, delims) : strlen(p);
        pieces.emplace_back(p, n);
        if (p[n] == '\0')
            break;
        p += n + 1;
    }
    PKLIBC_SZLIST l = *list;
    if (pieces.size() > static_cast<size_t>(INT_MAX - l->nItem)) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    int need = l->nItem + static_cast<int>(pieces.size());
    if (need > l->nAlloc) {
        int cap = l->nAlloc;
        while (cap < need)
            cap = cap > INT_MAX / 2 ? need : cap * 2;
        size_t bytes = ListBytes(cap);
        PKLIBC_SZLIST grown = bytes ? static_cast<PKLIBC_SZLIST>(realloc(l, bytes)) : nullptr;
        if (grown == nullptr) {
            KYTO_FAIL(KYTO_ERR_OUT_OF_MEMORY);
            return -1;
        }
        for (int i = grown->nAlloc; i < cap; ++i)
            grown->pszItem[i] = nullptr;
        grown->nAlloc = cap;
        *list = l = grown;
    }
    // All copies are made before any is added, so a failure leaves the items unchanged.
    std::vector<char*> copies;
    copies.reserve(pieces.size());
    for (const std::string& piece : pieces) {
        char* copy = strdup(piece.c_str());
        if (copy == nullptr) {
            for (char* c : copies)
                free(c);
            KYTO_FAIL(KYTO_ERR_OUT_OF_MEMORY);
            return -1;
        }
        copies.push_back(copy);
    }
    for (char* c : copies)
        l->pszItem[l->nItem++] = c;
    return static_cast<int>(copies.size());
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCSzListJoin(PKLIBC_SZLIST list, const char* sep, char** buf, int* bufSize) noexcept try {
    if (list == nullptr || sep == nullptr || buf == nullptr || bufSize == nullptr || *bufSize < 0 ||
        (*buf == nullptr && *bufSize != 0) || list->nItem < 0 || list->nItem > list->nAlloc) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::string joined;
    for (int i = 0; i < list->nItem; ++i) {
        if (i > 0)
            joined += sep;
        if (list->pszItem[i])
            joined += list->pszItem[i];
    }
    if (joined.size() >= static_cast<size_t>(INT_MAX)) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    int need = static_cast<int>(joined.size()) + 1;
    if (*buf == nullptr || *bufSize < need) {
        char* grown = static_cast<char*>(realloc(*buf, static_cast<size_t>(need)));
        if (grown == nullptr) {
            KYTO_FAIL(KYTO_ERR_OUT_OF_MEMORY);
            return -1;
        }
        *buf = grown;
        *bufSize = need;
    }
    memcpy(*buf, joined.c_str(), joined.size() + 1);
    return static_cast<int>(joined.size());
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

void KLIBCSzListFree(PKLIBC_SZLIST list) noexcept {
    if (list == nullptr)
        return;
    for (int i = 0; i < list->nItem && i < list->nAlloc; ++i)
        free(list->pszItem[i]);
    free(list);
}

}  // extern "C"
