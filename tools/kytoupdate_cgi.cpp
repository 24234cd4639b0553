// kytoupdate-cgi: the back end of the sample update page (www/), run as CGI by fcgiwrap
// behind nginx.
//   GET  /api/status    the JSON of `kytoupdate status --json` with the last check's answer,
//                       the last action's end, the page's download and its progress line
//   POST /api/check | /api/download | /api/cancel | /api/apply
//                       runs `kytoupdate <action>` (only these four words, never a shell);
//                       a download runs detached and survives the browser closing
// Only the page's own origin may post.  Settings come from the server's CGI variables:
// KYTOUPDATE (the program), KYTO_PAGE_STATE (the state folder), KYTO_PAGE_ORIGIN (the
// page's origin, scheme://host[:port]).
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <iostream>
#include <memory>
#include <string>

#include "kytoupdate_cgi.h"
#include "kytoupdate_exit.h"
#include "scoped.h"

namespace kytoupdate::cgi {

namespace {

constexpr const char* kUsage =
    "kytoupdate-cgi: the back end of the sample update page, run as CGI by the web server.\n"
    "  GET  /api/status                           the update's status, as JSON\n"
    "  POST /api/{check,download,cancel,apply}    runs kytoupdate with that command\n"
    "CGI variables: KYTOUPDATE (program, default /usr/bin/kytoupdate), KYTO_PAGE_STATE\n"
    "(state folder, default /run/kyto-page), KYTO_PAGE_ORIGIN (the page's origin; posts\n"
    "from any other are refused).  See the README's section on the update page.\n";

// What the last download printed is read from the end of its log only.
constexpr off_t kProgressTail = 4096;

std::string Env(const char* name) {
    const char* v = getenv(name);
    return v ? v : "";
}

std::string Compact(const Json::Value& v) {
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    return Json::writeString(b, v);
}

// The last line of the download log: "33%  package 2 of 3  532.7 KiB/s  0:03 left".
std::string ProgressLine(const Config& c) {
    kyto::UniqueFd log(open(c.Path("download.log").c_str(), O_RDONLY | O_CLOEXEC));
    struct stat st;
    if (!log.valid() || fstat(log.get(), &st) != 0)
        return "";
    const off_t from = st.st_size > kProgressTail ? st.st_size - kProgressTail : 0;
    std::string tail(static_cast<size_t>(st.st_size - from), '\0');
    const ssize_t n = pread(log.get(), &tail[0], tail.size(), from);
    tail.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return LastLine(tail);
}

Json::Value Status(const Config& c) {
    const Result r = Run(c, "status", "--json");
    Json::Value v(Json::objectValue), status;
    Json::CharReaderBuilder builder;
    std::string errors;
    const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    if (r.exit == kExitOk &&
        reader->parse(r.out.data(), r.out.data() + r.out.size(), &status, &errors))
        v["status"] = status;
    else
        v["error"] = LastNote(r.err).empty() ? "the status could not be read" : LastNote(r.err);
    v["check"] = ReadJson(c.Path("check.json"));
    v["last"] = ReadJson(c.Path("last.json"));
    v["download"] = DownloadRecord(c);
    v["progress"] = ProgressLine(c);
    return v;
}

Json::Value Act(const Config& c, const std::string& action) {
    if (action == "download")
        return StartDownload(c);
    const Json::Value end = ActionRecord(action.c_str(), Run(c, action.c_str()));
    // The offer stands until a check answers again or the update it offered is applied.
    if (action == "check")
        WriteJson(c.Path("check.json"), end);
    else if (action == "apply" && end["exit"].asInt() == kExitOk)
        unlink(c.Path("check.json").c_str());
    WriteJson(c.Path("last.json"), end);
    return end;
}

void Reply(int code, const char* reason, const Json::Value& body, const char* extra = "") {
    std::cout << "Status: " << code << " " << reason << "\r\n"
              << "Content-Type: application/json\r\n"
              << "Cache-Control: no-store\r\n"
              << extra << "\r\n"
              << Compact(body) << "\n";
}

void ReplyError(int code, const char* reason, const std::string& text, const char* extra = "") {
    Json::Value v(Json::objectValue);
    v["error"] = text;
    Reply(code, reason, v, extra);
}

// A post must come from the page itself: Sec-Fetch-Site, when sent, says same-origin, and
// Origin, which is required, is the page's origin as the server gives it.
bool SameOrigin() {
    const std::string site = Env("HTTP_SEC_FETCH_SITE");
    if (!site.empty() && site != "same-origin")
        return false;
    const std::string origin = Env("HTTP_ORIGIN"), page = Env("KYTO_PAGE_ORIGIN");
    return !origin.empty() && origin == page;
}

void Serve(const Config& c) {
    const std::string method = Env("REQUEST_METHOD");
    const std::string path = Env("DOCUMENT_URI");
    const std::string prefix = "/api/";
    const std::string name =
        path.compare(0, prefix.size(), prefix) == 0 ? path.substr(prefix.size()) : std::string();
    const bool action =
        name == "check" || name == "download" || name == "cancel" || name == "apply";
    if (name == "status") {
        if (method != "GET" && method != "HEAD")
            ReplyError(405, "Method Not Allowed", "status is read with GET", "Allow: GET\r\n");
        else
            Reply(200, "OK", Status(c));
    } else if (!action) {
        ReplyError(404, "Not Found", "no such action");
    } else if (method != "POST") {
        ReplyError(405, "Method Not Allowed", "actions are posted", "Allow: POST\r\n");
    } else if (!SameOrigin()) {
        ReplyError(403, "Forbidden", "only the update page itself may post");
    } else {
        Reply(200, "OK", Act(c, name));
    }
}

}  // namespace

}  // namespace kytoupdate::cgi

int main(int argc, char** argv) {
    using namespace kytoupdate;
    if (argc > 1 && (strcmp(argv[1], "--help") == 0 || strcmp(argv[1], "-h") == 0)) {
        std::cout << cgi::kUsage;
        return kExitOk;
    }
    if (argc > 1 || getenv("REQUEST_METHOD") == nullptr) {
        std::cerr << cgi::kUsage;
        return kExitUsage;
    }
    cgi::Config c;
    if (!cgi::Env("KYTOUPDATE").empty())
        c.program = cgi::Env("KYTOUPDATE");
    if (!cgi::Env("KYTO_PAGE_STATE").empty())
        c.state = cgi::Env("KYTO_PAGE_STATE");
    mkdir(c.state.c_str(), 0755);
    cgi::Serve(c);
    return kExitOk;
}
