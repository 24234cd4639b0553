// CustomBugFix: folds the entries of a patch list, one Merge per entry, into one result:
// the newest small-update and flash packages, every other package of every newer fix,
// and the strongest restart demand.
#ifndef KYTOINSTALLCPP_CUSTOMBUGFIX_H
#define KYTOINSTALLCPP_CUSTOMBUGFIX_H

#include <string>
#include <vector>

#include <json/json.h>

#include "kyto_export.h"

class KYTO_EXPORT CustomBugFix {
  public:
    explicit CustomBugFix(int curSmallFixNumber);

    // Folds one patch-list entry in; 1 success, 0 failure.
    int Merge(const Json::Value& entry);
    int MergeProjList(const Json::Value& proj, int version);
    int MergeServiceList(const Json::Value& restart);
    // 1 when some element equals item exactly.
    static int Find(const std::vector<std::string>& list, const std::string& item);

    // The accumulated result, read back by the patch-list lookup.
    int m_smallFixNumber;
    bool m_blConfigUpdate;
    bool m_blFlashUpdate;
    std::string m_smallUpdateDeb;
    std::string m_smallUpdateDebLink;
    std::string m_flashUpdateDeb;
    std::string m_flashUpdateDebLink;
    std::vector<std::string> m_installDebs;
    std::vector<std::string> m_installDebLinks;
    bool m_blRestartAllService;
    bool m_blNeedReboot;
    std::vector<std::string> m_vyxServiceRestartList;
    std::vector<std::string> m_pkgRestartList;
    int m_curSmallFixNumber;
};

#endif
