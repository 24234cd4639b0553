// VyxUpdate: the release feed.  The feed is read line by line (not as XML): every data
// element stands on a line of its own, and the reader picks the first item that this
// system may take and that holds a model element for this device.
#include "vyxupdate.h"

#include <ctype.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "file_system.h"
#include "scoped.h"
#include "vyxupdate_internal.h"

using namespace kyto::vyx;

namespace {

void ClearModelFields(_tag_vyxinfo_& info) {
    memset(info.unique, 0, sizeof(info.unique));
    memset(info.link, 0, sizeof(info.link));
    memset(info.checksum, 0, sizeof(info.checksum));
}

// The kind of an element name: the first of that name, else the kind unchanged.  (A name
// with a NUL in it matches none.)
void KindOfName(const char* name, size_t len, _tag_rss_tag_type_& type) {
    for (int kind = RSS_TAG_RSS; kind <= RSS_TAG_M_CHECKSUM; ++kind) {
        const char* row = kTagNames[kind];
        if (strncmp(row, name, len) == 0 && row[len] == '\0') {
            type = static_cast<_tag_rss_tag_type_>(kind);
            return;
        }
    }
}

}  // namespace

void VyxUpdate::ConvertTagNameToTagType(std::string name, _tag_rss_tag_type_& type) {
    KindOfName(name.data(), name.size(), type);
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

// The one grammar of a data line, used by ParseTagValue and the feed reader: white space,
// "<", an opening name of 1 to 128 characters other than ">", ">", a value of 1 to 4096
// characters other than "<", "</", a closing name of 1 to 128 characters other than ">"
// (longer ones are cut there); the rest of the line, and anything from a NUL on, is not
// looked at.  The parts are ranges of the line; false when the line does not hold all three.
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
    t.leftLen = ScanRun(s, i, n, '>', kTagNameWidth);
    i += t.leftLen;
    if (t.leftLen == 0 || i >= n || s[i] != '>')
        return false;
    t.value = s + ++i;
    t.valueLen = ScanRun(s, i, n, '<', kTagValueWidth);
    i += t.valueLen;
    if (t.valueLen == 0 || i + 1 >= n || s[i] != '<' || s[i + 1] != '/')
        return false;
    i += 2;
    t.right = s + i;
    t.rightLen = ScanRun(s, i, n, '>', kTagNameWidth);
    return t.rightLen != 0;
}

// True when the opening and closing names agree; otherwise logs both and sets the error.
bool NamesMatch(const TagLine& t) {
    if (t.leftLen == t.rightLen && memcmp(t.left, t.right, t.leftLen) == 0)
        return true;
    syslog(LOG_ERR, "%s:%d Left tag [%.*s] and right tag [%.*s] don't match", kModule, __LINE__,
           static_cast<int>(t.leftLen), t.left, static_cast<int>(t.rightLen), t.right);
    KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
    return false;
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

bool VyxUpdate::ParseTagValue(const std::string& line, std::string& name, std::string& value,
                              _tag_rss_tag_type_& type) {
    TagLine t;
    if (!ScanTagLine(line.data(), line.size(), t) || !NamesMatch(t))
        return false;
    name.assign(t.left, t.leftLen);
    value.assign(t.value, t.valueLen);
    // The kind is not reset: a name outside the table keeps the previous line's kind.
    KindOfName(t.left, t.leftLen, type);
    return true;
}

int kyto::vyx::ReadFeed(const char* path, bool hotfixOnly, const _tag_vyxinfo_& current,
                        bool& found, _tag_vyxinfo_& release) {
    kyto::UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        syslog(LOG_ERR, "%s:%d Fail to open [%s]", kModule, __LINE__, path);
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
    char value[kTagValueWidth + 1];
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
        if (!ScanTagLine(line, len, t) || !NamesMatch(t))
            continue;
        KindOfName(t.left, t.leftLen, type);
        memcpy(value, t.value, t.valueLen);
        value[t.valueLen] = '\0';
        VyxUpdate::SetVyxInfo(type, value, release);
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

int VyxUpdate::ParseRssFile(bool hotfixOnly, const _tag_vyxinfo_& current, bool& found,
                            _tag_vyxinfo_& release) {
    return ReadFeed(kyto::kRssFile, hotfixOnly, current, found, release);
}
