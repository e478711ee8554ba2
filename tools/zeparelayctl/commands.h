// The subcommands of zeparelayctl. Each takes its own arguments (without the
// subcommand's name) and the options given anywhere on the command line, and
// returns the process exit status (exit_codes.h).
#ifndef ZEPARELAYD_TOOL_CTL_COMMANDS_H
#define ZEPARELAYD_TOOL_CTL_COMMANDS_H

#include <string>
#include <vector>

#include "exit_codes.h"

namespace zeparelayctl {

using namespace zepatools;

using Args = std::vector<std::string>;

struct Options {
    bool json = false;   // status --json, doctor --json
    bool debug = false;  // status --debug
    int timeoutMs = -1;  // doctor --timeout, -1: its default
};

struct Command {
    const char* name;
    const char* synopsis;
    const char* help;
    int (*run)(const Args& args, const Options& opt);
};

// Table of every subcommand, ended by a row whose name is null.
extern const Command kCommands[];

}  // namespace zeparelayctl

#endif
