// VyxUpdate: finds, downloads and verifies a full VYX release image.
//
// The release feed is read line by line (not as XML), the running version comes from the
// system's version files, the image is fetched by wget in a forked child (so another
// process can cancel it by signal) and the progress is shared with other processes
// through "/var/run/downloadVYX.status", the pid file and wget's own progress log.
#include "vyxupdate.h"

#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <libgen.h>
#include <mntent.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <cmath>
#include <memory>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>
#include <kytoplatform/kytoconf.h>

#include "child_process.h"
#include "download_status.h"
#include "file_system.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "update_cpputil.h"

namespace {

const char* const kModule = "vyxupdate";

const char* const kRssFile = "/var/run/autoupdate_tmp_file_RSS";
const char* const kPidFile = "/var/run/downloadVYX.pid";
const char* const kOldPidFile = "/var/run/download_vyx.pid";
const char* const kProgressLog = "/var/run/downloadprogress";
const char* const kInstallerProgress = "/tmp/update.progress";
const char* const kOpenssl = "/usr/kyto/bin/openssl";
const char* const kNotifier = "/usr/kyto/bin/kytovyxnotify";
const char* const kDownloadFolderName = "@autoupdate";

// Feed URL used when "rss_server" is not configured: the appliance's default update
// server followed by the feed script.
const char* const kDefaultRssServer = "http://update.kyto.local/autoupdate/genRSS.php";

constexpr unsigned long long kSufficientFreeSpace = 524288000ULL;  // 500 MiB
constexpr int kMaxDownloadAttempts = 10;

constexpr unsigned int kEventDownloadDone = 0x11B01021;
constexpr unsigned int kEventDownloadFailed = 0x11B01022;
const char* const kNotifyLinkText =
    "<a style='font-size:12px;text-decoration:underline;' "
    "href=javascript:KYTO.QVS.AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS."
    "ControlPanel.Upgrade.Main'})> {0} </a>";

// Element names of the feed and the kinds they map to.  "title" appears twice (the
// channel's and the item's); lookup takes the first row, so the second is never reached.
// The last row ends the table.
struct TagRow {
    const char* name;
    _tag_rss_tag_type_ type;
};
const TagRow kTagTable[] = {
    {"rss", RSS_TAG_RSS},
    {"channel", RSS_TAG_CHANNEL},
    {"title", RSS_TAG_TITLE},
    {"link", RSS_TAG_LINK},
    {"pubDate", RSS_TAG_PUBDATE},
    {"copyright", RSS_TAG_COPYRIGHT},
    {"item", RSS_TAG_ITEM},
    {"title", RSS_TAG_ITEM_TITLE},
    {"MajorVer", RSS_TAG_MAJOR_VER},
    {"MinorVer", RSS_TAG_MINOR_VER},
    {"BuildPhase", RSS_TAG_BUILD_PHASE},
    {"BuildNum", RSS_TAG_BUILD_NUM},
    {"BuildDate", RSS_TAG_BUILD_DATE},
    {"ReqMajorVer", RSS_TAG_REQ_MAJOR_VER},
    {"ReqMinorVer", RSS_TAG_REQ_MINOR_VER},
    {"ReqBuildPhase", RSS_TAG_REQ_BUILD_PHASE},
    {"ReqBuildNum", RSS_TAG_REQ_BUILD_NUM},
    {"ReqBuildDate", RSS_TAG_REQ_BUILD_DATE},
    {"model", RSS_TAG_MODEL},
    {"mUnique", RSS_TAG_M_UNIQUE},
    {"mLink", RSS_TAG_M_LINK},
    {"mCheckSum", RSS_TAG_M_CHECKSUM},
    {nullptr, RSS_TAG_NONE},
};

// Version numbers are compared after conversion with automatic base: "0x" hex, a
// leading "0" octal, anything unparsable 0.
long ToNumber(const char* text) {
    return strtol(text, nullptr, 0);
}

void ClearRecord(_tag_vyxinfo_& info) {
    memset(&info, 0, sizeof(info));
}

void ClearModelFields(_tag_vyxinfo_& info) {
    memset(info.unique, 0, sizeof(info.unique));
    memset(info.link, 0, sizeof(info.link));
    memset(info.checksum, 0, sizeof(info.checksum));
}

void UnlinkIfExists(const char* path) {
    if (KLIBCFileExist(path))
        unlink(path);
}

struct MntentClose {
    void operator()(FILE* f) const { endmntent(f); }
};

void LogPidFileOpenFailure() {
    syslog(LOG_ERR, "%s:%d Fail to open [%s] for writing", kModule, __LINE__, kPidFile);
}

}  // namespace

// ---------------------------------------------------------------------------------------
// Construction
// ---------------------------------------------------------------------------------------

VyxUpdate::VyxUpdate() : m_checked(false), m_haveNew(false), m_hybridDL(false) {
    ClearRecord(m_release);
    ClearRecord(m_partnerRelease);
    if (KYTOHAIsRunning()) {
        char partner[64];
        memset(partner, 0, sizeof(partner));
        int ret = KYTOHAIsHybridDL(partner, sizeof(partner));
        if (ret == -1) {
            syslog(LOG_ERR, "%s:%d KYTOHAIsHybridDL() error", kModule, __LINE__);
        } else if (ret == 1) {
            m_hybridDL = true;
            m_partnerUnique = partner;
        }
    }
}

VyxUpdate::~VyxUpdate() {}

// ---------------------------------------------------------------------------------------
// Version records and release feed
// ---------------------------------------------------------------------------------------

int VyxUpdate::GetVyxInfo(_tag_vyxinfo_& info) {
    struct Source {
        const char* file;
        const char* key;
        char* field;
        int size;
    };
    const Source sources[] = {
        {kyto::kVersionFile, "majorversion", info.major, sizeof(info.major)},
        {kyto::kVersionFile, "minorversion", info.minor, sizeof(info.minor)},
        {kyto::kVersionFile, "buildphase", info.buildPhase, sizeof(info.buildPhase)},
        {kyto::kVersionFile, "buildnumber", info.buildNum, sizeof(info.buildNum)},
        {kyto::kVersionFile, "builddate", info.buildDate, sizeof(info.buildDate)},
        {kyto::kInfoConfFile, "unique", info.unique, sizeof(info.unique)},
    };
    for (const Source& src : sources) {
        if (KLIBCFileGetKeyValue(src.file, src.key, src.field, src.size, 0) < 1) {
            syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, src.key,
                   src.file, kyto::LastErrorText().c_str());
            return 0;
        }
    }
    return 1;
}

