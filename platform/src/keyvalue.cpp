// key=value files: reading, atomic in-place update, existence check.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "platform_internal.h"

namespace {

constexpr const char* kDefaultLineFormat = "%s=\"%s\"\n";

bool IsBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

// True when fmt has exactly two "%s" conversions and no other conversion ("%%" allowed).
bool ValidLineFormat(const char* fmt) {
    int strings = 0;
    for (const char* p = fmt; *p; ++p) {
        if (*p != '%')
            continue;
        ++p;
        if (*p == '%')
            continue;
        if (*p != 's')
            return false;
        ++strings;
    }
    return strings == 2;
}

bool WriteAll(int fd, const std::string& data) {
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = ::write(fd, data.data() + done, data.size() - done);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

// Folder and base name of path ("." for a bare name).
void SplitPath(const std::string& path, std::string* dir, std::string* base) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos) {
        *dir = ".";
        *base = path;
    } else {
        *dir = slash == 0 ? "/" : path.substr(0, slash);
        *base = path.substr(slash + 1);
    }
}

}  // namespace

namespace kytoplat {

UniqueFd OpenFileForReading(const char* path) {
    UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        KYTO_FAIL(OpenErrorCode(errno, KYTO_ERR_FILE_OPEN));
        return fd;
    }
    struct stat st;
    if (::fstat(fd.get(), &st) != 0 || S_ISDIR(st.st_mode)) {
        KYTO_FAIL(KYTO_ERR_FILE_OPEN);
        fd.reset();
    }
    return fd;
}

int KvLoad(const char* path, std::vector<std::string>* lines, bool* endsWithNewline) {
    lines->clear();
    *endsWithNewline = true;
    UniqueFd fd = OpenFileForReading(path);
    if (!fd.valid())
        return -1;
    // Read in chunks and split at newlines; memory stays bounded by the line limit even
    // when a file holds one endless line.
    std::string cur;
    std::vector<char> chunk(16384);
    for (;;) {
        ssize_t n = ReadRetry(fd.get(), chunk.data(), chunk.size());
        if (n < 0) {
            KYTO_FAIL(KYTO_ERR_FILE_READ);
            return -1;
        }
        if (n == 0)
            break;
        const char* p = chunk.data();
        const char* end = p + n;
        while (p < end) {
            const char* nl = static_cast<const char*>(memchr(p, '\n', end - p));
            const char* stop = nl ? nl : end;
            cur.append(p, stop);
            if (cur.size() > KLIBC_KV_MAX_LINE) {
                KYTO_FAIL(KYTO_ERR_LINE_TOO_LONG);
                return -1;
            }
            if (!nl)
                break;
            lines->push_back(std::move(cur));
            cur.clear();
            p = nl + 1;
        }
    }
    if (!cur.empty()) {
        lines->push_back(std::move(cur));
        *endsWithNewline = false;
    }
    return 0;
}

bool KvLineMatches(const std::string& line, const std::string& key, std::string* value) {
    size_t b = 0;
    while (b < line.size() && IsBlank(line[b]))
        ++b;
    if (b == line.size() || line[b] == '#')
        return false;
    size_t eq = line.find('=', b);
    if (eq == std::string::npos)
        return false;
    size_t e = eq;
    while (e > b && IsBlank(line[e - 1]))
        --e;
    if (line.compare(b, e - b, key) != 0 || e - b != key.size())
        return false;
    size_t vb = eq + 1;
    size_t ve = line.size();
    while (vb < ve && IsBlank(line[vb]))
        ++vb;
    while (ve > vb && IsBlank(line[ve - 1]))
        --ve;
    if (ve - vb >= 2 && line[vb] == '"' && line[ve - 1] == '"') {
        ++vb;
        --ve;
    }
    if (value)
        value->assign(line, vb, ve - vb);
    return true;
}

int KvFind(const std::vector<std::string>& lines, const std::string& key, std::string* value) {
    for (const std::string& line : lines) {
        if (KvLineMatches(line, key, value))
            return 1;
    }
    return 0;
}

int KvGet(const char* path, const std::string& key, std::string* value) {
    std::vector<std::string> lines;
    bool endsWithNewline;
    if (KvLoad(path, &lines, &endsWithNewline) != 0)
        return -1;
    return KvFind(lines, key, value);
}

}  // namespace kytoplat

