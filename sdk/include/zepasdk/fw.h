/*
 * Firewall service definitions.
 *
 * Each network service the appliance can open in its firewall is described by
 * one key/value file (format of kv.h) in the folder
 *
 *     <root>/usr/zepa/etc/fw_services/
 *
 * Every regular file of that folder whose name ends in ".conf" is one
 * definition; the folder is read in byte order of the file names. Keys:
 *
 *     name="nso_https"          the definition's name (required, < 64 bytes)
 *     title="Management"        first title part  (optional, < 128 bytes)
 *     subtitle="HTTPS"          second title part (optional, < 128 bytes)
 *     alt_title="Web admin"     alternative title (optional, < 128 bytes)
 *     protocol="tcp"            "tcp", "udp" or "all"; anything else opens nothing
 *     ports="5001"              comma list of port items ("80,443", "5000-5002"),
 *                               kept item by item as text, blanks trimmed
 *
 * A file without a "name" (or with a name too long) is not a definition and is
 * left out. Two files with the same name: the first in folder order wins for
 * lookups, both are enumerated.
 */
#ifndef ZEPASDK_FW_H
#define ZEPASDK_FW_H

#include <stdint.h>
#include <zepasdk/kv.h>
#include <zepasdk/sysroot.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The folder of the definitions, below the system root. */
#define ZEPA_FW_SERVICE_DIR "/usr/zepa/etc/fw_services"

#define ZEPA_FW_NAME_MAX 64
#define ZEPA_FW_TITLE_MAX 128

typedef struct ZEPAFwService {
    char szName[ZEPA_FW_NAME_MAX];      /* never empty in an enumeration */
    uint32_t dwTcp;                     /* 1 when the service opens TCP ports */
    uint32_t dwUdp;                     /* 1 when the service opens UDP ports */
    char szTitle[ZEPA_FW_TITLE_MAX];    /* first title part, may be empty */
    char szSubTitle[ZEPA_FW_TITLE_MAX]; /* second title part, may be empty */
    char szAltTitle[ZEPA_FW_TITLE_MAX]; /* alternative title, may be empty */
    PVLIBCSzList pPorts;                /* port items as text; NULL without "ports" */
    struct ZEPAFwService* pNext;        /* next definition in folder order */
} ZEPAFwService, *PZEPAFwService;

/* Reads every definition into a list that the caller frees with
 * ZEPAFwServiceFree. Returns the number of definitions (> 0) and sets *ppList.
 * 0: the folder holds no definition (ZEPA_ERR_NOT_FOUND); -1: the folder
 * cannot be read (ZEPA_ERR_FILE_NOT_FOUND), out of memory, or ppList is NULL
 * (ZEPA_ERR_BAD_PARAMETERS). On 0 and -1, *ppList is set to NULL. */
ZEPASDK_API int ZEPAFwServiceEnum(PZEPAFwService* ppList);

/* The first definition of pList named szName (exact, case-sensitive), or NULL
 * (ZEPA_ERR_NOT_FOUND; ZEPA_ERR_BAD_PARAMETERS for NULL arguments). */
ZEPASDK_API PZEPAFwService ZEPAFWServiceFind(PZEPAFwService pList, const char* szName);

/* Frees a list of ZEPAFwServiceEnum with its port lists; NULL is accepted. */
ZEPASDK_API void ZEPAFwServiceFree(PZEPAFwService pList);

#ifdef __cplusplus
}
#endif

#endif
