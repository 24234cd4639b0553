/*
 * KytoConf: reader of the appliance's configuration files.
 */
#ifndef KYTOPLATFORM_KYTOCONF_H
#define KYTOPLATFORM_KYTOCONF_H

#ifdef __cplusplus
#include <string>

/* Built with hidden symbols by default: the class is exported. */
#pragma GCC visibility push(default)

class KytoConf {
  public:
    static constexpr const char* kDefaultsPath = "/etc.defaults/kytoinfo.conf";
    static constexpr const char* kInfoPath = "/etc/kytoinfo.conf";

    /* The value of key in /etc.defaults/kytoinfo.conf, or def when absent or unreadable. */
    std::string Def(const std::string& key, const std::string& def);
    /* The value in /etc/kytoinfo.conf when present there, else as Def. */
    std::string Info(const std::string& key, const std::string& def);
};

#pragma GCC visibility pop
#endif

#endif
