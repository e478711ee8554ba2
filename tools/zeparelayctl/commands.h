// The subcommands of zeparelayctl. Each takes its own arguments (without the
// subcommand's name) and returns the process exit status.
#ifndef ZEPARELAYD_TOOL_CTL_COMMANDS_H
#define ZEPARELAYD_TOOL_CTL_COMMANDS_H

#include <string>
#include <vector>

namespace zeparelayctl {

// Exit statuses shared by every subcommand.
enum Exit {
    EXIT_OK = 0,
    EXIT_NOT_RUNNING = 1,    // the daemon does not run
    EXIT_BROKEN_STATUS = 2,  // the status file is broken ("status")
    EXIT_CONFIG = 5,         // the configuration could not be read or written
    EXIT_NOT_FOUND = 6,      // no server id, or the service is not relayed ("server-id")
    EXIT_BUSY = 11,          // another debug query runs, or no dump came ("status --debug")
    EXIT_USAGE = 64,         // bad command line
    EXIT_BROKEN = 255,       // the status or debug file is broken
};

using Args = std::vector<std::string>;

struct Command {
    const char* name;
    const char* synopsis;
    const char* help;
    int (*run)(const Args& args);
};

// Table of every subcommand, ended by a row whose name is null.
extern const Command kCommands[];

}  // namespace zeparelayctl

#endif
