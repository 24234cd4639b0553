#include "file_system.h"

#include <sys/statfs.h>
#include <syslog.h>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

namespace kyto {

int AvailableBytes(const char* path, unsigned long long& available) {
    struct statfs st;
    if (statfs(path, &st) != 0)
        return -1;
    available =
        static_cast<unsigned long long>(st.f_bavail) * static_cast<unsigned long long>(st.f_bsize);
    return 0;
}

PKYTO_MOUNT_VOL_INFO FirstVolumeWithRoom(PKYTO_MOUNT_VOL_INFO node, unsigned long minFreeBytes,
                                         const char* module, bool announceEach) {
    for (; node != nullptr; node = node->pNext) {
        if (announceEach)
            syslog(LOG_ERR, "%s:%d Got a volume %s.", module, __LINE__, node->szMountPath);
        if (!node->blWritable) {
            syslog(LOG_ERR, "%s:%d sad.. %s is not a writable volume.", module, __LINE__,
                   node->szMountPath);
            continue;
        }
        if (announceEach)
            syslog(LOG_ERR, "%s:%d check if it has sufficient capacity.", module, __LINE__);
        if (node->ullFreeBytes >= minFreeBytes)
            return node;
        syslog(LOG_ERR, "%s:%d %llu < %lu, check next volume.", module, __LINE__,
               static_cast<unsigned long long>(node->ullFreeBytes), minFreeBytes);
    }
    return nullptr;
}

int RemoveFolderWith(const char* rmProgram, const char* path) {
    if (path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        return 0;
    }
    return KLIBCExec(rmProgram, "-rf", path, nullptr, nullptr) == 0 ? 1 : 0;
}

}  // namespace kyto
