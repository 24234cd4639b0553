// Running the kytoupdate program in the sandbox against the loopback update server: one
// run's exit code and output, tables of expected runs, and a fixture that publishes a
// release (5.2-5700); the small update (fix 1 of build 5644) is engine_fixtures.h's.
#ifndef KYTO_TESTS_SUPPORT_KYTOUPDATE_FIXTURE_H
#define KYTO_TESTS_SUPPORT_KYTOUPDATE_FIXTURE_H

#include <string>
#include <vector>

#include "engine_fixtures.h"
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
void ExpectRuns(const std::vector<Outcome>& rows);

class KytoupdateTest : public UpdateServerTest {
  protected:
    void SetUp() override;
    // Serves release 5.2-5700 with an image of the given size, sent at bytesPerSecond.
    void Release(unsigned long long bytes, long bytesPerSecond = 0);
};

}  // namespace kytotest

#endif
