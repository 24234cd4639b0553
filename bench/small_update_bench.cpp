// Driver for bench/small_update_bench.sh: one step of a small update as the library does
// it, timed with a monotonic clock and printed in seconds.
//   download  looks the patch list up (not timed), then times Download(true): every
//             package fetched with wget, status file, info file;
//   apply     times Apply() of the downloaded update: info file, update log, apply status
//             file, dpkg -i of every package, the new small-fix number, the clean-up.
// It writes to the appliance's fixed paths, so it refuses to run outside the test sandbox.
#include <stdio.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include "smallupdate.h"

namespace {

double Now() {
    timespec t{};
    clock_gettime(CLOCK_MONOTONIC, &t);
    return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) / 1e9;
}

}  // namespace

int main(int argc, char** argv) {
    if (access("/.kyto-sandbox", F_OK) != 0) {
        fprintf(stderr, "small_update_bench: run it through build/tests/kyto-sandbox only\n");
        return 2;
    }
    const bool download = argc == 2 && strcmp(argv[1], "download") == 0;
    if (!download && !(argc == 2 && strcmp(argv[1], "apply") == 0)) {
        fprintf(stderr, "usage: small_update_bench download|apply\n");
        return 2;
    }
    SmallUpdate update;
    if (download && !update.HaveNewFix()) {
        fprintf(stderr, "small_update_bench: no new fix found (error %d)\n", update.GetErrno());
        return 1;
    }
    const double start = Now();
    const bool ok = download ? update.Download(true) : update.Apply();
    const double seconds = Now() - start;
    printf("%.6f\n", seconds);
    return ok ? 0 : 1;
}