void VyxUpdate::SetVyxInfo(const _tag_rss_tag_type_& type, const char* value, _tag_vyxinfo_& info) {
    if (value == nullptr)
        return;
    char* field = nullptr;
    size_t size = 0;
    switch (type) {
        case RSS_TAG_MAJOR_VER:
            field = info.major, size = sizeof(info.major);
            break;
        case RSS_TAG_MINOR_VER:
            field = info.minor, size = sizeof(info.minor);
            break;
        case RSS_TAG_BUILD_PHASE:
            field = info.buildPhase, size = sizeof(info.buildPhase);
            break;
        case RSS_TAG_BUILD_NUM:
            field = info.buildNum, size = sizeof(info.buildNum);
            break;
        case RSS_TAG_BUILD_DATE:
            field = info.buildDate, size = sizeof(info.buildDate);
            break;
        case RSS_TAG_REQ_MAJOR_VER:
            field = info.reqMajor, size = sizeof(info.reqMajor);
            break;
        case RSS_TAG_REQ_MINOR_VER:
            field = info.reqMinor, size = sizeof(info.reqMinor);
            break;
        case RSS_TAG_REQ_BUILD_PHASE:
            field = info.reqBuildPhase, size = sizeof(info.reqBuildPhase);
            break;
        case RSS_TAG_REQ_BUILD_NUM:
            field = info.reqBuildNum, size = sizeof(info.reqBuildNum);
            break;
        case RSS_TAG_REQ_BUILD_DATE:
            field = info.reqBuildDate, size = sizeof(info.reqBuildDate);
            break;
        case RSS_TAG_M_UNIQUE:
            field = info.unique, size = sizeof(info.unique);
            break;
        case RSS_TAG_M_LINK:
            field = info.link, size = sizeof(info.link);
            break;
        case RSS_TAG_M_CHECKSUM:
            field = info.checksum, size = sizeof(info.checksum);
            break;
        default:  // channel and item framing, "model": nothing to store
            return;
    }
    snprintf(field, size, "%s", value);
}

void VyxUpdate::ConvertTagNameToTagType(std::string name, _tag_rss_tag_type_& type) {
    for (const TagRow* row = kTagTable; row->name != nullptr; ++row) {
        if (name == row->name) {
            type = row->type;
            return;
        }
    }
}

bool VyxUpdate::ParseTagValue(const std::string& line, std::string& name, std::string& value,
                              _tag_rss_tag_type_& type) {
    char left[129];
    char right[129];
    std::unique_ptr<char[]> text(new char[4097]);
    left[0] = right[0] = text[0] = '\0';
    if (sscanf(line.c_str(), " <%128[^>]>%4096[^<]</%128[^>]>", left, text.get(), right) != 3) {
        return false;
    }
    if (strcmp(left, right) != 0) {
        syslog(LOG_ERR, "%s:%d Left tag [%s] and right tag [%s] don't match", kModule, __LINE__,
               left, right);
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return false;
    }
    name = left;
    value = text.get();
    // The kind is not reset: a name outside the table keeps the previous line's kind.
    ConvertTagNameToTagType(name, type);
    return true;
}

namespace {

// The release feed, read in large blocks.  Lines are handed out as ranges of the block
// (valid until the next call), without their newline; a line longer than a block makes
// the buffer grow.  A read error ends the feed as its end would.
class FeedLines {
  public:
    explicit FeedLines(int fd) : fd_(fd), cap_(kBlock), buf_(new char[kBlock]) {}

    bool Next(const char*& line, size_t& len) {
        for (;;) {
            const void* nl = memchr(buf_.get() + scan_, '\n', end_ - scan_);
            if (nl != nullptr) {
                size_t stop = static_cast<size_t>(static_cast<const char*>(nl) - buf_.get());
                line = buf_.get() + pos_;
                len = stop - pos_;
                pos_ = scan_ = stop + 1;
                return true;
            }
            scan_ = end_;  // the incomplete line is not searched again after the refill
            if (eof_) {
                if (pos_ == end_)
                    return false;
                line = buf_.get() + pos_;
                len = end_ - pos_;
                pos_ = scan_ = end_;
                return true;
            }
            Refill();
        }
    }

  private:
    static constexpr size_t kBlock = 1 << 20;

    void Refill() {
        if (pos_ > 0) {
            memmove(buf_.get(), buf_.get() + pos_, end_ - pos_);
            end_ -= pos_;
            scan_ -= pos_;
            pos_ = 0;
        }
        if (end_ == cap_) {
            std::unique_ptr<char[]> bigger(new char[cap_ * 2]);
            memcpy(bigger.get(), buf_.get(), end_);
            buf_ = std::move(bigger);
            cap_ *= 2;
        }
        ssize_t n = kyto::ReadRetry(fd_, buf_.get() + end_, cap_ - end_);
        if (n <= 0)
            eof_ = true;
        else
            end_ += static_cast<size_t>(n);
    }

    int fd_;
    size_t cap_;
    std::unique_ptr<char[]> buf_;
    size_t pos_ = 0;   // start of the next line
    size_t scan_ = 0;  // where the search for its newline goes on
    size_t end_ = 0;   // bytes in the buffer
    bool eof_ = false;
};

// Which of the item and model elements a line opens or closes ("<item>", "</item>",
// "<model>", "</model>" anywhere in it): one pass over its '<' characters.
constexpr unsigned kItemTag = 1;
constexpr unsigned kModelTag = 2;

unsigned FramingTagsIn(const char* line, size_t len) {
    unsigned tags = 0;
    const char* end = line + len;
    const char* p = line;
    while ((p = static_cast<const char*>(memchr(p, '<', end - p))) != nullptr) {
        ++p;
        const char* name = p < end && *p == '/' ? p + 1 : p;
        size_t left = end - name;
        if (left >= 5 && memcmp(name, "item>", 5) == 0)
            tags |= kItemTag;
        else if (left >= 6 && memcmp(name, "model>", 6) == 0)
            tags |= kModelTag;
    }
    return tags;
}

// A data line split the way ParseTagValue's scan splits it (" <%128[^>]>%4096[^<]</%128[^>]>",
// which stops at the first NUL), as ranges of the line.  False when the scan would not
// fill all three.
struct TagLine {
    const char* left;
    size_t leftLen;
    const char* value;
    size_t valueLen;
    const char* right;
    size_t rightLen;
};

size_t ScanRun(const char* s, size_t i, size_t n, char stop, size_t width) {
    size_t j = i;
    while (j < n && s[j] != stop && j - i < width)
        ++j;
    return j - i;
}

bool ScanTagLine(const char* s, size_t n, TagLine& t) {
    const void* nul = memchr(s, '\0', n);
    if (nul != nullptr)
        n = static_cast<size_t>(static_cast<const char*>(nul) - s);
    size_t i = 0;
    while (i < n && isspace(static_cast<unsigned char>(s[i])))
        ++i;
    if (i >= n || s[i] != '<')
        return false;
    t.left = s + ++i;
    t.leftLen = ScanRun(s, i, n, '>', 128);
    i += t.leftLen;
    if (t.leftLen == 0 || i >= n || s[i] != '>')
        return false;
    t.value = s + ++i;
    t.valueLen = ScanRun(s, i, n, '<', 4096);
    i += t.valueLen;
    if (t.valueLen == 0 || i + 1 >= n || s[i] != '<' || s[i + 1] != '/')
        return false;
    i += 2;
    t.right = s + i;
    t.rightLen = ScanRun(s, i, n, '>', 128);
    return t.rightLen != 0;
}

// ConvertTagNameToTagType on a range: the first row of that name, else the kind unchanged.
void KindOfName(const char* name, size_t len, _tag_rss_tag_type_& type) {
    for (const TagRow* row = kTagTable; row->name != nullptr; ++row) {
        if (strncmp(row->name, name, len) == 0 && row->name[len] == '\0') {
            type = row->type;
            return;
        }
    }
}

// Kinds stored into a version field, the fields the wanted-item test reads among them.
bool IsVersionKind(_tag_rss_tag_type_ type) {
    return type >= RSS_TAG_MAJOR_VER && type <= RSS_TAG_REQ_BUILD_DATE;
}

// Whether an item whose version fields are read offers an update this system may take:
// newer than the running version (and a hot-fix of it when only hot-fixes are wanted),
// and installable on top of it.
bool ItemIsWanted(bool hotfixOnly, const _tag_vyxinfo_& current, const _tag_vyxinfo_& item) {
    return !(hotfixOnly && !VyxUpdate::IsHotfix(current, item)) &&
           VyxUpdate::IsVersionNewer(current, item) && VyxUpdate::SatisfyReqVersion(current, item);
}

}  // namespace

