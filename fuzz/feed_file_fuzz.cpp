// Fuzz target: a whole release feed through VyxUpdate::ParseRssFile, compared with a
// plain reading of the same bytes that follows the feed reader's rules line by line
// (item and model boundaries, the version tests inside a model, the model identity), built
// on the library's own line parser and version tests.  The first input byte chooses
// hotfixOnly; the rest is the feed.
#include <string.h>

#include <string>

#include "fuzz_common.h"
#include "vyxupdate.h"

namespace {

constexpr const char* kFeed = "/var/run/autoupdate_tmp_file_RSS";
_tag_vyxinfo_ g_current;

void ClearModel(_tag_vyxinfo_& r) {
    memset(r.unique, 0, sizeof r.unique);
    memset(r.link, 0, sizeof r.link);
    memset(r.checksum, 0, sizeof r.checksum);
}

void ReferenceChoice(const std::string& feed, bool hotfixOnly, bool& found,
                     _tag_vyxinfo_& release) {
    found = false;
    bool skipItem = false, inModel = false, skipModel = false, matched = false;
    _tag_rss_tag_type_ type = RSS_TAG_NONE;
    size_t start = 0;
    while (start < feed.size()) {
        size_t nl = feed.find('\n', start);
        size_t end = nl == std::string::npos ? feed.size() : nl;
        const std::string line = feed.substr(start, end - start);
        start = end + 1;
        if (line.empty())
            continue;
        if (line.find("<item>") != std::string::npos || line.find("</item>") != std::string::npos) {
            skipItem = inModel = skipModel = false;
            memset(&release, 0, sizeof release);
        } else if (skipItem) {
            continue;
        }
        if (line.find("<model>") != std::string::npos ||
            line.find("</model>") != std::string::npos) {
            if (matched)
                return;
            skipModel = false;
            inModel = true;
        } else if (skipModel) {
            continue;
        }
        std::string name, value;
        if (!VyxUpdate::ParseTagValue(line, name, value, type))
            continue;
        VyxUpdate::SetVyxInfo(type, value.c_str(), release);
        if (!inModel)
            continue;
        if ((hotfixOnly && !VyxUpdate::IsHotfix(g_current, release)) ||
            !VyxUpdate::IsVersionNewer(g_current, release) ||
            !VyxUpdate::SatisfyReqVersion(g_current, release)) {
            skipItem = true;
            continue;
        }
        if (type == RSS_TAG_M_UNIQUE) {
            if (value == g_current.unique) {
                matched = found = true;
            } else {
                skipModel = true;
                ClearModel(release);
            }
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    memset(&g_current, 0, sizeof g_current);
    KYTO_FUZZ_CHECK(VyxUpdate::GetVyxInfo(g_current) == 1);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    const bool hotfixOnly = data[0] & 1;
    const std::string feed(reinterpret_cast<const char*>(data + 1), size - 1);
    kytofuzz::WriteWhole(kFeed, feed);

    static _tag_vyxinfo_ release, expected;
    memset(&release, 0, sizeof release);
    memset(&expected, 0, sizeof expected);
    bool found = true, expectedFound = false;
    KYTO_FUZZ_CHECK(VyxUpdate::ParseRssFile(hotfixOnly, g_current, found, release) == 1);
    ReferenceChoice(feed, hotfixOnly, expectedFound, expected);
    KYTO_FUZZ_CHECK(found == expectedFound);
    // Field texts, not raw bytes: what lies after a field's NUL is nobody's business.
#define KYTO_SAME_FIELD(f) KYTO_FUZZ_CHECK(strcmp(release.f, expected.f) == 0)
    KYTO_SAME_FIELD(major);
    KYTO_SAME_FIELD(minor);
    KYTO_SAME_FIELD(buildPhase);
    KYTO_SAME_FIELD(buildNum);
    KYTO_SAME_FIELD(buildDate);
    KYTO_SAME_FIELD(reqMajor);
    KYTO_SAME_FIELD(reqMinor);
    KYTO_SAME_FIELD(reqBuildPhase);
    KYTO_SAME_FIELD(reqBuildNum);
    KYTO_SAME_FIELD(reqBuildDate);
    KYTO_SAME_FIELD(unique);
    KYTO_SAME_FIELD(link);
    KYTO_SAME_FIELD(checksum);
#undef KYTO_SAME_FIELD
    kytofuzz::CheckDescriptors();
    return 0;
}
