// Test support: a private system root per test, standard-error capture and
// small file helpers. Every test owns its root and removes it afterwards.
#ifndef ZEPARELAYD_TESTS_SUPPORT_TEST_SUPPORT_H
#define ZEPARELAYD_TESTS_SUPPORT_TEST_SUPPORT_H

#include <gtest/gtest.h>
#include <json/value.h>
#include <sys/types.h>

#include <string>
#include <vector>

namespace zepatest {

// A fresh temporary directory made the process's system root; removed (and
// the root reset to "/") on destruction.
class TempRoot {
public:
    TempRoot();
    ~TempRoot();
    TempRoot(const TempRoot&) = delete;
    TempRoot& operator=(const TempRoot&) = delete;

    const std::string& dir() const { return _dir; }
    // dir() + absPath ("/etc/zepainfo.conf" -> "<dir>/etc/zepainfo.conf").
    std::string path(const std::string& absPath) const;
    // Writes a file below the root, creating parent folders.
    void write(const std::string& absPath, const std::string& content, mode_t mode = 0644) const;
    std::string read(const std::string& absPath) const;
    bool exists(const std::string& absPath) const;
    void mkdir(const std::string& absPath) const;

private:
    std::string _dir;
};

// Captures everything written to descriptor 2 between construction and stop().
class StderrCapture {
public:
    StderrCapture();
    ~StderrCapture();
    std::string stop();

private:
    int _saved;
    std::string _file;
    bool _stopped;
};

// Captures descriptor 1 likewise.
class StdoutCapture {
public:
    StdoutCapture();
    ~StdoutCapture();
    std::string stop();

private:
    int _saved;
    std::string _file;
    bool _stopped;
};

// Splits captured log output into messages with the 24-character time stamp
// and its blank removed.
std::vector<std::string> LogMessages(const std::string& captured);
// True when some message of the captured log contains needle.
bool LogContains(const std::string& captured, const std::string& needle);

// Plain file helpers on real paths.
std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& content, mode_t mode = 0644);
bool FileExists(const std::string& path);
// Sets the modification time of path (not following a link) seconds into the past.
bool SetAge(const std::string& path, int seconds);
// Names in a folder, one per line.
std::string ListDir(const std::string& dir);
// The full path of a program found on PATH; empty when there is none.
std::string FindProgram(const std::string& name);
// Runs a program, waits for it and gives its exit status (-1 when it did not
// exit normally); its standard output goes to out when given.
int RunProgram(const std::vector<std::string>& args, std::string* out = nullptr, std::string* err = nullptr);
// How a program run under RunBounded ended.
struct BoundedRun {
    int status = -1;        // exit status, -1 when it did not exit normally
    int signal = 0;         // the signal that ended it, 0 when none did
    bool timedOut = false;  // still running at the time limit (then killed)
    long maxRssKb = 0;      // its peak resident memory
};
// RunProgram for programs that may hang or die: killed after timeoutMs
// (waited for without limit when negative). Standard error is captured only
// when err is given.
BoundedRun RunBounded(const std::vector<std::string>& args, int timeoutMs, std::string* out = nullptr,
                      std::string* err = nullptr);
// Peak resident memory (VmHWM) of a live process in KiB, -1 when unreadable.
long PeakMemoryKb(pid_t pid);
void MakeDirs(const std::string& path);
mode_t FileMode(const std::string& path);
// Names in path's folder that start with path's name + ".tmp.": temporary
// files of writes to path.
std::vector<std::string> TemporariesOf(const std::string& path);
// Puts what a hostile local user might plant at path, after removing what
// stood there: "fifo", "folder" (not empty), "device" (a link to /dev/zero),
// "huge" (a sparse 1 GiB file), "nested" (a JSON object nested 1,001 deep),
// "second-link" (a second name of path + ".elsewhere"), and, as root only,
// "foreign-folder" (a tree with a link to "/" in it) and "foreign-file" owned by
// user 65534.
// False for an unknown kind or a failed call.
bool PlantHostile(const std::string& kind, const std::string& path);
// rm -rf path and path + ".bad".
void RemoveWithBad(const std::string& path);
Json::Value ParseJson(const std::string& text);
std::string ToJson(const Json::Value& value);

// Base fixture: a private root and the library's logging statics at their
// initial values.
class RootTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;
    TempRoot root;
};

}  // namespace zepatest

#endif
