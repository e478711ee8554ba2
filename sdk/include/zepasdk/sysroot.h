/*
 * System root of the stand-in SDK.
 *
 * Every fixed absolute path of the system (the SDK's own files and the
 * library's) is resolved against one process-wide root, "/" by default, so
 * that tests, demos and developers can run everything unprivileged in a
 * staging directory. With the root "/" every path is exactly as named.
 */
#ifndef ZEPASDK_SYSROOT_H
#define ZEPASDK_SYSROOT_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ZEPASDK_API __attribute__((visibility("default")))

/* Sets the root. NULL or "" means "/". A trailing "/" is dropped.
 * Returns 0, or -1 when root is not absolute (the root is then unchanged). */
ZEPASDK_API int ZEPASysRootSet(const char* root);

/* The current root, "/" by default. Valid until the next ZEPASysRootSet. */
ZEPASDK_API const char* ZEPASysRootGet(void);

/* Writes root + absPath into buf (NUL-terminated). absPath must begin with "/".
 * Returns the length written, or -1 when absPath is NULL or relative, or the
 * result does not fit in size bytes (buf is then an empty string when size > 0). */
ZEPASDK_API int ZEPASysRootPath(const char* absPath, char* buf, size_t size);

#ifdef __cplusplus
}
#endif

#endif
