// kytosite: what the vendor's site tool's commands share: exit codes and errors, the site
// folder and its settings, files written beside their place and renamed into it, the
// description of a device lent to the library's rules, a program run without a shell, and
// the commands' options and entry points (each command lives in the file of its concern:
// init and release in kytosite_release, fix, sign and keygen in their own files, check in
// kytosite_check).
#ifndef KYTOSITE_SITE_H
#define KYTOSITE_SITE_H

#include <memory>
#include <string>
#include <vector>

#include "version_file.h"

namespace kytosite {

constexpr int kExitOk = 0;
constexpr int kExitFailed = 1;
constexpr int kExitUsage = 64;

// Prints "kytosite: <message>" on standard error; returns code.
int Fail(const std::string& message, int code = kExitFailed);

// ---- The site ----------------------------------------------------------------------------

constexpr const char* kSettingsName = "kytosite.json";
constexpr const char* kFeedRel = "autoupdate/genRSS.php";

struct Site {
    std::string root;     // the folder, as given
    std::string baseUrl;  // links start with it (no trailing "/")
    std::string Path(const std::string& rel) const { return root + "/" + rel; }
    std::string Url(const std::string& rel) const { return baseUrl + "/" + rel; }
};
// Reads the site's settings (written by init).
bool OpenSite(const std::string& root, Site& site, std::string& why);
// A name that may stand in a path, a link and a feed line as it is: letters, digits and
// ". _ + - ~", not "." or "..".
bool SafeName(const std::string& name);
// A base for owners of something on disk: never copied, so that one owner cleans up.
struct NonCopyable {
    NonCopyable() = default;
    NonCopyable(const NonCopyable&) = delete;
    NonCopyable& operator=(const NonCopyable&) = delete;
};

// Creates the folder and its parents (mode 0755), naming those it made in *made.
bool MakeFolders(const std::string& path, std::string& why,
                 std::vector<std::string>* made = nullptr);
// Folders made for a command, removed again (when empty) unless the command kept them.
class MadeFolders : NonCopyable {
  public:
    ~MadeFolders();
    bool Make(const std::string& path, std::string& why) { return MakeFolders(path, why, &made_); }
    void Keep() { made_.clear(); }

  private:
    std::vector<std::string> made_;
};
bool ReadText(const std::string& path, std::string& text, std::string& why);
bool Exists(const std::string& path);

// A new file written beside dest (a hidden temporary file in the same folder) and renamed
// over dest by Commit; removed when it goes away uncommitted.
class StagedFile : NonCopyable {
  public:
    ~StagedFile();

    bool Open(const std::string& dest, std::string& why);
    bool Write(const std::string& text, std::string& why);
    bool Write(const void* data, size_t size, std::string& why);
    // Flushes to disk, makes the file 0644 and renames it into place.
    bool Commit(std::string& why);
    const std::string& TempPath() const { return temp_; }
    const std::string& Dest() const { return dest_; }

  private:
    int fd_ = -1;
    std::string temp_, dest_;
};
// Writes text to path (beside it, then renamed).
bool WriteAtomically(const std::string& path, const std::string& text, std::string& why);
// Copies src into dest, streamed, with its MD5 as lower-case hex.  With label set and
// standard error a terminal, shows the percentage copied.
bool CopyWithMd5(const std::string& src, StagedFile& dest, std::string& md5, const char* label,
                 std::string& why);

// ---- The device the library's rules judge for --------------------------------------------

struct Device {
    std::string major, minor, build, smallfix, unique;
};
// Lends the library a version file and an information file describing the device (in a
// private temporary folder, removed with the scope); the library's rules then read those
// instead of the machine's own files.
class DeviceScope {
  public:
    DeviceScope() = default;
    ~DeviceScope();
    DeviceScope(const DeviceScope&) = delete;
    DeviceScope& operator=(const DeviceScope&) = delete;
    bool Lend(const Device& device, std::string& why);
    // The private folder, for files the rules are to read.
    const std::string& Folder() const { return dir_; }

  private:
    std::string dir_;
    std::unique_ptr<kyto::ScopedDeviceDescription> scope_;
};

// Runs argv[0] (no shell) with standard output captured; true when it exited with 0.
bool RunCapture(const std::vector<std::string>& argv, std::string& out);

// ---- The commands ------------------------------------------------------------------------

struct ReleaseOptions {
    std::string site, image, version, phase = "GM", date, requirement;
    std::vector<std::string> models;
};
struct FixOptions {
    std::string site, smallupdate, flash;
    int build = 0, fix = 0;
    bool config = false, reboot = false, restartAll = false;
    std::vector<std::string> models, services, packages, debs;
};

int CmdInit(const std::string& site, const std::string& baseUrl);
int CmdRelease(const ReleaseOptions& o);
int CmdFix(const FixOptions& o);
int CmdSign(const std::string& site, const std::string& key, const std::string& passwordFile);
int CmdKeygen(const std::string& pub, const std::string& sec, const std::string& passwordFile);

}  // namespace kytosite

#endif
