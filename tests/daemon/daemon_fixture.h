// Real processes for the daemon tests: launchers that go through Init(true),
// stand-in daemons that wait for signals, and a system-log recorder.
#ifndef ZEPARELAYD_TESTS_DAEMON_DAEMON_FIXTURE_H
#define ZEPARELAYD_TESTS_DAEMON_DAEMON_FIXTURE_H

#include <sys/types.h>

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "support/test_support.h"

namespace daemontest {

// Lines handed to the system logger while the recorder is installed.
struct SyslogLine {
    int priority;
    std::string message;
};
void StartSyslogRecorder();
void StopSyslogRecorder();
const std::vector<SyslogLine>& SyslogLines();
// True when some recorded line has the priority and contains needle.
bool SyslogHas(int priority, const std::string& needle);

// Runs body in a forked child that ends with _exit(body()), or with exit()
// wherever the library ends it. Returns the raw wait status.
int RunInChild(const std::function<int()>& body);

// Waits for one of our children (daemons are re-parented to the test
// process, a subreaper). Returns the raw wait status, or -1.
int Reap(pid_t pid);

// Reaps every child until none is left; the status of the last one, or -1.
int ReapAll();

// Reads the pid written in a PID file; -1 when missing or unreadable.
pid_t PidInFile(const std::string& path);

// What a stand-in daemon does with SIGUSR1.
// REMOVE deletes the debug file instead of writing it.
enum class DumpMode { ANSWER, IGNORE, REMOVE };

// A forked child that waits for signals with sigwaitinfo and reports every
// signal it gets through a pipe. On SIGUSR1 in ANSWER mode it writes
// {"pid": <pid>, "dumps": <n>} into its debug file. SIGTERM ends it.
class StandInDaemon {
public:
    explicit StandInDaemon(DumpMode mode = DumpMode::ANSWER);
    ~StandInDaemon();
    StandInDaemon(const StandInDaemon&) = delete;
    StandInDaemon& operator=(const StandInDaemon&) = delete;

    pid_t pid() const { return _pid; }
    // Waits for the next reported signal; 0 when the child is gone.
    int NextSignal();
    // True when no signal report is waiting right now.
    bool NothingReported();
    // Ends the child (SIGKILL) and reaps it; idempotent.
    void Stop();

private:
    pid_t _pid = -1;
    int _reports = -1;
};

// The debug file of a daemon with the given pid, below the current root.
std::string DebugFile(pid_t pid);

// Base fixture: private root, syslog recorder, subreaper.
class DaemonTest : public zepatest::RootTest {
protected:
    // False where the kernel interface is refused, as qemu-user does: a
    // daemon child then goes to init instead of to the test.
    bool isSubreaper = false;
    void SetUp() override;
    void TearDown() override;
    // root + "/var/run/zeparelayd.pid"
    std::string DefaultPidFile() const { return root.path("/var/run/zeparelayd.pid"); }
    // Writes the default PID file naming pid.
    void WritePidFile(pid_t pid) const;
    void WriteStatus(const std::string& content) const { root.write("/tmp/.zeparelayd.status", content); }
};

}  // namespace daemontest

// For tests that wait for a daemonised grandchild re-parented to them.
#define ZEPA_SKIP_WITHOUT_SUBREAPER()                                                                  \
    if (!isSubreaper)                                                                                  \
    GTEST_SKIP() << "PR_SET_CHILD_SUBREAPER is refused here (qemu-user refuses it): the daemon child " \
                    "would not be re-parented to the test, which could not wait for it"

#endif
