// The thread's last error, the logs, string lists, the configuration reader, data volumes
// and folders, the high-availability state and the start-up scripts.
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using namespace kytotest;
using SystemTest = SandboxTest;
constexpr unsigned long long kMiB = 1024ULL * 1024ULL;

TEST_F(SystemTest, LastErrorIsPerThreadAndSuccessLeavesItAlone) {
    char name[] = "caller.cpp";
    KLIBCErrSetEx(KYTO_ERR_FILE_READ, name, 42);
    name[0] = 'X';  // the file name was copied
    int otherCode = -1;
    std::thread([&] { otherCode = KLIBCErrGet(); }).join();
    EXPECT_EQ(otherCode, 0);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv", "k", "v", nullptr), 1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_READ);
    EXPECT_STREQ(KLIBCErrorGetFile(), "caller.cpp");
    EXPECT_EQ(KLIBCErrorGetLine(), 42);
}

// The event log's lines are seen in the release download's tests; here: the update log's file
// and a log file that cannot be written.
TEST_F(SystemTest, ErrLogSetAppendsLinesAndEventLogAlsoGoesToSyslog) {
    mode_t old = umask(0);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/err.log", ""), 0);
    umask(old);
    EXPECT_EQ(ModeOf("/tmp/err.log"), 0644u);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/log/err.log", "x"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
    // A folder in place of the event log: an error, but syslog still gets the line.
    RemoveTree(KYTO_EVENT_LOG_PATH);
    ASSERT_EQ(mkdir(KYTO_EVENT_LOG_PATH, 0755), 0);
    EXPECT_EQ(KYTOLogSet1(4, 1, 0xFFFFFFFF, "a", "b", "c", "d"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_TRUE(SyslogContains("4 1 0xFFFFFFFF a b c d", LOG_NOTICE));
}

// The engines split an announced length at its thousands separators and join the digits.
TEST_F(SystemTest, StringListsGrowOnSplitAndJoin) {
    PKLIBC_SZLIST list = KLIBCSzListAlloc(1);
    ASSERT_NE(list, nullptr);
    std::string text = "1";
    for (int i = 0; i < 200; ++i)
        text += i == 100 ? "," : ",0";  // one empty item, counted too
    EXPECT_EQ(KLIBCStrSep(text.c_str(), ",", &list), 201);
    char* buf = static_cast<char*>(malloc(2));
    int size = 2, negative = -1;
    EXPECT_EQ(KLIBCSzListJoin(list, "", &buf, &size), 200);  // the buffer grows
    EXPECT_EQ(std::string(buf), "1" + std::string(199, '0'));
    EXPECT_EQ(KLIBCSzListJoin(list, ",", &buf, &negative), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    free(buf);
    KLIBCSzListFree(list);
}

TEST_F(SystemTest, ConfReadsTheLocalThenTheDefaultsFile) {
    KytoConf conf;
    WriteFile(KytoConf::kDefaultsPath, "unique=\"default\"\ntimezone=\"Europe/Rome\"\n");
    EXPECT_EQ(conf.Info("unique", "none"), "default");  // no local file yet
    WriteFile(KytoConf::kInfoPath, "unique=\"local\"\nempty=\"\"\n");
    EXPECT_EQ(conf.Info("unique", "none") + conf.Info("empty", "none"), "local");
    EXPECT_EQ(conf.Info("timezone", "none"), "Europe/Rome");
    EXPECT_EQ(conf.Def("unique", "none"), "default");
    // Unreadable defaults give the fallback; the caller's last error stays.
    ClearLastError();
    ASSERT_EQ(unlink(KytoConf::kDefaultsPath), 0);
    ASSERT_EQ(mkdir(KytoConf::kDefaultsPath, 0755), 0);
    EXPECT_EQ(conf.Info("timezone", "fallback"), "fallback");
    EXPECT_EQ(KLIBCErrGet(), 0);
}

// Which mounts count and the free-space rule; the order is walked by the engines' volume search.
TEST_F(SystemTest, OnlyWritableDataVolumesWithMoreThanTheMinimum) {
    for (const char* notData : {"/volumeUSB1", "/volume", "/mnt/volume1", "/volume1x"})
        MountVolume(notData, 500 * kMiB);
    MountVolume("/volume1", 500 * kMiB, /*readOnly=*/true);
    MountVolume("/volume2", 100 * kMiB);
    WriteFile("/volume2/data", std::string(3 * kMiB, 'x'));
    KYTO_VOLUME_INFO out[2] = {};
    ClearLastError();
    EXPECT_EQ(VolumeAvailGet(0, 97 * kMiB, out, 2), 0);  // equal is not enough; none: no error
    EXPECT_EQ(KLIBCErrGet(), 0);
    EXPECT_EQ(VolumeAvailGet(0, 97 * kMiB - 1, out, 2), 1);
    EXPECT_EQ(std::string(out[0].szMountPath) + " " + std::to_string(out[0].ullFreeBytes),
              "/volume2 " + std::to_string(97 * kMiB));
    EXPECT_EQ(VolumeAvailGet(1, 0, out, 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

TEST_F(SystemTest, HighAvailabilityState) {
    // content nullptr: no file; "/": a folder in its place.
    // clang-format off
    // What KYTOHAIsRunning, KYTOHAIsHybridDL and its partner buffer give.
    struct Case { const char *content, *seen; } cases[] = {
        {nullptr, "0 0 "}, {"running=\"YES\"\n#running=\"yes\"\n", "0 0 "},
        {"running=yes\nhybrid_dl=\"yes\"\npartner_unique=\"abcdefghijklmnop\"\n", "1 1 abcdefg"},
        {"hybrid_dl=\"yes\"\npartner_unique=\"\"\n", "0 -1 "}, {"/", "0 -1 "}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.content ? c.content : "(no file)");
        const bool folder = c.content && *c.content == '/';
        WriteOrRemove(KYTO_HA_STATUS_PATH, folder ? nullptr : c.content);
        ASSERT_EQ(folder ? mkdir(KYTO_HA_STATUS_PATH, 0755) : 0, 0);
        char buf[8] = "stale";
        const int running = KYTOHAIsRunning(), hybrid = KYTOHAIsHybridDL(buf, sizeof buf);
        EXPECT_EQ(c.seen, std::to_string(running) + " " + std::to_string(hybrid) + " " + buf);
    }
}

// Order and the third-party tool's run are seen through the engine's service switch, which
// ignores the results; here: which names count as start-up scripts, failures that do not stop
// the walk.
TEST_F(SystemTest, ServicesRunOnlyStartScriptsAndFailuresDoNotStopTheWalk) {
    std::string recorder = *ReadFile("/usr/kyto/bin/kytopkg");
    for (const char* name : {"S50extra.sh", "K10old.sh", "S30notes.txt", "xS40.sh"})
        WriteFile(std::string("/usr/kyto/etc/rc.d/") + name, recorder, 0755);
    WriteFile("/var/run/fake-exit/S20samba.sh", "3");
    ClearRecordedCalls();
    EXPECT_EQ(KYTOServiceOnOffALL(KYTO_SERVICE_STOP_ALL), 0);
    std::string calls;
    for (const std::vector<std::string>& call : RecordedCalls())
        calls += call.at(0) + " " + call.at(1) + ";";
    EXPECT_EQ(calls, "S99sshd.sh stop;S50extra.sh stop;S20samba.sh stop;S01iptables.sh stop;");
}

}  // namespace
