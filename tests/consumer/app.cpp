// A program built outside the source tree against the installed library, once through
// pkg-config and once through find_package (CMakeLists.txt beside it): proves that the
// installed headers, libraries and both package descriptions are complete, and that the
// exported symbols are the ones a program needs.
//   g++ app.cpp $(pkg-config --cflags --libs kytoinstallcpp)
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include <custombugfix.h>
#include <debian_lib.h>
#include <smallupdate.h>
#include <systemupdate.h>
#include <update_cpputil.h>
#include <vyxupdate.h>
#include <kytoplatform/klibc.h>
#include <kytoplatform/kytoconf.h>

static int g_failures = 0;

static void Check(bool ok, const char* what) {
    printf("%-58s %s\n", what, ok ? "ok" : "FAILED");
    if (!ok)
        ++g_failures;
}

int main() {
    // Same strings, other counts: not equal (the record comparison's tests hold the rest).
    std::vector<std::string> a = {"samba", "nfs", "samba"}, c = {"nfs", "samba"};
    Check(UpdateUtil::CompareVector(a, c) == 0, "CompareVector: different multiplicities");
    VyxUpdate::VYX_DOWNLOAD_STATUS st = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;
    Check(VyxUpdate::DownloadStatusToString(st) == "failed", "DownloadStatusToString(failed)");

    PKLIBC_SZLIST list = KLIBCSzListAlloc(2);
    Check(list != nullptr, "KLIBCSzListAlloc(2)");
    if (list != nullptr) {
        int n = KLIBCStrSep("a,b,c", ",", &list);
        char* joined = nullptr;
        int size = 0;
        int len = KLIBCSzListJoin(list, "+", &joined, &size);
        Check(n == 3 && len == 5 && joined != nullptr && strcmp(joined, "a+b+c") == 0,
              "KLIBCStrSep + KLIBCSzListJoin");
        free(joined);
        KLIBCSzListFree(list);
    }
    Check(KLIBCSzListAlloc(0) == nullptr, "KLIBCSzListAlloc(0) refused");
    Check(KytoConf().Def("no_such_key_in_any_model", "fallback") == "fallback",
          "KytoConf::Def of a missing key");

    printf("consumer: %s\n", g_failures == 0 ? "all checks passed" : "checks FAILED");
    return g_failures == 0 ? 0 : 1;
}
