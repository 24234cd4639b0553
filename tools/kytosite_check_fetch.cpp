// The work folder, the HTTP fetch (libcurl, in-process, MD5 computed while the body is
// written) and the reading of one site file with its signature.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <utility>

#include <curl/curl.h>
#include <openssl/evp.h>

#include <kytoplatform/klibc.h>

#include "kytosite_check_internal.h"

namespace kytosite {
namespace check {

namespace {

struct FileCloser {
    void operator()(FILE* f) const { fclose(f); }
};
using UniqueFile = std::unique_ptr<FILE, FileCloser>;

struct CurlCleanup {
    void operator()(CURL* c) const { curl_easy_cleanup(c); }
};
struct MdFree {
    void operator()(EVP_MD_CTX* c) const { EVP_MD_CTX_free(c); }
};

// Where the body goes: the file, the running MD5 and the byte count.
struct Sink {
    FILE* file;
    EVP_MD_CTX* md5;
    unsigned long long size;
};

size_t WriteBody(char* data, size_t size, size_t count, void* userdata) {
    Sink* sink = static_cast<Sink*>(userdata);
    const size_t len = size * count;
    if (fwrite(data, 1, len, sink->file) != len || EVP_DigestUpdate(sink->md5, data, len) != 1)
        return 0;  // libcurl stops the transfer with a write error
    sink->size += len;
    return len;
}

std::string Hex(const unsigned char* bytes, unsigned int len) {
    static const char digits[] = "0123456789abcdef";
    std::string text;
    for (unsigned int i = 0; i < len; ++i) {
        text += digits[bytes[i] >> 4];
        text += digits[bytes[i] & 15];
    }
    return text;
}

// The verifier's reason with the local copy's path put back as the address it came from.
std::string Published(std::string why, const std::string& path, const std::string& url) {
    for (size_t at = why.find(path); at != std::string::npos; at = why.find(path, at + url.size()))
        why.replace(at, path.size(), url);
    return why;
}

}  // namespace

Fetched Fetch(const std::string& url, const std::string& path, bool followRedirects) {
    Fetched got;
    UniqueFile file(fopen(path.c_str(), "we"));
    std::unique_ptr<CURL, CurlCleanup> curl(curl_easy_init());
    std::unique_ptr<EVP_MD_CTX, MdFree> md5(EVP_MD_CTX_new());
    if (!file || !curl || !md5 || EVP_DigestInit_ex(md5.get(), EVP_md5(), nullptr) != 1) {
        got.error = "cannot prepare the download into " + path + ": " + strerror(errno);
        return got;
    }
    Sink sink{file.get(), md5.get(), 0};
    char errorText[CURL_ERROR_SIZE] = {0};
    curl_easy_setopt(curl.get(), CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl.get(), CURLOPT_WRITEFUNCTION, WriteBody);
    curl_easy_setopt(curl.get(), CURLOPT_WRITEDATA, &sink);
    curl_easy_setopt(curl.get(), CURLOPT_ERRORBUFFER, errorText);
    curl_easy_setopt(curl.get(), CURLOPT_FOLLOWLOCATION, followRedirects ? 1L : 0L);
    curl_easy_setopt(curl.get(), CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl.get(), CURLOPT_CONNECTTIMEOUT, 15L);
    // Like the appliance's wget (--timeout=15): give up on a body that stops coming.
    curl_easy_setopt(curl.get(), CURLOPT_LOW_SPEED_LIMIT, 1L);
    curl_easy_setopt(curl.get(), CURLOPT_LOW_SPEED_TIME, 15L);
    const CURLcode rc = curl_easy_perform(curl.get());
    curl_easy_getinfo(curl.get(), CURLINFO_RESPONSE_CODE, &got.status);
    if (rc != CURLE_OK)
        got.error = errorText[0] ? errorText : curl_easy_strerror(rc);
    else if (fflush(file.get()) != 0)
        got.error = "cannot write " + path + ": " + strerror(errno);
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int len = 0;
    if (EVP_DigestFinal_ex(md5.get(), digest, &len) == 1)
        got.md5 = Hex(digest, len);
    got.size = sink.size;
    return got;
}

bool Site::Get(const std::string& url, bool followRedirects, bool missingIsProblem,
               std::string& path, Fetched& got) {
    path = dir + "/" + std::to_string(++files) + "-" + kytotrust::SignedName(url);
    got = Fetch(url, path, followRedirects);
    if (got.status != 0)
        report.answered = true;
    if (!got.error.empty()) {
        if (got.status == 0 && !report.unreachable) {
            report.unreachable = true;
            report.unreachableWhy = got.error;
        }
        Problem("cannot fetch " + url + ": " + got.error);
        return false;
    }
    if (got.status == 404) {
        if (missingIsProblem)
            Problem("missing file " + url + " (404)");
        return false;
    }
    if (got.status != 200) {
        Problem(url + ": the server answered " + std::to_string(got.status));
        return false;
    }
    Report::File file{url, got.size, -1};
    if (trust) {
        // The signature beside the file; a missing one leaves no file, and the verifier
        // calls the file unsigned.
        const std::string sig = path + ".minisig";
        const Fetched sigGot = Fetch(url + ".minisig", sig, followRedirects);
        if (sigGot.status != 200 || !sigGot.error.empty())
            unlink(sig.c_str());
        std::string why;
        file.signedState =
            kytotrust::VerifyFile(keys, path, sig, kytotrust::SignedName(url), why) ? 1 : 0;
        if (file.signedState == 0)
            Problem(url + ": " + Published(why, path, url));
    }
    report.files.push_back(file);
    return true;
}

bool WriteDevice(const CheckOptions& o, const std::string& dir, std::string& versionFile,
                 std::string& infoFile) {
    versionFile = dir + "/VERSION";
    infoFile = dir + "/kytoinfo.conf";
    std::string major = "0", minor = "0";
    const size_t dot = o.version.find('.');
    if (dot != std::string::npos) {
        major = o.version.substr(0, dot);
        minor = o.version.substr(dot + 1);
    }
    // Build phase and date take no part in any rule; the record reader only needs them.
    const std::pair<const char*, std::string> keys[] = {
        {"majorversion", major},     {"minorversion", minor},
        {"buildphase", "GM"},        {"buildnumber", std::to_string(o.build)},
        {"builddate", "2000/01/01"}, {"smallfixnumber", std::to_string(o.smallfix)},
    };
    for (const auto& kv : keys) {
        if (KLIBCFileSetKeyValue(versionFile.c_str(), kv.first, kv.second.c_str(), nullptr) != 1)
            return false;
    }
    return KLIBCFileSetKeyValue(infoFile.c_str(), "unique", o.model.c_str(), nullptr) == 1;
}

}  // namespace check
}  // namespace kytosite
