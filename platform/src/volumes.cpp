// Data volumes (from /proc/mounts) and folder creation.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <string>
#include <vector>

#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "platform_internal.h"

namespace {

constexpr const char* kMountsPath = "/proc/mounts";

struct MountEntry {
    std::string dir;
    bool readOnlyOption = false;
};

// Decodes the octal escapes (\040 space, \011 tab, \012 newline, \134 backslash) the
// kernel writes in /proc/mounts fields.
std::string Unescape(const std::string& field) {
    std::string out;
    for (size_t i = 0; i < field.size(); ++i) {
        if (field[i] == '\\' && i + 3 < field.size() && field[i + 1] >= '0' &&
            field[i + 1] <= '3' && field[i + 2] >= '0' && field[i + 2] <= '7' &&
            field[i + 3] >= '0' && field[i + 3] <= '7') {
            out.push_back(static_cast<char>((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 +
                                            (field[i + 3] - '0')));
            i += 3;
        } else {
            out.push_back(field[i]);
        }
    }
    return out;
}

// "/volume" followed by one or more digits and nothing else.
bool IsDataVolume(const std::string& dir) {
    static const std::string prefix = "/volume";
    if (dir.size() <= prefix.size() || dir.compare(0, prefix.size(), prefix) != 0)
        return false;
    for (size_t i = prefix.size(); i < dir.size(); ++i) {
        if (dir[i] < '0' || dir[i] > '9')
            return false;
    }
    return true;
}

bool HasRoOption(const std::string& options) {
    size_t start = 0;
    for (;;) {
        size_t comma = options.find(',', start);
        std::string opt =
            options.substr(start, comma == std::string::npos ? std::string::npos : comma - start);
        if (opt == "ro")
            return true;
        if (comma == std::string::npos)
            return false;
        start = comma + 1;
    }
}

std::vector<std::string> Fields(const std::string& line) {
    std::vector<std::string> out;
    size_t i = 0;
    while (i < line.size()) {
        while (i < line.size() && (line[i] == ' ' || line[i] == '\t'))
            ++i;
        size_t b = i;
        while (i < line.size() && line[i] != ' ' && line[i] != '\t')
            ++i;
        if (i > b)
            out.push_back(line.substr(b, i - b));
    }
    return out;
}

// Data volume mounts in /proc/mounts order.  A mount point mounted over more than once is
// listed once, at its first position, with the options of the last (visible) mount.
int ReadDataMounts(std::vector<MountEntry>* mounts) {
    kytoplat::UniqueFile f(fopen(kMountsPath, "re"));
    if (!f) {
        KYTO_FAIL(KYTO_ERR_FILE_OPEN);
        return -1;
    }
    char* line = nullptr;
    size_t cap = 0;
    ssize_t n;
    while ((n = getline(&line, &cap, f.get())) > 0) {
        std::string text(line, static_cast<size_t>(n));
        if (!text.empty() && text.back() == '\n')
            text.pop_back();
        std::vector<std::string> fields = Fields(text);
        if (fields.size() < 4)
            continue;
        std::string dir = Unescape(fields[1]);
        if (!IsDataVolume(dir))
            continue;
        bool ro = HasRoOption(fields[3]);
        bool seen = false;
        for (MountEntry& m : *mounts) {
            if (m.dir == dir) {
                m.readOnlyOption = ro;
                seen = true;
            }
        }
        if (!seen)
            mounts->push_back(MountEntry{dir, ro});
    }
    bool readError = ferror(f.get()) != 0;
    free(line);
    if (readError) {
        KYTO_FAIL(KYTO_ERR_FILE_READ);
        return -1;
    }
    return 0;
}

}  // namespace

extern "C" {

PKYTO_MOUNT_VOL_INFO KYTOMountVolInfoEnum(int flags) noexcept try {
    if (flags != 0) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return nullptr;
    }
    std::vector<MountEntry> mounts;
    if (ReadDataMounts(&mounts) != 0)
        return nullptr;
    if (mounts.empty()) {
        KYTO_FAIL(KYTO_ERR_NOT_FOUND);
        return nullptr;
    }
    PKYTO_MOUNT_VOL_INFO head = nullptr;
    PKYTO_MOUNT_VOL_INFO* tail = &head;
    for (const MountEntry& m : mounts) {
        if (m.dir.size() >= KYTO_VOL_PATH_MAX)
            continue;  // cannot be represented
        struct statvfs vfs;
        if (statvfs(m.dir.c_str(), &vfs) != 0) {
            KYTOMountVolInfoFree(head);
            KYTO_FAIL(KYTO_ERR_SYSTEM);
            return nullptr;
        }
        auto node = static_cast<PKYTO_MOUNT_VOL_INFO>(calloc(1, sizeof(KYTO_MOUNT_VOL_INFO)));
        if (node == nullptr) {
            KYTOMountVolInfoFree(head);
            KYTO_FAIL(KYTO_ERR_OUT_OF_MEMORY);
            return nullptr;
        }
        memcpy(node->szMountPath, m.dir.c_str(), m.dir.size() + 1);
        node->blWritable = !m.readOnlyOption && !(vfs.f_flag & ST_RDONLY);
        node->ullFreeBytes = static_cast<unsigned long long>(vfs.f_bavail) *
                             static_cast<unsigned long long>(vfs.f_frsize);
        node->pNext = nullptr;
        *tail = node;
        tail = &node->pNext;
    }
    if (head == nullptr)
        KYTO_FAIL(KYTO_ERR_NOT_FOUND);
    return head;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(static_cast<PKYTO_MOUNT_VOL_INFO>(nullptr));
}

void KYTOMountVolInfoFree(PKYTO_MOUNT_VOL_INFO node) noexcept {
    while (node != nullptr) {
        PKYTO_MOUNT_VOL_INFO next = node->pNext;
        free(node);
        node = next;
    }
}

int VolumeAvailGet(int flags, unsigned long long minFree, PKYTO_VOLUME_INFO out, int count) noexcept
    try {
    if (flags != 0 || out == nullptr || count < 1) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    PKYTO_MOUNT_VOL_INFO list;
    {
        kytoplat::ErrorKeeper keeper;
        list = KYTOMountVolInfoEnum(0);
        if (list == nullptr) {
            if (KLIBCErrGet() == KYTO_ERR_NOT_FOUND)
                return 0;  // no volume: not an error
            keeper.dismiss();
            return -1;
        }
    }
    int found = 0;
    for (PKYTO_MOUNT_VOL_INFO v = list; v != nullptr; v = v->pNext) {
        if (v->blWritable && v->ullFreeBytes > minFree) {
            memset(out, 0, sizeof *out);
            memcpy(out->szMountPath, v->szMountPath, sizeof out->szMountPath);
            out->blWritable = v->blWritable;
            out->ullFreeBytes = v->ullFreeBytes;
            found = 1;
            break;
        }
    }
    KYTOMountVolInfoFree(list);
    return found;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KYTOFSMkdirP(const char* path, mode_t mode) noexcept try {
    if (path == nullptr || *path == '\0') {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::string p(path);
    while (p.size() > 1 && p.back() == '/')
        p.pop_back();
    // Create each prefix ending before a '/', then the whole path.
    for (size_t i = 1; i <= p.size(); ++i) {
        if (i < p.size() && p[i] != '/')
            continue;
        if (p[i - 1] == '/')
            continue;  // "//" inside the path
        std::string prefix = p.substr(0, i);
        if (mkdir(prefix.c_str(), mode) != 0 && errno != EEXIST) {
            KYTO_FAIL(errno == ENOENT ? KYTO_ERR_FILE_NOT_FOUND : KYTO_ERR_SYSTEM);
            return -1;
        }
    }
    struct stat st;
    if (stat(p.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
        KYTO_FAIL(KYTO_ERR_SYSTEM);
        return -1;
    }
    return 0;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

}  // extern "C"