int VyxUpdate::ParseRssFile(bool hotfixOnly, const _tag_vyxinfo_& current, bool& found,
                            _tag_vyxinfo_& release) {
    kyto::UniqueFd fd(open(kRssFile, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        syslog(LOG_ERR, "%s:%d Fail to open [%s]", kModule, __LINE__, kRssFile);
        return 0;
    }
    found = false;
    bool skipItem = false;
    bool inModel = false;
    bool skipModel = false;
    bool matched = false;
    _tag_rss_tag_type_ type = RSS_TAG_NONE;
    // The wanted-item test depends only on the version fields: worked out once per item
    // and again only when a line changes one of them (-1: not worked out).
    int wanted = -1;

    FeedLines lines(fd.get());
    const char* line;
    size_t len;
    char value[4097];
    while (lines.Next(line, len)) {
        if (len == 0)
            continue;
        const unsigned tags = FramingTagsIn(line, len);

        if (tags & kItemTag) {
            skipItem = inModel = skipModel = false;
            ClearRecord(release);
            wanted = -1;
        } else if (skipItem) {
            continue;
        }

        if (tags & kModelTag) {
            // The matching model's fields are complete at its closing tag (or at the
            // next model element).
            if (matched)
                break;
            skipModel = false;
            inModel = true;
        } else if (skipModel) {
            continue;
        }

        TagLine t;
        if (!ScanTagLine(line, len, t))
            continue;
        if (t.leftLen != t.rightLen || memcmp(t.left, t.right, t.leftLen) != 0) {
            // ParseTagValue logs the mismatch and sets the error.
            std::string name, text;
            ParseTagValue(std::string(line, len), name, text, type);
            continue;
        }
        KindOfName(t.left, t.leftLen, type);
        memcpy(value, t.value, t.valueLen);
        value[t.valueLen] = '\0';
        SetVyxInfo(type, value, release);
        if (IsVersionKind(type))
            wanted = -1;
        if (!inModel)
            continue;

        // Inside a model element the item's version fields are all known: decide whether
        // the item is wanted at all.
        if (wanted < 0)
            wanted = ItemIsWanted(hotfixOnly, current, release) ? 1 : 0;
        if (!wanted) {
            skipItem = true;
            continue;
        }
        if (type == RSS_TAG_M_UNIQUE) {
            if (t.valueLen == strlen(current.unique) &&
                memcmp(value, current.unique, t.valueLen) == 0) {
                matched = true;
                found = true;
            } else {
                skipModel = true;
                ClearModelFields(release);
            }
        }
    }
    return 1;
}

int VyxUpdate::IsVersionNewer(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    long curMajor = ToNumber(current.major);
    long newMajor = ToNumber(candidate.major);
    if (newMajor != curMajor)
        return newMajor > curMajor ? 1 : 0;
    long curMinor = ToNumber(current.minor);
    long newMinor = ToNumber(candidate.minor);
    if (newMinor != curMinor)
        return newMinor > curMinor ? 1 : 0;
    return ToNumber(candidate.buildNum) > ToNumber(current.buildNum) ? 1 : 0;
}

int VyxUpdate::IsHotfix(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    return (ToNumber(candidate.major) == ToNumber(current.major) &&
            ToNumber(candidate.minor) == ToNumber(current.minor))
               ? 1
               : 0;
}

int VyxUpdate::SatisfyReqVersion(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    // Any one of the three is enough: the requirement is deliberately not compared as a
    // version triple.
    if (ToNumber(current.major) >= ToNumber(candidate.reqMajor))
        return 1;
    if (ToNumber(current.minor) >= ToNumber(candidate.reqMinor))
        return 1;
    if (ToNumber(current.buildNum) >= ToNumber(candidate.reqBuildNum))
        return 1;
    return 0;
}

// ---------------------------------------------------------------------------------------
// Release check
// ---------------------------------------------------------------------------------------

bool VyxUpdate::IsHotfixOnly() {
    KytoConf conf;
    return conf.Info("upgradetype", "all") != "all";
}

int VyxUpdate::GetRssFile() {
    char server[4096];
    char timezone[64];
    memset(server, 0, sizeof(server));
    memset(timezone, 0, sizeof(timezone));

    int ret = KLIBCFileGetKeyValue(kyto::kInfoConfFile, "rss_server", server, sizeof(server), 0);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, "rss_server",
               kyto::kInfoConfFile, kyto::LastErrorText().c_str());
        return 0;
    }
    if (ret == 0)
        snprintf(server, sizeof(server), "%s", kDefaultRssServer);

    if (KLIBCFileGetKeyValue(kyto::kInfoConfFile, "timezone", timezone, sizeof(timezone), 0) < 1) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, "timezone",
               kyto::kInfoConfFile, kyto::LastErrorText().c_str());
        return 0;
    }

    std::string agent;
    if (!UpdateUtil::GetUserAgent(agent)) {
        syslog(LOG_ERR, "%s:%d Fail to get user agent", kModule, __LINE__);
        return 0;
    }

    // The values go into the command as they stand; the configuration is trusted.
    // The command is bounded like a 4096-byte buffer: an over-long URL is cut, and the
    // fetch then fails.
    std::string command = std::string(kyto::kWget) + " --user-agent='" + agent + "' -O " +
                          kRssFile + " " + server + "?tz=" + timezone + " 2> /dev/null";
    if (command.size() > 4095)
        command.resize(4095);
    if (system(command.c_str()) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to exec command [%s]. %s", kModule, __LINE__, command.c_str(),
               kyto::LastErrorText().c_str());
        return 0;
    }
    return 1;
}

