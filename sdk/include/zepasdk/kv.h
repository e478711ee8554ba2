/*
 * Key/value files, string lists, the last error and program execution.
 *
 * A key/value file is a text file of lines
 *
 *     key="value"
 *
 * Blanks around the key and around "=" are ignored; the value is the text
 * between the double quotes, in which \" stands for a quote and \\ for a
 * backslash. An unquoted value (key=value) is taken up to the end of the line,
 * trimmed. Empty lines and lines starting with "#" or ";" are comments. Any
 * other line (no "=", an empty key, an unterminated quote) is malformed: readers
 * skip it, writers keep it untouched. The first occurrence of a key wins.
 *
 * The sectioned form groups keys under "[section]" lines; keys before the first
 * section belong to no section. Keys may contain blanks ("protocol name").
 *
 * Writes replace the file atomically (temporary file in the same folder, then
 * rename) and keep every other line, comments and malformed lines included.
 *
 * Every function sets the last error (VLIBCErrGet) on failure and clears it to
 * ZEPA_ERR_NONE on success. Paths are used as given.
 */
#ifndef ZEPASDK_KV_H
#define ZEPASDK_KV_H

#include <zepasdk/sysroot.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Last-error codes (printed by callers as 0x%04X). */
#define ZEPA_ERR_NONE 0x0000
#define ZEPA_ERR_BAD_PARAMETERS 0x0D00
#define ZEPA_ERR_OUT_OF_MEMORY 0x0200
#define ZEPA_ERR_FILE_NOT_FOUND 0x0300
#define ZEPA_ERR_KEY_NOT_FOUND 0x0301
#define ZEPA_ERR_SECTION_NOT_FOUND 0x0302
#define ZEPA_ERR_IO 0x0400
#define ZEPA_ERR_BUFFER_TOO_SMALL 0x0500
#define ZEPA_ERR_PARSE 0x0600
#define ZEPA_ERR_EXEC 0x0700
#define ZEPA_ERR_NOT_SUPPORTED 0x0800
#define ZEPA_ERR_NOT_FOUND 0x0900

/* The last error of this thread's latest failing SDK call. */
ZEPASDK_API int VLIBCErrGet(void);
/* Sets the last error; for the SDK's own families. */
ZEPASDK_API void VLIBCErrSet(int code);

/* ---- string lists ------------------------------------------------------- */

typedef struct VLIBCSzList {
    int nAlloc;     /* capacity of pszItem */
    int nItem;      /* number of items */
    char** pszItem; /* the items, owned by the list */
} VLIBCSzList, *PVLIBCSzList;

/* A new empty list with room for capacity items (at least 1); NULL on failure. */
ZEPASDK_API PVLIBCSzList VLIBCSzListAlloc(int capacity);
/* Appends a copy of item, growing the list (*list may be replaced). 0 or -1. */
ZEPASDK_API int VLIBCSzListPush(PVLIBCSzList* list, const char* item);
/* The index-th item, or NULL when index is out of range or list is NULL. */
ZEPASDK_API const char* VLIBCSzListGet(const VLIBCSzList* list, int index);
/* Frees the list and its items; NULL is accepted. */
ZEPASDK_API void VLIBCSzListFree(PVLIBCSzList list);

/* ---- key/value files ---------------------------------------------------- */

/* Reads key (outside any section) into buf (size bytes, always terminated; a
 * longer value is cut to size - 1 bytes).
 * > 0: the length written; 0: the key is missing or its value is empty
 * (ZEPA_ERR_KEY_NOT_FOUND when missing); -1: the file cannot be read
 * (ZEPA_ERR_FILE_NOT_FOUND) or bad arguments (ZEPA_ERR_BAD_PARAMETERS). */
ZEPASDK_API int VLIBCFileGetKeyValue(const char* file, const char* key, char* buf, int size);

/* 1 when key holds value (compared without regard to case), else 0.
 * opt 1: a missing key (or a missing file) counts as holding value, i.e. value
 * is the key's default. opt 0: a missing key or file is no match.
 * -1 on bad arguments. */
ZEPASDK_API int VLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int opt);

/* Sets key="value" (outside any section), adding the key at the end when
 * missing, creating the file when absent. 0 on success, -1 on failure. */
ZEPASDK_API int VLIBCFileSetKeyValue(const char* file, const char* key, const char* value);

/* VLIBCFileSetKeyValue on the system's main key/value file "/etc/zepainfo.conf"
 * under the system root. 0 on success, -1 on failure. */
ZEPASDK_API int VLIBCINFOSetKeyValue(const char* key, const char* value);

/* Appends the names of the sections of file, in file order, to *list (which
 * may grow). The number of sections (0 when none), or -1 when the file cannot
 * be read or on bad arguments. */
ZEPASDK_API int VLIBCFileEnumSection(const char* file, PVLIBCSzList* list);

/* Reads key of section into buf, as VLIBCFileGetKeyValue.
 * > 0 length; 0 key missing or empty; -1 file unreadable, section missing
 * (ZEPA_ERR_SECTION_NOT_FOUND) or bad arguments. */
ZEPASDK_API int VLIBCFileGetSectionValue(const char* file, const char* section, const char* key, char* buf,
                                         int size);

/* Sets key="value" in section, creating the section (at the end) and the file
 * when missing. 0 or -1. */
ZEPASDK_API int VLIBCFileSetSectionValue(const char* file, const char* section, const char* key,
                                         const char* value);

/* ---- programs ------------------------------------------------------------ */

/* Runs the program at path (used as given) with the NULL-terminated argument
 * list that follows (argument zero is the program's base name), without a
 * shell, and waits for it. Standard input is /dev/null.
 * The exit status (0-255), 128 + the signal number when it was killed, or -1
 * when it could not be started (ZEPA_ERR_EXEC). */
ZEPASDK_API int VLIBCExec(const char* path, ...);

#ifdef __cplusplus
}
#endif

#endif
