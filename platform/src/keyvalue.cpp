// key=value files: reading, atomic in-place update, existence check.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>
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

namespace {

// Opens an existing file that is not a folder for reading and gives back its status.
UniqueFd OpenForReading(const char* path, struct stat* st) {
    UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        KYTO_FAIL(OpenErrorCode(errno, KYTO_ERR_FILE_OPEN));
        return fd;
    }
    if (::fstat(fd.get(), st) != 0 || S_ISDIR(st->st_mode)) {
        KYTO_FAIL(KYTO_ERR_FILE_OPEN);
        fd.reset();
    }
    return fd;
}

// Whether [line, line + len) is a key=value line for key; if so, [*value, *value +
// *valueLen) is its value with the blanks around it and one pair of surrounding double
// quotes removed.  Works on the bytes as they are: a line may hold NUL bytes.
bool LineMatches(const char* line, size_t len, const char* key, size_t keyLen, const char** value,
                 size_t* valueLen) {
    size_t b = 0;
    while (b < len && IsBlank(line[b]))
        ++b;
    if (b == len || line[b] == '#')
        return false;
    const char* eqp = static_cast<const char*>(memchr(line + b, '=', len - b));
    if (eqp == nullptr)
        return false;
    size_t eq = static_cast<size_t>(eqp - line);
    size_t e = eq;
    while (e > b && IsBlank(line[e - 1]))
        --e;
    if (e - b != keyLen || memcmp(line + b, key, keyLen) != 0)
        return false;
    size_t vb = eq + 1;
    size_t ve = len;
    while (vb < ve && IsBlank(line[vb]))
        ++vb;
    while (ve > vb && IsBlank(line[ve - 1]))
        --ve;
    if (ve - vb >= 2 && line[vb] == '"' && line[ve - 1] == '"') {
        ++vb;
        --ve;
    }
    *value = line + vb;
    *valueLen = ve - vb;
    return true;
}

// Looks key up in the file at path, with the same answers as loading every line with
// KvLoad and taking the first match (a line over the limit or a failed read anywhere in
// the file fails the whole lookup), but without building the lines: status pollers call
// this several times a second.  A small file (every status file) is read into a stack
// buffer with one read and parsed in place; a larger one streams through a buffer with
// room for the longest allowed line.  deliver(value, length) is called once, for a found
// key, when the whole file has been read.  1 found, 0 absent, -1 error (last error set).
template <typename Deliver>
int KvLookup(const char* path, const char* key, size_t keyLen, Deliver&& deliver) {
    struct stat st;
    UniqueFd fd = OpenForReading(path, &st);
    if (!fd.valid())
        return -1;
    // A regular file whose reported size has been read in full ends at the first short
    // read: no extra read to see the end.  Other files (pipes, /proc files that report
    // a size of 0) are read until read says the end.
    const bool sizeKnown = S_ISREG(st.st_mode) && st.st_size > 0;
    const unsigned long long expected = static_cast<unsigned long long>(st.st_size);
    unsigned long long total = 0;

    char small[8192];
    std::unique_ptr<char[]> large;
    constexpr size_t kLargeSize = KLIBC_KV_MAX_LINE + 1 + 65536;
    char* buf = small;
    size_t cap = sizeof small;
    size_t start = 0;  // beginning of the line not yet complete
    size_t fill = 0;   // bytes in buf

    bool found = false;
    const char* value = nullptr;
    size_t valueLen = 0;
    bool valueInLarge = false;  // the large buffer is reused: the value is saved first
    std::string saved;

    for (;;) {
        if (fill == cap) {
            // Full: keep only the incomplete line, in the large buffer.
            if (valueInLarge) {
                saved.assign(value, valueLen);
                value = saved.data();
                valueInLarge = false;
            }
            if (!large) {
                large.reset(new char[kLargeSize]);
                memcpy(large.get(), buf + start, fill - start);
            } else {
                memmove(large.get(), buf + start, fill - start);
            }
            buf = large.get();
            cap = kLargeSize;
            fill -= start;
            start = 0;
        }
        const size_t asked = cap - fill;
        ssize_t n = ReadRetry(fd.get(), buf + fill, asked);
        if (n < 0) {
            KYTO_FAIL(KYTO_ERR_FILE_READ);
            return -1;
        }
        if (n == 0)
            break;
        size_t scan = fill;
        fill += static_cast<size_t>(n);
        total += static_cast<unsigned long long>(n);
        while (const char* nl = static_cast<const char*>(memchr(buf + scan, '\n', fill - scan))) {
            size_t end = static_cast<size_t>(nl - buf);
            if (end - start > KLIBC_KV_MAX_LINE) {
                KYTO_FAIL(KYTO_ERR_LINE_TOO_LONG);
                return -1;
            }
            if (!found) {
                found = LineMatches(buf + start, end - start, key, keyLen, &value, &valueLen);
                valueInLarge = found && buf == large.get();
            }
            start = scan = end + 1;
        }
        if (fill - start > KLIBC_KV_MAX_LINE) {
            KYTO_FAIL(KYTO_ERR_LINE_TOO_LONG);
            return -1;
        }
        if (sizeKnown && static_cast<size_t>(n) < asked && total >= expected)
            break;
    }
    // The last line may lack its newline.
    if (!found && fill > start)
        found = LineMatches(buf + start, fill - start, key, keyLen, &value, &valueLen);
    if (!found)
        return 0;
    deliver(value, valueLen);
    return 1;
}

}  // namespace

