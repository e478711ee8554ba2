#include "log_file_check.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace zepatools {

bool LogFileUsable(const std::string& path, std::string& why) {
    if (path.empty()) return true;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) {
        // A missing file is created at the start; another error shows there.
        return true;
    }
    if (S_ISLNK(st.st_mode)) {
        why = "is a symbolic link";
    } else if (S_ISFIFO(st.st_mode)) {
        why = "is a FIFO";
    } else if (S_ISDIR(st.st_mode)) {
        why = "is a folder";
    } else if (!S_ISREG(st.st_mode)) {
        why = "is not a regular file";
    } else if (st.st_nlink != 1) {
        why = "has a second hard link";
    } else {
        return true;
    }
    return false;
}

}  // namespace zepatools
