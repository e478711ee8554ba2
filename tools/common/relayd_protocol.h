// What zeparelayd and the tools that control it agree on, in one place both
// include: which signal asks the daemon for what, the signals the daemon holds
// back until its loop can answer them, the member names of its status file,
// and which process counts as the daemon.
#ifndef ZEPARELAYD_TOOL_RELAYD_PROTOCOL_H
#define ZEPARELAYD_TOOL_RELAYD_PROTOCOL_H

#include <signal.h>
#include <sys/types.h>

#include <string>
#include <vector>

namespace zepatools {

// ---- signals ------------------------------------------------------------------

// What a signal asks of the daemon.
enum class DaemonSignal {
    OTHER,         // handled only so that its default action cannot end the daemon
    STOP,          // SIGTERM, SIGINT, SIGQUIT: final status, PID file removed
    RELOAD,        // SIGHUP: re-read the configuration
    DEBUG_DUMP,    // SIGUSR1: write the debug dump
    UPDATE_ALIAS,  // SIGRTMIN+1: one alias exchange now
    REOPEN_LOG,    // SIGRTMIN+2: reopen the log file (after rotation), nothing else
    TUNNEL_UP,     // SIGUSR2: the tunnel's up script has run
    CHILD_EXITED,  // SIGCHLD
};

// The signal to send for a request (SIGTERM for STOP); 0 for OTHER. The
// real-time ones are computed at run time: SIGRTMIN is no constant.
int SignalOf(DaemonSignal meaning);

// What a signal the daemon received asks of it.
DaemonSignal MeaningOf(int sig);

// Every signal the daemon handles: those the library's
// Daemon::InitSignalHandler routes through its pipe, and REOPEN_LOG.
std::vector<int> DaemonSignals();

// The same as a set. The daemon blocks it from before its PID file exists
// (tools signal as soon as it does) until its loop can answer.
sigset_t DaemonSignalSet();

// ---- the status file ------------------------------------------------------------

// Member names of the status file. The first five are also what the library's
// status readers (Daemon::GetStatus) look for.
namespace status_key {
inline constexpr char kPid[] = "pid";                   // int: the daemon that wrote the file
inline constexpr char kState[] = "state";               // int: RELAYD_STATE
inline constexpr char kError[] = "error";               // int: RELAYD_RET
inline constexpr char kServerId[] = "serverID";         // string
inline constexpr char kService[] = "service";           // array of the relayed services' sections
inline constexpr char kServiceId[] = "id";              // string, in each element of kService
inline constexpr char kAlias[] = "alias";               // string: the configured alias
inline constexpr char kAliasStatus[] = "alias_status";  // string: the alias status word
inline constexpr char kConfigError[] = "config_error";  // string, only after a refused reload
inline constexpr char kConnect[] = "connect";           // "direct", "tunnel" or empty
inline constexpr char kTunnel[] = "tunnel";             // object, once a tunnel was asked for
// Unix seconds: when the registration and the alias results came, when the
// next attempt of each is due (null when none is planned).
inline constexpr char kRegistrationAt[] = "registration_at";
inline constexpr char kAliasAt[] = "alias_at";
inline constexpr char kRegistrationRetryAt[] = "registration_retry_at";
inline constexpr char kAliasRetryAt[] = "alias_retry_at";

// Members of kTunnel: the tunnel section in its full form (Tunnel::Write)
// and what the daemon adds.
inline constexpr char kTunnelStatus[] = "status";         // the tunnel status word ("READY", ...)
inline constexpr char kTunnelRelayIp[] = "relay_ip";      // string
inline constexpr char kTunnelRelayUser[] = "relay_user";  // string
inline constexpr char kTunnelPid[] = "pid";               // int: the openvpn child, -1 when none
inline constexpr char kTunnelPeerIp[] = "peer_ip";        // string: empty while not carrying traffic
inline constexpr char kTunnelFailures[] = "failures";     // int: failed starts in a row
inline constexpr char kTunnelStarting[] = "starting";     // string: the protocol of a start under way
}  // namespace status_key

// ---- the daemon's process -----------------------------------------------------

// Which process a signal of ours may reach: the one named in the PID file,
// and only while it is the process that wrote the file (Daemon::ProbeFilePid).
// A PID file left behind by a crash can name any process once its number is
// reused.
struct PidFileState {
    pid_t pid = -1;      // the running daemon, or -1
    bool stale = false;  // a PID file exists but names no daemon of ours
};

// The process id written in a PID file; -1 when the file is missing,
// unreadable or holds no positive number.
pid_t ReadPidFile(const std::string& path);

// The daemon that the library's PID file names (Daemon::GetPidFile).
PidFileState DaemonFromPidFile();

// Whether pid is that daemon.
bool IsRunningDaemon(pid_t pid);

}  // namespace zepatools

#endif
