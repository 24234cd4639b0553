// Helpers shared by the engine tests (see engine_fixtures.h).
#include "engine_fixtures.h"

#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <kytoplatform/klibc.h>

#include "vyxupdate.h"

namespace kytotest {

std::vector<std::vector<std::string>> DownloadNotification(bool ok) {
    return {{"kytovyxnotify", "@administrators",
             ok ? "update:update_download_noti_title" : "update:update_download_noti_title_err",
             "<a style='font-size:12px;text-decoration:underline;' href=javascript:KYTO.QVS."
             "AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS.ControlPanel.Upgrade.Main'"
             "})> {0} </a>",
             "update:update_download_noti_link"}};
}

bool EventLogged(const std::string& text) {
    return ReadFile("/var/log/kytoevent.log").value_or("").find(text) != std::string::npos;
}

void ReleaseServerTest::SetUp() {
    SandboxTest::SetUp();
    server = std::make_unique<UpdateServer>();
    server->PointRssServerHere();
    MountVolume("/volume1", 300ULL << 20);
}

void ReleaseServerTest::TearDown() {
    server.reset();
    SandboxTest::TearDown();
}

void ReleaseServerTest::ServeFeed(const std::vector<FeedModel>& models) {
    server->PutFile("/autoupdate/genRSS.php", FeedDocument(FeedItem("5", "2", "5700", models)));
}

FeedModel ReleaseServerTest::Image(const std::string& unique, const std::string& urlPath,
                                   unsigned long long bytes) {
    return {unique, server->Url(urlPath), Md5Of(server->PutFileOfSize(urlPath, bytes))};
}

pid_t ReleaseServerTest::StartSlowDownload(unsigned long long bytes) {
    ServeFeed({Image("demo_model", "/img/slow.img", bytes)});
    server->SlowPath("/img/slow.img", 64 << 10);
    pid_t pid = Spawn([] { return VyxUpdate().DownloadVyx(); });
    struct stat st;
    EXPECT_TRUE(WaitFor([&] {
        return KLIBCReadPidFile("/var/run/downloadVYX.pid") > 0 &&
               stat("/volume1/@autoupdate/slow.img", &st) == 0 && st.st_size > 0;
    }));
    return pid;
}

std::string VyxStatusSeen() {
    const char* const kWords[] = {"none", "downloading", "finished", "stopped", "failed"};
    int percentage = -1;
    VyxUpdate::VYX_DOWNLOAD_STATUS status = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;
    const bool ok = VyxUpdate::GetDownloadStatus(percentage, status);
    const int index = static_cast<int>(status);
    return std::string(ok ? "" : "refused ") +
           (index >= 0 && index < 5 ? kWords[index] : std::to_string(index)) + " " +
           std::to_string(percentage);
}

void WriteLiveVyxDownload() {
    WriteFile("/var/run/downloadVYX.status",
              "updateType=\"vyxupdate\"\ndownloadStatus=\"downloading\"\n"
              "downloadCount=\"1\"\ndownloadNum=\"1\"\npatchPath=\"/volume1/part.img\"\n");
    WriteFile("/volume1/part.img", "part");
    WriteFile("/var/run/downloadprogress", "Length: 100 [x]\n");
    WriteFile("/var/run/downloadVYX.pid", std::to_string(getpid()));
}

std::string SuppliedImagePlace() {
    std::string path;
    bool sufficient = false;
    const int rc = VyxUpdate::GetVolumePathForPatch(path, sufficient);
    return std::to_string(rc) + " " + path + (sufficient ? " sufficient" : "");
}

int ReleaseFeedTest::Parse(const std::string& items, bool hotfixOnly) {
    WriteFile("/var/run/autoupdate_tmp_file_RSS", FeedDocument(items));
    memset(&current, 0, sizeof(current));
    EXPECT_EQ(1, VyxUpdate::GetVyxInfo(current));
    memset(&release, 0x55, sizeof(release));
    return VyxUpdate::ParseRssFile(hotfixOnly, current, found, release);
}

std::string BuildDebName(const DebPackage& pkg, const std::string& folder) {
    const std::string path = BuildDeb(pkg, folder);
    return path.substr(path.rfind('/') + 1);
}

std::string ApplyStageSeen() {
    int percentage = -7;
    std::string word = "caller-stage", err = "caller-err";
    SmallUpdate::GetApplyStage(percentage, word, err);
    return std::to_string(percentage) + " " + word + " " + err;
}

std::string ApplyDeb(const std::string& name, int fix, bool fails,
                     const std::map<std::string, std::string>& files) {
    DebPackage pkg = fails ? FailingDeb(name, SmallFixVersion("6.1", 5644, fix))
                           : MakeDebPackage(name, SmallFixVersion("6.1", 5644, fix));
    if (!fails && files.empty()) {
        pkg.postinst = "#!/bin/sh\necho " + name +
                       " $(sed -n 's/^percentage=\"\\(.*\\)\"/\\1/p' "
                       "/var/run/applySmallUpd@te.status) >> /tmp/install_order.log\n";
    }
    pkg.files = files;
    return BuildDebName(pkg, "/volume1/@smallupd@te_deb");
}

const char* const kApplyStageWords[7] = {
    "none",  "waiting_remote_upgrading", "analying", "program", "startService", "finished",
    "reboot"};

void ApplyStepsTest::SetUp() {
    SandboxTest::SetUp();
    Shell("mkdir -p /volume1/@smallupd@te_deb");
    u.m_debDir = "/volume1/@smallupd@te_deb";
}

void WriteSmallInfo(const std::vector<std::pair<std::string, const char*>>& changes) {
    Json::Value info =
        ParseJson(R"({"updateType":"smallupdate","buildnumber":5644,"newSmallFixNumber":3,)"
                  R"("debDir":"/volume1/d","smallupdateDeb":"smallfix_6.1-5644-s3_all.deb",)"
                  R"("vyxServiceRestartList":["S20samba.sh"],"pkgRestartList":[]})");
    for (const auto& [key, value] : changes) {
        if (value)
            info[key] = ParseJson(value);
        else
            info.removeMember(key);
    }
    WriteFile("/autoupd@te.info", Json::FastWriter().write(info));
}

SmallUpdate DumpableRecord() {
    SmallUpdate u;
    u.m_buildNumber = 5644;
    u.m_newSmallFixNumber = 7;
    u.m_debDir = "/volume1/d";
    u.m_smallUpdateDeb = "smallfix_6.1-5644-s7_all.deb";
    u.m_smallUpdateDebLink = "http://127.0.0.1/s7";
    return u;
}

std::string SmallDownloadSeen() {
    int percentage = 7;
    std::string word;
    SmallUpdate().GetDownloadStatus(percentage, word);
    return std::to_string(percentage) + " " + word;
}

void SmallDownloadTest::SetUp() {
    UpdateServerTest::SetUp();
    u.m_newSmallFixNumber = 5;  // a filled record: the server's list is not asked
    u.m_buildNumber = 5644;
    u.m_blRestartAllService = true;
}

void SmallDownloadTest::Packages(const std::vector<std::string>& names, long bytesPerSecond) {
    u.m_installDebs.clear();
    u.m_installDebLinks.clear();
    std::vector<std::string> all = names;
    all.push_back("small" + names.front());
    for (const std::string& name : all) {
        const std::string deb = SmallFixDebName(name, 5), link = server->Url("/debs/" + deb);
        server->PutFileOfSize("/debs/" + deb, 48 << 10);
        if (bytesPerSecond)
            server->SlowPath("/debs/" + deb, bytesPerSecond);
        (name == all.back() ? u.m_smallUpdateDeb : u.m_installDebs.emplace_back()) = deb;
        (name == all.back() ? u.m_smallUpdateDebLink : u.m_installDebLinks.emplace_back()) = link;
    }
}

PatchEntry PatchListTest::Entry(int fix, const std::string& restart) {
    const std::string pkg = "fix" + std::to_string(fix);
    return {fix,
            {{"smallupdate", server->Url("/debs/" + SmallFixDebName("smallfix", fix))},
             {pkg, server->Url("/debs/" + SmallFixDebName(pkg, fix))}},
            false,
            false,
            restart};
}

std::vector<PatchEntry> PatchListTest::RealisticList() {
    std::vector<PatchEntry> list = {Entry(1, "\"reboot\""), Entry(2), Entry(5), Entry(4)};
    list[2].flash = true;
    list[2].restart = "{\"vyx_service\":[\"samba\",\"sshd\"],\"pkg\":[\"web\"]}";
    list[2].proj.push_back({"flashupdate", server->Url("/debs/" + SmallFixDebName("flash", 5))});
    list[3].config = true;
    list[3].restart = "{\"vyx_service\":[\"samba\"],\"pkg\":[]}";
    return list;
}

void InstallServiceProbes(const std::vector<std::string>& scripts) {
    const std::string probe =
        "#!/bin/sh\nf=/var/run/applySmallUpd@te.status\ns=none\n"
        "[ -f \"$f\" ] && s=$(. \"$f\"; echo \"$percentage/$stage\")\n"
        "printf '%s\\t%s\\t%s\\n' \"${0##*/}\" \"$*\" \"$s\" >>/var/log/kyto-calls.log\n";
    RemoveTree("/usr/kyto/etc/rc.d");
    for (const std::string& s : scripts)
        WriteFile("/usr/kyto/etc/rc.d/" + s, probe, 0755);
    WriteFile("/usr/kyto/bin/kytopkg", probe, 0755);
}

const std::string kPatchBase = "http://updates.example.invalid/smallupdate/5644/";

std::string FixDeb(const std::string& package, int fix) {
    return DebFileName(MakeDebPackage(package, SmallFixVersion("6.1", 5644, fix)));
}

Json::Value ProjJson(const std::string& name, int fix, const std::string& package) {
    Json::Value p;
    p["name"] = name;
    p["url"] = kPatchBase + FixDeb(package.empty() ? name : package, fix);
    return p;
}

Json::Value EntryJson(int version, const std::vector<Json::Value>& proj, const Json::Value& restart,
                      bool flash, bool config) {
    Json::Value e;
    e["proj"] = Json::Value(Json::arrayValue);
    for (const auto& p : proj)
        e["proj"].append(p);
    e["version"] = version;
    e["flash_upgrade"] = flash;
    e["config_upgrade"] = config;
    e["restart"] = restart;
    return e;
}

DebPackage SmallFixPackage() {
    return MakeDebPackage("kyto-tool-fix", SmallFixVersion("1.0", 5644, 1));
}

std::string SmallFixDeb() {
    return DebFileName(SmallFixPackage());
}

std::string SmallFixList(const UpdateServer& server) {
    PatchEntry fix;
    fix.version = 1;
    fix.proj = {{"kyto-tool-fix", server.Url("/debs/" + SmallFixDeb())},
                {"smallupdate", server.Url("/debs/kyto-su_5.2-5644-s1_all.deb")}};
    fix.restart = R"({"vyx_service":["S01iptables.sh"],"pkg":["DemoApp"]})";
    return PatchListJson(5644, "demo_model", {fix});
}

void PublishSmallFix(UpdateServer& server) {
    BuildDeb(SmallFixPackage(), server.Root() + "/debs");
    BuildDeb(MakeDebPackage("kyto-su", SmallFixVersion("5.2", 5644, 1)), server.Root() + "/debs");
    server.PutFile(UpdateServer::PatchListPath(5644, "demo_model"), SmallFixList(server));
}

}  // namespace kytotest
