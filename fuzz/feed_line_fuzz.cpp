// Fuzz target: one line of the release feed through VyxUpdate::ParseTagValue (the line
// scanner the feed reader uses), compared with a plain scan of the same line in the feed's
// one-element-per-line form (opening name of 1..128 characters, value of 1..4096, closing
// name, names equal); then the same line as a whole feed through VyxUpdate::ParseRssFile,
// which must store what ParseTagValue found, as SetVyxInfo stores it.
#include <stdio.h>
#include <string.h>

#include <string>

#include "fuzz_common.h"
#include "vyxupdate.h"

namespace {

const char* const kTagNames[] = {
    "rss",         "channel",     "title",         "link",        "pubDate",      "copyright",
    "item",        "MajorVer",    "MinorVer",      "BuildPhase",  "BuildNum",     "BuildDate",
    "ReqMajorVer", "ReqMinorVer", "ReqBuildPhase", "ReqBuildNum", "ReqBuildDate", "model",
    "mUnique",     "mLink",       "mCheckSum"};

bool InTable(const std::string& name) {
    for (const char* n : kTagNames) {
        if (name == n)
            return true;
    }
    return false;
}

constexpr const char* kFeed = "/var/run/autoupdate_tmp_file_RSS";

// The line as the only line of a feed, read for a running system with an empty record: the
// reader stores the line's value into a zeroed record exactly as ParseTagValue and
// SetVyxInfo do, unless the line opens or closes a model element (where the model's
// identity is compared, and the model fields may be cleared again).
void CheckReaderAgrees(const std::string& line) {
    const std::string first = line.substr(0, line.find('\n'));
    if (first.empty() || first.find("<model>") != std::string::npos ||
        first.find("</model>") != std::string::npos)
        return;
    std::string name, value;
    _tag_rss_tag_type_ type = RSS_TAG_NONE;
    _tag_vyxinfo_ expected, current, release;
    memset(&expected, 0, sizeof expected);
    memset(&current, 0, sizeof current);
    memset(&release, 0, sizeof release);
    if (VyxUpdate::ParseTagValue(first, name, value, type))
        VyxUpdate::SetVyxInfo(type, value.c_str(), expected);

    kytofuzz::WriteWhole(kFeed, first);
    bool found = true;
    KYTO_FUZZ_CHECK(VyxUpdate::ParseRssFile(false, current, found, release) == 1);
    KYTO_FUZZ_CHECK(!found);
    KYTO_FUZZ_CHECK(memcmp(&expected, &release, sizeof release) == 0);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string line(reinterpret_cast<const char*>(data), size);
    std::string name = "unset", value = "unset";
    // The item title's kind is never produced by a lookup ("title" yields the first row),
    // so it shows whether the call left the kind alone.
    _tag_rss_tag_type_ type = RSS_TAG_ITEM_TITLE;
    const bool ok = VyxUpdate::ParseTagValue(line, name, value, type);

    static char open[129], text[4097], close[129];
    const bool scanned =
        sscanf(line.c_str(), " <%128[^>]>%4096[^<]</%128[^>]>", open, text, close) == 3;
    const bool expected = scanned && strcmp(open, close) == 0;
    KYTO_FUZZ_CHECK(ok == expected);
    if (ok) {
        KYTO_FUZZ_CHECK(name == open);
        KYTO_FUZZ_CHECK(value == text);
        if (InTable(name))
            KYTO_FUZZ_CHECK(type != RSS_TAG_ITEM_TITLE && type >= RSS_TAG_RSS &&
                            type <= RSS_TAG_M_CHECKSUM);
        else
            KYTO_FUZZ_CHECK(type == RSS_TAG_ITEM_TITLE);
        _tag_vyxinfo_ info;
        memset(&info, 0, sizeof info);
        VyxUpdate::SetVyxInfo(type, value.c_str(), info);
        KYTO_FUZZ_CHECK(kytofuzz::Terminated(info.link) && kytofuzz::Terminated(info.unique) &&
                        kytofuzz::Terminated(info.major));
    } else {
        KYTO_FUZZ_CHECK(type == RSS_TAG_ITEM_TITLE);
    }
    CheckReaderAgrees(line);
    kytofuzz::CheckDescriptors();
    return 0;
}
