// Checks a relay configuration file without changing it: the daemon does so
// before it reloads, the control tool before it asks for a reload, and both
// offer it as "check-config". A file the library could only rename to ".bad"
// (or read as no configuration at all) never reaches the library's reload.
#ifndef ZEPARELAYD_TOOL_CONFIG_CHECK_H
#define ZEPARELAYD_TOOL_CONFIG_CHECK_H

#include <string>
#include <vector>

namespace zepatools {

struct ConfigCheck {
    // "FILE:LINE:COLUMN: what is wrong" (or "FILE: what is wrong"), in file order.
    std::vector<std::string> errors;
    // Parts that the daemon skips but that do not stop it (an unknown service).
    std::vector<std::string> warnings;
    bool ok() const { return errors.empty(); }
    // The first error, for one-line reports such as the status file's.
    std::string first() const { return errors.empty() ? std::string() : errors.front(); }
};

// Reads path (a regular file of at most 1 MiB) and checks it.
ConfigCheck CheckConfigFile(const std::string& path);

// "check-config" of both programs: warnings and errors on standard error,
// each after "program: ", "FILE: configuration OK" on standard output.
// Whether the file is usable.
bool ReportConfigCheck(const char* program, const std::string& path);

}  // namespace zepatools

#endif
