// The files that describe this device to the library: the version file
// ("/etc.defaults/VERSION": version, build, small-fix number) and the information file
// ("/etc.defaults/kytoinfo.conf": the model identity), and the one bounded reader of
// version-file keys.  Internal header: not installed.
//
// The library's rules read the device's facts only through VersionFile() and
// InfoConfFile().  On the appliance these are its fixed paths.  A program built in this
// tree that applies the appliance's rules on another machine (the vendor's site check) lends
// the library a description of the device it stands for with ScopedDeviceDescription, so
// that the same code judges a site as that device would, without touching the machine's
// own files.  No caller of the shared library can reach it.
#ifndef KYTOINSTALLCPP_VERSION_FILE_H
#define KYTOINSTALLCPP_VERSION_FILE_H

#include <stddef.h>

#include <string>

#include <kytoplatform/klibc.h>

namespace kyto {

const char* VersionFile();
const char* InfoConfFile();

// Points VersionFile() and InfoConfFile() at the given files while it lives.  Not for
// concurrent use: the library has no threads.
class ScopedDeviceDescription {
  public:
    ScopedDeviceDescription(std::string versionFile, std::string infoConfFile);
    ~ScopedDeviceDescription();
    ScopedDeviceDescription(const ScopedDeviceDescription&) = delete;
    ScopedDeviceDescription& operator=(const ScopedDeviceDescription&) = delete;

  private:
    std::string versionFile_;
    std::string infoConfFile_;
    std::string* previousVersion_;
    std::string* previousInfoConf_;
};

// One key of the version file, read into a zeroed buffer whose width each caller states:
// the widths differ by caller and bound what is read, so they stay visible where the key
// is used.
template <size_t Width>
struct VersionKey {
    static_assert(Width > 1, "a value needs room for at least one character");
    // The value, NUL-terminated; "" when absent or unreadable.
    char text[Width] = {0};
    // What the key=value reader answered: > 0 found, 0 absent, < 0 error (the platform's
    // last error says which).
    int result;

    explicit VersionKey(const char* key)
        : result(KLIBCFileGetKeyValue(VersionFile(), key, text, Width, 0)) {}
};

}  // namespace kyto

#endif
