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

testing::AssertionResult Has(const std::string& text, const std::string& part) {
    if (text.find(part) != std::string::npos)
        return testing::AssertionSuccess();
    return testing::AssertionFailure() << "no \"" << part << "\" in:\n" << text;
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
    const std::string md5 = Md5Of(server->PutFileOfSize("/img/vyx.img", bytes));
    if (bytesPerSecond)
        server->SlowPath("/img/vyx.img", bytesPerSecond);
    server->PutFile(
        kFeed, FeedDocument(
                   FeedItem("5", "2", "5700", {{"demo_model", server->Url("/img/vyx.img"), md5}})));
}

void KytoupdateTest::SmallFix() {
    BuildDeb(FixPackage(), server->Root() + "/debs");
    BuildDeb(MakeDebPackage("kyto-su", SmallFixVersion("5.2", 5644, 1)), server->Root() + "/debs");
    server->PutFile(UpdateServer::PatchListPath(5644, "demo_model"), PatchList());
}

DebPackage KytoupdateTest::FixPackage() {
    return MakeDebPackage("kyto-tool-fix", SmallFixVersion("1.0", 5644, 1));
}

std::string KytoupdateTest::PatchList() const {
    PatchEntry fix;
    fix.version = 1;
    fix.proj = {{"kyto-tool-fix", server->Url("/debs/" + Deb())},
                {"smallupdate", server->Url("/debs/kyto-su_5.2-5644-s1_all.deb")}};
    fix.restart = R"({"vyx_service":["S01iptables.sh"],"pkg":["DemoApp"]})";
    return PatchListJson(5644, "demo_model", {fix});
}

std::string KytoupdateTest::Deb() {
    return DebFileName(FixPackage());
}

}  // namespace kytotest
