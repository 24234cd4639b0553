// The library's RAII owners: the set shared with the platform layer (descriptors, FILE*s,
// temporary files, child waits), plus owners of the platform's own allocations.
// Internal header: not installed.
#ifndef KYTOINSTALLCPP_SCOPED_H
#define KYTOINSTALLCPP_SCOPED_H

#include <stdlib.h>

#include <memory>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>

#include "../platform/src/scoped_owners.h"

namespace kyto {

struct SzListFree {
    void operator()(PKLIBC_SZLIST list) const { KLIBCSzListFree(list); }
};
// Owns a platform string list.
using UniqueSzList = std::unique_ptr<KLIBC_SZLIST, SzListFree>;

struct MountVolListFree {
    void operator()(PKYTO_MOUNT_VOL_INFO list) const { KYTOMountVolInfoFree(list); }
};
// Owns the platform's list of mounted volumes.
using UniqueMountVolList = std::unique_ptr<KYTO_MOUNT_VOL_INFO, MountVolListFree>;

// A getline buffer that is freed on every way out.
struct LineBuffer {
    char* data = nullptr;
    size_t size = 0;
    LineBuffer() = default;
    LineBuffer(const LineBuffer&) = delete;
    LineBuffer& operator=(const LineBuffer&) = delete;
    ~LineBuffer() { free(data); }
    ssize_t Read(FILE* f) { return getline(&data, &size, f); }
};

}  // namespace kyto

#endif
