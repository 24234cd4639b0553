#include "version_file.h"

#include <string>
#include <utility>

#include "kyto_paths.h"

namespace kyto {

namespace {

// The description in force: the appliance's own files unless one is lent for a while.
std::string* g_versionFile = nullptr;
std::string* g_infoConfFile = nullptr;

}  // namespace

const char* VersionFile() {
    return g_versionFile ? g_versionFile->c_str() : kVersionFile;
}

const char* InfoConfFile() {
    return g_infoConfFile ? g_infoConfFile->c_str() : kInfoConfFile;
}

ScopedDeviceDescription::ScopedDeviceDescription(std::string versionFile, std::string infoConfFile)
    : versionFile_(std::move(versionFile)),
      infoConfFile_(std::move(infoConfFile)),
      previousVersion_(g_versionFile),
      previousInfoConf_(g_infoConfFile) {
    g_versionFile = &versionFile_;
    g_infoConfFile = &infoConfFile_;
}

ScopedDeviceDescription::~ScopedDeviceDescription() {
    g_versionFile = previousVersion_;
    g_infoConfFile = previousInfoConf_;
}

}  // namespace kyto