int VyxUpdate::GetAutoUpdateInfo(bool& have, Json::Value& info) {
    have = false;
    if (!KLIBCFileExist(kyto::kAutoUpdateInfoFile))
        return 1;

    Json::Value root;
    if (!UpdateUtil::ParseJsonRootFromFile(kyto::kAutoUpdateInfoFile, root)) {
        syslog(LOG_ERR, "%s:%d Fail to get download info", kModule, __LINE__);
        return 0;
    }
    if (root.empty())
        return 1;
    if (root.isObject()) {
        // A small update's info file is left alone.
        if (root.isMember("updateType") &&
            (!root["updateType"].isString() || root["updateType"].asString() != kyto::kTypeVyx)) {
            return 1;
        }
        if (root.isMember("buildnumber") && root.isMember("majorversion") &&
            root.isMember("minorversion") && root.isMember("patchPath")) {
            info = root;
            have = true;
            return 1;
        }
    }
    syslog(LOG_DEBUG, "%s:%d [%s] does not contain correct format", kModule, __LINE__,
           kyto::kAutoUpdateInfoFile);
    unlink(kyto::kAutoUpdateInfoFile);
    return 1;
}

int VyxUpdate::CheckVyxRelease() {
    bool hotfixOnly = IsHotfixOnly();
    // The fetched feed never outlives the check.
    kyto::ScopedUnlink feedCleanup(kRssFile);

    if (!GetRssFile()) {
        syslog(LOG_ERR, "%s:%d Fail to get RSS file", kModule, __LINE__);
        return 0;
    }

    _tag_vyxinfo_ work;
    _tag_vyxinfo_ current;
    ClearRecord(work);
    ClearRecord(current);
    if (!GetVyxInfo(current)) {
        syslog(LOG_ERR, "%s:%d Fail to get current VYX info", kModule, __LINE__);
        return 0;
    }

    if (!ParseRssFile(hotfixOnly, current, m_haveNew, work)) {
        syslog(LOG_ERR, "%s:%d Fail to parse RSS file", kModule, __LINE__);
        return 0;
    }
    if (m_haveNew) {
        m_release = work;
    } else {
        ClearRecord(m_release);
    }

    if (m_hybridDL && m_haveNew) {
        // The partner's model must be offered in the same item; this second parse
        // decides whether the pair has a new release.
        snprintf(current.unique, sizeof(current.unique), "%s", m_partnerUnique.c_str());
        ClearRecord(work);
        if (!ParseRssFile(hotfixOnly, current, m_haveNew, work)) {
            syslog(LOG_ERR, "%s:%d Fail to parse RSS file", kModule, __LINE__);
            return 0;
        }
        if (m_haveNew) {
            m_partnerRelease = work;
        } else {
            ClearRecord(m_partnerRelease);
        }
    }

    bool have = false;
    Json::Value info;
    if (!GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get auto update info", kModule, __LINE__);
        return 0;
    }
    if (have && m_haveNew) {
        char folder[4096];
        snprintf(folder, sizeof(folder), "%s", kyto::MemberText(info, "patchPath").c_str());
        std::string dir = dirname(folder);
        if (ToNumber(kyto::MemberText(info, "buildnumber").c_str()) !=
            ToNumber(m_release.buildNum)) {
            // The recorded image belongs to an outdated release.
            if (!CleanDownloadResult(dir)) {
                syslog(LOG_ERR, "%s:%d Fail to clean download result", kModule, __LINE__);
                return 0;
            }
        }
    }
    m_checked = true;
    return 1;
}

int VyxUpdate::CheckNewRelease(bool& haveNew) {
    if (!m_checked && !CheckVyxRelease()) {
        syslog(LOG_ERR, "%s:%d Fail to get latest VYX info", kModule, __LINE__);
        return 0;
    }
    haveNew = m_haveNew;
    return 1;
}

int VyxUpdate::PreCheckDownload(bool& canStart) {
    if (!m_checked && !CheckVyxRelease()) {
        syslog(LOG_ERR, "%s:%d Fail to get latest VYX info", kModule, __LINE__);
        return 0;
    }
    if (!m_haveNew) {
        syslog(LOG_ERR, "%s:%d Current VYX version is latest", kModule, __LINE__);
        return 0;
    }
    int percentage = 0;
    VYX_DOWNLOAD_STATUS status = VYX_DOWNLOAD_STATUS_NONE;
    if (!GetDownloadStatus(percentage, status)) {
        syslog(LOG_ERR, "%s:%d Fail to check download status", kModule, __LINE__);
        return 0;
    }
    canStart = (status != VYX_DOWNLOAD_STATUS_DOWNLOADING);
    return 1;
}

bool VyxUpdate::CheckPatchAndUpdateType(bool& isNewer, Json::Value& info) {
    bool hotfixOnly = IsHotfixOnly();
    _tag_vyxinfo_ current;
    _tag_vyxinfo_ candidate;
    ClearRecord(current);
    ClearRecord(candidate);
    if (!GetVyxInfo(current)) {
        syslog(LOG_ERR, "%s:%d Fail to get current VYX info", kModule, __LINE__);
        return false;
    }
    snprintf(candidate.major, sizeof(candidate.major), "%s",
             kyto::MemberText(info, "majorversion").c_str());
    snprintf(candidate.minor, sizeof(candidate.minor), "%s",
             kyto::MemberText(info, "minorversion").c_str());
    snprintf(candidate.buildNum, sizeof(candidate.buildNum), "%s",
             kyto::MemberText(info, "buildnumber").c_str());
    int newer = hotfixOnly ? IsHotfix(current, candidate) : IsVersionNewer(current, candidate);
    if (newer == 1)
        isNewer = true;
    return true;
}

std::string VyxUpdate::GetFullVersion() {
    if (!m_checked || !m_haveNew)
        return std::string();
    char text[256];
    snprintf(text, sizeof(text), "VYX %.63s.%.63s-%.63s", m_release.major, m_release.minor,
             m_release.buildNum);
    return text;
}

// ---------------------------------------------------------------------------------------
// Download location
// ---------------------------------------------------------------------------------------

