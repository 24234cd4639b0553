// KytoConf: values of the appliance configuration files.
#include <string>

#include <kytoplatform/kytoconf.h>

#include "platform_internal.h"

namespace {

// Value of key in path; false when absent or the file cannot be read.  The caller's last
// error is left alone: a missing setting is not a failure here.
bool Lookup(const char* path, const std::string& key, std::string* value) {
    kytoplat::ErrorKeeper keeper;
    return !key.empty() && kytoplat::KvGet(path, key, value) == 1;
}

}  // namespace

std::string KytoConf::Def(const std::string& key, const std::string& def) {
    std::string value;
    return Lookup(kDefaultsPath, key, &value) ? value : def;
}

std::string KytoConf::Info(const std::string& key, const std::string& def) {
    std::string value;
    return Lookup(kInfoPath, key, &value) ? value : Def(key, def);
}
