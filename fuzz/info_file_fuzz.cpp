// Fuzz target: an arbitrary info file ("/autoupd@te.info") through
// SmallUpdate::ImportInfoFile, and the small-update status reader that trusts it.  An
// accepted file leaves error code 0 and reads as a finished download; a refused one leaves
// code 3 (bad document) or 4 (other build).
#include <string>

#include "fuzz_common.h"
#include "smallupdate.h"

namespace {
constexpr const char* kInfo = "/autoupd@te.info";
}

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    unlink("/var/run/downloadVYX.status");
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    kytofuzz::WriteWhole(kInfo, data, size);
    SmallUpdate update;
    const bool ok = update.ImportInfoFile(kInfo);
    const int code = update.GetErrno();
    if (ok)
        KYTO_FUZZ_CHECK(code == 0);
    else
        KYTO_FUZZ_CHECK(code == 3 || code == 4);

    SmallUpdate poller;
    int percentage = -7;
    std::string status = "unset";
    poller.GetDownloadStatus(percentage, status);
    if (ok)
        KYTO_FUZZ_CHECK(percentage == 100 && status == "finished");
    else
        KYTO_FUZZ_CHECK(percentage == -7 && status == "none");  // no status file
    kytofuzz::CheckDescriptors();
    return 0;
}
