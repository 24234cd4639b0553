// Shared by the fuzz targets.  The library reads and writes the appliance's fixed paths
// ("/var/run/downloadVYX.status", "/autoupd@te.info", ...), so every target runs only
// inside the test sandbox (tests/sandbox/kyto-sandbox), where every write vanishes with the
// run.  A finding aborts, so libFuzzer reports it with the input that caused it.
#ifndef KYTO_FUZZ_COMMON_H
#define KYTO_FUZZ_COMMON_H

#include <dirent.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <string>
#include <vector>

namespace kytofuzz {

// Aborts with a message: libFuzzer treats it as a crash and prints the input.
#define KYTO_FUZZ_CHECK(cond)                                                              \
    do {                                                                                   \
        if (!(cond)) {                                                                     \
            fprintf(stderr, "fuzz check failed: %s (%s:%d)\n", #cond, __FILE__, __LINE__); \
            abort();                                                                       \
        }                                                                                  \
    } while (0)

// Refuses to run on the real root: the sandbox leaves its marker file on an overlay root.
inline void RequireSandbox(const char* self) {
    struct statfs fs;
    struct stat st;
    if (stat("/.kyto-sandbox", &st) != 0 || statfs("/", &fs) != 0 ||
        fs.f_type != 0x794c7630 /* overlayfs */) {
        fprintf(stderr,
                "%s: refusing to run outside the test sandbox; run it as "
                "kyto-sandbox %s [libFuzzer options]\n",
                self, self);
        _exit(2);
    }
    // Millions of runs would fill the sandbox's syslog file; nobody reads it here.
    unlink("/dev/log");
}

// Replaces the file at path with exactly the given bytes.
inline void WriteWhole(const char* path, const void* data, size_t size) {
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    KYTO_FUZZ_CHECK(fd >= 0);
    const char* p = static_cast<const char*>(data);
    while (size > 0) {
        ssize_t n = write(fd, p, size);
        KYTO_FUZZ_CHECK(n > 0);
        p += n;
        size -= static_cast<size_t>(n);
    }
    KYTO_FUZZ_CHECK(close(fd) == 0);
}

inline void WriteWhole(const char* path, const std::string& text) {
    WriteWhole(path, text.data(), text.size());
}

// Splits the input at every occurrence of sep (a multi-byte separator, so that a fuzzer
// input can carry several files); always yields at least `parts` entries.
inline std::vector<std::string> SplitInput(const uint8_t* data, size_t size, const std::string& sep,
                                           size_t parts) {
    std::vector<std::string> out;
    std::string all(reinterpret_cast<const char*>(data), size);
    size_t start = 0;
    while (out.size() + 1 < parts) {
        size_t at = all.find(sep, start);
        if (at == std::string::npos)
            break;
        out.push_back(all.substr(start, at - start));
        start = at + sep.size();
    }
    out.push_back(all.substr(start));
    while (out.size() < parts)
        out.emplace_back();
    return out;
}

// Called once per run: every 4096 runs the open descriptors are counted; a reader that
// leaks one per call would hold thousands more than at the first count.  (A descriptor
// that a library keeps open once is no leak: a handful over the first count is allowed.)
inline void CheckDescriptors() {
    static long runs = 0;
    static int first = -1;
    if (runs++ % 4096 != 0)
        return;
    int n = 0;
    DIR* d = opendir("/proc/self/fd");
    KYTO_FUZZ_CHECK(d != nullptr);
    while (readdir(d) != nullptr)
        ++n;
    closedir(d);
    if (first < 0)
        first = n;
    KYTO_FUZZ_CHECK(n < first + 16);
}

// True when a fixed-size text field holds its terminating NUL.
template <size_t N>
bool Terminated(const char (&field)[N]) {
    return memchr(field, '\0', N) != nullptr;
}

}  // namespace kytofuzz

#endif
