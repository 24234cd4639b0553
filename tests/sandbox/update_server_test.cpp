// Self-test of the loopback update server the library tests download from.
#include <regex>
#include <string>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "update_server.h"

namespace {

using kytotest::Shell;
using kytotest::UpdateServer;

class UpdateServerTest : public kytotest::SandboxTest {};

// Fetches url with the real wget; returns its exit status, output in *log.
int Wget(const std::string& url, const std::string& out, std::string* log) {
    return Shell(
        "/usr/bin/wget -t 1 --progress=dot:mega -U 'demo_model VYX5.2 5644 (autoupgrade)' -O " +
            out + " '" + url + "' 2>&1",
        log);
}

TEST_F(UpdateServerTest, ServesFeedAndRecordsRequests) {
    UpdateServer server;
    ASSERT_GT(server.Port(), 0);
    server.PutFile("/autoupdate/genRSS.php", "<rss/>");
    server.PointRssServerHere();
    EXPECT_EQ(kytotest::ReadKeyValueFile("/etc.defaults/kytoinfo.conf")["rss_server"],
              server.Url("/autoupdate/genRSS.php"));

    std::string log;
    ASSERT_EQ(Wget(server.Url("/autoupdate/genRSS.php?tz=Europe/Berlin"), "/tmp/feed", &log), 0)
        << log;
    EXPECT_EQ(kytotest::ReadFile("/tmp/feed"), "<rss/>");
    EXPECT_NE(log.find("Length: 6"), std::string::npos) << log;

    EXPECT_NE(Wget(server.Url("/missing"), "/tmp/missing", &log), 0);

    auto requests = server.Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(requests[0].method, "GET");
    EXPECT_EQ(requests[0].path, "/autoupdate/genRSS.php");
    EXPECT_EQ(requests[0].query, "tz=Europe/Berlin");
    EXPECT_EQ(requests[0].userAgent, "demo_model VYX5.2 5644 (autoupgrade)");
    EXPECT_EQ(requests[0].status, 200);
    EXPECT_EQ(requests[1].status, 404);
    EXPECT_EQ(server.RequestsFor("/missing").size(), 1u);
}

TEST_F(UpdateServerTest, FailsGivenTimesThenServes) {
    UpdateServer server;
    server.PutFile("/images/a.img", "payload");
    server.FailPath("/images/a.img", 503, 2);
    std::string log;
    EXPECT_NE(Wget(server.Url("/images/a.img"), "/tmp/a", &log), 0);
    EXPECT_NE(Wget(server.Url("/images/a.img"), "/tmp/a", &log), 0);
    ASSERT_EQ(Wget(server.Url("/images/a.img"), "/tmp/a", &log), 0) << log;
    EXPECT_EQ(kytotest::ReadFile("/tmp/a"), "payload");

    std::vector<int> statuses;
    for (const auto& r : server.RequestsFor("/images/a.img"))
        statuses.push_back(r.status);
    EXPECT_EQ(statuses, (std::vector<int>{503, 503, 200}));

    server.ClearRequests();
    server.FailPath("/images/a.img", 404);
    EXPECT_NE(Wget(server.Url("/images/a.img"), "/tmp/a", &log), 0);
    EXPECT_NE(Wget(server.Url("/images/a.img"), "/tmp/a", &log), 0);
    EXPECT_EQ(server.Requests().size(), 2u);
}

TEST_F(UpdateServerTest, SlowAndLargeBodiesArriveWhole) {
    UpdateServer server;
    const std::string local = server.PutFileOfSize("/images/big.img", 3 * 1048576 + 17);
    server.PutFile("/slow.bin", std::string(2000, 's'));
    server.SlowPath("/slow.bin", 4000);

    std::string log;
    ASSERT_EQ(Wget(server.Url("/images/big.img"), "/tmp/big", &log), 0) << log;
    // wget groups the digits only in locales that have a thousands separator.
    EXPECT_TRUE(std::regex_search(log, std::regex("Length: 3,?145,?745 \\(3.0M\\)"))) << log;
    EXPECT_EQ(Shell("cmp -s /tmp/big " + local), 0);

    ASSERT_EQ(Wget(server.Url("/slow.bin"), "/tmp/slow", &log), 0) << log;
    EXPECT_EQ(kytotest::ReadFile("/tmp/slow"), std::string(2000, 's'));

    // HEAD answers the length without a body.
    ASSERT_EQ(Shell("/usr/bin/wget -S --spider '" + server.Url("/slow.bin") + "' 2>&1", &log), 0);
    EXPECT_NE(log.find("Content-Length: 2000"), std::string::npos) << log;
    EXPECT_EQ(server.Requests().back().method, "HEAD");
}

}  // namespace
