// Where the release feed comes from and goes, and which releases a check considers: the one
// definition that the release check and the programs in tools/ use.  Internal header: not
// installed; header-only, so that programs built in this tree use it without an exported
// symbol.
#ifndef KYTOINSTALLCPP_VYXUPDATE_PLAN_H
#define KYTOINSTALLCPP_VYXUPDATE_PLAN_H

#include <kytoplatform/kytoconf.h>

namespace kyto {

// The feed's address when "rss_server" of the information file names none: the
// appliance's default update server followed by the feed script.
constexpr const char* kDefaultRssServer = "http://update.kyto.local/autoupdate/genRSS.php";
// The fetched feed, read by the feed reader and deleted at the end of the check.
constexpr const char* kRssFile = "/var/run/autoupdate_tmp_file_RSS";

// True unless the configured upgrade type is exactly "all": the check then considers only
// releases of the running MAJOR.MINOR.
inline bool HotfixOnly() {
    KytoConf conf;
    return conf.Info("upgradetype", "all") != "all";
}

}  // namespace kyto

#endif
