// Driver for bench/download_bench.sh: one whole full-release download (feed fetch, check,
// image download, MD5 verification) as the library does it, timed with a monotonic clock.
// It writes to the appliance's fixed paths, so it refuses to run outside the test sandbox.
#include <stdio.h>
#include <time.h>
#include <unistd.h>

#include "vyxupdate.h"

int main() {
    if (access("/.kyto-sandbox", F_OK) != 0) {
        fprintf(stderr, "vyx_download_bench: run it through build/tests/kyto-sandbox only\n");
        return 2;
    }
    timespec start{}, end{};
    clock_gettime(CLOCK_MONOTONIC, &start);
    VyxUpdate vyx;
    int result = vyx.DownloadVyx();
    clock_gettime(CLOCK_MONOTONIC, &end);
    double seconds =
        static_cast<double>(end.tv_sec - start.tv_sec) + (end.tv_nsec - start.tv_nsec) / 1e9;
    printf("%.3f\n", seconds);
    return result == 1 ? 0 : 1;
}
