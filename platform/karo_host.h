/* Identity of the host: host name, serial number, high-availability state,
 * and the reduced-appliance ("plug unit") flag.
 *
 * Everything an appliance may set for itself comes from the platform
 * configuration, the section file /etc/s2s/platform.conf under the root
 * (section "Platform"; the keys are listed in platform/README.md), so two
 * appliances on one machine can differ. What the file does not say comes
 * from the machine: gethostname() and /etc/machine-id.
 *
 * Every failure returns -1 and sets the platform error (karo_err.h). No state
 * is kept; the file is read at every call. Thread-safe. */
#ifndef KARO_HOST_H_
#define KARO_HOST_H_

#ifdef __cplusplus
extern "C" {
#endif

/* Path of the platform configuration below the root, and its section. */
#define KARO_PLATFORM_CONF "/etc/s2s/platform.conf"
#define KARO_PLATFORM_SECTION "Platform"

/* Copies the value of `key` of the platform configuration into `buf` (`size`
 * bytes, NUL included). Returns its length, or -1: KERR_FILE_NOT_FOUND (no
 * configuration), KERR_NOT_FOUND (no such key), KERR_BUFFER_TOO_SMALL,
 * KERR_FILE_FORMAT, KERR_INVALID_ARG. */
int KaroPlatformConfGet(const char* key, char* buf, int size);

/* 1 when `key` of the platform configuration is "yes" (any case), else 0. */
int KaroPlatformConfIsYes(const char* key);

/* Writes the host name ("hostname" in the platform configuration, else the
 * system's) into `buf`, at most `size` bytes: like gethostname(), a name of
 * `size` characters or more is cut to `size` characters and left without a
 * terminating NUL, so callers zero a larger buffer first. Returns 0, or -1
 * (KERR_INVALID_ARG, KERR_SYSTEM). */
int KAROLnxGetHostname(char* buf, int size);

/* Writes the serial number into `buf` (`size` bytes, NUL included): the
 * "serial" key when the configuration has one (an empty value means "no
 * serial"), else the machine's /etc/machine-id (read as it is, not under the
 * root). Returns the serial's length (0 when there is none), or -1 with an
 * empty buffer: KERR_BUFFER_TOO_SMALL (a serial is never cut),
 * KERR_INVALID_ARG. */
int KLIBGetSerialNumber(char* buf, int size);

/* 1 when this appliance is part of a running high-availability pair ("ha" is
 * "yes"), else 0. */
int KAROHAIsRunning(void);

/* Writes the pair's shared hardware address ("ha_mac", index 0 only) into
 * `buf`. Returns its length, or -1 with an empty buffer: KERR_NOT_FOUND (no
 * such address), KERR_BUFFER_TOO_SMALL, KERR_INVALID_ARG. */
int KAROHAGetMac(int index, char* buf, int size);

/* 1 on a reduced appliance without internal volumes ("plug_unit" is "yes"),
 * else 0. */
int KLIBCIsPlugUnit(void);

#ifdef __cplusplus
}
#endif

#endif /* KARO_HOST_H_ */
