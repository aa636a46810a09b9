/* Network interfaces and name lookup.
 *
 * C linkage; a failing operation sets the error code of tarq/core.h. Any thread may call.
 */
#pragma once

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* Flags of KAPINetGetInterfaceInfo. */
enum TARQNetInterfaceFlag {
    TARQ_NET_INCLUDE_DOWN = 0x1 /* list the interfaces that are down, too */
};

typedef struct KAPINetInterface {
    char name[16];        /* the kernel's name, such as "eth0", NUL-terminated */
    unsigned char mac[6]; /* hardware address */
} KAPINetInterface;

typedef struct TARQNetAddress {
    char address[46]; /* IPv4 or IPv6 address as text without brackets, NUL-terminated */
    char reserved[6]; /* zero */
} TARQNetAddress;     /* 52 bytes */

/* Fills up to `count` records with the Ethernet-like interfaces that have a hardware address, and
 * returns how many it filled: 0 when there are none. Negative when an argument is bad
 * (TARQ_ERR_BAD_PARAMETER) or the interfaces cannot be listed (TARQ_ERR_READ_FILE). The loopback
 * interface is never listed.
 *
 * The first record is what a device without a serial number is known by, so the order depends on
 * the hardware alone: adapters before virtual interfaces (bonds, VLANs), and these before bridges,
 * tunnels and containers' pairs; within each, addresses that stay from start to start before random
 * ones, burned-in before locally administered, built-in before USB; then by position on the bus,
 * and by name, numbers by value. An adapter in a bond is given with its own address, not with the
 * bond's. Without TARQ_NET_INCLUDE_DOWN, interfaces that are administratively down are left out. */
int KAPINetGetInterfaceInfo(KAPINetInterface* records, int count, int flags);

/* Looks `name` (a host name or a literal address) up through the system's name service and fills up
 * to `count` records. `flags` is 0.
 *
 * All IPv4 addresses come first, then all IPv6 addresses, each in the order in which the system
 * would try them; none comes twice. A link-local IPv6 address carries its zone ("fe80::1%eth0") and
 * is left out when it has none, since nothing can be reached by it.
 *
 * The number of records filled; 0 when the name is unknown or has no address; negative when an
 * argument is bad (TARQ_ERR_BAD_PARAMETER) or the name service fails (TARQ_ERR_LOOKUP). Blocks as
 * long as the system's resolver does. */
int TARQNetLookupIP(const char* name, TARQNetAddress* records, int count, int flags);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
