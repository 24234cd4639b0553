// main() of every test program: the tests write to the appliance's fixed paths, so they run
// only inside the sandbox root made by tests/kyto-sandbox (ctest starts them that way).
#include <stdio.h>
#include <string.h>

#include <gtest/gtest.h>

#include "sandbox.h"

// UpdateUtil::IsThereAvailVolPath releases the volume list only from the node where its
// walk stopped; the nodes before it (all of them when no volume qualified) stay allocated
// on purpose, which is harmless in the short-lived processes that use it.  The sanitizer
// build ignores only leaks whose allocation passed through that one function (its
// qualified name, matched from the start); every other leak fails the test.  The hook is
// looked up by the sanitizer runtime at run time, so it must stay visible in a build with
// hidden symbols.
extern "C" __attribute__((visibility("default"))) const char* __lsan_default_suppressions() {
    return "leak:^UpdateUtil::IsThereAvailVolPath(\n";
}

int main(int argc, char** argv) {
    bool listOnly = false;
    for (int i = 1; i < argc; ++i) {
        if (strcmp(argv[i], "--gtest_list_tests") == 0)
            listOnly = true;
    }
    if (!listOnly && !kytotest::InSandbox()) {
        fprintf(stderr,
                "%s: refusing to run outside the test sandbox (this would write to the real "
                "root).\nRun the tests with ctest, or by hand as root: "
                "build/tests/kyto-sandbox %s [gtest options]\n",
                argv[0], argv[0]);
        return 2;
    }
    ::testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
