// Shared by the stress programs: they drive the library on the appliance's fixed paths, so
// they run only inside the test sandbox (tests/sandbox/kyto-sandbox).
#ifndef KYTO_STRESS_COMMON_H
#define KYTO_STRESS_COMMON_H

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <string>

namespace kytostress {

inline void RequireSandbox(const char* self) {
    struct statfs fs;
    struct stat st;
    if (stat("/.kyto-sandbox", &st) != 0 || statfs("/", &fs) != 0 ||
        fs.f_type != 0x794c7630 /* overlayfs */) {
        fprintf(stderr, "%s: refusing to run outside the test sandbox; run it as kyto-sandbox %s\n",
                self, self);
        exit(2);
    }
}

inline bool WriteText(const std::string& path, const std::string& text) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0)
        return false;
    bool ok = write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    return close(fd) == 0 && ok;
}

inline bool Exists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

// Value of "--name=N" among the arguments, or def.
inline long LongArg(int argc, char** argv, const char* name, long def) {
    size_t n = strlen(name);
    for (int i = 1; i < argc; ++i) {
        if (strncmp(argv[i], "--", 2) == 0 && strncmp(argv[i] + 2, name, n) == 0 &&
            argv[i][2 + n] == '=')
            return strtol(argv[i] + 3 + n, nullptr, 10);
    }
    return def;
}

}  // namespace kytostress

#endif