int VyxUpdate::IsPathSufficient(const char* path, bool& sufficient) {
    if (path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return 0;
    }
    unsigned long long avail = 0;
    if (kyto::AvailableBytes(path, avail) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do statfs to [%s]. reason: [%m]", kModule, __LINE__, path);
        return 0;
    }
    if (avail < kyto::kMinDownloadFreeBytes) {
        syslog(LOG_ERR, "%s:%d Theres is no sufficient free space on [%s]", kModule, __LINE__,
               path);
        return 0;
    }
    sufficient = avail > kSufficientFreeSpace;
    return 1;
}

int VyxUpdate::FindDownloadVolume(std::string& path) {
    KYTO_VOLUME_INFO volume;
    memset(&volume, 0, sizeof(volume));
    int ret = VolumeAvailGet(0, kyto::kMinDownloadFreeBytes, &volume, 1);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get available volume with size greater than [%llu] bytes",
               kModule, __LINE__, static_cast<unsigned long long>(kyto::kMinDownloadFreeBytes));
        return false;
    }
    if (ret > 0) {
        path = volume.szMountPath;
        return true;
    }
    // No data volume qualifies: the root file system is the last resort.
    unsigned long long rootAvail = 0;
    if (kyto::AvailableBytes("/", rootAvail) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do statfs to [%s]. reason=%s", kModule, __LINE__, "/",
               strerror(errno));
        return false;
    }
    if (rootAvail < kyto::kMinDownloadFreeBytes)
        return false;
    path = "/";
    return true;
}

int VyxUpdate::PrepareDownloadEnv(std::string& folder) {
    std::string volume;
    if (!FindDownloadVolume(volume)) {
        syslog(LOG_ERR, "%s:%d No enough free space to download VYX", kModule, __LINE__);
        return 0;
    }
    // Joined as plain text: the root fallback gives "//@autoupdate", which is fine.
    folder = volume + "/" + kDownloadFolderName;
    if (!CleanDownloadResult(folder)) {
        syslog(LOG_ERR, "%s:%d Fail to clean download result", kModule, __LINE__);
        return 0;
    }
    if (KYTOFSMkdirP(folder.c_str(), 0700) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to mkdir [%s]. %s", kModule, __LINE__, folder.c_str(),
               kyto::LastErrorText().c_str());
        return 0;
    }
    return 1;
}

int VyxUpdate::GetVolumePathForPatch(std::string& path, bool& sufficient) {
    KytoConf conf;
    std::string supportRaid = conf.Def("supportraid", "no");
    std::string buildinStorage = conf.Def("support_buildin_storage", "no");
    std::string maxDisks = conf.Def("maxdisks", "");
    std::string chosen;

    if (strcasecmp(supportRaid.c_str(), "yes") == 0 ||
        strcasecmp(buildinStorage.c_str(), "yes") == 0) {
        if (!IsPathSufficient("/", sufficient))
            return 0;
        // Tell the installer whether the image lives on the system volume (0) or on
        // built-in storage (1).
        int rc =
            system(strcasecmp(supportRaid.c_str(), "yes") == 0 ? "/bin/echo 0 > /.upgrade_vol"
                                                               : "/bin/echo 1 > /.upgrade_vol");
        (void)rc;
        chosen = "/";
    } else if (strcasecmp(maxDisks.c_str(), "0") != 0) {
        kyto::UniqueMountVolList list(KYTOMountVolInfoEnum(0));
        PKYTO_MOUNT_VOL_INFO vol =
            kyto::FirstVolumeWithRoom(list.get(), kyto::kMinDownloadFreeBytes, kModule, true);
        if (vol != nullptr) {
            // 4 GiB or more is always sufficient; being above the comfortable free space
            // already says so.
            sufficient = vol->ullFreeBytes > kSufficientFreeSpace;
            chosen = vol->szMountPath;
        }
        if (chosen.empty())
            return 0;
    } else {
        // A device without internal disks: the first usable USB mount.
        std::unique_ptr<FILE, MntentClose> mounts(setmntent("/proc/mounts", "re"));
        if (!mounts) {
            syslog(LOG_ERR, "%s:%d Failed to open /proc/mounts, errno=%m", kModule, __LINE__);
            return 0;
        }
        struct mntent* entry;
        while ((entry = getmntent(mounts.get())) != nullptr) {
            if (strncmp(entry->mnt_dir, "/volumeUSB", 10) != 0)
                continue;
            if (strcmp(entry->mnt_type, "aufs") == 0)
                continue;
            if (IsPathSufficient(entry->mnt_dir, sufficient) == 1) {
                chosen = entry->mnt_dir;
                break;
            }
        }
        if (chosen.empty())
            return 0;
    }

    syslog(LOG_INFO, "%s:%d We get %s to upgrade.", kModule, __LINE__, chosen.c_str());
    path = chosen.substr(0, 63);
    return 1;
}

bool VyxUpdate::GetOutputFilePath(std::string url, std::string folder, std::string& outputPath) {
    size_t slash = url.rfind('/');
    if (slash == std::string::npos) {
        syslog(LOG_ERR, "%s:%d Wrong download link [%s]", kModule, __LINE__, url.c_str());
        return false;
    }
    char path[4096];
    snprintf(path, sizeof(path), "%s/%s", folder.c_str(), url.c_str() + slash + 1);
    outputPath = path;
    return true;
}

bool VyxUpdate::GetDownloadedPatchPath(bool& have, std::string& path) {
    Json::Value info;
    if (!GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get auto update info", kModule, __LINE__);
        return false;
    }
    if (have)
        path = kyto::MemberText(info, "patchPath");
    return true;
}

// ---------------------------------------------------------------------------------------
// Release download
// ---------------------------------------------------------------------------------------

