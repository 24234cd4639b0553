// Download status, percentage, cancel and installer progress as other processes see them,
// from files set up by hand.
#include <unistd.h>

#include "engine_fixtures.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char *kStatus = "/var/run/downloadVYX.status", *kPid = "/var/run/downloadVYX.pid",
           *kInfo = "/autoupd@te.info", *kProgress = "/var/run/downloadprogress";

using VyxStatusTest = SandboxTest;

TEST_F(VyxStatusTest, StatusFileDecisions) {
    pid_t dead = Spawn([] { return 0; });
    Wait(dead);
    const std::string base =
        "updateType=\"vyxupdate\"\npatchPath=\"/tmp/img\"\n"
        "downloadCount=\"2\"\ndownloadNum=\"2\"\ndownloadStatus=";
    // status and pid file ("": none), what a poller sees.
    // clang-format off
    struct Case { std::string status, pid, seen; } cases[] = {
        {"", "", "none 0"}, {"updateType=smallupdate\ndownloadStatus=2\n", "", "none 0"},
        {base + "stopped\n", "", "stopped 0"}, {base + "failed\n", "1", "failed 0"},
        {base + "downloading\n", std::to_string(dead), "failed 0"},
        {base + "downloading\n", std::to_string(getpid()), "downloading 75"},  // 2nd half done
        {base + "finish\n", "junk", "refused none 0"},
        {"updateType=vyxupdate\npatchPath=/x\ndownloadStatus=failed\n", "", "refused none 0"}};
    // clang-format on
    // Half of the second image (any page size up to 512 KiB allocates it exactly).
    WriteFile(kProgress, "--2026-01-01--  http://h/img\nLength: 1,048,576 (1M)\n");
    WriteFile("/tmp/img", std::string(512 << 10, 'x'));
    for (const Case& c : cases) {
        SCOPED_TRACE(c.status + " pid " + c.pid);
        WriteOrRemove(kStatus, c.status.empty() ? nullptr : c.status.c_str());
        WriteOrRemove(kPid, c.pid.empty() ? nullptr : c.pid.c_str());
        EXPECT_EQ(c.seen, VyxStatusSeen());
    }
    // A complete newer download wins over whatever the status file says.
    WriteFile(kInfo, R"({"updateType":"vyxupdate","buildnumber":"5700",
        "majorversion":"5","minorversion":"2","patchPath":"/tmp/img"})");
    EXPECT_EQ("finished 100", VyxStatusSeen());
}

// The share of the announced length that is allocated on disk.  Sizes are multiples of
// 64 KiB so that no page size matters, except where the page of a short file is the point.
TEST_F(VyxStatusTest, PercentageOfOneImage) {
    // clang-format off
    struct Case { std::string log; size_t bytes; bool sparse; int percentage; } cases[] = {
        {"no size line here\n", 65536, false, 0},
        {"Length: 131,072 (128K) [application/octet-stream]\n", 131072, false, 100},
        {"Length: 1,310,720 (1.2M)\n", 655360, false, 50},
        {"Length: 1,310,720 (1.2M)\n", 1310720, true, 0},  // the length only, nothing allocated
        {"Length: 1,000 (1K)\n", 1000, false, static_cast<int>(sysconf(_SC_PAGESIZE) / 10)}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.log);
        WriteFile(kProgress, c.log);
        WriteFile("/tmp/img", c.sparse ? "" : std::string(c.bytes, 'x'));
        ASSERT_EQ(0, truncate("/tmp/img", static_cast<off_t>(c.bytes)));
        int percentage = -1;
        ASSERT_TRUE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
        EXPECT_EQ(c.percentage, percentage);
    }
    int percentage = 0;
    unlink(kProgress);
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
    EXPECT_TRUE(SyslogContains("Fail to open file [/var/run/downloadprogress] for reading"));
}

// A cancel without a pid file is the facade's case.
TEST_F(VyxStatusTest, CancelWithoutDownloadAndInstallerProgress) {
    WriteFile(kPid, "0");
    EXPECT_FALSE(VyxUpdate::CancelDownloadVyx());
    // clang-format off
    struct Case { _tag_update_step_ step; int number; std::string text, line; } cases[] = {
        {UPDATE_STEP_U, -1, "unpacking", "U:unpacking\n"}, {UPDATE_STEP_U, 30, "x", "U:30:\n"},
        {UPDATE_STEP_R, -1, "x", "R:-1:\n"}};
    // clang-format on
    for (const Case& c : cases) {
        EXPECT_TRUE(VyxUpdate::ReportProgress(c.step, c.number, c.text.c_str()));
        EXPECT_EQ(c.line, ReadFile("/tmp/update.progress"));
    }
    // A text longer than the command buffer makes a command the shell refuses, nothing more.
    EXPECT_FALSE(VyxUpdate::ReportProgress(UPDATE_STEP_U, -1, std::string(200, 't').c_str()));
}

}  // namespace
