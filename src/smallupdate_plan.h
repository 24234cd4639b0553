// Where a small update's patch list is, what a small update fetches and which start-up
// scripts a restart of all services runs: the one definition that the lookup, the
// download, the service restart and the programs in tools/ all use.  Internal header: not
// installed; header-only, so that programs built in this tree use it without an exported symbol.
#ifndef KYTOINSTALLCPP_SMALLUPDATE_PLAN_H
#define KYTOINSTALLCPP_SMALLUPDATE_PLAN_H

#include <glob.h>

#include <string>
#include <vector>

#include "custombugfix.h"
#include "smallupdate.h"

namespace kyto {

// The patch list's name, and the base of its address when "small_info_path" of the
// information file names none.
constexpr const char* kPatchListName = "VYX-Security.json";
constexpr const char* kDefaultSmallInfoPath = "http://update.kyto.local/smallupdate";

// Where the patch list of a build and model is: "<base>/<build>/<unique>/VYX-Security.json".
inline std::string PatchListUrl(const std::string& base, const std::string& build,
                                const std::string& unique) {
    return base + "/" + build + "/" + unique + "/" + kPatchListName;
}

// Folder of the start-up scripts and the scripts a restart of all services runs.
constexpr const char* kRcDir = "/usr/kyto/etc/rc.d";
constexpr const char* kRcPattern = "/usr/kyto/etc/rc.d/S*.sh";

// Links the download fetches, in its order: the further packages; the small-update
// package only together with a configuration update or further packages (it carries the
// configuration updater and the boot-time installer); the flash package when a flash
// update is asked for.  Links are taken as the record has them, empty ones included.
inline std::vector<std::string> SmallUpdateDownloadLinks(const SmallUpdate& u) {
    std::vector<std::string> links = u.m_installDebLinks;
    if (u.m_blConfigUpdate || !u.m_installDebLinks.empty())
        links.push_back(u.m_smallUpdateDebLink);
    if (u.m_blFlashUpdate)
        links.push_back(u.m_flashUpdateDebLink);
    return links;
}

// Every start-up script (full paths) in start order, as the shell sorts them.  A read
// error part-way still gives the scripts found so far; empty when none could be listed.
inline std::vector<std::string> StartupScripts() {
    std::vector<std::string> scripts;
    glob_t g{};
    glob(kRcPattern, GLOB_ERR, nullptr, &g);
    for (size_t i = 0; i < g.gl_pathc; ++i)
        scripts.emplace_back(g.gl_pathv[i]);
    globfree(&g);
    return scripts;
}

// Whether a restart of all services leaves script alone: it is on the invalid-restart
// list (whole paths compared).
inline bool SkippedOnRestartAll(const std::vector<std::string>& invalid,
                                const std::string& script) {
    return CustomBugFix::Find(invalid, script) != 0;
}

// The scripts a restart of all services runs, in start order: StartupScripts() without
// those on the invalid-restart list.
inline std::vector<std::string> RestartAllScripts(const std::vector<std::string>& invalid) {
    std::vector<std::string> run;
    for (const std::string& script : StartupScripts()) {
        if (!SkippedOnRestartAll(invalid, script))
            run.push_back(script);
    }
    return run;
}

}  // namespace kyto

#endif
