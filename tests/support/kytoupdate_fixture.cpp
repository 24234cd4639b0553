#include "kytoupdate_fixture.h"

#include <filesystem>

namespace kytotest {

std::string Kyto() {
    return std::filesystem::read_symlink("/proc/self/exe").parent_path().string() +
           "/../tools/kytoupdate";
}

Outcome Cmd(const std::string& args) {
    const int rc = Shell(Kyto() + " " + args + " >/tmp/k.out 2>/tmp/k.err");
    return {args, rc, ReadFile("/tmp/k.out").value_or(""), ReadFile("/tmp/k.err").value_or("")};
}

void ExpectRuns(const std::vector<Outcome>& rows) {
    for (const Outcome& row : rows) {
        SCOPED_TRACE(row.args);
        const Outcome r = Cmd(row.args);
        EXPECT_EQ(row.rc, r.rc);
        EXPECT_EQ(row.out, r.out);
        EXPECT_TRUE(Has(r.err, row.err));
        EXPECT_EQ(row.err.empty(), r.err.empty()) << r.err;
    }
}

void KytoupdateTest::SetUp() {
    UpdateServerTest::SetUp();
    server->PointRssServerHere();
    server->PutFile(kFeed, FeedDocument(""));  // no release on offer
}

void KytoupdateTest::Release(unsigned long long bytes, long bytesPerSecond) {
    server->PublishRelease("5700", "/img/vyx.img", bytes, bytesPerSecond);
}

}  // namespace kytotest
