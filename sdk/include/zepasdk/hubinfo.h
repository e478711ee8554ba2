/*
 * Device identity for HTTP clients.
 *
 * The user agent is built from the device's model and version files below
 * the system root:
 *
 *   "/etc.defaults/zepainfo.conf"  key "upnpmodelname"   (e.g. "ZS220")
 *   "/etc.defaults/VERSION"        keys "productversion" (e.g. "7.2"),
 *                                  "buildnumber"         (e.g. "64570")
 *
 * and reads "<product>/<productversion>-<buildnumber> (<upnpmodelname>)",
 * for example "Farlink/7.2-64570 (ZS220)". Both files are key/value files
 * (zepasdk/kv.h).
 */
#ifndef ZEPASDK_HUBINFO_H
#define ZEPASDK_HUBINFO_H

#include <zepasdk/sysroot.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Writes the user agent for the product word into buf (size bytes, always
 * NUL-terminated on success).
 * 0 on success.
 * -1 bad arguments (NULL product or buf, empty product, size < 1;
 *    ZEPA_ERR_BAD_PARAMETERS),
 * -2 a file is missing or unreadable, or a key is missing or empty
 *    (the error of the key/value read is kept),
 * -3 the text does not fit in size bytes (ZEPA_ERR_BUFFER_TOO_SMALL; buf is "").
 * On failure buf is left as an empty string when size > 0. */
ZEPASDK_API int VLIBHubinfoUserAgentGet(const char* product, char* buf, int size);

#ifdef __cplusplus
}
#endif

#endif
