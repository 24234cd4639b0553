// kytosite: builds, signs and checks an update site.  Minimal command table with the check
// command only, so that it can be built and tested on its own.
#include <CLI/CLI.hpp>

#include "kytosite_check.h"

int main(int argc, char** argv) {
    CLI::App app{"kytosite: builds, signs and checks an update site"};
    app.require_subcommand(1, 1);
    kytosite::CheckOptions check;
    CLI::App* checkCommand = kytosite::AddCheckCommand(app, check);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return app.exit(e) == 0 ? 0 : 64;
    }
    return checkCommand->parsed() ? kytosite::RunCheck(check) : 64;
}
