// Running the project's programs from tests.
#include <dirent.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <thread>

#include "support/test_support.h"

namespace zepatest {

int RunProgram(const std::vector<std::string>& args, std::string* out, std::string* err) {
    return RunBounded(args, -1, out, err).status;
}

BoundedRun RunBounded(const std::vector<std::string>& args, int timeoutMs, std::string* out,
                      std::string* err) {
    BoundedRun run;
    char tmpl[] = "/tmp/zepa_run_outXXXXXX";
    char errTmpl[] = "/tmp/zepa_run_errXXXXXX";
    const int fd = mkstemp(tmpl);
    const int errFd = fd < 0 ? -1 : mkstemp(errTmpl);
    if (errFd < 0) {
        if (fd >= 0) {
            close(fd);
            unlink(tmpl);
        }
        return run;
    }
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(fd, 1);
        if (err != nullptr) dup2(errFd, 2);
        std::vector<char*> argv;
        for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
        argv.push_back(nullptr);
        execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    struct rusage usage = {};
    bool reaped = false;
    if (pid > 0) {
        // Tests with signal handlers of their own (the tunnel's) interrupt waits.
        const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
        pid_t done = 0;
        for (;;) {
            done = wait4(pid, &status, timeoutMs < 0 ? 0 : WNOHANG, &usage);
            if (done < 0 && errno == EINTR) continue;
            if (done != 0 || std::chrono::steady_clock::now() >= end) break;
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        if (done == 0) {
            run.timedOut = true;
            kill(pid, SIGKILL);
            while ((done = wait4(pid, &status, 0, &usage)) < 0 && errno == EINTR) {
            }
        }
        reaped = done == pid;
    }
    if (reaped) {
        run.maxRssKb = usage.ru_maxrss;
        if (WIFEXITED(status)) run.status = WEXITSTATUS(status);
        if (WIFSIGNALED(status) && !run.timedOut) run.signal = WTERMSIG(status);
    }
    close(fd);
    close(errFd);
    if (out != nullptr) *out = ReadFile(tmpl);
    if (err != nullptr) *err = ReadFile(errTmpl);
    unlink(tmpl);
    unlink(errTmpl);
    return run;
}

long PeakMemoryKb(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line)) {
        if (line.compare(0, 6, "VmHWM:") == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
    }
    return -1;
}

std::string ListDir(const std::string& dir) {
    std::string names;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) return names;
    while (struct dirent* entry = readdir(d)) names += std::string(entry->d_name) + "\n";
    closedir(d);
    return names;
}

}  // namespace zepatest
