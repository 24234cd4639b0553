// SystemUpdate: the one entry object through which a caller drives an update of either
// kind.  It owns one engine of each kind and routes check, download, apply and cancel to
// the engine that has something to offer.
#ifndef KYTOINSTALLCPP_SYSTEMUPDATE_H
#define KYTOINSTALLCPP_SYSTEMUPDATE_H

#include <string>

#include "kyto_export.h"
#include "smallupdate.h"
#include "vyxupdate.h"

class KYTO_EXPORT SystemUpdate {
  public:
    SystemUpdate();

    SmallUpdate m_smallUpdate;
    VyxUpdate m_vyxUpdate;
    int m_updateType;  // 0 none, 1 full release, 2 small update
    std::string m_fullVersion;
    bool m_blChecked;
};

#endif
