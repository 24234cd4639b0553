// The apply status file: its writer, the high-availability marker and the reader used by
// pollers in other processes.
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "smallupdate.h"

using namespace kytotest;

namespace {

const char* const kStatus = "/var/run/applySmallUpd@te.status";
const char* const kWords[] = {
    "none",  "waiting_remote_upgrading", "analying", "program", "startService", "finished",
    "reboot"};

struct Stage {
    int percentage = -7;
    std::string word = "caller-stage";
    std::string err = "caller-err";
};

Stage Read() {
    Stage s;
    SmallUpdate::GetApplyStage(s.percentage, s.word, s.err);
    return s;
}

bool TempFilesLeft() {
    for (const auto& name : ListDir("/var/run")) {
        if (name.rfind("applySmallUpd@te.status_", 0) == 0)
            return true;
    }
    return false;
}

class SmallUpdateApplyStatusTest : public SandboxTest {};

TEST_F(SmallUpdateApplyStatusTest, WriterReplacesTheFileWithThreeQuotedKeys) {
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(10, SmallUpdate::APPLY_STAGE_PROGRAM, ""));
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(53, SmallUpdate::APPLY_STAGE_PROGRAM, "a b"));
    EXPECT_EQ("percentage=\"53\"\nstage=\"3\"\nErrMsg=\"a b\"\n", ReadFile(kStatus).value_or(""));
    EXPECT_FALSE(TempFilesLeft());

    // A value the key=value writer refuses: the old file stays, no temporary file is left.
    EXPECT_FALSE(SmallUpdate::UpdateApplyProgress(99, SmallUpdate::APPLY_STAGE_REBOOT, "x\ny"));
    EXPECT_EQ("53", ReadKeyValueFile(kStatus)["percentage"]);
    EXPECT_FALSE(TempFilesLeft());

    SmallUpdate().HASetApplyProgressErr("peer upgrading");
    Stage s = Read();
    EXPECT_EQ(0, s.percentage);
    EXPECT_EQ("waiting_remote_upgrading", s.word);
    EXPECT_EQ("peer upgrading", s.err);
}

TEST_F(SmallUpdateApplyStatusTest, ReaderGivesTheWordOfEveryStage) {
    for (int stage = 0; stage <= 6; ++stage) {
        ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(
            stage * 10, static_cast<SmallUpdate::APPLY_STAGE>(stage), ""));
        Stage s = Read();
        EXPECT_EQ(stage * 10, s.percentage);
        EXPECT_EQ(kWords[stage], s.word);
        EXPECT_EQ("caller-err", s.err) << "an empty ErrMsg leaves the caller's text";
    }
    // Files written by others, or missing and incomplete ones (nullptr: no file).  Stages
    // beyond the table (negative ones too) keep the caller's word and report an error.
    struct Row {
        const char* content;
        int percentage;
        const char* word;
        const char* err;
    } rows[] = {
        {"percentage=\"40\"\nstage=\"7\"\nErrMsg=\"\"\n", 40, "caller-stage", "err_system"},
        {"percentage=\"40\"\nstage=\"-1\"\n", 40, "caller-stage", "err_system"},
        {"percentage=\"40\"\nstage=\"4294967295\"\n", 40, "caller-stage", "err_system"},
        {"percentage=\"40\"\nstage=\"9\"\nErrMsg=\"disk full\"\n", 40, "caller-stage", "disk full"},
        {"percentage=\"77\"\nstage=\"5\"\nErrMsg=\"err_system\"\n", 77, "finished", "err_system"},
        {nullptr, -7, "none", "caller-err"},
        {"stage=\"3\"\nErrMsg=\"\"\n", -7, "none", "err_system"},
        {"percentage=\"30\"\n", -7, "none", "err_system"},
        {"percentage=\"\"\nstage=\"3\"\n", -7, "none", "err_system"},
        {"", -7, "none", "err_system"},
    };
    for (const Row& row : rows) {
        Shell(std::string("rm -f ") + kStatus);
        if (row.content) {
            WriteFile(kStatus, row.content);
        }
        Stage s = Read();
        const std::string what = row.content ? row.content : "(no file)";
        EXPECT_EQ(row.percentage, s.percentage) << what;
        EXPECT_EQ(row.word, s.word) << what;
        EXPECT_EQ(row.err, s.err) << what;
    }
}

// A poller in another process sees only pairs that were written together, while the
// file is replaced thousands of times.
TEST_F(SmallUpdateApplyStatusTest, PollerInAnotherProcessNeverSeesATornFile) {
    const std::string stopMarker = "/tmp/apply_status_writer_done";
    auto stageFor = [](int percentage) { return 2 + percentage % 5; };
    auto errFor = [](int percentage) { return "e" + std::to_string(percentage); };
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(
        0, static_cast<SmallUpdate::APPLY_STAGE>(stageFor(0)), errFor(0)));

    pid_t reader = Spawn([&]() {
        long reads = 0;
        bool done = false;
        while (!done) {
            done = access(stopMarker.c_str(), F_OK) == 0;  // one last read after the writer
            Stage s = Read();
            ++reads;
            if (s.percentage < 0 || s.percentage > 100)
                return 1;
            if (s.word != kWords[stageFor(s.percentage)])
                return 2;
            if (s.err != errFor(s.percentage))
                return 3;
        }
        return reads > 1 ? 0 : 4;
    });
    int written = 0;
    for (int i = 1; i <= 3000; ++i) {
        const int percentage = i % 101;
        if (!SmallUpdate::UpdateApplyProgress(
                percentage, static_cast<SmallUpdate::APPLY_STAGE>(stageFor(percentage)),
                errFor(percentage))) {
            break;  // the reader must still be stopped below
        }
        ++written;
    }
    WriteFile(stopMarker, "");
    EXPECT_EQ(3000, written);
    EXPECT_EQ(0, Wait(reader)) << "1: bad percentage, 2: stage torn, 3: message torn";
    EXPECT_FALSE(TempFilesLeft());
}

}  // namespace
