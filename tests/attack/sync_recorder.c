/* Preloaded into a program: appends "fsync <path>" and "rename <from> <to>"
 * lines to the file named by ZEPA_SYNC_LOG, then makes the real call. */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

static void Note(const char* line) {
    const char* log = getenv("ZEPA_SYNC_LOG");
    if (log == NULL) return;
    int fd = open(log, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    if (fd < 0) return;
    ssize_t unused = write(fd, line, strlen(line));
    (void)unused;
    close(fd);
}

int fsync(int fd) {
    static int (*real)(int) = NULL;
    if (real == NULL) real = (int (*)(int))dlsym(RTLD_NEXT, "fsync");
    char link[64], target[4096], line[4200];
    snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
    ssize_t n = readlink(link, target, sizeof(target) - 1);
    target[n > 0 ? n : 0] = '\0';
    snprintf(line, sizeof(line), "fsync %s\n", target);
    Note(line);
    return real(fd);
}

int rename(const char* from, const char* to) {
    static int (*real)(const char*, const char*) = NULL;
    if (real == NULL) real = (int (*)(const char*, const char*))dlsym(RTLD_NEXT, "rename");
    int ret = real(from, to);
    char line[8300];
    snprintf(line, sizeof(line), "rename %s %s %d\n", from, to, ret);
    Note(line);
    return ret;
}
