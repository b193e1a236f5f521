/* Network facts of the host: its interfaces' hardware addresses and the
 * IPv4 addresses of a host name.
 *
 * Name lookup consults the root's hosts file (/etc/hosts under a non-empty
 * root) first, so that tests and demos can name their servers, then the
 * system resolver, unless the platform configuration restricts it to the
 * hosts file ("lookup" = "hosts").
 *
 * Every failure returns -1 and sets the platform error (karo_err.h).
 * Thread-safe. */
#ifndef KARO_NET_H_
#define KARO_NET_H_

#ifdef __cplusplus
extern "C" {
#endif

/* One network interface. */
typedef struct KARO_NETIF {
  char name[32];
  int index;
  unsigned char mac[6];
} KARO_NETIF;

/* Flag for KLIBNetGetInterfaceInfo: leave out loopback interfaces. */
#define KARO_NETIF_SKIP_LOOPBACK 1

/* Fills at most `max` records with the interfaces that have a non-zero
 * six-byte hardware address, in the order of their interface index. `flags`
 * is 0 or KARO_NETIF_SKIP_LOOPBACK. Returns the number filled (0 when there
 * is none), or -1: KERR_INVALID_ARG, KERR_SYSTEM. */
int KLIBNetGetInterfaceInfo(KARO_NETIF* info, int max, int flags);

/* One address of KARONetLookupIP, in dotted-quad form. */
typedef struct KARO_IPADDR {
  char addr[16];
} KARO_IPADDR;

/* Resolves `host` to at most `max` IPv4 addresses in `table`, without
 * duplicates, in the order the source gives them. `flags` must be 0.
 * Returns the count, 0 when the name is unknown (or cannot be resolved now),
 * or -1: KERR_INVALID_ARG, KERR_SYSTEM (the resolver itself failed). */
int KARONetLookupIP(const char* host, KARO_IPADDR* table, int max, int flags);

#ifdef __cplusplus
}
#endif

#endif /* KARO_NET_H_ */
