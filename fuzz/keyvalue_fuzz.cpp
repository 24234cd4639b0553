// Fuzz target: the platform's key=value reader on arbitrary files.  Input: one byte for
// the caller's buffer size, the key up to the first newline, then the file's bytes.  The
// value read must be what a plain reading of the file's lines gives (first line whose key,
// blanks around it ignored, matches; blanks around the value dropped; one pair of enclosing
// double quotes removed; a line over the platform's limit makes the file unreadable), cut
// to the buffer; and a value written with KLIBCFileSetKeyValue must read back unchanged.
// With the size byte's top bit set, a line of about the limit's length (one of the four
// lengths around it) is appended to the file.
#include <string.h>

#include <string>

#include <kytoplatform/klibc.h>

#include "fuzz_common.h"

namespace {

constexpr const char* kFile = "/tmp/fuzz-keyvalue";

bool Blank(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

// -1: a line is longer than the platform accepts; 0: absent; 1: found (value set).
int ReferenceGet(const std::string& file, const std::string& key, std::string& value) {
    std::string found;
    int result = 0;
    size_t start = 0;
    while (start < file.size()) {
        size_t nl = file.find('\n', start);
        size_t end = nl == std::string::npos ? file.size() : nl;
        if (end - start > KLIBC_KV_MAX_LINE)
            return -1;
        if (result == 0) {
            const std::string line = file.substr(start, end - start);
            size_t b = 0;
            while (b < line.size() && Blank(line[b]))
                ++b;
            size_t eq = line.find('=', b);
            if (b < line.size() && line[b] != '#' && eq != std::string::npos) {
                size_t e = eq;
                while (e > b && Blank(line[e - 1]))
                    --e;
                if (line.compare(b, e - b, key) == 0 && e - b == key.size()) {
                    size_t vb = eq + 1, ve = line.size();
                    while (vb < ve && Blank(line[vb]))
                        ++vb;
                    while (ve > vb && Blank(line[ve - 1]))
                        --ve;
                    if (ve - vb >= 2 && line[vb] == '"' && line[ve - 1] == '"') {
                        ++vb;
                        --ve;
                    }
                    found = line.substr(vb, ve - vb);
                    result = 1;
                }
            }
        }
        start = end + 1;
    }
    value = found;
    return result;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 2)
        return 0;
    const int bufSize = 1 + data[0] % 80;
    std::string rest(reinterpret_cast<const char*>(data + 1), size - 1);
    size_t nl = rest.find('\n');
    if (nl == std::string::npos)
        return 0;
    const std::string key = rest.substr(0, nl);
    std::string file = rest.substr(nl + 1);
    if (data[0] & 0x80)
        file += "\n" + std::string(KLIBC_KV_MAX_LINE - 2 + (data[0] & 3), 'v');
    if (key.empty() || key.find('\0') != std::string::npos)
        return 0;
    kytofuzz::WriteWhole(kFile, file);

    char buf[96];
    memset(buf, 'Z', sizeof buf);
    const int got = KLIBCFileGetKeyValue(kFile, key.c_str(), buf, bufSize, 0);
    std::string value;
    const int expected = ReferenceGet(file, key, value);
    if (expected < 0) {
        KYTO_FUZZ_CHECK(got == -1 && buf[0] == 'Z');  // an unreadable file leaves buf alone
        return 0;
    }
    if (expected == 0) {
        KYTO_FUZZ_CHECK(got == 0 && buf[0] == '\0');
    } else {
        const size_t n =
            value.size() < static_cast<size_t>(bufSize - 1) ? value.size() : bufSize - 1;
        KYTO_FUZZ_CHECK(got == static_cast<int>(n));
        KYTO_FUZZ_CHECK(memcmp(buf, value.data(), n) == 0 && buf[n] == '\0');
    }
    KYTO_FUZZ_CHECK(buf[bufSize] == 'Z');  // nothing written past the caller's buffer

    // A write of a value without a newline reads back exactly, other lines kept.
    const std::string newValue = file.substr(0, file.find_first_of("\n\0", 0, 2)).substr(0, 60);
    if (KLIBCFileSetKeyValue(kFile, key.c_str(), newValue.c_str(), nullptr) == 1) {
        char back[96];
        KYTO_FUZZ_CHECK(KLIBCFileGetKeyValue(kFile, key.c_str(), back, sizeof back, 0) ==
                        static_cast<int>(newValue.size()));
        KYTO_FUZZ_CHECK(newValue == back);
    }
    kytofuzz::CheckDescriptors();
    return 0;
}
