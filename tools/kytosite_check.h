// kytosite check: reads an update site over HTTP exactly as an appliance of a given model,
// build and small-fix level would, with the library's own readers, and reports what that
// appliance would be offered, every file it would fetch with its size, and each problem.
#ifndef KYTOSITE_CHECK_H
#define KYTOSITE_CHECK_H

#include <string>

#include <CLI/CLI.hpp>

namespace kytosite {

struct CheckOptions {
    std::string url;       // the site's base URL (what `kytosite init --base-url` was given)
    std::string model;     // the appliance's model identity ("unique")
    int build = 0;         // its running build number
    int smallfix = 0;      // its installed small-fix number
    std::string version;   // its MAJOR.MINOR
    std::string trustDir;  // a folder of *.pub keys: signatures are checked when set
    bool json = false;     // one JSON document on standard output instead of text
};

// Adds the "check" command and its options to app; main runs RunCheck when it was given.
CLI::App* AddCheckCommand(CLI::App& app, CheckOptions& options);
// 0 when the appliance would find a consistent update or none, non-zero otherwise.
int RunCheck(const CheckOptions& options);

}  // namespace kytosite

#endif
