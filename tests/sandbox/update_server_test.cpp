// Self-test of the loopback update server, for what the library tests do not already use:
// unknown paths, failures without end, HEAD requests and the request record.
#include "sandbox.h"
#include "update_server.h"

namespace {

using namespace kytotest;
using UpdateServerTest = SandboxTest;

TEST_F(UpdateServerTest, AnswersAndRecordsEveryRequest) {
    UpdateServer server;
    server.PutFile("/slow.bin", std::string(2000, 's'));
    server.SlowPath("/slow.bin", 4000);
    server.PutFile("/a.img", "payload");
    server.FailPath("/a.img", 404);  // always
    auto wget = [&](const std::string& path, const std::string& options) {
        return Shell("/usr/bin/wget -q -t 1 " + options + " -U 'agent 1.0' -O /tmp/out '" +
                     server.Url(path) + "'");
    };
    ASSERT_EQ(wget("/slow.bin?x=1", ""), 0);
    EXPECT_EQ(ReadFile("/tmp/out"), std::string(2000, 's'));
    EXPECT_NE(wget("/missing", ""), 0);
    EXPECT_NE(wget("/a.img", ""), 0);
    EXPECT_NE(wget("/a.img", ""), 0);
    EXPECT_EQ(wget("/slow.bin", "--spider"), 0);
    std::string seen;
    for (const auto& r : server.Requests()) {
        seen += r.method + " " + r.path + " " + r.query + " " + r.userAgent + " " +
                std::to_string(r.status) + ";";
    }
    EXPECT_EQ(seen, "GET /slow.bin x=1 agent 1.0 200;GET /missing  agent 1.0 404;"
                    "GET /a.img  agent 1.0 404;GET /a.img  agent 1.0 404;"
                    "HEAD /slow.bin  agent 1.0 200;");
    server.ClearRequests();
    EXPECT_TRUE(server.Requests().empty());
}

}  // namespace