extern "C" {

int KLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int flags) noexcept try {
    if (path == nullptr || *path == '\0' || key == nullptr || *key == '\0' || buf == nullptr ||
        size < 1 || flags != 0) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::string value;
    int rc = kytoplat::KvGet(path, key, &value);
    if (rc < 0)
        return -1;
    if (rc == 0) {
        buf[0] = '\0';
        return 0;
    }
    size_t n =
        value.size() < static_cast<size_t>(size - 1) ? value.size() : static_cast<size_t>(size - 1);
    memcpy(buf, value.data(), n);
    buf[n] = '\0';
    return static_cast<int>(n);
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCFileSetKeyValue(const char* path, const char* key, const char* value,
                         const char* lineFormat) noexcept try {
    if (lineFormat == nullptr)
        lineFormat = kDefaultLineFormat;
    if (path == nullptr || *path == '\0' || key == nullptr || *key == '\0' || value == nullptr ||
        key[0] == '#' || IsBlank(key[0]) || IsBlank(key[strlen(key) - 1]) ||
        strpbrk(key, "=\n") != nullptr || strchr(value, '\n') != nullptr ||
        !ValidLineFormat(lineFormat)) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }

    std::vector<std::string> lines;
    bool endsWithNewline = true;
    mode_t mode = 0644;
    {
        kytoplat::ErrorKeeper keeper;
        if (kytoplat::KvLoad(path, &lines, &endsWithNewline) != 0) {
            if (KLIBCErrGet() != KYTO_ERR_FILE_NOT_FOUND) {
                keeper.dismiss();
                return -1;
            }
            lines.clear();  // no file yet: it is created
        } else {
            struct stat st;
            if (::stat(path, &st) == 0)
                mode = st.st_mode & 07777;
        }
    }

    int len = snprintf(nullptr, 0, lineFormat, key, value);
    if (len < 0) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::string newLine(static_cast<size_t>(len) + 1, '\0');
    snprintf(&newLine[0], newLine.size(), lineFormat, key, value);
    newLine.resize(static_cast<size_t>(len));
    // Every line ends with a newline, even when the format forgot it, so that the next
    // line is not glued to this one.
    if (newLine.empty() || newLine.back() != '\n')
        newLine.push_back('\n');

    std::string content;
    bool replaced = false;
    for (size_t i = 0; i < lines.size(); ++i) {
        if (!replaced && kytoplat::KvLineMatches(lines[i], key, nullptr)) {
            content += newLine;
            replaced = true;
            continue;
        }
        content += lines[i];
        if (i + 1 < lines.size() || endsWithNewline)
            content.push_back('\n');
    }
    if (!replaced) {
        if (!content.empty() && content.back() != '\n')
            content.push_back('\n');
        content += newLine;
    }

    std::string dir, base;
    SplitPath(path, &dir, &base);
    std::string tmpl = dir + "/." + base + ".XXXXXX";
    kytoplat::UniqueFd fd(::mkostemp(&tmpl[0], O_CLOEXEC));
    if (!fd.valid()) {
        KYTO_FAIL(kytoplat::OpenErrorCode(errno, KYTO_ERR_FILE_WRITE));
        return -1;
    }
    kytoplat::ScopedUnlink cleanup(tmpl);
    if (::fchmod(fd.get(), mode) != 0 || !WriteAll(fd.get(), content) || ::fsync(fd.get()) != 0) {
        KYTO_FAIL(KYTO_ERR_FILE_WRITE);
        return -1;
    }
    if (::close(fd.release()) != 0) {
        KYTO_FAIL(KYTO_ERR_FILE_WRITE);
        return -1;
    }
    if (::rename(tmpl.c_str(), path) != 0) {
        KYTO_FAIL(KYTO_ERR_FILE_WRITE);
        return -1;
    }
    cleanup.release();
    return 1;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCFileExist(const char* path) noexcept try {
    if (path == nullptr) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return 0;
    }
    struct stat st;
    return ::stat(path, &st) == 0 ? 1 : 0;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(0);
}

}  // extern "C"
