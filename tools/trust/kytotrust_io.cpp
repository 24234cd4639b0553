// Descriptors, small files, base64 and lines for kytotrust.
#include "kytotrust_io.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <sodium.h>

#include "kytotrust.h"
#include "scoped.h"

namespace kytotrust {

SecretKey::~SecretKey() {
    sodium_memzero(key, sizeof key);
}

std::string KeyIdHex(const uint8_t id[8]) {
    char hex[17];
    for (int i = 0; i < 8; ++i)
        snprintf(hex + 2 * i, 3, "%02X", id[7 - i]);
    return hex;
}

namespace detail {

Wipe::~Wipe() {
    sodium_memzero(p_, n_);
}

bool SodiumReady(std::string& why) {
    if (sodium_init() < 0) {
        why = "the cryptography library could not start";
        return false;
    }
    return true;
}

bool ReadSmallFile(const std::string& path, std::string& text, std::string& why, int* errnoOut) {
    kyto::UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
    struct stat st;
    if (!fd.valid() || fstat(fd.get(), &st) != 0) {
        if (errnoOut)
            *errnoOut = errno;
        why = "cannot read " + path + ": " + strerror(errno);
        return false;
    }
    if (errnoOut)
        *errnoOut = 0;
    if (!S_ISREG(st.st_mode)) {
        why = path + " is not a regular file";
        return false;
    }
    text.clear();
    char buf[4096];
    for (;;) {
        const ssize_t n = kyto::ReadRetry(fd.get(), buf, sizeof buf);
        if (n < 0) {
            if (errnoOut)
                *errnoOut = errno;
            why = "cannot read " + path + ": " + strerror(errno);
            return false;
        }
        if (n == 0)
            break;
        if (text.size() + static_cast<size_t>(n) > kMaxSmallFile) {
            why = path + " is too large for a key or signature file";
            return false;
        }
        text.append(buf, static_cast<size_t>(n));
    }
    return true;
}

bool WriteBeside(const std::string& path, const std::string& text, unsigned mode, bool noReplace,
                 std::string& why) {
    std::string tmp = path + ".tmp.XXXXXX";
    kyto::UniqueFd fd(mkostemp(&tmp[0], O_CLOEXEC));
    if (!fd.valid()) {
        why = "cannot create a file beside " + path + ": " + strerror(errno);
        return false;
    }
    bool ok = fchmod(fd.get(), mode) == 0 && kyto::WriteAll(fd.get(), text) && fsync(fd.get()) == 0;
    if (ok)
        ok = noReplace ? link(tmp.c_str(), path.c_str()) == 0
                       : rename(tmp.c_str(), path.c_str()) == 0;
    const int err = errno;
    if (!ok || noReplace)
        unlink(tmp.c_str());
    if (!ok) {
        why = err == EEXIST ? path + " exists already: not overwritten"
                            : "cannot write " + path + ": " + strerror(err);
        return false;
    }
    return true;
}

std::string Base64(const uint8_t* bin, size_t len) {
    const size_t size = sodium_base64_ENCODED_LEN(len, sodium_base64_VARIANT_ORIGINAL);
    std::string out(size, '\0');
    sodium_bin2base64(&out[0], size, bin, len, sodium_base64_VARIANT_ORIGINAL);
    out.resize(size - 1);  // the terminating NUL
    return out;
}

bool Unbase64(const std::string& text, uint8_t* bin, size_t len) {
    size_t got = 0;
    const char* end = nullptr;
    if (sodium_base642bin(bin, len, text.data(), text.size(), nullptr, &got, &end,
                          sodium_base64_VARIANT_ORIGINAL) != 0)
        return false;
    return got == len && end == text.data() + text.size();
}

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    size_t start = 0;
    while (start < text.size()) {
        size_t nl = text.find('\n', start);
        if (nl == std::string::npos)
            nl = text.size();
        std::string line = text.substr(start, nl - start);
        if (!line.empty() && line.back() == '\r')
            line.pop_back();
        lines.push_back(line);
        start = nl + 1;
    }
    return lines;
}

bool StartsWith(const std::string& s, const char* prefix) {
    return s.compare(0, strlen(prefix), prefix) == 0;
}

}  // namespace detail
}  // namespace kytotrust
