// The daemon's process-wide facilities: logging, process control through
// libdaemon, the status readers used by other processes, and three plain C
// entry points for callers that do not use the classes.
#ifndef ZEPARELAYD_DAEMON_H
#define ZEPARELAYD_DAEMON_H

#ifdef __cplusplus

#include <json/value.h>

#include <cstdarg>
#include <string>

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Static members only; never instantiated. Single-threaded by design.
class ZEPARELAYD_API Daemon {
public:
    Daemon() = delete;

    // ---- logging -------------------------------------------------------
    // Highest syslog priority written (3 error ... 7 debug).
    static int _logLevel;
    // Log file chosen by the last SetLogFile; empty means none.
    static std::string _strLogFile;

    static bool IsLogEnable(int level);
    // One line on standard error: ctime text, a blank, the message, "\n".
    // errno is preserved.
    static void Log(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));
    static void LogV(int level, const char* format, va_list args) __attribute__((format(printf, 2, 0)));
    // Opens path write-only (mode 0600 when created) and makes fd refer to it.
    static bool OpenLogFile(const std::string& path, int fd, int flags);
    // Records file and level (a negative level is ignored); once daemonised
    // re-points standard error at once (appending). Always true.
    static bool SetLogFile(const std::string& path, int level);

    // ---- process control -------------------------------------------------
    static std::string _strPidFile;
    static bool _isForked;
    // Declared for the daemon program; the library never reads or writes it.
    static bool _isCreated;

    static bool LibInit();
    static bool SetName(const char* name);
    static bool SetPidFile(const char* path);
    static const char* GetPidFile();
    static bool IsForked();
    static bool Init(bool fork);
    static bool Fork();
    static int InitSignalHandler();
    static int Signal(int sig);
    static int Kill();
    static int Hup();

    // ---- files shared with other processes -----------------------------------
    // Each is resolved under the system root, so a program started with another
    // root (a staging tree, a test) finds the same files as the library does.
    // The relay configuration, "/usr/zepa/etc/zeparelayd/zeparelayd.conf".
    static std::string GetConfPath();
    // The status file the daemon writes and the readers below read.
    static std::string GetStatusPath();
    // The debug dump that the daemon with this process id writes on SIGUSR1.
    static std::string GetDebugPath(int pid);
    // Any absolute appliance path, such as a configured "log_file", under the
    // system root; empty stays empty.
    static std::string ResolvePath(const std::string& absPath);

    // ---- status readers (report through syslog) ----------------------------
    // 0 running, 1 not running, 255 broken status file.
    static int GetStatus(Json::Value& out);
    static bool GetStatus(std::string& serverId, std::string& state, std::string& error,
                          const char* serviceId);
    // 0, 1, 11 (busy or never readable) or 255.
    static int DebugStatus(Json::Value& out);
    static int Status(bool debug);
    // SIGRTMIN+1 to the status file's pid: 0 delivered, 1 not running, 255 broken.
    static int UpdateAlias();

    // Whether pid, read from the status or PID file at path, is the live
    // process that wrote it: 0 alive and started no later than the file was
    // last written (2 s allowed for the boot clock's coarseness); 1 no file,
    // no such process or one we may not signal, or a process started after
    // the file (its pid recycled); 255 a pid of 0 or below, or a file that
    // cannot be trusted: not a regular file (a link), a second hard link,
    // owned by neither root nor the caller, or writable by group or others.
    static int ProbeFilePid(const std::string& path, int pid);
};

}  // namespace Relay
}  // namespace ZEPA

#define ZEPARELAYD_EXTERN_C extern "C"
#else
#define ZEPARELAYD_EXTERN_C
#endif

// Entry points with plain C names, outside any namespace.
ZEPARELAYD_EXTERN_C __attribute__((visibility("default"))) int VLIBRelaydLogStart(const char* logFile);
ZEPARELAYD_EXTERN_C __attribute__((visibility("default"))) int VLIBRelaydLogStop(void);
ZEPARELAYD_EXTERN_C __attribute__((visibility("default"))) int VLIBRelaydGetServerId(const char* serviceId,
                                                                                     char* buf,
                                                                                     unsigned int size);

#endif