bool VyxUpdate::ExecWgetP(std::string outputPath, std::string url, bool& cancelled) {
    cancelled = false;
    // wget's progress goes to the progress log (read by GetDownloadPercentage in the
    // pollers), its standard output is discarded.  When the log cannot be opened wget
    // keeps this process's standard error.
    kyto::UniqueFd progress(open(kProgressLog, O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    const char* argv[] = {kyto::kWget,    "-O",        outputPath.c_str(), url.c_str(),
                          "--timeout=15", "--tries=1", "--no-dns-cache",   nullptr};
    kyto::ChildSetup setup;
    setup.program = kyto::kWget;
    setup.argv = const_cast<char* const*>(argv);
    setup.stdoutFd = kyto::kChildDevNull;
    setup.stderrFd = progress.valid() ? progress.get() : kyto::kChildInherit;
    setup.pidFile = kPidFile;
    kyto::ChildProcess wget;
    switch (wget.Start(setup)) {
        case kyto::ChildProcess::kForkFailed:
            syslog(LOG_ERR, "%s:%d Fail to fork", kModule, __LINE__);
            return false;
        case kyto::ChildProcess::kInChildPidFileFailed:
            // This is the child.  It reports the failure by returning false instead of
            // ending, so it carries on in the caller's code (and its retry loop) as a
            // second process: callers and log readers have always seen it that way.
            LogPidFileOpenFailure();
            syslog(LOG_ERR, "%s:%d Fail to write pid file", kModule, __LINE__);
            return false;
        case kyto::ChildProcess::kStarted:
            break;
    }

    int status = 0;
    if (wget.Wait(&status) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to download VYX patch [%m]", kModule, __LINE__);
        KLIBCExec("/bin/rm", "-f", outputPath.c_str(), nullptr, nullptr);
        return false;
    }
    if (WIFSIGNALED(status)) {
        // Only a cancel kills wget: not a failure.
        syslog(LOG_ERR, "%s:%d Download process is cancelled", kModule, __LINE__);
        cancelled = true;
        return true;
    }
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0)
        return true;
    syslog(LOG_ERR, "%s:%d Fail to download VYX patch", kModule, __LINE__);
    return false;
}

bool VyxUpdate::ExecWgetWithRetry(std::string outputPath, std::string url, bool& cancelled) {
    for (int attempt = 0; attempt < kMaxDownloadAttempts; ++attempt) {
        if (ExecWgetP(outputPath, url, cancelled))
            return true;
    }
    return false;
}

int VyxUpdate::VerifyChecksum(const char* expected, const char* path) {
    if (expected == nullptr || path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return 0;
    }
    char command[4096];
    snprintf(command, sizeof(command), "%s md5 %s 2>/dev/null", kOpenssl, path);
    kyto::UniqueFile pipe(popen(command, "re"), kyto::UniqueFile::kPopen);
    if (!pipe) {
        syslog(LOG_ERR, "%s:%d Fail to exec [%s]", kModule, __LINE__, command);
        return 0;
    }
    char line[4096];
    if (fgets(line, sizeof(line), pipe.get()) == nullptr) {
        syslog(LOG_ERR, "%s:%d Fail to get check sum result. reason=%m", kModule, __LINE__);
        return 0;
    }
    // "MD5(<path>)= <hex>": the digest is the second word.
    char sum[256];
    memset(sum, 0, sizeof(sum));
    if (sscanf(line, "%*s %255s", sum) != 1) {
        syslog(LOG_ERR, "%s:%d Fail to get check sum result", kModule, __LINE__);
        return 0;
    }
    if (strcmp(sum, expected) != 0) {
        syslog(LOG_ERR, "%s:%d Checksum not match", kModule, __LINE__);
        return 0;
    }
    return 1;
}

bool VyxUpdate::WriteDownloadPidFile() {
    kyto::UniqueFile file(fopen(kPidFile, "we"));
    if (!file) {
        LogPidFileOpenFailure();
        return false;
    }
    fprintf(file.get(), "%d", static_cast<int>(getpid()));
    return true;
}

int VyxUpdate::SendNotification(bool success, const std::string& patchPath) {
    if (success) {
        KYTOLogSet1(1, 1, kEventDownloadDone, patchPath.c_str(), "", "", "");
        return KLIBCExec(kNotifier, "@administrators", "update:update_download_noti_title",
                         kNotifyLinkText, "update:update_download_noti_link");
    }
    KYTOLogSet1(1, 3, kEventDownloadFailed, patchPath.c_str(), "", "", "");
    return KLIBCExec(kNotifier, "@administrators", "update:update_download_noti_title_err",
                     kNotifyLinkText, "update:update_download_noti_link");
}

void VyxUpdate::UpdateVyx(const char* /*reserved1*/, const char* /*reserved2*/,
                          bool /*reserved3*/) {}

bool VyxUpdate::SetStatusKey(const char* key, const char* value) {
    if (UpdateProgressFile(key, value))
        return true;
    syslog(LOG_ERR, "%s:%d Fail to update progress file. %s", kModule, __LINE__,
           kyto::LastErrorText().c_str());
    return false;
}

int VyxUpdate::FetchImage(const _tag_vyxinfo_& release, const std::string& folder, int number,
                          const char* recordKey, Json::Value& record, bool& cancelled) {
    std::string outputPath;
    if (!GetOutputFilePath(release.link, folder, outputPath)) {
        syslog(LOG_ERR, "%s:%d Fail to get output file path", kModule, __LINE__);
        return 0;
    }
    if (!SetStatusKey(kyto::kKeyPatchPath, outputPath.c_str()) ||
        !SetStatusKey(kyto::kKeyDownloadNum, number == 1 ? "1" : "2")) {
        return 0;
    }
    if (!ExecWgetWithRetry(outputPath, release.link, cancelled)) {
        if (number == 1)
            syslog(LOG_ERR, "%s:%d Fail to download patch file", kModule, __LINE__);
        else
            syslog(LOG_ERR, "%s:%d Fail to download patch file for passive", kModule, __LINE__);
        return 0;
    }
    if (cancelled)
        return 1;
    record[recordKey] = outputPath;
    if (VerifyChecksum(release.checksum, outputPath.c_str()) != 1) {
        syslog(LOG_ERR, "%s:%d Fail to verify checksum", kModule, __LINE__);
        return 0;
    }
    return 1;
}

int VyxUpdate::DownloadImages(Json::Value& record, bool& cancelled) {
    bool canStart = false;
    if (!PreCheckDownload(canStart)) {
        syslog(LOG_ERR, "%s:%d Fail to do pre check download", kModule, __LINE__);
        return 0;
    }
    // Another download is running: reported as success, and the end steps run as for
    // any success.
    if (!canStart)
        return 1;

    std::string folder;
    if (!PrepareDownloadEnv(folder)) {
        syslog(LOG_ERR, "%s:%d Fail to prepare download env", kModule, __LINE__);
        return 0;
    }

    unlink(kyto::kDownloadStatusFile);
    if (!SetStatusKey(kyto::kKeyUpdateType, kyto::kTypeVyx) ||
        !SetStatusKey(kyto::kKeyDownloadStatus, "downloading") ||
        !SetStatusKey(kyto::kKeyDownloadCount, m_hybridDL ? "2" : "1")) {
        return 0;
    }

    if (!FetchImage(m_release, folder, 1, "patchPath", record, cancelled) || cancelled)
        return cancelled ? 1 : 0;
    if (m_hybridDL &&
        (!FetchImage(m_partnerRelease, folder, 2, "passivePatchPath", record, cancelled) ||
         cancelled)) {
        return cancelled ? 1 : 0;
    }

    if (!SetStatusKey(kyto::kKeyDownloadStatus, "finish"))
        return 0;
    record["buildnumber"] = m_release.buildNum;
    record["minorversion"] = m_release.minor;
    record["majorversion"] = m_release.major;
    record["updateType"] = kyto::kTypeVyx;
    // For the installer and the interface's poller, which must never read half a record;
    // a file that cannot be written is not reported, the download itself succeeded.
    kyto::DumpJsonAtomically(kyto::kAutoUpdateInfoFile, record, false);
    return 1;
}

int VyxUpdate::DownloadVyx() {
    bool cancelled = false;
    Json::Value record(Json::objectValue);
    int result = DownloadImages(record, cancelled);

    if (!cancelled)
        SendNotification(result == 1, kyto::MemberText(record, "patchPath"));
    if (result == 0) {
        SetStatusKey(kyto::kKeyDownloadStatus, "failed");
    } else {
        unlink(kyto::kDownloadStatusFile);
    }
    unlink(kProgressLog);
    unlink(kPidFile);
    return result;
}

// ---------------------------------------------------------------------------------------
// Download progress and cancellation
// ---------------------------------------------------------------------------------------

bool VyxUpdate::UpdateProgressFile(const char* key, const char* value) {
    if (key == nullptr || value == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return false;
    }
    if (kyto::SetDownloadStatusKey(key, value, nullptr) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to set [%s] = [%s] to [%s]. %s", kModule, __LINE__, key, value,
               kyto::kDownloadStatusFile, kyto::LastErrorText().c_str());
        return false;
    }
    return true;
}

