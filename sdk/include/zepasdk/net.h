/*
 * Network facts: interfaces and their IPv4 and IPv6 addresses, the PPPoE
 * link, the default gateway, the DDNS registration, address checks and the
 * platform's capability switches.
 *
 * Interfaces, addresses and routes are read live from the kernel for the
 * calling process's network namespace (getifaddrs, /proc/net/route,
 * /proc/net/if_inet6), never under the system root. Configuration files are
 * under the root:
 *   /etc/zepa/ddns.conf            sectioned key/value file, one section per
 *                                  DDNS provider with its "hostname" and
 *                                  "username"
 *   /etc.defaults/zepainfo.conf    capability switches, e.g. supportddns="yes"
 *
 * Every function sets the last error (VLIBCErrGet, zepasdk/kv.h) on failure.
 */
#ifndef ZEPASDK_NET_H
#define ZEPASDK_NET_H

#include <zepasdk/kv.h>

#ifdef __cplusplus
extern "C" {
#endif

#define VLIBNET_IFNAME_SIZE 32
#define VLIBNET_ADDR_SIZE 46

/* Interface kinds a selection may combine. */
#define VLIBNET_SEL_LOOPBACK 0x01    /* the loopback */
#define VLIBNET_SEL_ETHER 0x02       /* Ethernet-type ports, physical or virtual */
#define VLIBNET_SEL_WIRELESS 0x04    /* wireless devices */
#define VLIBNET_SEL_PPP 0x08         /* point-to-point links (PPPoE) */
#define VLIBNET_SEL_BRIDGE_BOND 0x10 /* bridges and bonds */
#define VLIBNET_SEL_OTHER 0x20       /* everything else (tunnels, ...) */
/* Every wired LAN interface: the selection the relay asks for (18). */
#define VLIBNET_SEL_WIRED (VLIBNET_SEL_ETHER | VLIBNET_SEL_BRIDGE_BOND)

/* Status words of an interface record. */
#define VLIBNET_IF_DOWN 0
#define VLIBNET_IF_UP 1      /* up, no IPv4 address */
#define VLIBNET_IF_UP_IPV4 2 /* up with an IPv4 address */

struct VLIBNetIfInfo {
    char szName[VLIBNET_IFNAME_SIZE];
    char szIP[VLIBNET_ADDR_SIZE];   /* first IPv4 address, dotted; "" when none */
    char szMask[VLIBNET_ADDR_SIZE]; /* its netmask, dotted; "" when none */
    int status;                     /* VLIBNET_IF_* */
    int kind;                       /* the VLIBNET_SEL_* bit of the interface */
};

/* Fills up to max records, one per interface of the selected kinds, in
 * interface index order. Unknown selection bits are ignored.
 * The number of records (> 0); 0 when no interface is selected
 * (ZEPA_ERR_NOT_FOUND); -1 on bad arguments or when the interfaces cannot be
 * listed (ZEPA_ERR_IO). */
ZEPASDK_API int VLIBNetGetInterfaceInfo(struct VLIBNetIfInfo* list, int max, int selection);

/* Whether the PPPoE link is up: 1 when a point-to-point interface of
 * hardware type PPP is up with an IPv4 address, else 0; -1 when the
 * interfaces cannot be listed. opt is reserved: pass 0. */
ZEPASDK_API int ZEPAPPPoECheckStatus(int opt);

/* The IPv4 address and netmask of the PPPoE link (dotted text).
 * 0; -1: bad arguments, no PPPoE link up (ZEPA_ERR_NOT_FOUND), a buffer too
 * small (ZEPA_ERR_BUFFER_TOO_SMALL). Buffers are left empty on failure. */
ZEPASDK_API int ZEPAPPPoeNetInfoGet(char* ip, int ipSize, char* mask, int maskSize);

/* The IPv4 default gateway of the main routing table (/proc/net/route: an
 * up route to 0.0.0.0/0 through a gateway; the lowest metric wins, the first
 * listed among equals), dotted.
 * 0; -1: bad arguments, table unreadable (ZEPA_ERR_FILE_NOT_FOUND), no
 * default route (ZEPA_ERR_NOT_FOUND), buffer too small. */
ZEPASDK_API int ZEPANetDefaultGatewayGet(char* buf, int size);

#define ZEPA_DDNS_PROVIDER_SIZE 128
#define ZEPA_DDNS_HOSTNAME_SIZE 256
#define ZEPA_DDNS_USERNAME_SIZE 128

struct ZEPADDNSConfig {
    char szProvider[ZEPA_DDNS_PROVIDER_SIZE];
    char szHostname[ZEPA_DDNS_HOSTNAME_SIZE];
    char szUsername[ZEPA_DDNS_USERNAME_SIZE];
};

/* The registration of provider: section provider of /etc/zepa/ddns.conf.
 * 0; -1: bad arguments, file unreadable (ZEPA_ERR_FILE_NOT_FOUND), no such
 * provider (ZEPA_ERR_SECTION_NOT_FOUND), "hostname" missing or empty
 * (ZEPA_ERR_KEY_NOT_FOUND). The record is zeroed first; values too long for
 * their field are cut. */
ZEPASDK_API int ZEPADDNSConfigGet(const char* provider, struct ZEPADDNSConfig* conf);

struct ZEPAV6IPInfo {
    char szAddr[VLIBNET_ADDR_SIZE]; /* compressed text, e.g. "fe80::1" */
    unsigned int prefixLen;
    unsigned int addrType; /* the kernel's scope bits: 0x00 global, 0x10 host,
                              0x20 link, 0x40 site, 0x08 v4-compatible */
};

/* Fills up to max IPv6 address records of interface ifname, in the kernel's
 * order. The name "pppoe" stands for the PPPoE link's device (see
 * ZEPAPPPoECheckStatus) unless an interface of that very name exists. The number of records (0 when it has
 * none or IPv6 is off); -1 when no interface of that name exists (ZEPA_ERR_NOT_FOUND) or on bad arguments. */
ZEPASDK_API int ZEPALnxV6IPGet(const char* ifname, struct ZEPAV6IPInfo* list, int max);

/* 1 when ip and mask form a usable IPv4 host address/netmask pair, else 0:
 * both dotted quads, the mask's one bits contiguous and at least one, the
 * address neither 0.0.0.0, multicast nor reserved (224.0.0.0 and above),
 * and, for masks up to /30, neither the network's nor its broadcast address. */
ZEPASDK_API int BlVLIBIsValidIpMask(const char* ip, const char* mask);

/* 1 when the platform supports the capability key: key="yes" (any case) in
 * /etc.defaults/zepainfo.conf; 0 otherwise (also when file or key is missing
 * or key is NULL). */
ZEPASDK_API int VLIBCSupportGet(const char* key);

#ifdef __cplusplus
}
#endif

#endif
