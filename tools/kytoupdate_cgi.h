// kytoupdate-cgi, the back end of the sample update page (www/): what its request handling
// (kytoupdate_cgi.cpp) and its runs of kytoupdate (kytoupdate_cgi_run.cpp) share.  The
// state folder holds the page's own records: the last check's answer (check.json), the end
// of the last check, cancel or apply (last.json), the download it started, running or ended
// (download.json), and the output of its downloads (download.log).
#ifndef KYTOUPDATE_CGI_H
#define KYTOUPDATE_CGI_H

#include <string>

#include <json/json.h>

namespace kytoupdate::cgi {

struct Config {
    std::string program = "/usr/bin/kytoupdate";  // KYTOUPDATE
    std::string state = "/run/kyto-page";         // KYTO_PAGE_STATE
    std::string Path(const char* name) const { return state + "/" + name; }
};

// How a run of kytoupdate ended: its exit code (128 + signal when killed, 127 when it could
// not be started) and what it printed.
struct Result {
    int exit = 127;
    std::string out, err;
};

// Runs `kytoupdate WORD [FLAG]` and waits for it, standard input from /dev/null.
Result Run(const Config& c, const char* word, const char* flag = nullptr);

// The record of an action's end: action, exit, words (a sentence for the exit code),
// output (what it printed; a download: its last line), message (its last note) and time;
// running is false.
Json::Value ActionRecord(const char* action, const Result& r);

// Starts `kytoupdate download` detached from the request (its own session; it survives the
// browser closing and the server ending the request), its output appended to download.log.
// Answers once the download has begun (the running record, also in download.json) or has
// ended without beginning (a refusal, an up-to-date system: its end), or after 30 seconds
// of checking.  A download's end goes to download.json; a refusal because another download
// runs leaves that download's record there.
Json::Value StartDownload(const Config& c);

// download.json, the record of the page's download; a running one whose supervising process
// is gone (killed) reads as failed.
Json::Value DownloadRecord(const Config& c);

// The last "kytoupdate: ..." note in text, without the prefix; the last other line.
std::string LastNote(const std::string& text);
std::string LastLine(const std::string& text);

// A JSON file of the state folder; null when it is missing or broken.
Json::Value ReadJson(const std::string& path);
// Replaces a JSON file of the state folder as a whole.
void WriteJson(const std::string& path, const Json::Value& value);

}  // namespace kytoupdate::cgi

#endif
