/*
 * The device identity: serial number and device token, the MAC address the
 * device is known by, and the API key of the maker's cloud service.
 *
 * Backing files (under the system root, see sysroot.h):
 *   /etc/zepa/hubtoken.conf      key/value file: serial="...", token="..."
 *   /etc/zepa/hubtoken.secret    the device secret that keys token derivation
 *                                (created on first use, mode 0600)
 *   /etc/zepa/cloudservice.conf  key/value file: api_key="..."
 *
 * Every function returns a negative value on failure and sets the last error
 * (VLIBCErrGet, zepasdk/kv.h); on success it clears it to ZEPA_ERR_NONE.
 * Output buffers are always NUL-terminated when their size is at least 1 and
 * are left empty on failure.
 */
#ifndef ZEPASDK_IDENTITY_H
#define ZEPASDK_IDENTITY_H

#include <zepasdk/kv.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Room a device token needs: 32 hexadecimal digits and the NUL. */
#define ZEPA_HUBTOKEN_TOKEN_SIZE 33
/* Room a serial number may need: at most 35 characters and the NUL. */
#define ZEPA_HUBTOKEN_SERIAL_SIZE 36
/* Room for a MAC address "aa:bb:cc:dd:ee:ff" and the NUL. */
#define ZEPA_CLOUD_MAC_SIZE 18
/* Room the API key functions may fill. */
#define ZEPA_CLOUD_KEY_SIZE 1024
/* ZEPACloudServiceGetApiKey flag: register a key when none is stored. */
#define ZEPA_CLOUD_KEY_REGISTER 0x1

/* Reads the serial number and the device token from /etc/zepa/hubtoken.conf.
 * Both keys must be present and non-empty and fit their buffers (a value of
 * serialSize or more characters does not fit).
 * 0 on success; -1: bad arguments (ZEPA_ERR_BAD_PARAMETERS), file unreadable
 * (ZEPA_ERR_FILE_NOT_FOUND), a key missing or empty (ZEPA_ERR_KEY_NOT_FOUND),
 * a value too long (ZEPA_ERR_BUFFER_TOO_SMALL). */
ZEPASDK_API int ZEPAHubtokenGetToken(char* serial, int serialSize, char* token, int tokenSize);

/* Derives the device token of serial: the first 32 lower-case hexadecimal
 * digits of HMAC-SHA256 keyed with the device secret, so the same serial
 * gives the same token on one device and different tokens on others. The
 * secret (64 hexadecimal digits from the system's random source) is created
 * on first use. Nothing is stored besides the secret.
 * 0 on success; -1: serial NULL or empty or token NULL
 * (ZEPA_ERR_BAD_PARAMETERS), tokenSize below ZEPA_HUBTOKEN_TOKEN_SIZE
 * (ZEPA_ERR_BUFFER_TOO_SMALL), the secret can be neither read nor created,
 * or it is empty (ZEPA_ERR_IO; an existing secret is never replaced). */
ZEPASDK_API int ZEPAHubtokenGenerateToken(const char* serial, char* token, int tokenSize);

/* The MAC address of the device's first wired interface, lower-case and
 * colon-separated. Wired: an interface of the live network namespace whose
 * hardware type is Ethernet, that is not the loopback and not a wireless
 * device, with a non-zero address; the first is the one of the lowest
 * interface index (the kernel's registration order). Up or down alike.
 * 0 on success; -1: bad arguments or size below ZEPA_CLOUD_MAC_SIZE
 * (ZEPA_ERR_BAD_PARAMETERS / ZEPA_ERR_BUFFER_TOO_SMALL), interfaces cannot
 * be listed (ZEPA_ERR_IO), no wired interface (ZEPA_ERR_NOT_FOUND). */
ZEPASDK_API int ZEPACloudServiceGetMacAddress(char* buf, int size);

/* The stored API key (api_key of /etc/zepa/cloudservice.conf) into key,
 * which must hold ZEPA_CLOUD_KEY_SIZE bytes. flags 0 only reads; with
 * ZEPA_CLOUD_KEY_REGISTER a key is registered (as below) when none is stored.
 * The key's length (> 0); -1: key NULL (ZEPA_ERR_BAD_PARAMETERS), no key
 * stored (ZEPA_ERR_KEY_NOT_FOUND or ZEPA_ERR_FILE_NOT_FOUND), registering
 * failed (as below). */
ZEPASDK_API int ZEPACloudServiceGetApiKey(char* key, int flags);

/* Registers a fresh API key: 64 lower-case hexadecimal digits from the
 * system's random source, stored as api_key in /etc/zepa/cloudservice.conf
 * (replacing an older key; folders and file are created when missing) and
 * copied into key.
 * The key's length (> 0); -1: key NULL (ZEPA_ERR_BAD_PARAMETERS), size too
 * small for the key and its NUL (ZEPA_ERR_BUFFER_TOO_SMALL; nothing stored),
 * no random bytes or the file cannot be written (ZEPA_ERR_IO). */
ZEPASDK_API int ZEPACloudServiceRegisterApiKey(char* key, int size);

#ifdef __cplusplus
}
#endif

#endif