namespace {

// The total wget announced in its progress log, as it printed it ("Length: 1,234,567
// (1.2M) [type]" gives "1,234,567"); empty when no line names it.  False (logged) when
// the log cannot be opened or the line cannot be read.
bool ReadAnnouncedLength(char (&sizeText)[128]) {
    kyto::UniqueFile file(fopen(kProgressLog, "re"));
    if (!file) {
        syslog(LOG_ERR, "%s:%d Fail to open file [%s] for reading", kModule, __LINE__,
               kProgressLog);
        return false;
    }
    kyto::LineBuffer buffer;
    while (buffer.Read(file.get()) != -1) {
        if (strstr(buffer.data, "Length") == nullptr)
            continue;
        if (sscanf(buffer.data, "Length: %127s %*s", sizeText) != 1) {
            syslog(LOG_ERR, "%s:%d Fail to parse file size", kModule, __LINE__);
            return false;
        }
        break;
    }
    return true;
}

// The announced total as a number: the thousands separators dropped through the
// platform's string list, the digits converted with automatic base.  False (logged) when
// a platform call fails.
bool AnnouncedLengthToNumber(const char* sizeText, kyto::UniqueSzList& pieces,
                             unsigned long long& total) {
    PKLIBC_SZLIST list = pieces.release();
    int split = KLIBCStrSep(sizeText, ",", &list);  // may move the list
    pieces.reset(list);
    if (split < 0) {
        syslog(LOG_ERR, "%s:%d Fail to do KLIBCStrSep. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    int digitsSize = 64;
    char* digits = static_cast<char*>(malloc(digitsSize));
    if (digits == nullptr) {
        syslog(LOG_ERR, "%s:%d Fail to allocate memory", kModule, __LINE__);
        return false;
    }
    digits[0] = '\0';
    int joined = KLIBCSzListJoin(pieces.get(), "", &digits, &digitsSize);  // may move digits
    std::unique_ptr<char, decltype(&free)> digitsOwner(digits, &free);
    if (joined < 0) {
        syslog(LOG_ERR, "%s:%d Fail to do KLIBCSzListJoin. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    total = strtoull(digits, nullptr, 0);
    return true;
}

}  // namespace

bool VyxUpdate::GetDownloadPercentage(const char* patchPath, int& percentage) {
    kyto::UniqueSzList pieces(KLIBCSzListAlloc(512));
    if (!pieces) {
        syslog(LOG_ERR, "%s:%d Fail to alloc list. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    char sizeText[128];
    memset(sizeText, 0, sizeof(sizeText));
    unsigned long long total = 0;
    if (!ReadAnnouncedLength(sizeText) || !AnnouncedLengthToNumber(sizeText, pieces, total))
        return false;

    struct stat st;
    if (patchPath == nullptr || stat(patchPath, &st) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do stat to [%s]", kModule, __LINE__,
               patchPath ? patchPath : "");
        return false;
    }
    // Allocated blocks, not the length: a sparse or preallocated file counts what is on
    // disk, and the result may pass 100 when allocation rounds up.
    unsigned long long downloaded = static_cast<unsigned long long>(st.st_blocks) * 512ULL;
    if (total == 0) {
        percentage = 0;
    } else if (downloaded == total) {
        percentage = 100;
    } else {
        percentage = kyto::PercentageToInt(static_cast<double>(downloaded) /
                                           static_cast<double>(total) * 100.0);
    }
    return true;
}

bool VyxUpdate::FinishedDownloadOnRecord(bool& finished) {
    finished = false;
    bool have = false;
    Json::Value info;
    if (!GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get downloaded patch info", kModule, __LINE__);
        return false;
    }
    if (!have)
        return true;
    if (!CheckPatchAndUpdateType(finished, info)) {
        syslog(LOG_ERR, "%s:%d Fail to check if downloaded patch matches to current update type",
               kModule, __LINE__);
        return false;
    }
    return true;
}

int VyxUpdate::ReadStatusFileKeys(StatusFileKeys& keys) {
    const char* file = kyto::kDownloadStatusFile;
    char updateType[64];
    memset(updateType, 0, sizeof(updateType));
    int ret = KLIBCFileGetKeyValue(file, kyto::kKeyUpdateType, updateType, sizeof(updateType), 0);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__,
               kyto::kKeyUpdateType, file, kyto::LastErrorText().c_str());
        return -1;
    }
    // No type, or a small update's file: no full-release download.
    if (ret == 0 || strcmp(updateType, kyto::kTypeVyx) != 0)
        return 0;

    // Log readers know the messages for a missing "downloadCount" and "downloadNum" by the
    // key named before each of them.
    struct KeyRead {
        const char* key;
        const char* reported;
        char* buf;
        int size;
    };
    const KeyRead reads[] = {
        {kyto::kKeyPatchPath, kyto::kKeyPatchPath, keys.patchPath, sizeof(keys.patchPath)},
        {kyto::kKeyDownloadStatus, kyto::kKeyDownloadStatus, keys.downloadStatus,
         sizeof(keys.downloadStatus)},
        {kyto::kKeyDownloadCount, kyto::kKeyPatchPath, keys.downloadCount,
         sizeof(keys.downloadCount)},
        {kyto::kKeyDownloadNum, kyto::kKeyDownloadStatus, keys.downloadNum,
         sizeof(keys.downloadNum)},
    };
    for (const KeyRead& r : reads) {
        if (KLIBCFileGetKeyValue(file, r.key, r.buf, r.size, 0) < 1) {
            syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, r.reported,
                   file, kyto::LastErrorText().c_str());
            return -1;
        }
    }
    return 1;
}

bool VyxUpdate::RunningDownloadStatus(const StatusFileKeys& keys, int& percentage,
                                      VYX_DOWNLOAD_STATUS& status) {
    int pid = KLIBCReadPidFile(kPidFile);
    if (pid < 0) {
        syslog(LOG_ERR, "%s:%d [%s] dose not exist", kModule, __LINE__, kPidFile);
        return false;
    }
    if (pid == 0) {
        syslog(LOG_ERR, "%s:%d Invalid pid [%d] in pid file [%s]", kModule, __LINE__, pid,
               kPidFile);
        return false;
    }
    if (kill(pid, 0) != 0) {
        status = VYX_DOWNLOAD_STATUS_FAILED;
        return true;
    }
    status = VYX_DOWNLOAD_STATUS_DOWNLOADING;
    int current = 0;
    if (!GetDownloadPercentage(keys.patchPath, current)) {
        syslog(LOG_ERR, "%s:%d Fail to get download percentag", kModule, __LINE__);
        return false;
    }
    // Image num of count: the finished images count whole, the current one in part.
    double count = static_cast<double>(ToNumber(keys.downloadCount));
    double num = static_cast<double>(ToNumber(keys.downloadNum));
    percentage = kyto::PercentageToInt((num - 1) * (100.0 / count) + current / count);
    return true;
}

bool VyxUpdate::GetDownloadStatus(int& percentage, VYX_DOWNLOAD_STATUS& status) {
    percentage = 0;
    status = VYX_DOWNLOAD_STATUS_NONE;

    bool finished = false;
    if (!FinishedDownloadOnRecord(finished))
        return false;
    if (finished) {
        percentage = 100;
        status = VYX_DOWNLOAD_STATUS_FINISHED;
        return true;
    }
    if (!KLIBCFileExist(kyto::kDownloadStatusFile))
        return true;

    StatusFileKeys keys;
    int read = ReadStatusFileKeys(keys);
    if (read <= 0)
        return read == 0;

    if (strcmp(keys.downloadStatus, "stopped") == 0) {
        status = VYX_DOWNLOAD_STATUS_STOPPED;
        return true;
    }
    if (strcmp(keys.downloadStatus, "failed") == 0 ||
        (strcmp(keys.downloadStatus, "downloading") == 0 && !KLIBCFileExist(kPidFile))) {
        status = VYX_DOWNLOAD_STATUS_FAILED;
        return true;
    }
    return RunningDownloadStatus(keys, percentage, status);
}

std::string VyxUpdate::DownloadStatusToString(VYX_DOWNLOAD_STATUS& status) {
    switch (status) {
        case VYX_DOWNLOAD_STATUS_NONE:
            return "none";
        case VYX_DOWNLOAD_STATUS_DOWNLOADING:
            return "downloading";
        case VYX_DOWNLOAD_STATUS_FINISHED:
            return "finished";
        case VYX_DOWNLOAD_STATUS_STOPPED:
            return "stopped";
        case VYX_DOWNLOAD_STATUS_FAILED:
            return "failed";
    }
    return std::string();
}

bool VyxUpdate::CancelDownloadVyx() {
    int pid = KLIBCReadPidFile(kPidFile);
    if (pid < 0) {
        syslog(LOG_INFO, "%s:%d [%s] dose not exist", kModule, __LINE__, kPidFile);
        return true;
    }
    if (pid == 0) {
        syslog(LOG_ERR, "%s:%d Invalid pid [%d] in pid file [%s]", kModule, __LINE__, pid,
               kPidFile);
        return false;
    }
    if (kill(pid, SIGKILL) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to kill download VYX process. reason: [%m]", kModule, __LINE__);
    }
    unlink(kPidFile);
    if (!UpdateProgressFile(kyto::kKeyDownloadStatus, "stopped")) {
        syslog(LOG_ERR, "%s:%d Fail to update progress file. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    return true;
}

bool VyxUpdate::CleanDownloadResult(std::string path) {
    struct stat st;
    if (KLIBCFileExist(path.c_str()) && stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode)) {
        unlink(path.c_str());
    } else {
        int ret = stat(path.c_str(), &st);
        if (ret != 0 && errno != ENOENT) {
            syslog(LOG_ERR, "%s:%d Fail to do stat to [%s]. reason=%s", kModule, __LINE__,
                   path.c_str(), strerror(errno));
            return false;
        }
        // stat never returns a positive value, so an existing download folder and the
        // images in it stay for the installer (a new download of the same link writes over
        // its image); the folder removal below is never reached.
        if (ret > 0) {
            if (!S_ISDIR(st.st_mode)) {
                syslog(LOG_ERR, "%s:%d [%s] is neither a file nor a directory", kModule, __LINE__,
                       path.c_str());
                return false;
            }
            if (!UpdateUtil::RemoveFolder(path)) {
                syslog(LOG_ERR, "%s:%d Fail to remove folder %s. %s", kModule, __LINE__,
                       path.c_str(), kyto::LastErrorText().c_str());
                return false;
            }
        }
    }
    UnlinkIfExists(kOldPidFile);
    UnlinkIfExists(kProgressLog);
    UnlinkIfExists(kyto::kAutoUpdateInfoFile);
    return true;
}

bool VyxUpdate::ReportProgress(_tag_update_step_ step, int number, const char* text) {
    char letter = 0;
    switch (step) {
        case UPDATE_STEP_U:
            letter = 'U';
            break;
        case UPDATE_STEP_A:
            letter = 'A';
            break;
        case UPDATE_STEP_P:
            letter = 'P';
            break;
        case UPDATE_STEP_C:
            letter = 'C';
            break;
        case UPDATE_STEP_R:
            letter = 'R';
            break;
    }
    char command[128];
    if (step == UPDATE_STEP_U && number < 0 && text != nullptr) {
        snprintf(command, sizeof(command), "/bin/echo \"%c:%s\" > %s", letter, text,
                 kInstallerProgress);
    } else {
        snprintf(command, sizeof(command), "/bin/echo \"%c:%d:\" > %s", letter, number,
                 kInstallerProgress);
    }
    int ret = system(command);
    if (ret != 0) {
        syslog(LOG_ERR, "%s:(%d) : failed to system cmd=[%s], r=%d", kModule, __LINE__, command,
               ret);
        return false;
    }
    return true;
}
