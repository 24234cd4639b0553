// The status files the interface's poller reads: the apply status file (writer, the
// high-availability marker, reader, a poller in another process), the download status writer.
#include <stdlib.h>

#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const char* const kApplyStatus = "/var/run/applySmallUpd@te.status";
using SmallUpdateStatusTest = SandboxTest;

TEST_F(SmallUpdateStatusTest, ApplyStatusWriterAndReader) {
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(53, SmallUpdate::APPLY_STAGE_PROGRAM, "a b"));
    EXPECT_EQ("percentage=\"53\"\nstage=\"3\"\nErrMsg=\"a b\"\n", ReadFile(kApplyStatus));
    EXPECT_EQ(0644u, ModeOf(kApplyStatus));
    // A value the key=value writer refuses: the old file stays, no temporary file is left.
    EXPECT_FALSE(SmallUpdate::UpdateApplyProgress(99, SmallUpdate::APPLY_STAGE_REBOOT, "x\ny"));
    EXPECT_EQ("53 program a b", ApplyStageSeen());
    EXPECT_FALSE(AnyEntryStartsWith("/var/run", "applySmallUpd@te.status_"));
    SmallUpdate().HASetApplyProgressErr("peer upgrading");
    EXPECT_EQ("0 waiting_remote_upgrading peer upgrading", ApplyStageSeen());
    // Files written by others, missing (nullptr) or incomplete.  Stages beyond the table keep
    // the caller's word and report an error (the words of stages 2 to 6: the poller test).
    // clang-format off
    const std::pair<const char*, const char*> rows[] = {
        {"percentage=\"40\"\nstage=\"7\"\nErrMsg=\"\"\n", "40 caller-stage err_system"},
        {"percentage=\"9\"\nstage=\"0\"\nErrMsg=\"\"\n", "9 none caller-err"},
        {nullptr, "-7 none caller-err"}, {"stage=\"3\"\nErrMsg=\"\"\n", "-7 none err_system"},
        {"percentage=\"30\"\n", "-7 none err_system"}};
    // clang-format on
    for (const auto& [content, seen] : rows) {
        WriteOrRemove(kApplyStatus, content);
        EXPECT_EQ(seen, ApplyStageSeen()) << (content ? content : "(no file)");
    }
    // The download status writer reports a file it cannot write.
    Shell("mkdir -p /var/run/downloadVYX.status");
    EXPECT_EQ(0, SmallUpdate::UpdateDownloadProgress(0, SmallUpdate::DOWNLOAD_STATUS_STOPPED));
}

// A poller in another process sees only values that were written together, while the
// file is replaced thousands of times.
TEST_F(SmallUpdateStatusTest, PollerInAnotherProcessNeverSeesATornFile) {
    auto stageFor = [](int p) { return static_cast<SmallUpdate::APPLY_STAGE>(2 + p % 5); };
    auto write = [&](int i) {
        return SmallUpdate::UpdateApplyProgress(i % 101, stageFor(i % 101),
                                                "e" + std::to_string(i % 101));
    };
    ASSERT_TRUE(write(0));
    auto check = [&] {
        const std::string seen = ApplyStageSeen();
        const int p = atoi(seen.c_str());
        const std::string whole =
            std::to_string(p) + " " + kApplyStageWords[stageFor(p)] + " e" + std::to_string(p);
        return p >= 0 && p <= 100 && seen == whole ? 0 : 1;
    };
    EXPECT_EQ(0, RaceReaderAgainstWriter(3000, write, check)) << "a torn or missing record";
}

}  // namespace
