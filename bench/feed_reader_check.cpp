// Differential check of the release feed reader (run by hand through
// bench/reader_bench.sh check, inside the sandbox).
//
// VyxUpdate::ParseRssFile reads the feed in large blocks and scans lines in place; the
// reference below is the plain reader it replaced (one getline, one string and one
// ParseTagValue per line, the wanted-item test on every line inside a model).  Both run
// on the same generated and mutated feeds, with the same starting record, and must agree
// byte for byte: result, found, the whole release record and the last platform error.
// Feeds mix well-formed items with framing tags inside other text, unknown and
// mismatched names, names and values at and over their scan widths, NUL bytes, blank
// and carriage-return variants, missing final newlines, and lines longer than a block.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <random>
#include <string>
#include <vector>

#include <kytoplatform/klibc.h>

#include "bench_ratio.h"
#include "scoped.h"
#include "vyxupdate.h"

namespace {

const char* const kRssFile = "/var/run/autoupdate_tmp_file_RSS";

bool OpensOrCloses(const std::string& line, const char* element) {
    const std::string name(element);
    return line.find("<" + name + ">") != std::string::npos ||
           line.find("</" + name + ">") != std::string::npos;
}

int ReferenceParse(bool hotfixOnly, const _tag_vyxinfo_& current, bool& found,
                   _tag_vyxinfo_& release) {
    kyto::UniqueFile file(fopen(kRssFile, "re"));
    if (!file)
        return 0;
    found = false;
    bool skipItem = false, inModel = false, skipModel = false, matched = false;
    _tag_rss_tag_type_ type = RSS_TAG_NONE;
    kyto::LineBuffer buffer;
    ssize_t len;
    while ((len = buffer.Read(file.get())) != -1) {
        std::string line(buffer.data, static_cast<size_t>(len));
        if (!line.empty() && line.back() == '\n')
            line.pop_back();
        if (line.empty())
            continue;
        if (OpensOrCloses(line, "item")) {
            skipItem = inModel = skipModel = false;
            memset(&release, 0, sizeof release);
        } else if (skipItem) {
            continue;
        }
        if (OpensOrCloses(line, "model")) {
            if (matched)
                break;
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
        if ((hotfixOnly && !VyxUpdate::IsHotfix(current, release)) ||
            !VyxUpdate::IsVersionNewer(current, release) ||
            !VyxUpdate::SatisfyReqVersion(current, release)) {
            skipItem = true;
            continue;
        }
        if (type == RSS_TAG_M_UNIQUE) {
            if (value == current.unique) {
                matched = found = true;
            } else {
                skipModel = true;
                memset(release.unique, 0, sizeof release.unique);
                memset(release.link, 0, sizeof release.link);
                memset(release.checksum, 0, sizeof release.checksum);
            }
        }
    }
    return 1;
}

class FeedMaker {
  public:
    explicit FeedMaker(unsigned seed) : rng_(seed) {}

    // Either lines drawn at random or items of the usual shape with some lines replaced.
    std::string Make() {
        std::string feed;
        if (Pick(2) == 0) {
            const int lines = Pick(5) == 0 ? 2000 + Pick(20000) : 1 + Pick(80);
            for (int i = 0; i < lines; ++i)
                feed += Line() + (Pick(40) == 0 ? "\r\n" : "\n");
        } else {
            const int items = Pick(8) == 0 ? 200 + Pick(2000) : 1 + Pick(6);
            for (int i = 0; i < items; ++i)
                for (const std::string& line : Item())
                    feed += (Pick(12) == 0 ? Line() : line) + "\n";
        }
        if (Pick(6) == 0 && !feed.empty())
            feed.pop_back();  // no final newline
        if (Pick(30) == 0)    // longer than a read block
            feed.insert(Pick(static_cast<unsigned>(feed.size()) + 1),
                        "<mLink>" + std::string((1 << 20) + Pick(1 << 20), 'L') + "</mLink>\n");
        return feed;
    }

    unsigned Pick(unsigned n) { return static_cast<unsigned>(rng_() % n); }

  private:
    std::string Name() {
        static const char* const kNames[] = {
            "MajorVer",    "MinorVer",    "BuildPhase",  "BuildNum",     "BuildDate",
            "ReqMajorVer", "ReqMinorVer", "ReqBuildNum", "ReqBuildDate", "ReqBuildPhase",
            "mUnique",     "mLink",       "mCheckSum",   "title",        "model",
            "item",        "rss",         "unknown",     "mUniqueX",     "MAJORVER"};
        switch (Pick(30)) {
            case 0:
                return std::string(128, 'n');
            case 1:
                return std::string(129, 'n');
            default:
                return kNames[Pick(sizeof kNames / sizeof *kNames)];
        }
    }

    std::string Value() {
        static const char* const kValues[] = {
            "5",    "6",   "2",   "3",   "5644",        "5645",
            "9999", "0x6", "010", "-1",  "demo_model",  "other",
            "x>y",  " 5",  "5 ",  "1e3", "demo_model ", "abc",
            "0",    "7",   "4",   "",    "\xc3\xa9",    "http://h/i.img"};
        switch (Pick(40)) {
            case 0:
                return std::string(4096, 'v');
            case 1:
                return std::string(4097, 'v');
            case 2:
                return std::string(300, 'w');
            default:
                return kValues[Pick(sizeof kValues / sizeof *kValues)];
        }
    }

    std::string Space() {
        static const char* const kSpaces[] = {"", "", "", "\t", "  ", " \t", "\v", "\f", "\r"};
        return kSpaces[Pick(sizeof kSpaces / sizeof *kSpaces)];
    }

    std::vector<std::string> Item() {
        auto tag = [](const char* name, const std::string& value) {
            return std::string("\t<") + name + ">" + value + "</" + name + ">";
        };
        std::vector<std::string> lines = {"<item>",
                                          tag("MajorVer", std::to_string(4 + Pick(3))),
                                          tag("MinorVer", std::to_string(1 + Pick(3))),
                                          tag("BuildNum", std::to_string(5643 + Pick(4))),
                                          tag("ReqMajorVer", std::to_string(4 + Pick(3))),
                                          tag("ReqMinorVer", std::to_string(Pick(4))),
                                          tag("ReqBuildNum", std::to_string(5600 + Pick(100)))};
        for (unsigned m = 1 + Pick(4); m > 0; --m) {
            lines.push_back("<model>");
            lines.push_back(tag("mUnique", Pick(3) ? "other" : "demo_model"));
            lines.push_back(tag("mLink", "http://h/" + std::to_string(Pick(1000)) + ".img"));
            lines.push_back(tag("mCheckSum", std::to_string(Pick(100000))));
            lines.push_back("</model>");
        }
        lines.push_back("</item>");
        return lines;
    }

    std::string Line() {
        static const char* const kFraming[] = {"<item>",
                                               "</item>",
                                               "<model>",
                                               "</model>",
                                               "<rss>",
                                               "<channel>",
                                               "x<item>y",
                                               "<subitem>",
                                               "<item/>",
                                               "<items>",
                                               "</model><item>",
                                               "<</model>",
                                               "<//item>",
                                               "<model >",
                                               "",
                                               "<item><MajorVer>6</MajorVer>"};
        const unsigned kind = Pick(20);
        if (kind < 5)
            return Space() + kFraming[Pick(sizeof kFraming / sizeof *kFraming)] + Space();
        std::string name = Name();
        std::string close = Pick(25) == 0 ? Name() : name;
        std::string line = Space() + "<" + name + ">" + Value() + "</" + close;
        if (Pick(15) != 0)
            line += ">";
        line += Space();
        if (Pick(25) == 0)
            line.insert(Pick(static_cast<unsigned>(line.size()) + 1), 1, '\0');
        if (Pick(30) == 0)
            line.insert(Pick(static_cast<unsigned>(line.size()) + 1), 1, '<');
        return line;
    }

    std::mt19937 rng_;
};

bool WriteFeed(const std::string& feed) {
    FILE* f = fopen(kRssFile, "we");
    if (f == nullptr)
        return false;
    bool ok = fwrite(feed.data(), 1, feed.size(), f) == feed.size();
    return fclose(f) == 0 && ok;
}

}  // namespace

int main(int argc, char** argv) {
    if (!kytobench::InsideSandbox("feed_reader_check"))
        return 2;
    const int rounds = argc > 1 ? atoi(argv[1]) : 20000;
    FeedMaker maker(argc > 2 ? static_cast<unsigned>(atoi(argv[2])) : 1u);
    long found = 0, mismatches = 0, errors = 0;
    for (int round = 0; round < rounds; ++round) {
        const bool missing = maker.Pick(200) == 0;
        if (missing)
            unlink(kRssFile);
        else if (!WriteFeed(maker.Make()))
            return 2;
        _tag_vyxinfo_ current;
        memset(&current, 0, sizeof current);
        snprintf(current.major, sizeof current.major, "%u", 4 + maker.Pick(3));
        snprintf(current.minor, sizeof current.minor, "%u", 1 + maker.Pick(3));
        snprintf(current.buildNum, sizeof current.buildNum, "%u", 5643 + maker.Pick(3));
        snprintf(current.unique, sizeof current.unique, "%s",
                 maker.Pick(4) ? "demo_model" : "other");
        const bool hotfixOnly = maker.Pick(3) == 0;
        _tag_vyxinfo_ start;
        for (size_t i = 0; i < sizeof start; ++i)
            reinterpret_cast<unsigned char*>(&start)[i] =
                static_cast<unsigned char>(maker.Pick(256));
        _tag_vyxinfo_ a = start, b = start;
        bool foundA = maker.Pick(2), foundB = foundA;

        KLIBCErrSetEx(0, "", 0);
        const int ra = ReferenceParse(hotfixOnly, current, foundA, a);
        const int errA = KLIBCErrGet(), lineA = KLIBCErrorGetLine();
        KLIBCErrSetEx(0, "", 0);
        const int rb = VyxUpdate::ParseRssFile(hotfixOnly, current, foundB, b);
        const int errB = KLIBCErrGet(), lineB = KLIBCErrorGetLine();

        found += foundA;
        errors += errA != 0;
        if (ra != rb || foundA != foundB || memcmp(&a, &b, sizeof a) != 0 || errA != errB ||
            lineA != lineB) {
            ++mismatches;
            fprintf(stderr, "round %d: reference %d/%d/0x%x, reader %d/%d/0x%x, records %s\n",
                    round, ra, foundA, errA, rb, foundB, errB,
                    memcmp(&a, &b, sizeof a) ? "differ" : "equal");
            if (system("cp /var/run/autoupdate_tmp_file_RSS /var/run/mismatch.rss") != 0)
                fprintf(stderr, "could not keep the feed\n");
            break;
        }
    }
    unlink(kRssFile);
    printf(
        "feed reader check: %d feeds, %ld with a match, %ld with a tag mismatch error, "
        "%ld differences\n",
        rounds, found, errors, mismatches);
    return mismatches == 0 ? 0 : 1;
}
