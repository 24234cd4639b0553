#include "kytosite_site.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/evp.h>

#include <json/json.h>

#include "child_process.h"
#include "json_members.h"
#include "scoped.h"

namespace kytosite {

namespace {

std::string Errno(const std::string& what) {
    return what + ": " + strerror(errno);
}

// The percentage display of a long copy: on standard error, only on a terminal.
class Progress {
  public:
    Progress(const char* label, off_t total)
        : label_(label), total_(total), on_(label && total > 0 && isatty(2)) {}
    ~Progress() {
        if (on_ && shown_ >= 0)
            fprintf(stderr, "\n");
    }
    void Show(off_t done) {
        if (!on_)
            return;
        const int pct = static_cast<int>(done * 100 / total_);
        if (pct != shown_)
            fprintf(stderr, "\rkytosite: copying %s %3d%%", label_, pct);
        shown_ = pct;
    }

  private:
    const char* label_;
    off_t total_;
    bool on_;
    int shown_ = -1;
};

}  // namespace

int Fail(const std::string& message, int code) {
    fprintf(stderr, "kytosite: %s\n", message.c_str());
    return code;
}

bool SafeName(const std::string& name) {
    if (name.empty() || name == "." || name == "..")
        return false;
    for (char c : name) {
        if (!isalnum(static_cast<unsigned char>(c)) && !strchr("._+-~", c))
            return false;
    }
    return true;
}

bool Exists(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

bool MakeFolders(const std::string& path, std::string& why, std::vector<std::string>* made) {
    for (size_t pos = 1; pos <= path.size(); ++pos) {
        if (pos < path.size() && path[pos] != '/')
            continue;
        const std::string part = path.substr(0, pos);
        if (::mkdir(part.c_str(), 0755) == 0) {
            if (made)
                made->push_back(part);
        } else if (errno != EEXIST) {
            why = Errno("cannot make " + part);
            return false;
        }
    }
    return true;
}

MadeFolders::~MadeFolders() {
    for (auto it = made_.rbegin(); it != made_.rend(); ++it)
        ::rmdir(it->c_str());
}

bool ReadText(const std::string& path, std::string& text, std::string& why) {
    kyto::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        why = Errno("cannot read " + path);
        return false;
    }
    text.clear();
    char buf[65536];
    ssize_t n;
    while ((n = kyto::ReadRetry(fd.get(), buf, sizeof buf)) > 0)
        text.append(buf, static_cast<size_t>(n));
    if (n < 0)
        why = Errno("cannot read " + path);
    return n == 0;
}

bool OpenSite(const std::string& root, Site& site, std::string& why) {
    std::string text;
    Json::Value settings;
    if (!ReadText(root + "/" + kSettingsName, text, why)) {
        why = root + " is not a site (kytosite init makes one): " + why;
        return false;
    }
    if (!kyto::ParseJsonText(text, settings) || kyto::MemberText(settings, "base_url").empty()) {
        why = root + "/" + kSettingsName + " holds no base_url";
        return false;
    }
    site.root = root;
    site.baseUrl = kyto::MemberText(settings, "base_url");
    return true;
}

StagedFile::~StagedFile() {
    if (fd_ >= 0)
        ::close(fd_);
    if (!temp_.empty())
        ::unlink(temp_.c_str());
}

bool StagedFile::Open(const std::string& dest, std::string& why) {
    const size_t slash = dest.rfind('/');
    const std::string folder = slash == std::string::npos ? "." : dest.substr(0, slash);
    const std::string name = slash == std::string::npos ? dest : dest.substr(slash + 1);
    std::string pattern = folder + "/." + name + ".XXXXXX";
    fd_ = ::mkostemp(&pattern[0], O_CLOEXEC);
    if (fd_ < 0) {
        why = Errno("cannot write beside " + dest);
        return false;
    }
    temp_ = pattern;
    dest_ = dest;
    return true;
}

bool StagedFile::Write(const void* data, size_t size, std::string& why) {
    if (!kyto::WriteAll(fd_, data, size)) {
        why = Errno("cannot write " + temp_);
        return false;
    }
    return true;
}

bool StagedFile::Write(const std::string& text, std::string& why) {
    return Write(text.data(), text.size(), why);
}

bool StagedFile::Commit(std::string& why) {
    if (::fsync(fd_) != 0 || ::fchmod(fd_, 0644) != 0 || ::close(fd_) != 0) {
        fd_ = -1;
        why = Errno("cannot write " + temp_);
        return false;
    }
    fd_ = -1;
    if (::rename(temp_.c_str(), dest_.c_str()) != 0) {
        why = Errno("cannot rename " + temp_ + " to " + dest_);
        return false;
    }
    temp_.clear();
    return true;
}

bool WriteAtomically(const std::string& path, const std::string& text, std::string& why) {
    StagedFile f;
    return f.Open(path, why) && f.Write(text, why) && f.Commit(why);
}

bool CopyWithMd5(const std::string& src, StagedFile& dest, std::string& md5, const char* label,
                 std::string& why) {
    kyto::UniqueFd in(::open(src.c_str(), O_RDONLY | O_CLOEXEC));
    struct stat st;
    if (!in.valid() || ::fstat(in.get(), &st) != 0) {
        why = Errno("cannot read " + src);
        return false;
    }
    std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> ctx(EVP_MD_CTX_new(), EVP_MD_CTX_free);
    if (!ctx || EVP_DigestInit_ex(ctx.get(), EVP_md5(), nullptr) != 1) {
        why = "cannot compute an MD5 (OpenSSL)";
        return false;
    }
    Progress progress(label, st.st_size);
    std::vector<char> buf(1 << 20);
    off_t done = 0;
    ssize_t n;
    while ((n = kyto::ReadRetry(in.get(), buf.data(), buf.size())) > 0) {
        if (EVP_DigestUpdate(ctx.get(), buf.data(), static_cast<size_t>(n)) != 1 ||
            !dest.Write(buf.data(), static_cast<size_t>(n), why))
            return false;
        progress.Show(done += n);
    }
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int len = 0;
    if (n < 0 || EVP_DigestFinal_ex(ctx.get(), digest, &len) != 1) {
        why = Errno("cannot read " + src);
        return false;
    }
    static const char kHex[] = "0123456789abcdef";
    md5.clear();
    for (unsigned int i = 0; i < len; ++i)
        md5 += std::string{kHex[digest[i] >> 4], kHex[digest[i] & 15]};
    return true;
}

DeviceScope::~DeviceScope() {
    scope_.reset();
    if (!dir_.empty()) {
        ::unlink((dir_ + "/VERSION").c_str());
        ::unlink((dir_ + "/kytoinfo.conf").c_str());
        ::rmdir(dir_.c_str());
    }
}

bool DeviceScope::Lend(const Device& d, std::string& why) {
    char tmpl[] = "/tmp/kytosite.XXXXXX";
    if (::mkdtemp(tmpl) == nullptr) {
        why = Errno("cannot make a temporary folder");
        return false;
    }
    dir_ = tmpl;
    const std::string version = "majorversion=\"" + d.major + "\"\nminorversion=\"" + d.minor +
                                "\"\nbuildphase=\"GM\"\nbuildnumber=\"" + d.build +
                                "\"\nbuilddate=\"2000/01/01\"\nsmallfixnumber=\"" + d.smallfix +
                                "\"\n";
    if (!WriteAtomically(dir_ + "/VERSION", version, why) ||
        !WriteAtomically(dir_ + "/kytoinfo.conf", "unique=\"" + d.unique + "\"\n", why))
        return false;
    scope_.reset(new kyto::ScopedDeviceDescription(dir_ + "/VERSION", dir_ + "/kytoinfo.conf"));
    return true;
}

bool RunCapture(const std::vector<std::string>& args, std::string& out) {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0)
        return false;
    kyto::UniqueFd readEnd(fds[0]), writeEnd(fds[1]);
    std::vector<char*> argv;
    for (const std::string& a : args)
        argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    kyto::ChildSetup setup;
    setup.program = argv[0];
    setup.argv = argv.data();
    setup.stdoutFd = writeEnd.get();
    kyto::ChildProcess child;
    if (child.Start(setup) != kyto::ChildProcess::kStarted)
        return false;
    writeEnd.reset();
    out.clear();
    char buf[4096];
    ssize_t n;
    while ((n = kyto::ReadRetry(readEnd.get(), buf, sizeof buf)) > 0)
        out.append(buf, static_cast<size_t>(n));
    int status = 0;
    return child.Wait(&status) > 0 && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

}  // namespace kytosite
