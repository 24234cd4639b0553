// A loopback update server for the tests: a separate python3 process
// (tests/support/update_server.py) listening on 127.0.0.1 on a port chosen by the kernel
// (port 0), serving files from a folder of its own.  It can answer any status code for a
// path a given number of times before it answers normally, send a body slowly, and it
// records every request (path, query, user agent, status) for the test to read back.
#ifndef KYTO_TESTS_SUPPORT_UPDATE_SERVER_H
#define KYTO_TESTS_SUPPORT_UPDATE_SERVER_H

#include <sys/types.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "sandbox.h"

namespace kytotest {

// One entry of a patch list ("VYX-Security.json"): proj holds (name, url) pairs, restart
// is raw JSON ("\"reboot\"", "{\"vyx_service\":[...],\"pkg\":[]}", ...).
struct PatchEntry {
    int version = 0;
    std::vector<std::pair<std::string, std::string>> proj;
    bool flash = false;
    bool config = false;
    std::string restart = "\"none\"";
};
// The patch-list document for a build and model holding the entries in order.
std::string PatchListJson(int build, const std::string& unique,
                          const std::vector<PatchEntry>& entries);

class UpdateServer {
  public:
    struct Request {
        std::string method;     // "GET", "HEAD", ...
        std::string path;       // URL path without the query, e.g. "/autoupdate/genRSS.php"
        std::string query;      // raw query text without '?', e.g. "tz=Europe/Berlin"
        std::string userAgent;  // the User-Agent header ("" when absent)
        int status = 0;         // status code answered
    };

    // Starts the server (fails the calling test with a fatal failure when it cannot) and
    // waits until it listens.  The served folder is a fresh folder under /tmp.
    UpdateServer();
    // Stops the server process and reaps it.  Declare the server in the test body (or
    // destroy it in TearDown before the base fixture's): the fixture fails a test that
    // leaves a child process behind.
    ~UpdateServer();
    UpdateServer(const UpdateServer&) = delete;
    UpdateServer& operator=(const UpdateServer&) = delete;

    int Port() const { return port_; }
    std::string BaseUrl() const;                     // "http://127.0.0.1:<port>"
    std::string Url(const std::string& path) const;  // BaseUrl() + path (path starts with '/')
    const std::string& Root() const { return root_; }

    // Serves content at urlPath (e.g. "/autoupdate/genRSS.php", "/images/vyx.img").  The
    // query string is ignored when matching a path.
    void PutFile(const std::string& urlPath, const std::string& content);
    // Serves a file of the given size with deterministic pseudo-random bytes; returns its
    // local path (under Root()), e.g. to compute its MD5.
    std::string PutFileOfSize(const std::string& urlPath, unsigned long long bytes);
    // Answers `status` (with a short body) for urlPath the next `times` requests, then
    // normally; times < 0 means always.
    void FailPath(const std::string& urlPath, int status, int times = -1);
    // Sends the body of urlPath at about bytesPerSecond (in small chunks, flushing each).
    void SlowPath(const std::string& urlPath, long bytesPerSecond);
    // Announces the whole body of urlPath but sends only its first `bytes`, then closes.
    void TruncatePath(const std::string& urlPath, long bytes);
    // Sends the headers and the first `bytes` of urlPath, then nothing for a few seconds,
    // then closes the connection.
    void StallPath(const std::string& urlPath, long bytes);
    // Every request seen so far, in arrival order.
    std::vector<Request> Requests() const;
    // Requests for one path.
    std::vector<Request> RequestsFor(const std::string& urlPath) const;
    // Forgets the requests seen so far.
    void ClearRequests();
    // Points the appliance at this server: sets rss_server="<BaseUrl>/autoupdate/genRSS.php"
    // in /etc.defaults/kytoinfo.conf.
    void PointRssServerHere() const;
    // Publishes release 5.2 build `build` for "demo_model" at the feed path of
    // PointRssServerHere, its image of `bytes` served at imagePath (at bytesPerSecond when
    // given).
    void PublishRelease(const std::string& build, const std::string& imagePath,
                        unsigned long long bytes, long bytesPerSecond = 0);
    // Points the small-update lookup at this server: small_info_path="<BaseUrl>/smallupdate".
    void PointSmallInfoPathHere() const;
    // URL path of the patch list the lookup fetches for a build and model:
    // "/smallupdate/<build>/<unique>/VYX-Security.json".
    static std::string PatchListPath(int build, const std::string& unique);

  private:
    void Start();

    pid_t pid_ = -1;
    int port_ = 0;
    std::string root_;
};

// Base fixture of the small-update tests: a loopback update server that the patch-list
// lookup points at (started in SetUp, stopped before the sandbox's own checks in
// TearDown) and a 300 MiB data volume at /volume1 for the package folder.
class UpdateServerTest : public SandboxTest {
  protected:
    void SetUp() override;
    void TearDown() override;
    std::unique_ptr<UpdateServer> server;
};

// "<name>_6.1-<build>-s<fix>_all.deb": a package file name carrying a small-fix number.
std::string SmallFixDebName(const std::string& name, int fix, int build = 5644);

// One model element of a release feed item: the model's unique name, image link, MD5.
struct FeedModel {
    std::string unique, link, sum;
};
// One release feed item for major.minor build, `extra` elements (requirements) before the
// model elements, one element per line as the update server writes them.
std::string FeedItem(const std::string& major, const std::string& minor, const std::string& build,
                     const std::vector<FeedModel>& models, const std::string& extra = "");
// A whole release feed document holding the items.
std::string FeedDocument(const std::string& items);

}  // namespace kytotest

#endif
