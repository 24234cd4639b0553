// Self-test of the loopback update server the library tests download from: what it serves,
// the failures and slow bodies it is told to give, and the requests it records.
#include "sandbox.h"
#include "update_server.h"

namespace {

using namespace kytotest;
using UpdateServerTest = SandboxTest;

// Fetches url with the real wget into /tmp/out; returns its exit status.
int Wget(const std::string& url, const std::string& options = "-t 1") {
    return Shell("/usr/bin/wget -q " + options + " -U 'agent 1.0' -O /tmp/out '" + url + "'");
}

TEST_F(UpdateServerTest, ServesFailsAndRecords) {
    UpdateServer server;
    server.PutFile("/autoupdate/genRSS.php", "<rss/>");
    const std::string big = server.PutFileOfSize("/images/big.img", 3 * 1048576 + 17);
    server.PutFile("/slow.bin", std::string(2000, 's'));
    server.SlowPath("/slow.bin", 4000);
    server.PutFile("/images/a.img", "payload");
    server.FailPath("/images/a.img", 503, 2);

    ASSERT_EQ(Wget(server.Url("/autoupdate/genRSS.php?tz=Europe/Berlin")), 0);
    EXPECT_EQ(ReadFile("/tmp/out"), "<rss/>");
    EXPECT_NE(Wget(server.Url("/missing")), 0);
    ASSERT_EQ(Wget(server.Url("/images/big.img")), 0);
    EXPECT_EQ(Md5Of("/tmp/out"), Md5Of(big));
    ASSERT_EQ(Wget(server.Url("/slow.bin")), 0);
    EXPECT_EQ(ReadFile("/tmp/out"), std::string(2000, 's'));
    for (int status : {8, 8, 0})  // wget's exit status for a server error, then success
        EXPECT_EQ(Wget(server.Url("/images/a.img")), status);
    EXPECT_EQ(ReadFile("/tmp/out"), "payload");
    ASSERT_EQ(Wget(server.Url("/slow.bin"), "--spider"), 0);

    auto requests = server.Requests();
    ASSERT_EQ(requests.size(), 8u);
    EXPECT_EQ(requests[0].method + " " + requests[0].path + "?" + requests[0].query + " " +
                  requests[0].userAgent,
              "GET /autoupdate/genRSS.php?tz=Europe/Berlin agent 1.0");
    std::vector<int> statuses;
    for (const auto& r : requests)
        statuses.push_back(r.status);
    EXPECT_EQ(statuses, (std::vector<int>{200, 404, 200, 200, 503, 503, 200, 200}));
    EXPECT_EQ(requests.back().method, "HEAD");
    EXPECT_EQ(server.RequestsFor("/images/a.img").size(), 3u);
    server.ClearRequests();
    server.FailPath("/images/a.img", 404);  // always
    EXPECT_NE(Wget(server.Url("/images/a.img")), 0);
    EXPECT_NE(Wget(server.Url("/images/a.img")), 0);
    EXPECT_EQ(server.Requests().size(), 2u);
}

}  // namespace
