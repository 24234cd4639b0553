// Running the kytoupdate program in the sandbox against the loopback update server: one
// run's exit code and output, tables of expected runs, and a fixture that publishes a
// release (5.2-5700) or a small update (fix 1 of build 5644 for "demo_model").
#ifndef KYTO_TESTS_SUPPORT_KYTOUPDATE_FIXTURE_H
#define KYTO_TESTS_SUPPORT_KYTOUPDATE_FIXTURE_H

#include <string>
#include <vector>

#include "deb_builder.h"
#include "update_server.h"

namespace kytotest {

constexpr const char* kFeed = "/autoupdate/genRSS.php";

// The program built beside the test program (build/tests/.. -> build/tools/kytoupdate).
std::string Kyto();

// One run: arguments, exit code, standard output and standard error.  In a table of
// expected runs, err is a part of standard error ("": nothing on it).
struct Outcome {
    std::string args;
    int rc;
    std::string out, err;
};

Outcome Cmd(const std::string& args);
testing::AssertionResult Has(const std::string& text, const std::string& part);
void ExpectRuns(const std::vector<Outcome>& rows);

class KytoupdateTest : public UpdateServerTest {
  protected:
    void SetUp() override;
    // Serves release 5.2-5700 with an image of the given size, sent at bytesPerSecond.
    void Release(unsigned long long bytes, long bytesPerSecond = 0);
    // Publishes fix 1: a further package and the small-update package, restarting
    // S01iptables.sh and the add-on "DemoApp".
    void SmallFix();
    static DebPackage FixPackage();
    std::string PatchList() const;
    static std::string Deb();  // the further package's file name
};

}  // namespace kytotest

#endif
