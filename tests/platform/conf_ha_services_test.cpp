// Configuration reader, high-availability state and the start-up scripts.
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using kytotest::RecordedCalls;
using kytotest::WriteFile;
using Calls = std::vector<std::vector<std::string>>;

class ConfTest : public kytotest::SandboxTest {};
class HaTest : public kytotest::SandboxTest {};
class ServicesTest : public kytotest::SandboxTest {};

TEST_F(ConfTest, DefReadsTheDefaultsFile) {
    KytoConf conf;
    EXPECT_EQ(conf.Def("unique", "none"), "demo_model");
    EXPECT_EQ(conf.Def("maxdisks", ""), "4");
    EXPECT_EQ(conf.Def("absent", "fallback"), "fallback");
    EXPECT_EQ(conf.Def("", "fallback"), "fallback");

    std::string longValue(60000, 'v');
    WriteFile(KytoConf::kDefaultsPath, "# defaults\nlong=\"" + longValue + "\"\nempty=\"\"\n");
    EXPECT_EQ(conf.Def("long", ""), longValue);
    EXPECT_EQ(conf.Def("empty", "fallback"), "");  // present but empty is a value

    // Unreadable: over-long line, a folder, or no file at all.  The caller's error stays.
    KLIBCErrSetEx(0, "", 0);
    WriteFile(KytoConf::kDefaultsPath, "k=" + std::string(KLIBC_KV_MAX_LINE, 'x') + "\n");
    EXPECT_EQ(conf.Def("k", "fallback"), "fallback");
    ASSERT_EQ(unlink(KytoConf::kDefaultsPath), 0);
    EXPECT_EQ(conf.Def("unique", "fallback"), "fallback");
    ASSERT_EQ(mkdir(KytoConf::kDefaultsPath, 0755), 0);
    EXPECT_EQ(conf.Def("unique", "fallback"), "fallback");
    EXPECT_EQ(KLIBCErrGet(), 0);
}

TEST_F(ConfTest, InfoPrefersTheLocalFile) {
    KytoConf conf;
    EXPECT_EQ(conf.Info("unique", "none"), "demo_model");  // no /etc/kytoinfo.conf
    WriteFile(KytoConf::kInfoPath, "unique=\"local\"\nonly_here=1\n");
    EXPECT_EQ(conf.Info("unique", "none"), "local");
    EXPECT_EQ(conf.Info("only_here", "none"), "1");
    EXPECT_EQ(conf.Info("timezone", "none"), "Europe/Berlin");
    EXPECT_EQ(conf.Info("absent", "none"), "none");
    EXPECT_EQ(conf.Def("unique", "none"), "demo_model");
}

TEST_F(HaTest, NoStatusFileMeansNoCluster) {
    char buf[16] = "untouched";
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KYTOHAIsRunning(), 0);
    EXPECT_EQ(KYTOHAIsHybridDL(buf, sizeof buf), 0);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(KLIBCErrGet(), 0);
}

TEST_F(HaTest, ReadsRunningAndHybridState) {
    struct Case {
        const char* content;
        int running;
        int hybrid;
        const char* partner;
    } cases[] = {
        {"running=\"yes\"\n", 1, 0, ""},
        {"running=yes\n", 1, 0, ""},
        {"running=\"no\"\nhybrid_dl=\"yes\"\npartner_unique=\"p\"\n", 0, 1, "p"},
        {"running=\"YES\"\n", 0, 0, ""},
        {"#running=\"yes\"\n", 0, 0, ""},
        {"", 0, 0, ""},
        {"running=\"yes\"\nhybrid_dl=\"yes\"\npartner_unique=\"model_b\"\n", 1, 1, "model_b"},
        {"hybrid_dl=\"no\"\npartner_unique=\"model_b\"\n", 0, 0, ""},
        {"hybrid_dl=\"yes\"\n", 0, -1, ""},
        {"hybrid_dl=\"yes\"\npartner_unique=\"\"\n", 0, -1, ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.content);
        WriteFile(KYTO_HA_STATUS_PATH, c.content);
        char buf[32];
        EXPECT_EQ(KYTOHAIsRunning(), c.running);
        EXPECT_EQ(KYTOHAIsHybridDL(buf, sizeof buf), c.hybrid);
        EXPECT_STREQ(buf, c.partner);
        if (c.hybrid < 0) {
            EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_NOT_FOUND);
        }
    }
}

