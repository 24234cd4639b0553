// Helpers shared by the engine tests: a reader racing a writer in another process, the
// release-download fixture, small-update records and packages, patch-list entries as JSON.
#ifndef KYTO_TESTS_SUPPORT_ENGINE_FIXTURES_H
#define KYTO_TESTS_SUPPORT_ENGINE_FIXTURES_H

#include <sys/types.h>

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include "deb_builder.h"
#include "sandbox.h"
#include "smallupdate.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace kytotest {

// ---- Release download --------------------------------------------------------------------

// The notification the release download sends to the administrators when it ends.
std::vector<std::vector<std::string>> DownloadNotification(bool ok);
// True when the appliance's event log holds the text.
bool EventLogged(const std::string& text);

// A loopback update server that the release feed points at (stopped before the sandbox's
// own checks) and a 300 MiB data volume at /volume1.
class ReleaseServerTest : public SandboxTest {
  protected:
    void SetUp() override;
    void TearDown() override;
    // Publishes one feed item, 5.2 build 5700, holding the models.
    void ServeFeed(const std::vector<FeedModel>& models);
    // Serves an image of `bytes` at urlPath; returns the feed entry for it with its MD5.
    FeedModel Image(const std::string& unique, const std::string& urlPath,
                    unsigned long long bytes);
    // Serves a slow image for this model and starts its download in a second process;
    // returns once wget runs and bytes have arrived in /volume1/@autoupdate/slow.img.
    pid_t StartSlowDownload(unsigned long long bytes);
    std::unique_ptr<UpdateServer> server;
};

// GetDownloadStatus of the release download as another process sees it: "<status>
// <percentage>", the status as none, failed, stopped, downloading or finished, led by
// "refused " when the call fails.
std::string VyxStatusSeen();

// Writes the shared files of a release download in progress into /volume1 whose wget is
// this process: status file, partial image, progress log and pid file.
void WriteLiveVyxDownload();
// What GetVolumePathForPatch answers: "<result> <path>", with " sufficient" when it says so.
std::string SuppliedImagePlace();

// The release feed reader against the provisioned 5.2 build 5644 "demo_model".
class ReleaseFeedTest : public SandboxTest {
  protected:
    // Writes a feed of the items where the check fetches it and parses it into `release`
    // (filled with 0x55 first), with `found` and `current` as the check passes them.
    int Parse(const std::string& items, bool hotfixOnly = false);
    bool found = false;
    _tag_vyxinfo_ current;
    _tag_vyxinfo_ release;
};

// ---- Small update ------------------------------------------------------------------------

// Builds the package into folder and returns its file name.
std::string BuildDebName(const DebPackage& pkg, const std::string& folder);
// What SmallUpdate::GetApplyStage reports, "<percentage> <stage word> <error>", starting
// from the caller's own values -7, "caller-stage" and "caller-err".
std::string ApplyStageSeen();
// Builds a package of small fix `fix` (build 5644) into the apply's package folder
// "/volume1/@smallupd@te_deb" and returns its file name.  Without `files` its postinst appends
// "<name> <percentage>" to /tmp/install_order.log, the percentage being the one the apply
// status file holds then; a failing package's postinst exits 1 instead.
std::string ApplyDeb(const std::string& name, int fix, bool fails = false,
                     const std::map<std::string, std::string>& files = {});
// The words GetApplyStage reports for the stages 0 to 6.
extern const char* const kApplyStageWords[7];
// The apply's steps on a record `u` whose package folder "/volume1/@smallupd@te_deb" exists.
class ApplyStepsTest : public SandboxTest {
  protected:
    void SetUp() override;
    SmallUpdate u;
};
// Writes "/autoupd@te.info" as a download on build 5644 writes it (fix 3, package folder
// "/volume1/d", the small-update package, "S20samba.sh" to restart, no packages to restart),
// each change setting a member to JSON text or removing it (nullptr).
void WriteSmallInfo(const std::vector<std::pair<std::string, const char*>>& changes = {});
// A record for build 5644, fix 7, that dumps cleanly: one small-update package with its link,
// package folder "/volume1/d".
SmallUpdate DumpableRecord();

// GetDownloadStatus of the small update as a fresh record in this process sees it:
// "<percentage> <word>", the percentage starting from the caller's 7.
std::string SmallDownloadSeen();
// A record for build 5644, fix 5, restart of all services, whose download runs against the
// loopback server into "/volume1//@smallupd@te_deb".
class SmallDownloadTest : public UpdateServerTest {
  protected:
    void SetUp() override;
    // Serves further packages of 48 KiB each (at bytesPerSecond when given) and the
    // small-update package that comes with them ("small" + the first name, fetched last),
    // and puts them into the record in place of earlier ones.
    void Packages(const std::vector<std::string>& names, long bytesPerSecond = 0);
    SmallUpdate u;
};
// The patch-list lookup against the loopback server.
class PatchListTest : public UpdateServerTest {
  protected:
    // Fix `fix`: its small-update package "smallfix" and one further package "fix<fix>".
    PatchEntry Entry(int fix, const std::string& restart = "\"none\"");
    // Fixes 1 (reboot) and 2, then a flash fix 5 (restarting samba, sshd and the add-on
    // web) and a configuration fix 4 (restarting samba): out of ascending order.
    std::vector<PatchEntry> RealisticList();
};
// Fix 1 of build 5644 as the driver and the facade see it: the further package
// "kyto-tool-fix" and the small-update package "kyto-su", restarting S01iptables.sh and the
// add-on "DemoApp".  The further package, its file name and the patch list with links on
// `server`; PublishSmallFix builds both packages into the server's /debs and serves the list.
DebPackage SmallFixPackage();
std::string SmallFixDeb();
std::string SmallFixList(const UpdateServer& server);
void PublishSmallFix(UpdateServer& server);
// Replaces the provisioned start-up scripts and the package control program with probes
// that record their arguments and the apply status ("percentage/stage", or "none") a
// poller would have read at the moment they ran.
void InstallServiceProbes(const std::vector<std::string>& scripts);

// ---- Patch-list entries as JSON ----------------------------------------------------------

// Where the entries' packages are "served": "http://updates.example.invalid/smallupdate/5644/".
extern const std::string kPatchBase;
// "<package>_6.1-5644-s<fix>_all.deb".
std::string FixDeb(const std::string& package, int fix);
// {"name": name, "url": kPatchBase + FixDeb(package or name, fix)}
Json::Value ProjJson(const std::string& name, int fix, const std::string& package = "");
// One patch-list entry with every key the merge needs.
Json::Value EntryJson(int version, const std::vector<Json::Value>& proj,
                      const Json::Value& restart = "none", bool flash = false, bool config = false);

}  // namespace kytotest

#endif
