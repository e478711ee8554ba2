#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstring>
#include <vector>

#include "zepasdk/kv.h"

extern "C" {

int VLIBCExec(const char* path, ...) {
    if (path == nullptr || path[0] == '\0') {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    const char* base = strrchr(path, '/');
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(base ? base + 1 : path));
    va_list ap;
    va_start(ap, path);
    for (const char* arg = va_arg(ap, const char*); arg != nullptr; arg = va_arg(ap, const char*))
        argv.push_back(const_cast<char*>(arg));
    va_end(ap);
    argv.push_back(nullptr);

    // A close-on-exec pipe tells the parent whether the exec itself failed.
    int report[2];
    if (pipe2(report, O_CLOEXEC) != 0) {
        VLIBCErrSet(ZEPA_ERR_EXEC);
        return -1;
    }
    pid_t pid = fork();
    if (pid < 0) {
        close(report[0]);
        close(report[1]);
        VLIBCErrSet(ZEPA_ERR_EXEC);
        return -1;
    }
    if (pid == 0) {
        close(report[0]);
        int devnull = open("/dev/null", O_RDONLY);
        if (devnull >= 0) {
            dup2(devnull, STDIN_FILENO);
            if (devnull != STDIN_FILENO) close(devnull);
        }
        execv(path, argv.data());
        int err = errno;
        ssize_t n = write(report[1], &err, sizeof(err));
        (void)n;
        _exit(127);
    }
    close(report[1]);
    int childErr = 0;
    ssize_t n;
    do {
        n = read(report[0], &childErr, sizeof(childErr));
    } while (n < 0 && errno == EINTR);
    close(report[0]);

    int status = 0;
    pid_t waited;
    do {
        waited = waitpid(pid, &status, 0);
    } while (waited < 0 && errno == EINTR);
    if (n == static_cast<ssize_t>(sizeof(childErr)) || waited < 0) {
        VLIBCErrSet(ZEPA_ERR_EXEC);
        return -1;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
    return -1;
}

}  // extern "C"
