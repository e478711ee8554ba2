// Small helpers shared by the identity and network families.
#ifndef ZEPASDK_SRC_SDK_UTIL_H
#define ZEPASDK_SRC_SDK_UTIL_H

#include <string>

namespace zepasdk {

// Sets the last error and returns -1.
int FailWith(int code);

// Copies value into buf when it fits with its NUL; else leaves buf empty and
// returns false.
bool CopyIfFits(const std::string& value, char* buf, int size);

// absPath resolved against the system root; empty when it does not fit.
std::string RootPath(const char* absPath);

// Creates every missing folder of path's parent (mode 0755).
bool MakeParentDirs(const std::string& path);

// Lower-case hexadecimal text of n bytes.
std::string HexOf(const unsigned char* bytes, size_t n);

}  // namespace zepasdk

#endif