TEST_F(HaTest, HybridPartnerIsCutAndBadInputFails) {
    WriteFile(KYTO_HA_STATUS_PATH, "hybrid_dl=\"yes\"\npartner_unique=\"abcdef\"\n");
    char buf[8];
    EXPECT_EQ(KYTOHAIsHybridDL(buf, 4), 1);
    EXPECT_STREQ(buf, "abc");
    EXPECT_EQ(KYTOHAIsHybridDL(buf, 1), 1);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(KYTOHAIsHybridDL(buf, 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_EQ(KYTOHAIsHybridDL(nullptr, 8), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);

    // A status file that exists but cannot be read.
    ASSERT_EQ(unlink(KYTO_HA_STATUS_PATH), 0);
    ASSERT_EQ(mkdir(KYTO_HA_STATUS_PATH, 0755), 0);
    EXPECT_EQ(KYTOHAIsRunning(), 0);
    EXPECT_EQ(KYTOHAIsHybridDL(buf, sizeof buf), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
}

TEST_F(ServicesTest, StopsInReverseAndStartsInNameOrder) {
    std::string recorder = *kytotest::ReadFile("/usr/kyto/bin/kytopkg");
    // Only S*.sh files count.
    WriteFile("/usr/kyto/etc/rc.d/S50extra.sh", recorder, 0755);
    WriteFile("/usr/kyto/etc/rc.d/K10old.sh", recorder, 0755);
    WriteFile("/usr/kyto/etc/rc.d/S30notes.txt", recorder, 0755);
    WriteFile("/usr/kyto/etc/rc.d/xS40.sh", recorder, 0755);
    // A failing script does not stop the others.
    WriteFile("/var/run/fake-exit/S20samba.sh", "3");
    kytotest::ClearRecordedCalls();

    EXPECT_EQ(KYTOServiceOnOffALL(KYTO_SERVICE_STOP_ALL), 0);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S99sshd.sh", "stop"},
                                      {"S50extra.sh", "stop"},
                                      {"S20samba.sh", "stop"},
                                      {"S01iptables.sh", "stop"}}));
    kytotest::ClearRecordedCalls();
    EXPECT_EQ(KYTOServiceOnOffALL(KYTO_SERVICE_START_ALL), 0);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S01iptables.sh", "start"},
                                      {"S20samba.sh", "start"},
                                      {"S50extra.sh", "start"},
                                      {"S99sshd.sh", "start"}}));
}

TEST_F(ServicesTest, RejectsBadActionAndMissingFolder) {
    kytotest::ClearRecordedCalls();
    for (int action : {0, 3, -1}) {
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(KYTOServiceOnOffALL(action), -1) << action;
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    }
    EXPECT_TRUE(RecordedCalls().empty());
    ASSERT_EQ(kytotest::Shell("rm -r /usr/kyto/etc/rc.d"), 0);
    EXPECT_EQ(KYTOServiceOnOffALL(KYTO_SERVICE_START_ALL), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
}

TEST_F(ServicesTest, ThirdPartyPackagesStartAndStop) {
    kytotest::ClearRecordedCalls();
    EXPECT_EQ(KYTOServiceThirdPartyAll(1), 0);
    EXPECT_EQ(KYTOServiceThirdPartyAll(0), 0);
    WriteFile("/var/run/fake-exit/kytopkg", "4");
    EXPECT_EQ(KYTOServiceThirdPartyAll(1), 4);
    EXPECT_EQ(RecordedCalls(),
              (Calls{{"kytopkg", "startall"}, {"kytopkg", "stopall"}, {"kytopkg", "startall"}}));

    ASSERT_EQ(unlink("/usr/kyto/bin/kytopkg"), 0);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KYTOServiceThirdPartyAll(0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_EXEC);
}

}  // namespace
