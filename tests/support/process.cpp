// Running the project's programs from tests.
#include <dirent.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>

#include "support/test_support.h"

namespace zepatest {

int RunProgram(const std::vector<std::string>& args, std::string* out, std::string* err) {
    char tmpl[] = "/tmp/zepa_run_outXXXXXX";
    char errTmpl[] = "/tmp/zepa_run_errXXXXXX";
    const int fd = mkstemp(tmpl);
    if (fd < 0) return -1;
    const int errFd = mkstemp(errTmpl);
    if (errFd < 0) {
        close(fd);
        unlink(tmpl);
        return -1;
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
    if (pid > 0) waitpid(pid, &status, 0);
    close(fd);
    close(errFd);
    if (out != nullptr) *out = ReadFile(tmpl);
    if (err != nullptr) *err = ReadFile(errTmpl);
    unlink(tmpl);
    unlink(errTmpl);
    return pid > 0 && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
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
