// SystemUpdate: the one entry object through which a caller drives an update of either
// kind.  It owns one engine of each kind and routes check, download, apply and cancel to
// the engine that has something to offer.
#ifndef KYTOINSTALLCPP_SYSTEMUPDATE_H
#define KYTOINSTALLCPP_SYSTEMUPDATE_H

#include <string>

#include "kyto_export.h"
#include "smallupdate.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

class KYTO_EXPORT SystemUpdate {
  public:
    SystemUpdate();

    // Asks the full-release engine, then the small-update engine, for a newer update; 1 when
    // the question could be answered (blHaveUpdate set), 0 when it could not.
    int CheckNewUpdate(bool& blHaveUpdate);
    // "vyx" for a full release, "smallupdate" otherwise; "" when a needed check fails.
    std::string GetUpdateType();
    // Display text of the offered version; checks again while it is empty.
    std::string GetFullVersion();
    // Takes the update type from the info file of a finished download; 1 when recognised.
    int ImportInfoFile();
    // Downloads, applies (small updates only) or cancels through the right engine; 1 success.
    int Download();
    int Apply();
    int CancelDownload();

    SmallUpdate m_smallUpdate;
    VyxUpdate m_vyxUpdate;
    // The kind found by the check, numbered as UpdateUtil::PATCH_TYPE (0 none, 1 full
    // release, 2 small update); an int, as callers that keep or restore it expect.
    int m_updateType;
    std::string m_fullVersion;
    bool m_blChecked;

  private:
    // Removes a status file left by a stopped or failed download of either engine.
    void TidyDownloadStatus();
};

#endif
