// High-availability state, read from the cluster's status file.
#include <string.h>

#include <string>
#include <vector>

#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "platform_internal.h"

namespace {

// Loads the status file.  1 loaded, 0 no file (no cluster), -1 unreadable (error set).
int LoadStatus(std::vector<std::string>* lines) {
    bool endsWithNewline;
    kytoplat::ErrorKeeper keeper;
    if (kytoplat::KvLoad(KYTO_HA_STATUS_PATH, lines, &endsWithNewline) == 0)
        return 1;
    if (KLIBCErrGet() == KYTO_ERR_FILE_NOT_FOUND)
        return 0;
    keeper.dismiss();
    return -1;
}

}  // namespace

extern "C" {

int KYTOHAIsRunning(void) noexcept try {
    std::vector<std::string> lines;
    if (LoadStatus(&lines) != 1)
        return 0;
    std::string running;
    return kytoplat::KvFind(lines, "running", &running) == 1 && running == "yes" ? 1 : 0;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(0);
}

int KYTOHAIsHybridDL(char* partnerUnique, int size) noexcept try {
    if (partnerUnique == nullptr || size < 1) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    partnerUnique[0] = '\0';
    std::vector<std::string> lines;
    int rc = LoadStatus(&lines);
    if (rc <= 0)
        return rc;
    std::string hybrid, partner;
    if (kytoplat::KvFind(lines, "hybrid_dl", &hybrid) != 1 || hybrid != "yes")
        return 0;
    if (kytoplat::KvFind(lines, "partner_unique", &partner) != 1 || partner.empty()) {
        KYTO_FAIL(KYTO_ERR_NOT_FOUND);
        return -1;
    }
    size_t n = partner.size() < static_cast<size_t>(size - 1) ? partner.size()
                                                              : static_cast<size_t>(size - 1);
    memcpy(partnerUnique, partner.data(), n);
    partnerUnique[n] = '\0';
    return 1;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

}  // extern "C"