UniqueFd OpenFileForReading(const char* path) {
    struct stat st;
    return OpenForReading(path, &st);
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
    const char* v;
    size_t n;
    if (!LineMatches(line.data(), line.size(), key.data(), key.size(), &v, &n))
        return false;
    if (value)
        value->assign(v, n);
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
    return KvLookup(path, key.data(), key.size(),
                    [value](const char* v, size_t n) { value->assign(v, n); });
}

namespace {

// ---- Steps of KLIBCFileSetKeyValue ----

bool ValidSetArguments(const char* path, const char* key, const char* value,
                       const char* lineFormat) {
    return path != nullptr && *path != '\0' && key != nullptr && *key != '\0' && value != nullptr &&
           key[0] != '#' && !IsBlank(key[0]) && !IsBlank(key[strlen(key) - 1]) &&
           strpbrk(key, "=\n") == nullptr && strchr(value, '\n') == nullptr &&
           ValidLineFormat(lineFormat);
}

// The file's lines and mode; a missing file is an empty one, created with 0644.  False
// (the platform error set) when it exists but cannot be read.
bool LoadForRewrite(const char* path, std::vector<std::string>* lines, bool* endsWithNewline,
                    mode_t* mode) {
    ErrorKeeper keeper;
    if (KvLoad(path, lines, endsWithNewline) != 0) {
        if (KLIBCErrGet() != KYTO_ERR_FILE_NOT_FOUND) {
            keeper.dismiss();
            return false;
        }
        lines->clear();  // no file yet: it is created
        return true;
    }
    struct stat st;
    if (::stat(path, &st) == 0)
        *mode = st.st_mode & 07777;
    return true;
}

// The line lineFormat makes of key and value.  Every line ends with a newline, even when
// the format forgot it, so that the next line is not glued to this one.
bool FormatLine(const char* lineFormat, const char* key, const char* value, std::string* out) {
    int len = snprintf(nullptr, 0, lineFormat, key, value);
    if (len < 0)
        return false;
    std::string line(static_cast<size_t>(len) + 1, '\0');
    snprintf(&line[0], line.size(), lineFormat, key, value);
    line.resize(static_cast<size_t>(len));
    if (line.empty() || line.back() != '\n')
        line.push_back('\n');
    *out = std::move(line);
    return true;
}

// The new content: the first line of key replaced by newLine, or newLine appended.
std::string ReplaceOrAppend(const std::vector<std::string>& lines, bool endsWithNewline,
                            const std::string& key, const std::string& newLine) {
    std::string content;
    bool replaced = false;
    for (size_t i = 0; i < lines.size(); ++i) {
        if (!replaced && KvLineMatches(lines[i], key, nullptr)) {
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
    return content;
}

// Writes content to a temporary file beside path (synced, with mode) and renames it over
// path.  False, with the platform error set, when any step fails.
bool ReplaceFile(const char* path, const std::string& content, mode_t mode) {
    std::string dir, base;
    SplitPath(path, &dir, &base);
    std::string tmpl = dir + "/." + base + ".XXXXXX";
    UniqueFd fd(::mkostemp(&tmpl[0], O_CLOEXEC));
    if (!fd.valid()) {
        KYTO_FAIL(OpenErrorCode(errno, KYTO_ERR_FILE_WRITE));
        return false;
    }
    ScopedUnlink cleanup(tmpl);
    if (::fchmod(fd.get(), mode) != 0 || !kyto::WriteAll(fd.get(), content) ||
        ::fsync(fd.get()) != 0 || ::close(fd.release()) != 0 || ::rename(tmpl.c_str(), path) != 0) {
        KYTO_FAIL(KYTO_ERR_FILE_WRITE);
        return false;
    }
    cleanup.release();
    return true;
}

}  // namespace

}  // namespace kytoplat

extern "C" {

int KLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int flags) noexcept
    try {
    if (path == nullptr || *path == '\0' || key == nullptr || *key == '\0' || buf == nullptr ||
        size < 1 || flags != 0) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    // The value goes straight from the read buffer into the caller's, cut to its size.
    int copied = 0;
    int rc = kytoplat::KvLookup(path, key, strlen(key), [&](const char* v, size_t n) {
        if (n > static_cast<size_t>(size - 1))
            n = static_cast<size_t>(size - 1);
        memcpy(buf, v, n);
        buf[n] = '\0';
        copied = static_cast<int>(n);
    });
    if (rc < 0)
        return -1;
    if (rc == 0) {
        buf[0] = '\0';
        return 0;
    }
    return copied;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCFileSetKeyValue(const char* path, const char* key, const char* value,
                         const char* lineFormat) noexcept try {
    if (lineFormat == nullptr)
        lineFormat = kDefaultLineFormat;
    if (!kytoplat::ValidSetArguments(path, key, value, lineFormat)) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::vector<std::string> lines;
    bool endsWithNewline = true;
    mode_t mode = 0644;
    if (!kytoplat::LoadForRewrite(path, &lines, &endsWithNewline, &mode))
        return -1;
    std::string newLine;
    if (!kytoplat::FormatLine(lineFormat, key, value, &newLine)) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    const std::string content = kytoplat::ReplaceOrAppend(lines, endsWithNewline, key, newLine);
    return kytoplat::ReplaceFile(path, content, mode) ? 1 : -1;
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
