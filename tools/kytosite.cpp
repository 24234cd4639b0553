// kytosite: the vendor's site tool.  It makes, fills, signs and checks an update site (a
// static folder any web server serves as it is) with the appliance's own rules: init,
// release, fix, sign, keygen and check.  Errors go to standard error as
// "kytosite: <message>".  See kytosite(1).  This file holds the command table.
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "kytosite_check.h"
#include "kytosite_site.h"

namespace {

using namespace kytosite;

struct Options {
    std::string site, baseUrl, key, passwordFile, pub, sec;
    ReleaseOptions release;
    FixOptions fix;
    CheckOptions check;
};

void AddInitRelease(CLI::App& app, Options& o) {
    CLI::App* init = app.add_subcommand("init", "Make an empty site whose links start with URL");
    init->add_option("SITE", o.site, "The site folder (made when missing)")->required();
    init->add_option("--base-url", o.baseUrl, "The address the site is served at")->required();

    ReleaseOptions& r = o.release;
    CLI::App* rel = app.add_subcommand("release", "Publish a release image and add it to the feed");
    rel->add_option("SITE", r.site, "The site folder")->required();
    rel->add_option("IMAGE", r.image, "The release image")->required()->check(CLI::ExistingFile);
    rel->add_option("--version", r.version, "The release, MAJOR.MINOR-BUILD")->required();
    rel->add_option("--model", r.models, "A model identity the image is for (repeatable)")
        ->required()
        ->allow_extra_args(false);
    rel->add_option("--phase", r.phase, "Build phase (default GM)");
    rel->add_option("--date", r.date, "Build date YYYY/MM/DD (default today)");
    rel->add_option("--requires", r.requirement,
                    "Lowest version it installs over, MAJOR.MINOR-BUILD");
}

void AddFix(CLI::App& app, FixOptions& f) {
    CLI::App* fix = app.add_subcommand("fix", "Publish packages as a small-update fix of a build");
    fix->add_option("SITE", f.site, "The site folder")->required();
    fix->add_option("--build", f.build, "The build the fix is for")
        ->required()
        ->check(CLI::PositiveNumber);
    fix->add_option("--model", f.models, "A model identity (repeatable)")
        ->required()
        ->allow_extra_args(false);
    fix->add_option("--fix", f.fix, "The fix number")->required()->check(CLI::PositiveNumber);
    fix->add_option("--smallupdate", f.smallupdate, "The small-update package")
        ->check(CLI::ExistingFile);
    fix->add_option("--flash", f.flash, "The flash package (asks for a flash update)")
        ->check(CLI::ExistingFile);
    fix->add_flag("--config", f.config, "Ask for a configuration update");
    CLI::Option* reboot = fix->add_flag("--reboot", f.reboot, "The fix needs a reboot");
    CLI::Option* all = fix->add_flag("--restart-all", f.restartAll, "Restart all services");
    // One name per option, so that a package file after it is never taken for a name.
    CLI::Option* svc =
        fix->add_option("--restart-service", f.services, "A service to restart (repeatable)")
            ->allow_extra_args(false);
    CLI::Option* pkg =
        fix->add_option("--restart-package", f.packages, "A package to restart (repeatable)")
            ->allow_extra_args(false);
    reboot->excludes(all)->excludes(svc)->excludes(pkg);
    all->excludes(svc)->excludes(pkg);
    fix->add_option("DEB", f.debs, "Further packages")->check(CLI::ExistingFile);
}

void AddSign(CLI::App& app, Options& o) {
    CLI::App* sign = app.add_subcommand("sign", "Sign every published file of the site");
    sign->add_option("SITE", o.site, "The site folder")->required();
    sign->add_option("--key", o.key, "The secret key")->required()->check(CLI::ExistingFile);
    sign->add_option("--password-file", o.passwordFile, "File whose first line is its password")
        ->check(CLI::ExistingFile);
    CLI::App* keygen = app.add_subcommand("keygen", "Make a signing key pair");
    keygen->add_option("PUBLIC", o.pub, "The public key to write")->required();
    keygen->add_option("SECRET", o.sec, "The secret key to write (mode 0600)")->required();
    keygen->add_option("--password-file", o.passwordFile, "Encrypt it with this file's first line")
        ->check(CLI::ExistingFile);
}

int Run(const std::string& cmd, const Options& o) {
    if (cmd == "init")
        return CmdInit(o.site, o.baseUrl);
    if (cmd == "release")
        return CmdRelease(o.release);
    if (cmd == "fix")
        return CmdFix(o.fix);
    if (cmd == "sign")
        return CmdSign(o.site, o.key, o.passwordFile);
    if (cmd == "keygen")
        return CmdKeygen(o.pub, o.sec, o.passwordFile);
    return RunCheck(o.check);
}

// The exit code of a parse that stopped (--help stops it too).  A first word that names no
// command is left over, and CLI11 would only say that a command is missing.
int ParseFailed(const CLI::App& app, const CLI::ParseError& e) {
    if (e.get_exit_code() == 0)
        return app.exit(e) == 0 ? kExitOk : kExitUsage;  // --help
    const std::vector<std::string> left = app.remaining();
    if (app.get_subcommands().empty() && !left.empty() && left.front().compare(0, 1, "-") != 0)
        return Fail("unknown command '" + left.front() + "' (kytosite --help lists them)",
                    kExitUsage);
    return Fail(e.what(), kExitUsage);
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{
        "kytosite: makes, signs and checks an update site for the appliance.\n"
        "Exit codes: 0 done, 1 refused or failed (check: a problem found), 64 bad command line."};
    app.require_subcommand(1, 1);
    Options o;
    AddInitRelease(app, o);
    AddFix(app, o.fix);
    AddSign(app, o);
    kytosite::AddCheckCommand(app, o.check);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return ParseFailed(app, e);
    }
    return Run(app.get_subcommands().front()->get_name(), o);
}
