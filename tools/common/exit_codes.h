// Exit statuses of zeparelayd and zeparelayctl: one table for both programs,
// so that scripts read the same number the same way whichever program ran.
#ifndef ZEPARELAYD_TOOL_EXIT_CODES_H
#define ZEPARELAYD_TOOL_EXIT_CODES_H

namespace zepatools {

enum ExitCode {
    EXIT_OK = 0,               // "doctor": every check ok
    EXIT_NOT_RUNNING = 1,      // the daemon does not run; "doctor": warnings only
    EXIT_BROKEN_STATUS = 2,    // "status": the status file is broken; "doctor": a check failed
    EXIT_NO_LOOP = 3,          // zeparelayd: signals or event loop could not be set up
    EXIT_NO_PID_FILE = 4,      // zeparelayd: the daemon could not create its PID file
    EXIT_CONFIG = 5,           // the configuration is broken, or not readable or writable
    EXIT_NOT_FOUND = 6,        // no server id, or the service is not relayed
    EXIT_ALREADY_RUNNING = 7,  // zeparelayd: a daemon already runs on the PID file
    EXIT_BUSY = 11,            // another debug query runs, or no dump came
    EXIT_USAGE = 64,           // bad command line (unknown option, missing argument, bad path)
    EXIT_BROKEN = 255,         // a status or debug file is broken; zeparelayd: no start-up word
};

// The table as both programs print it in their --help.
inline const char kExitTable[] =
    "Exit status (zeparelayd and zeparelayctl):\n"
    "    0  done; status: the daemon runs; doctor: every check ok\n"
    "    1  the daemon does not run; doctor: warnings, no failure\n"
    "    2  status: the status file is broken; doctor: at least one check failed\n"
    "    3  zeparelayd: signals or event loop could not be set up\n"
    "    4  zeparelayd: the PID file could not be created\n"
    "    5  the configuration is broken, or cannot be read or written\n"
    "    6  no server id yet, or the service is not relayed\n"
    "    7  zeparelayd: a daemon already runs on the PID file\n"
    "   11  busy: another debug query runs, or the dump did not come\n"
    "   64  bad usage: unknown option, missing argument, bad path\n"
    "  255  a status or debug file is broken; zeparelayd: no start-up word\n";

}  // namespace zepatools

#endif
