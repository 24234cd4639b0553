// Fuzz target: SmallUpdate::GetApplyStage on arbitrary apply status files.  The stage word
// is one of the seven words or the caller's own text (a stage number out of range), and an
// out-of-range stage or an unreadable file always carries an error text.
#include <string>

#include "fuzz_common.h"
#include "smallupdate.h"

namespace {

constexpr const char* kApply = "/var/run/applySmallUpd@te.status";

bool StageWord(const std::string& s) {
    return s == "none" || s == "waiting_remote_upgrading" || s == "analying" || s == "program" ||
           s == "startService" || s == "finished" || s == "reboot";
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    kytofuzz::WriteWhole(kApply, data, size);
    int percentage = -7;
    std::string stage = "unset", error = "unset";
    SmallUpdate::GetApplyStage(percentage, stage, error);
    KYTO_FUZZ_CHECK(StageWord(stage) || stage == "unset");
    if (stage == "unset")  // out of range: "err_system" or the stored text, never nothing
        KYTO_FUZZ_CHECK(!error.empty());
    // A second call with other starting values tells an untouched percentage from one read
    // from the file: untouched twice means a key was unreadable, which carries the error.
    int again = -8;
    std::string stage2 = "unset", error2 = "unset";
    SmallUpdate::GetApplyStage(again, stage2, error2);
    KYTO_FUZZ_CHECK(stage2 == stage && error2 == error);
    if (stage == "none" && percentage == -7 && again == -8)
        KYTO_FUZZ_CHECK(error == "err_system");
    else
        KYTO_FUZZ_CHECK(again == percentage);
    kytofuzz::CheckDescriptors();
    return 0;
}
