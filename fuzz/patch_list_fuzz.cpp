// Fuzz target: an arbitrary patch list ("VYX-Security.json") through
// SmallUpdate::SetUpdateList.  Whatever the document holds, the call returns, keeps its
// error code within the known codes, and a refused list leaves no update behind.
#include <string>

#include "fuzz_common.h"
#include "smallupdate.h"

namespace {
constexpr const char* kList = "/tmp/fuzz-VYX-Security.json";
}

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    kytofuzz::WriteWhole(kList, data, size);
    SmallUpdate update;
    const bool ok = update.SetUpdateList(kList);
    const int code = update.GetErrno();
    KYTO_FUZZ_CHECK(code >= 0 && code <= 7);
    if (!ok)
        KYTO_FUZZ_CHECK(update.GetFullVersion().empty());
    kytofuzz::CheckDescriptors();
    return 0;
}
