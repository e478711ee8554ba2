/*
 * System services, the router's port-forwarding rules and port lists.
 *
 * System services. A system service (a daemon of the appliance, named like
 * "ssh-shell" or "webdav-httpd-ssl") is enabled when its marker file
 *
 *     <root>/usr/zepa/etc/services.d/<name>.enabled
 *
 * exists (any content, any file type but a folder). The service manager creates
 * the marker when the administrator switches the service on and removes it when
 * it is switched off.
 *
 * Router rules. The router configuration lives in the folder that
 * VLIBServiceRouterBasepathGet gives (<root>/usr/zepa/etc/router). Its
 * port-forwarding rules are the sectioned key/value file (kv.h)
 * ZEPA_ROUTER_PF_RULES_FILE in that folder, one section per rule:
 *
 *     [web]
 *     s_port="5000,5001"        ports of the appliance (source), a port list
 *     r_port="80,443"           ports opened on the router, a port list
 *     protocol name="tcp"       "tcp", "udp" or "all"
 *     enabled="1"               "1" on, "0" off
 *
 * Port lists are comma lists of items, each a port or an inclusive range
 * "low-high", ports 0 to 65535, blanks around items allowed: "80,443,5000-5002".
 */
#ifndef ZEPASDK_SERVICE_H
#define ZEPASDK_SERVICE_H

#include <zepasdk/kv.h>
#include <zepasdk/sysroot.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ZEPA_SERVICE_MARKER_DIR "/usr/zepa/etc/services.d"
#define ZEPA_ROUTER_BASE_DIR "/usr/zepa/etc/router"
/* The port-forwarding rule file, relative to the router's base path. */
#define ZEPA_ROUTER_PF_RULES_FILE "portforward.conf"

/* 1 when the system service szService is enabled, 0 when not; -1 when
 * szService is NULL, empty, holds a "/" or is "." or ".."
 * (ZEPA_ERR_BAD_PARAMETERS). */
ZEPASDK_API int VLIBServiceIsEnabled(const char* szService);

/* Writes the router's base folder (resolved against the system root, without
 * a trailing "/") into szBuf. The length written, or -1 when szBuf is NULL or
 * too small (ZEPA_ERR_BUFFER_TOO_SMALL; szBuf is then "" when size > 0). */
ZEPASDK_API int VLIBServiceRouterBasepathGet(char* szBuf, int size);

/* Parses the port list szPorts, ranges expanded, into piPorts (room for nMax
 * ports), in text order, duplicates kept. Returns the number of ports, or -1
 * on a malformed list (empty text, empty item, non-digit, port above 65535,
 * range with low > high; ZEPA_ERR_PARSE), on NULL szPorts
 * (ZEPA_ERR_BAD_PARAMETERS) or when more than nMax ports result
 * (ZEPA_ERR_BUFFER_TOO_SMALL). With piPorts NULL nothing is stored and the
 * count is returned whatever nMax: a size query. */
ZEPASDK_API int VLibParsePorts(const char* szPorts, int* piPorts, int nMax);

#ifdef __cplusplus
}
#endif

#endif
