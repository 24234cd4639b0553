// kytoupdate: the program that drives updates of the appliance through libkytoinstallcpp,
// for an administrator's shell, the interface's back end (status --json, cancel) and the
// scheduled auto-update job (auto).  Standard output carries only what a script reads;
// notes and errors go to standard error.  See kytoupdate(1) for commands and exit codes.
// This file holds the command table; each command lives in the file of its concern (see
// kytoupdate_common.h).
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "kytoupdate_common.h"

namespace {

using namespace kytoupdate;

// The options of every command, filled by the parse.
struct Options {
    bool json = false, watch = false, planJson = false;
    double interval = 1.0;
    std::string action, archive;
};

void AddCommands(CLI::App& app, Options& o) {
    app.add_subcommand("check", "Ask for an update of either kind; print its kind and version");
    app.add_subcommand("download", "Check, then download the update found, showing progress");
    CLI::App* status =
        app.add_subcommand("status", "Download status of both kinds and the apply stage");
    status->add_flag("--json", o.json, "Print one JSON object (one per change with --watch)");
    status->add_flag("--watch", o.watch, "Print again at every change until interrupted");
    status->add_option("--interval", o.interval, "Seconds between two looks with --watch")
        ->check(CLI::Range(0.1, 3600.0));
    app.add_subcommand("cancel", "Stop a running download (started by any process)");
    app.add_subcommand("apply", "Stop the services, apply the downloaded small update, start them");
    app.add_subcommand("services", "Stop or start the services the downloaded small update touches")
        ->add_option("ACTION", o.action, "stop or start")
        ->required()
        ->check(CLI::IsMember({"stop", "start"}));
    app.add_subcommand("import", "Import a local small-update archive for apply")
        ->add_option("ARCHIVE", o.archive,
                     "Patch archive (tar) holding the patch list and packages")
        ->required()
        ->check(CLI::ExistingFile);
    app.add_subcommand("plan", "Show what a small update would download, install and restart")
        ->add_flag("--json", o.planJson, "Print one JSON object");
    app.add_subcommand("auto", "The auto-update job: check, download, apply a small update");
}

int Run(const std::string& cmd, const Options& o) {
    if (cmd == "check")
        return CmdCheck();
    if (cmd == "download")
        return CmdDownload();
    if (cmd == "status")
        return CmdStatus(o.json, o.watch, o.interval);
    if (cmd == "cancel")
        return CmdCancel();
    if (cmd == "apply")
        return CmdApply();
    if (cmd == "services")
        return CmdServices(o.action);
    if (cmd == "import")
        return CmdImport(o.archive);
    if (cmd == "plan")
        return CmdPlan(o.planJson);
    return CmdAuto();
}

// The exit code of a parse that stopped (--help and --version stop it too).  A first word
// that names no command is left over, and CLI11 would only say that a command is missing.
int ParseFailed(const CLI::App& app, const CLI::ParseError& e) {
    const std::vector<std::string> left = app.remaining();
    if (dynamic_cast<const CLI::RequiredError*>(&e) && app.get_subcommands().empty() &&
        !left.empty() && left.front().compare(0, 1, "-") != 0)
        return Fail("unknown command '" + left.front() + "' (kytoupdate --help lists them)",
                    kExitUsage);
    return app.exit(e) == 0 ? kExitOk : kExitUsage;
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{
        "kytoupdate: finds, downloads and installs updates of the appliance.\n"
        "Exit codes: 0 done (check: update available), 1 failed, 2 update server "
        "not reachable,\n3 up to date, 4 download stopped, 5 refused: not signed by a "
        "trusted key,\n64 bad command line.\nWith keys in /etc/kytoupdate/trusted.d/*.pub "
        "only signed updates are downloaded,\napplied or imported."};
    app.require_subcommand(1, 1);
    app.set_version_flag("--version", "kytoupdate 0.1.0");
    Options o;
    AddCommands(app, o);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return ParseFailed(app, e);
    }

    // The library runs some programs by relative names that it expects to resolve from the
    // root folder; archive paths are made absolute first.
    if (!o.archive.empty()) {
        char real[PATH_MAX];
        if (realpath(o.archive.c_str(), real) == nullptr)
            return Fail("cannot find " + o.archive);
        o.archive = real;
    }
    if (chdir("/") != 0)
        return Fail("cannot change to /");
    return Run(app.get_subcommands().front()->get_name(), o);
}
